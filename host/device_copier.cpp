#include "host/device_copier.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <utility>

namespace appsync {

namespace {

constexpr std::size_t kDeepest = 32;  // directories within directories

using Identity = std::pair<dev_t, ino_t>;

// The directory itself and those above it, as far up as they can be told.
std::vector<Identity> lineOf(int directory) {
  std::vector<Identity> line;
  OwnedFile above;
  struct stat information {};
  while (::fstat(directory, &information) == 0) {
    const Identity identity(information.st_dev, information.st_ino);
    if (!line.empty() && line.back() == identity) break;  // the root
    line.push_back(identity);
    above = OwnedFile(::openat(directory, "..", O_PATH | O_DIRECTORY | O_CLOEXEC));
    directory = above.get();
  }
  return line;
}

// Why the device cannot take anything from a directory; empty when it can.
std::string whyTooClose(const SourceKind& kind, int source, const std::string& device) {
  const std::vector<Identity> sourceLine = lineOf(source);
  std::filesystem::path path = device;
  OwnedFile nearest;  // the device's directory, or the first one above it that is there
  bool isThere = true;
  while (!(nearest = OwnedFile(::open(path.empty() ? "." : path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC)))) {
    if (errno != ENOENT || path.empty() || path == path.parent_path()) return "";
    path = path.parent_path();
    isThere = false;
  }
  const std::vector<Identity> deviceLine = lineOf(nearest.get());
  const auto liesIn = [](const std::vector<Identity>& line, const std::vector<Identity>& other) {
    return !other.empty() && std::find(line.begin(), line.end(), other.front()) != line.end();
  };
  if (isThere && liesIn(sourceLine, deviceLine)) return "it lies in the device \"" + device + "\"";
  Disk disk;
  for (const char* name : kind.parts) {
    const OwnedFile part = openDirectoryAt(disk, source, name);
    if (part && liesIn(deviceLine, lineOf(part.get()))) {
      return "the device \"" + device + "\" lies in its \"" + name + "\"";
    }
  }
  return "";
}

}  // namespace

OwnedFile openSource(const SourceKind& kind, const std::string& path, const std::string& device, Failure& failure) {
  OwnedFile directory(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  const auto refuse = [&](const std::string& why, const std::string& hint) {
    failure = {FailureCode::HostUnusable, "the " + std::string(kind.name) + " \"" + path + "\" cannot be used: " + why,
               hint};
    return OwnedFile();
  };
  if (!directory) return refuse(std::strerror(errno), "name a directory that holds " + std::string(kind.content));
  const std::string tooClose = whyTooClose(kind, directory.get(), device);
  if (!tooClose.empty()) return refuse(tooClose, "keep it and the device in directories apart from each other");
  return directory;
}

OwnedFile openPlainFile(int directory, const std::string& name, struct stat& information) {
  OwnedFile file(::openat(directory, name.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK));
  if (!file) return {};
  if (::fstat(file.get(), &information) != 0) return {};
  if (S_ISREG(information.st_mode)) return file;
  errno = S_ISDIR(information.st_mode) ? EISDIR : EINVAL;
  return {};
}

DeviceCopier::DeviceCopier(std::string directory, EmbeddedFileManager& files, const CopySupervision& supervision,
                           Failure& failure)
    : _directory(std::move(directory)),
      _files(files),
      _supervision(supervision),
      _failure(failure),
      _piece(kPieceSize) {}

bool DeviceCopier::copyDirectory(const OwnedFile& source, const std::string& name, const std::string& target) {
  return copyContents(source, name, target, 1);
}

bool DeviceCopier::copyFile(int directory, const std::string& name, const std::string& target) {
  return copyFile(directory, name, name, target);
}

bool DeviceCopier::copyContents(const OwnedFile& source, const std::string& name, const std::string& target,
                                std::size_t depth) {
  std::optional<Error> error;
  if (!_files.createDirectory(target, true, {}, &error)) return deviceFailed(*error);
  std::vector<std::string> names;
  if (!listDirectory(source.get(), names)) return sourceFailed(name, errno);
  for (const std::string& one : names) {
    if (!copyItem(source, one, name + "/" + one, target + "/" + one, depth)) return false;
  }
  return true;
}

bool DeviceCopier::copyItem(const OwnedFile& directory, const std::string& leaf, const std::string& name,
                            const std::string& target, std::size_t depth) {
  struct stat information {};
  if (::fstatat(directory.get(), leaf.c_str(), &information, AT_SYMLINK_NOFOLLOW) != 0) {
    return sourceFailed(name, errno);
  }
  if (S_ISREG(information.st_mode)) return copyFile(directory.get(), leaf, name, target);
  if (!S_ISDIR(information.st_mode)) {
    _supervision.note("\"" + name + "\" is neither a plain file nor a directory and is left out");
    return true;
  }
  if (depth == kDeepest) {
    _supervision.note("\"" + name + "\" lies deeper than " + std::to_string(kDeepest) + " directories and is left out");
    return true;
  }
  Disk disk;
  const OwnedFile inside = openDirectoryAt(disk, directory.get(), leaf);
  if (!inside) return sourceFailed(name, errno);
  return copyContents(inside, name, target, depth + 1);
}

bool DeviceCopier::copyFile(int directory, const std::string& leaf, const std::string& name,
                            const std::string& target) {
  struct stat information {};
  const OwnedFile source = openPlainFile(directory, leaf, information);
  if (!source) return sourceFailed(name, errno);
  std::optional<Error> error;
  const auto sink = _files.openSink(target, &error);
  if (!sink) return deviceFailed(*error);
  while (true) {
    if (_supervision.isStopped()) return false;
    const ssize_t count = ::read(source.get(), _piece.data(), _piece.size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return sourceFailed(name, errno);
    if (count == 0) break;
    if (!sink->append(_piece.data(), static_cast<std::size_t>(count), &error)) return deviceFailed(*error);
  }
  return sink->finish(&error) || deviceFailed(*error);
}

bool DeviceCopier::sourceFailed(const std::string& name, int errorNumber) {
  _failure = {FailureCode::HostUnusable,
              "\"" + _directory + "/" + name + "\" cannot be read: " + std::strerror(errorNumber),
              "make it a plain file that can be read, or take it out of the directory"};
  return false;
}

bool DeviceCopier::deviceFailed(const Error& error) {
  _failure = failureFrom(FailureCode::DeviceUnusable, error, "make room on the device's disk, and make it writable");
  return false;
}

}  // namespace appsync
