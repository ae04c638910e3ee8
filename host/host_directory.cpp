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
constexpr const char* kParts[] = {"ApplicationSync", "Packages"};
constexpr SourceKind kHost{"host directory", "ApplicationSync and Packages", kParts};

// Whether this error of opening a package tells that there is no such plain file, and no name that could have one.
bool tellsOfNoFile(int error) {
  return error == ENOENT || error == ENOTDIR || error == EISDIR || error == EINVAL || error == ELOOP ||
         error == ENXIO || error == ENAMETOOLONG;
}

}  // namespace

std::optional<HostDirectory> HostDirectory::open(const std::string& path, const std::string& device, Failure& failure) {
  OwnedFile directory = openSource(kHost, path, device, failure);
  if (!directory) return std::nullopt;
  return HostDirectory(path, std::make_shared<OwnedFile>(std::move(directory)));
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
      failure = failureFrom(FailureCode::DeviceUnusable, *error, "make the device's directory writable");
      done = false;
    }
    if (!done) {
      files.removeItem(kIncoming, nullptr);
      return false;
    }
  }
  if (!has(kLastSyncList, S_IFREG)) return true;
  if (!files.createDirectory(kLastSyncDirectory, true, {}, &error)) {
    failure = failureFrom(FailureCode::DeviceUnusable, *error, "make the device's directory writable");
    return false;
  }
  return copier.copyFile(_directory->get(), kLastSyncList, std::string(kLastSyncDirectory) + "/" + kLastSyncList);
}

OwnedFile HostDirectory::openPackage(const std::string& identifier, std::uint64_t& size, ErrorOut error) const {
  const std::string name = identifier + ".ipa";
  int reason = ENOENT;
  if (isSinglePathComponent(identifier)) {
    Disk disk;
    struct stat information {};
    const OwnedFile packages = openDirectoryAt(disk, _directory->get(), "Packages");
    OwnedFile package = packages ? openPlainFile(packages.get(), name, information) : OwnedFile();
    if (package) {
      size = static_cast<std::uint64_t>(information.st_size);
      return package;
    }
    reason = errno;
  }
  const std::string domain(kTransferErrorDomain);
  if (tellsOfNoFile(reason)) {
    setError(error,
             Error(domain, kTransferMissing, "missing package: the host has no plain file \"Packages/" + name + "\""));
  } else {
    setError(error, Error(domain, kTransferBroken,
                          "the host's \"Packages/" + name + "\" cannot be read: " + std::strerror(reason)));
  }
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
