// Copies files of the machine to the device. What is copied is only read; links are not followed.
#pragma once

#include <cstddef>
#include <functional>
#include <span>
#include <string>
#include <vector>

#include "embedded/disk.h"
#include "embedded/file_manager.h"
#include "host/failure.h"

struct stat;

namespace appsync {

inline constexpr std::size_t kPieceSize = std::size_t{1} << 20;  // bytes read and written at a time

// Hears of what is left out, one line each, and is asked between pieces whether to stop.
struct CopySupervision {
  std::function<void(const std::string& line)> note;
  std::function<bool()> isStopped;
};

// Copies until something fails. Every operation answers false then, with the failure said, or with the failure
// untouched when it was stopped.
class DeviceCopier {
 public:
  // `directory` is what messages call the directory that everything comes from.
  DeviceCopier(std::string directory, EmbeddedFileManager& files, const CopySupervision& supervision, Failure& failure);

  // `name` is what messages call the item, `target` a path of the device.
  bool copyDirectory(const OwnedFile& source, const std::string& name, const std::string& target);
  // The plain file `name` in a directory.
  bool copyFile(int directory, const std::string& name, const std::string& target);

 private:
  bool copyContents(const OwnedFile& source, const std::string& name, const std::string& target, std::size_t depth);
  bool copyItem(const OwnedFile& directory, const std::string& leaf, const std::string& name, const std::string& target,
                std::size_t depth);
  bool copyFile(int directory, const std::string& leaf, const std::string& name, const std::string& target);
  bool sourceFailed(const std::string& name, int errorNumber);
  bool deviceFailed(const Error& error);

  const std::string _directory;
  EmbeddedFileManager& _files;
  const CopySupervision& _supervision;
  Failure& _failure;
  std::vector<char> _piece;
};

// What messages say of a directory to copy from.
struct SourceKind {
  const char* name;
  const char* content;                      // what it has to hold
  std::span<const char* const> parts = {};  // its directories that are read whole
};

// Opens a directory to copy from. None, with the failure said, when it cannot be opened, when it lies in the device's
// directory, where clearing the staging area would clear it, or that in one of its parts, which would be copied into
// itself.
OwnedFile openSource(const SourceKind& kind, const std::string& path, const std::string& device, Failure& failure);

// A plain file below a directory. None, with errno, for everything else.
OwnedFile openPlainFile(int directory, const std::string& name, struct stat& information);

}  // namespace appsync
