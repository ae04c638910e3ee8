#include "embedded/device_directory.h"

#include <fcntl.h>
#include <sys/file.h>

#include <algorithm>
#include <cerrno>
#include <vector>

#include "embedded/device.h"
#include "embedded/file_manager.h"

namespace appsync {

namespace {

// What every device has. The client makes its own directory in the library.
constexpr const char* kDirectories[] = {
    "/state",
    "/var/mobile/Containers",
    "/var/mobile/Library/Logs/MediaServices",
    "/var/mobile/Library/Preferences",
    "/var/mobile/Media/PublicStaging",
    "/var/mobile/Media/TarvoRestore",
    "/var/mobile/tmp",
};

// What can stand in a directory that is to become a device: it is a disk's own, or a first start was cut short, which
// makes the lock, the records' directory and the device's files one after the other, and no record before all is there.
bool isHarmless(const EmbeddedFileManager& files, const std::string& name) {
  if (name == "lost+found") return true;
  const std::string path = "/" + name;
  if (name == "lock") return !files.isDirectory(path) && files.treeSize(path) == 0;
  if (name != "state" && name != "var") return false;
  const auto names = files.contentsOfDirectory(path, nullptr);
  return names && names->empty();
}

// Makes the directory with its parents, on the machine. 0 or an error number.
int makeWithParents(const std::string& directory, Disk& disk) {
  std::size_t end = 0;
  do {
    end = directory.find('/', end + 1);
    const std::string path = directory.substr(0, end);
    if (disk.mkdirat(AT_FDCWD, path.c_str(), 0755) != 0) {
      if (errno != EEXIST) return errno;
      continue;
    }
    const std::size_t slash = path.rfind('/');
    const std::string above = slash == std::string::npos ? "." : path.substr(0, slash + 1);
    const OwnedFile parent(disk.openat(AT_FDCWD, above.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC, 0));
    if (!parent || disk.fsync(parent.get()) != 0) return errno;
  } while (end != std::string::npos);
  return 0;
}

OwnedFile lockDirectory(const std::string& directory, Disk& disk, ErrorOut error) {
  const std::string path = directory + "/lock";
  OwnedFile file(disk.openat(AT_FDCWD, path.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0644));
  if (file && ::flock(file.get(), LOCK_EX | LOCK_NB) == 0) return file;
  if (file && errno == EWOULDBLOCK) {
    setError(error, deviceError(kDeviceInUse, "The device directory \"" + directory +
                                                  "\" is in use by another process; wait until that has ended"));
  } else {
    setError(error, deviceError(kDeviceUnusable, "The device directory \"" + directory + "\" cannot be locked",
                                fileError("lock", path, errno)));
  }
  return {};
}

}  // namespace

Error deviceError(std::int64_t code, const std::string& text, const std::optional<Error>& reason) {
  const std::string domain(kDeviceErrorDomain);
  return reason ? Error(domain, code, text, *reason) : Error(domain, code, text);
}

Error notADeviceError(const std::string& directory) {
  return deviceError(kDeviceUnusable, "The directory \"" + directory +
                                          "\" is not empty and is no device; name an empty or new directory, or one "
                                          "that holds a device");
}

Error unreadableRecordsError(const std::string& directory, const Error& reason) {
  return deviceError(kDeviceUnusable,
                     "The records of the device in \"" + directory +
                         "\" cannot be read; make them readable, or move the directory away",
                     reason);
}

std::optional<DeviceDirectory> lookAtDeviceDirectory(const std::string& directory, Disk& disk, ErrorOut error) {
  if (directory.empty() || directory.find('\0') != std::string::npos) {
    setError(error, deviceError(kDeviceUnusable, "\"" + directory + "\" cannot be the name of a directory"));
    return std::nullopt;
  }
  const EmbeddedFileManager files = EmbeddedFileManager(directory, disk).ownFiles();
  std::optional<Error> reason;
  const auto names = files.contentsOfDirectory("/", &reason);
  if (!names && reason->code() == ENOENT) return DeviceDirectory::Missing;
  if (!names) {
    const bool isFile = reason->code() == ENOTDIR;
    setError(error, deviceError(kDeviceUnusable,
                                "The device directory \"" + directory + "\" " +
                                    (isFile ? "is no directory; name another one" : "cannot be read"),
                                reason));
    return std::nullopt;
  }
  // In this order: another process may be making the device just now.
  const bool isEmpty =
      std::all_of(names->begin(), names->end(), [&](const std::string& name) { return isHarmless(files, name); });
  if (isEmpty) return DeviceDirectory::Empty;
  const bool isDevice = files.isDirectory("/state") && files.isDirectory("/var/mobile");
  return isDevice ? DeviceDirectory::Device : DeviceDirectory::SomethingElse;
}

OwnedFile prepareDeviceDirectory(const std::string& directory, Disk& disk, ErrorOut error) {
  const std::optional<DeviceDirectory> found = lookAtDeviceDirectory(directory, disk, error);
  if (!found) return {};
  if (found == DeviceDirectory::SomethingElse) {
    setError(error, notADeviceError(directory));
    return {};
  }
  const int result = found == DeviceDirectory::Missing ? makeWithParents(directory, disk) : 0;
  if (result != 0) {
    setError(error, deviceError(kDeviceUnusable, "The device directory cannot be made",
                                fileError("create directory", directory, result)));
    return {};
  }
  OwnedFile lock = lockDirectory(directory, disk, error);
  if (!lock) return {};
  EmbeddedFileManager files = EmbeddedFileManager(directory, disk).ownFiles();
  std::optional<Error> reason;
  for (const char* path : kDirectories) {
    if (files.createDirectory(path, true, {}, &reason)) continue;
    setError(error, deviceError(kDeviceUnusable,
                                "The device in \"" + directory +
                                    "\" cannot be used: a directory of it is missing and cannot be made",
                                reason));
    return {};
  }
  return lock;
}

}  // namespace appsync
