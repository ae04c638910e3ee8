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

  std::string place() const { return std::string(directory) + "/" + name; }
  std::string incoming() const { return std::string(directory) + "/." + name + ".incoming"; }
};

constexpr SourceKind kBackup{"backup directory", kBackupRestoreList};

constexpr List kLists[] = {
    {kBackupRestoreList, "/var/mobile/Media/TarvoRestore"},
    {kBackupDemotedApps, "/var/mobile/Library/Preferences"},
};

bool notWritable(const Error& error, Failure& failure) {
  failure = failureFrom(FailureCode::DeviceUnusable, error, "make the device's directory writable");
  return false;
}

// What has been copied takes the place of what is there; where nothing has been copied that goes. The list of what to
// restore goes first and comes last: it never stands beside another backup's demoted ones.
bool putInPlace(EmbeddedFileManager& files, Failure& failure) {
  std::optional<Error> error;
  for (const List& list : kLists) {
    if (files.fileExists(list.place()) && !files.removeItem(list.place(), &error)) return notWritable(*error, failure);
  }
  for (const List& list : {kLists[1], kLists[0]}) {
    if (!files.fileExists(list.incoming())) continue;
    if (!files.moveItem(list.incoming(), list.place(), &error)) return notWritable(*error, failure);
  }
  return true;
}

}  // namespace

std::optional<BackupDirectory> BackupDirectory::open(const std::string& path, const std::string& device,
                                                     Failure& failure) {
  OwnedFile directory = openSource(kBackup, path, device, failure);
  if (!directory) return std::nullopt;
  return BackupDirectory(path, std::make_shared<OwnedFile>(std::move(directory)));
}

bool BackupDirectory::push(EmbeddedFileManager& files, const CopySupervision& supervision, Failure& failure) const {
  if (copyLists(files, supervision, failure) && putInPlace(files, failure)) return true;
  for (const List& list : kLists) {
    if (files.fileExists(list.incoming())) files.removeItem(list.incoming(), nullptr);
  }
  return false;
}

// Beside their places, so that a list that cannot be read leaves those of an earlier backup as they are.
bool BackupDirectory::copyLists(EmbeddedFileManager& files, const CopySupervision& supervision,
                                Failure& failure) const {
  DeviceCopier copier(_path, files, supervision, failure);
  for (const List& list : kLists) {
    std::optional<Error> error;
    bool done = files.createDirectory(list.directory, true, {}, &error);
    if (done && files.fileExists(list.incoming())) done = files.removeItem(list.incoming(), &error);
    if (!done) return notWritable(*error, failure);
    struct stat information {};
    if (::fstatat(_directory->get(), list.name, &information, AT_SYMLINK_NOFOLLOW) != 0 && errno == ENOENT) continue;
    if (!copier.copyFile(_directory->get(), list.name, list.incoming())) return false;
  }
  return true;
}

}  // namespace appsync
