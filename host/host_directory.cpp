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

}  // namespace

std::optional<HostDirectory> HostDirectory::open(const std::string& path, Failure& failure) {
  OwnedFile directory(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (directory) return HostDirectory(path, std::make_shared<OwnedFile>(std::move(directory)));
  failure = {FailureCode::HostUnusable, "the host directory \"" + path + "\" cannot be used: " + std::strerror(errno),
             "name a directory that holds ApplicationSync and Packages"};
  return std::nullopt;
}

bool HostDirectory::push(EmbeddedFileManager& files, const CopySupervision& supervision, Failure& failure) const {
  DeviceCopier copier(_path, files, supervision, failure);
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
    bool done = copier.copyDirectory(source, "ApplicationSync", kIncoming);
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
  return copier.copyFile(_directory->get(), kLastSyncList, std::string(kLastSyncDirectory) + "/" + kLastSyncList);
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
