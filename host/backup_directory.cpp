#include "host/backup_directory.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>

namespace appsync {

namespace {

// A list's name in the backup, and the device's directory that it belongs to.
struct List {
  const char* name;
  const char* directory;
};

constexpr SourceKind kBackup{"backup directory", kBackupRestoreList};

constexpr List kLists[] = {
    {kBackupRestoreList, "/var/mobile/Media/TarvoRestore"},
    {kBackupDemotedApps, "/var/mobile/Library/Preferences"},
};

}  // namespace

std::optional<BackupDirectory> BackupDirectory::open(const std::string& path, const std::string& device,
                                                     Failure& failure) {
  OwnedFile directory = openSource(kBackup, path, device, failure);
  if (!directory) return std::nullopt;
  return BackupDirectory(path, std::make_shared<OwnedFile>(std::move(directory)));
}

bool BackupDirectory::push(EmbeddedFileManager& files, const CopySupervision& supervision, Failure& failure) const {
  DeviceCopier copier(_path, files, supervision, failure);
  for (const List& list : kLists) {
    const std::string target = std::string(list.directory) + "/" + list.name;
    std::optional<Error> error;
    bool done = files.createDirectory(list.directory, true, {}, &error);
    if (done && files.fileExists(target)) done = files.removeItem(target, &error);
    if (!done) {
      failure = failureFrom(FailureCode::DeviceUnusable, *error, "make the device's directory writable");
      return false;
    }
    struct stat information {};
    if (::fstatat(_directory->get(), list.name, &information, AT_SYMLINK_NOFOLLOW) != 0 && errno == ENOENT) continue;
    if (!copier.copyFile(_directory->get(), list.name, target)) return false;
  }
  return true;
}

}  // namespace appsync
