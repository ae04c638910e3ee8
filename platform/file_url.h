// The address of a file or directory on the device.
#pragma once

#include <optional>
#include <string>

namespace appsync {

class FileURL {
 public:
  // None for a path that no file can have: an empty one, or one that contains a NUL.
  static std::optional<FileURL> fileURLWithPath(const std::string& path, bool isDirectory);

  const std::string& path() const { return _path; }
  bool isDirectory() const { return _isDirectory; }

  // "file://" and the path, percent-encoded; a directory's ends with a slash.
  std::string description() const;

  friend bool operator==(const FileURL&, const FileURL&) = default;

 private:
  FileURL(std::string path, bool isDirectory) : _path(std::move(path)), _isDirectory(isDirectory) {}

  std::string _path;
  bool _isDirectory;
};

}  // namespace appsync
