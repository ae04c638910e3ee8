// The desktop host's directory: what it has for the device. Only read, never changed; links in it are not followed.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "embedded/disk.h"
#include "embedded/file_manager.h"
#include "host/device_copier.h"
#include "host/failure.h"

namespace appsync {

inline constexpr char kStagingDirectory[] = "/var/mobile/Media/PublicStaging";
inline constexpr char kStagedSync[] = "/var/mobile/Media/PublicStaging/ApplicationSync";
inline constexpr char kPackageDirectory[] = "/var/mobile/Media/PublicStaging/Packages";

class HostDirectory {
 public:
  // None, with the failure said, when there is no such directory, or when it and that of the device lie in each other
  // (see `openSource`).
  static std::optional<HostDirectory> open(const std::string& path, const std::string& device, Failure& failure);

  // Puts a copy of "ApplicationSync" into the staging area, in one step once it is whole, and the last-sync list to its
  // place. What the host does not have is left out. False, with the failure said, when something cannot be read or
  // written (then nothing is staged), or when it was stopped (then the failure stays untouched).
  bool push(EmbeddedFileManager& files, const CopySupervision& supervision, Failure& failure) const;

  // A package, open for reading. None, with an error of the domain "TransferError": the host does not have it, or it
  // cannot be read.
  OwnedFile openPackage(const std::string& identifier, std::uint64_t& size, ErrorOut error) const;

 private:
  HostDirectory(std::string path, std::shared_ptr<OwnedFile> directory)
      : _path(std::move(path)), _directory(std::move(directory)) {}

  std::string _path;
  std::shared_ptr<OwnedFile> _directory;
};

// Removes what an earlier push or transfer left in the staging area, but for the packages that are still to be
// installed.
void clearStaging(EmbeddedFileManager& files, const std::vector<std::string>& packagesInUse);

// Removes packages that nobody is going to install.
void clearPackages(EmbeddedFileManager& files, const std::vector<std::string>& packagesInUse);

}  // namespace appsync
