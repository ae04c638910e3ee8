// A backup: what a restore leaves on the device before the client is asked to bring the applications back. Only read,
// never changed; links in it are not followed.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "embedded/disk.h"
#include "embedded/file_manager.h"
#include "host/device_copier.h"
#include "host/failure.h"

namespace appsync {

inline constexpr char kBackupRestoreList[] = "RestoreApplications.plist";
inline constexpr char kBackupDemotedApps[] = "com.zelk.Vaultry.DemotedApps.plist";

class BackupDirectory {
 public:
  // None, with the failure said, when there is no such directory, or when it lies in the device's.
  static std::optional<BackupDirectory> open(const std::string& path, const std::string& device, Failure& failure);

  // Puts a copy of its lists in place on the device; what the backup lacks is not there afterwards either. False, with
  // the failure said, when something cannot be read or written, or when it was stopped (then the failure stays
  // untouched); of a backup that cannot be read nothing is put in place, and whatever fails, no list of what to restore
  // stands there beside demoted ones of another backup.
  bool push(EmbeddedFileManager& files, const CopySupervision& supervision, Failure& failure) const;

  const std::string& path() const { return _path; }

 private:
  BackupDirectory(std::string path, std::shared_ptr<OwnedFile> directory)
      : _path(std::move(path)), _directory(std::move(directory)) {}
  bool copyLists(EmbeddedFileManager& files, const CopySupervision& supervision, Failure& failure) const;

  std::string _path;
  std::shared_ptr<OwnedFile> _directory;
};

}  // namespace appsync
