#include "host/plugin_loader.h"

#include <dlfcn.h>
#include <elf.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <vector>

namespace appsync {

namespace {

constexpr char kHint[] = "name an AppSync.so of this version with --plugin, or put it beside dovel";

std::string pathOfThisProgram() {
  std::error_code error;
  return std::filesystem::read_symlink("/proc/self/exe", error).parent_path().string();
}

std::string pathOfPlugin(const std::optional<std::string>& file) {
  // A bare name is a file here, not one of the system's.
  if (file) return file->find('/') == std::string::npos ? "./" + *file : *file;
  std::string beside = pathOfThisProgram() + "/AppSync.so";
  if (::access(beside.c_str(), F_OK) == 0) return beside;
  const std::string installed = pathOfThisProgram() + "/../lib/appsync/AppSync.so";
  return ::access(installed.c_str(), F_OK) == 0 ? installed : beside;
}

// What keeps the file from being a whole loadable module; empty when nothing does. The system's loader trusts the file,
// and would stop the program over one that was cut off.
std::string whyNotLoadable(const std::string& path) {
  const int file = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
  if (file < 0) return std::strerror(errno);
  struct stat information {};
  Elf64_Ehdr header{};
  std::string why;
  if (::fstat(file, &information) != 0 || !S_ISREG(information.st_mode)) {
    why = "it is no plain file";
  } else if (::pread(file, &header, sizeof header, 0) != static_cast<ssize_t>(sizeof header) ||
             std::memcmp(header.e_ident, ELFMAG, SELFMAG) != 0 || header.e_ident[EI_CLASS] != ELFCLASS64 ||
             header.e_phentsize != sizeof(Elf64_Phdr)) {
    why = "it is no module of this machine";
  } else {
    std::vector<Elf64_Phdr> segments(header.e_phnum);
    const std::size_t bytes = segments.size() * sizeof(Elf64_Phdr);
    const bool read =
        header.e_phoff < static_cast<std::uint64_t>(information.st_size) &&
        ::pread(file, segments.data(), bytes, static_cast<off_t>(header.e_phoff)) == static_cast<ssize_t>(bytes);
    const auto size = static_cast<std::uint64_t>(information.st_size);
    if (!read) why = "it is cut off";
    for (const Elf64_Phdr& segment : segments) {
      if (segment.p_offset > size || segment.p_filesz > size - segment.p_offset) why = "it is cut off";
    }
  }
  ::close(file);
  return why;
}

}  // namespace

std::optional<Plugin> Plugin::load(const std::optional<std::string>& file, Failure& failure) {
  const std::string path = pathOfPlugin(file);
  const auto refuse = [&](FailureCode code, const std::string& why) {
    failure = {code, "the plug-in \"" + path + "\" cannot be used: " + why, kHint};
    return std::nullopt;
  };
  if (const std::string why = whyNotLoadable(path); !why.empty()) return refuse(FailureCode::PluginUnusable, why);
  void* module = ::dlopen(path.c_str(), RTLD_NOW | RTLD_LOCAL);
  if (module == nullptr) {
    const char* why = ::dlerror();
    return refuse(FailureCode::PluginUnusable, why == nullptr ? "the system refuses it" : why);
  }
  const auto* descriptor = static_cast<const DovelPluginDescriptor*>(::dlsym(module, kDovelPluginSymbol));
  if (descriptor == nullptr) {
    return refuse(FailureCode::PluginUnusable, "it has no symbol " + std::string(kDovelPluginSymbol));
  }
  if (descriptor->abi != kDovelPluginABI) {
    return refuse(FailureCode::PluginABI, "its ABI number is " + std::to_string(descriptor->abi) +
                                              ", this program's is " + std::to_string(kDovelPluginABI));
  }
  if (descriptor->size != sizeof(DovelPluginDescriptor) || descriptor->makeClient == nullptr) {
    return refuse(FailureCode::PluginABI, "its descriptor has " + std::to_string(descriptor->size) +
                                              " bytes, this program's has " +
                                              std::to_string(sizeof(DovelPluginDescriptor)));
  }
  return Plugin(path, *descriptor);
}

std::unique_ptr<DovelClient> Plugin::makeClient(const Platform& platform, Failure& failure) const {
  std::unique_ptr<DovelClient> client(_descriptor->makeClient(platform));
  if (!client) failure = {FailureCode::PluginUnusable, "the plug-in \"" + _path + "\" makes no client", kHint};
  return client;
}

}  // namespace appsync
