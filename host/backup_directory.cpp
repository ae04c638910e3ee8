#include "host/backup_directory.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>

namespace appsync {

namespace {

// A list's name in the backup, and the device's directory that it belongs to.
struct List {
  const char* name;
  const char* directory;
};

constexpr List kLists[] = {
    {kBackupRestoreList, "/var/mobile/Media/TarvoRestore"},
    {kBackupDemotedApps, "/var/mobile/Library/Preferences"},
};

}  // namespace

std::optional<BackupDirectory> BackupDirectory::open(const std::string& path, Failure& failure) {
  OwnedFile directory(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (directory) return BackupDirectory(path, std::make_shared<OwnedFile>(std::move(directory)));
  failure = {FailureCode::HostUnusable, "the backup directory \"" + path + "\" cannot be used: " + std::strerror(errno),
             "name a directory that holds " + std::string(kBackupRestoreList)};
  return std::nullopt;
}

bool BackupDirectory::push(EmbeddedFileManager& files, const CopySupervision& supervision, Failure& failure) const {
  DeviceCopier copier(_path, files, supervision, failure);
  for (const List& list : kLists) {
    const std::string target = std::string(list.directory) + "/" + list.name;
    std::optional<Error> error;
    bool done = files.createDirectory(list.directory, true, {}, &error);
    if (done && files.fileExists(target)) done = files.removeItem(target, &error);
    if (!done) {
      failure = {FailureCode::DeviceUnusable, error->text(), "make the device's directory writable"};
      return false;
    }
    struct stat information {};
    if (::fstatat(_directory->get(), list.name, &information, AT_SYMLINK_NOFOLLOW) != 0 && errno == ENOENT) continue;
    if (!copier.copyFile(_directory->get(), list.name, target)) return false;
  }
  return true;
}

}  // namespace appsync
