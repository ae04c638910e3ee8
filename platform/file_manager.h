// The device's files, by the device's own absolute paths.
//
// A leaf service: any thread, never calls back, may be called under a lock. Paths are absolute; a path that is not,
// that is empty, that contains a NUL or has a ".." component is refused by every operation as if nothing could be
// there. All errors are of the domain "FileError", their code the system's error number, their text naming operation
// and path.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/error.h"
#include "platform/property_list.h"

namespace appsync {

inline constexpr std::string_view kFileErrorDomain = "FileError";

// What is set on a file or directory when it is made. Accounts that the file system cannot set are recorded where it
// can hold the record, and otherwise ignored: they never make an operation fail.
struct FileAttributes {
  std::optional<std::string> ownerAccountName;
  std::optional<std::string> groupOwnerAccountName;
};

// What is read of a file.
struct FileInformation {
  std::uint64_t size = 0;  // bytes
  bool isDirectory = false;
  FileAttributes attributes;  // as recorded when the file was made; absent when nothing was
};

class FileManager {
 public:
  virtual ~FileManager() = default;

  // The host process's temporary directory, which exists.
  virtual std::string temporaryDirectory() = 0;

  // Whether anything is at the path.
  virtual bool fileExists(const std::string& path) = 0;

  // The whole file, read past every cache of ours. None, with an error, when it is missing, no regular file, cannot be
  // read or is larger than 256 MiB.
  virtual std::optional<Bytes> readFile(const std::string& path, ErrorOut error) = 0;

  // Replaces or makes the file in one step: whoever reads sees the old bytes or the new ones, also after a crash or
  // loss of power at any instant. False, with an error, leaves the old file as it was, unless the new one had got its
  // place and could then not be flushed: it is what everybody reads from now on, and may be lost with power.
  virtual bool writeFile(const std::string& path, BytesView bytes, ErrorOut error) = 0;

  // Makes the file with these bytes and attributes; a file that is there is overwritten.
  virtual bool createFile(const std::string& path, BytesView bytes, const FileAttributes& attributes) = 0;

  // Makes the directory. With `intermediateDirectories` its missing parents too (with the same attributes), and a
  // directory that is there already is success; without, it is an error.
  virtual bool createDirectory(const std::string& path, bool intermediateDirectories, const FileAttributes& attributes,
                               ErrorOut error) = 0;

  // Removes a file, or a directory with everything in it (a link is removed, never followed). What cannot be removed
  // stays, with all that stands above it. Nothing there is an error.
  virtual bool removeItem(const std::string& path, ErrorOut error) = 0;

  // Moves a file or directory. An item that is at the destination already is an error, and both stay.
  virtual bool moveItem(const std::string& from, const std::string& to, ErrorOut error) = 0;

  // Copies a regular file. A file at the destination is replaced; a directory at either end is an error.
  virtual bool copyItem(const std::string& from, const std::string& to, ErrorOut error) = 0;

  virtual std::optional<FileInformation> attributesOfItem(const std::string& path, ErrorOut error) = 0;

  // Sets the access and modification times to now. 0, or the system's error number.
  virtual int utimes(const std::string& path) = 0;

  // The system's text for an error number.
  virtual std::string strerror(int errorNumber) = 0;
};

}  // namespace appsync
