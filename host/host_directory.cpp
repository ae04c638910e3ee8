#include "host/host_directory.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "embedded/device_service.h"
#include "embedded/state_store.h"

namespace appsync {

namespace {

constexpr char kIncoming[] = "/var/mobile/Media/PublicStaging/.ApplicationSync.incoming";
constexpr char kLastSyncDirectory[] = "/var/mobile/Library/ApplicationSync";
constexpr char kLastSyncList[] = "LastSyncAppState.plist";
constexpr std::size_t kDeepest = 32;  // directories within directories

// A plain file below a directory. None, with errno, for everything else.
OwnedFile openPlainFile(int directory, const std::string& name, struct stat& information) {
  OwnedFile file(::openat(directory, name.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK));
  if (!file) return {};
  if (::fstat(file.get(), &information) != 0) return {};
  if (S_ISREG(information.st_mode)) return file;
  errno = S_ISDIR(information.st_mode) ? EISDIR : EINVAL;
  return {};
}

}  // namespace

// Copies from the host to the device until something fails.
class HostDirectory::Copier {
 public:
  Copier(std::string host, EmbeddedFileManager& files, const Supervision& supervision, Failure& failure)
      : _host(std::move(host)), _files(files), _supervision(supervision), _failure(failure), _piece(kPieceSize) {}

  bool copyDirectory(const OwnedFile& source, const std::string& name, const std::string& target, std::size_t depth) {
    std::optional<Error> error;
    if (!_files.createDirectory(target, true, {}, &error)) return deviceFailed(*error);
    std::vector<std::string> names;
    if (!listDirectory(source.get(), names)) return hostFailed(name, errno);
    for (const std::string& one : names) {
      if (!copyItem(source, one, name + "/" + one, target + "/" + one, depth)) return false;
    }
    return true;
  }

  // `name` is what messages call it.
  bool copyFile(int directory, const std::string& leaf, const std::string& name, const std::string& target) {
    struct stat information {};
    const OwnedFile source = openPlainFile(directory, leaf, information);
    if (!source) return hostFailed(name, errno);
    std::optional<Error> error;
    const auto sink = _files.openSink(target, &error);
    if (!sink) return deviceFailed(*error);
    while (true) {
      if (_supervision.isStopped()) return false;
      const ssize_t count = ::read(source.get(), _piece.data(), _piece.size());
      if (count < 0 && errno == EINTR) continue;
      if (count < 0) return hostFailed(name, errno);
      if (count == 0) break;
      if (!sink->append(_piece.data(), static_cast<std::size_t>(count), &error)) return deviceFailed(*error);
    }
    return sink->finish(&error) || deviceFailed(*error);
  }

 private:
  bool copyItem(const OwnedFile& directory, const std::string& leaf, const std::string& name, const std::string& target,
                std::size_t depth) {
    struct stat information {};
    if (::fstatat(directory.get(), leaf.c_str(), &information, AT_SYMLINK_NOFOLLOW) != 0) {
      return hostFailed(name, errno);
    }
    if (S_ISREG(information.st_mode)) return copyFile(directory.get(), leaf, name, target);
    if (!S_ISDIR(information.st_mode)) {
      _supervision.note("\"" + name + "\" is neither a plain file nor a directory and is left out");
      return true;
    }
    if (depth == kDeepest) {
      _supervision.note("\"" + name + "\" lies deeper than " + std::to_string(kDeepest) +
                        " directories and is left out");
      return true;
    }
    Disk disk;
    const OwnedFile inside = openDirectoryAt(disk, directory.get(), leaf);
    if (!inside) return hostFailed(name, errno);
    return copyDirectory(inside, name, target, depth + 1);
  }

  bool hostFailed(const std::string& name, int errorNumber) {
    _failure = {FailureCode::HostUnusable,
                "\"" + _host + "/" + name + "\" cannot be read: " + std::strerror(errorNumber),
                "make it readable, or take it out of the host directory"};
    return false;
  }

  bool deviceFailed(const Error& error) {
    _failure = {FailureCode::DeviceUnusable, error.text(), "make room on the device's disk, and it writable"};
    return false;
  }

  const std::string _host;
  EmbeddedFileManager& _files;
  const Supervision& _supervision;
  Failure& _failure;
  std::vector<char> _piece;
};

std::optional<HostDirectory> HostDirectory::open(const std::string& path, Failure& failure) {
  OwnedFile directory(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (directory) return HostDirectory(path, std::make_shared<OwnedFile>(std::move(directory)));
  failure = {FailureCode::HostUnusable, "the host directory \"" + path + "\" cannot be used: " + std::strerror(errno),
             "name a directory that holds ApplicationSync and Packages"};
  return std::nullopt;
}

bool HostDirectory::push(EmbeddedFileManager& files, const Supervision& supervision, Failure& failure) const {
  Copier copier(_path, files, supervision, failure);
  std::optional<Error> error;
  struct stat information {};
  const auto has = [&](const char* name, mode_t kind) {
    if (::fstatat(_directory->get(), name, &information, AT_SYMLINK_NOFOLLOW) != 0) return false;
    if ((information.st_mode & S_IFMT) == kind) return true;
    supervision.note("\"" + std::string(name) + "\" of the host directory is no plain " +
                     (kind == S_IFDIR ? "directory" : "file") + " and is left out");
    return false;
  };

  if (has("ApplicationSync", S_IFDIR)) {
    Disk disk;
    const OwnedFile source = openDirectoryAt(disk, _directory->get(), "ApplicationSync");
    bool done = copier.copyDirectory(source, "ApplicationSync", kIncoming, 1);
    if (done && !files.moveItem(kIncoming, kStagedSync, &error)) {
      failure = {FailureCode::DeviceUnusable, error->text(), "make the device's directory writable"};
      done = false;
    }
    if (!done) {
      files.removeItem(kIncoming, nullptr);
      return false;
    }
  }
  if (!has(kLastSyncList, S_IFREG)) return true;
  if (!files.createDirectory(kLastSyncDirectory, true, {}, &error)) {
    failure = {FailureCode::DeviceUnusable, error->text(), "make the device's directory writable"};
    return false;
  }
  return copier.copyFile(_directory->get(), kLastSyncList, kLastSyncList,
                         std::string(kLastSyncDirectory) + "/" + kLastSyncList);
}

OwnedFile HostDirectory::openPackage(const std::string& identifier, std::uint64_t& size, ErrorOut error) const {
  Disk disk;
  struct stat information {};
  const std::string name = identifier + ".ipa";
  OwnedFile package;
  if (isSinglePathComponent(identifier)) {
    const OwnedFile packages = openDirectoryAt(disk, _directory->get(), "Packages");
    if (packages) package = openPlainFile(packages.get(), name, information);
  }
  if (package) {
    size = static_cast<std::uint64_t>(information.st_size);
    return package;
  }
  setError(error, Error(std::string(kTransferErrorDomain), kTransferMissing,
                        "missing package: the host has no plain file \"Packages/" + name + "\" that can be read"));
  return {};
}

void clearStaging(EmbeddedFileManager& files, const std::vector<std::string>& packagesInUse) {
  for (const char* left : {kStagedSync, kIncoming}) {
    if (files.fileExists(left)) files.removeItem(left, nullptr);
  }
  clearPackages(files, packagesInUse);
}

void clearPackages(EmbeddedFileManager& files, const std::vector<std::string>& packagesInUse) {
  const auto names = files.contentsOfDirectory(kPackageDirectory, nullptr);
  if (!names) return;
  for (const std::string& name : *names) {
    const std::string path = std::string(kPackageDirectory) + "/" + name;
    if (std::find(packagesInUse.begin(), packagesInUse.end(), path) == packagesInUse.end()) {
      files.removeItem(path, nullptr);
    }
  }
}

}  // namespace appsync
