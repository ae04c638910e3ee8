#include "embedded/disk.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/random.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <memory>
#include <string_view>

namespace appsync {

int Disk::openat(int directory, const char* name, int flags, mode_t mode) {
  return ::openat(directory, name, flags, mode);
}

ssize_t Disk::write(int file, const void* bytes, std::size_t size) {
  return ::write(file, bytes, size);
}

int Disk::fsync(int file) {
  return ::fsync(file);
}

int Disk::mkdirat(int directory, const char* name, mode_t mode) {
  return ::mkdirat(directory, name, mode);
}

int Disk::renameat(int fromDirectory, const char* from, int toDirectory, const char* to) {
  return ::renameat(fromDirectory, from, toDirectory, to);
}

int Disk::renameat2(int fromDirectory, const char* from, int toDirectory, const char* to, unsigned flags) {
  return ::renameat2(fromDirectory, from, toDirectory, to, flags);
}

int Disk::unlinkat(int directory, const char* name, int flags) {
  return ::unlinkat(directory, name, flags);
}

int Disk::symlinkat(const char* target, int directory, const char* name) {
  return ::symlinkat(target, directory, name);
}

int Disk::fsetxattr(int file, const char* name, const void* value, std::size_t size) {
  return ::fsetxattr(file, name, value, size, 0);
}

int Disk::utimensat(int directory, const char* name) {
  return ::utimensat(directory, name, nullptr, AT_SYMLINK_NOFOLLOW);
}

OwnedFile::~OwnedFile() {
  if (_file >= 0) ::close(_file);
}

OwnedFile openDirectoryAt(Disk& disk, int directory, const std::string& name) {
  return OwnedFile(disk.openat(directory, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC, 0));
}

bool writeAll(Disk& disk, int file, const void* bytes, std::size_t size) {
  const char* rest = static_cast<const char*>(bytes);
  while (size > 0) {
    const ssize_t written = disk.write(file, rest, size);
    if (written < 0 && errno == EINTR) continue;
    if (written == 0) errno = EIO;
    if (written <= 0) return false;
    rest += written;
    size -= static_cast<std::size_t>(written);
  }
  return true;
}

// --- temporary files ------------------------------------------------------------------------------------------------

namespace {

constexpr std::string_view kTemporaryPrefix = ".tmp-appsync-";
constexpr std::string_view kDigits = "0123456789abcdef";
constexpr std::size_t kTemporaryDigits = 16;

std::uint64_t unforeseenNumber() {
  std::uint64_t number = 0;
  if (::getrandom(&number, sizeof number, GRND_NONBLOCK) == sizeof number) return number;
  // Early after a machine's start there may be no random numbers; made exclusively, a file needs only a new name.
  static std::atomic<std::uint64_t> counter{0};
  const auto time = static_cast<std::uint64_t>(std::chrono::steady_clock::now().time_since_epoch().count());
  return (time << 20U) ^ (static_cast<std::uint64_t>(::getpid()) << 44U) ^ counter.fetch_add(1);
}

std::string makeTemporaryName() {
  std::string name(kTemporaryPrefix);
  std::uint64_t number = unforeseenNumber();
  for (std::size_t digit = 0; digit < kTemporaryDigits; ++digit, number >>= 4U) name += kDigits[number & 15U];
  return name;
}

}  // namespace

OwnedFile makeTemporaryFile(Disk& disk, int directory, std::string& name) {
  constexpr int kTries = 100;
  for (int i = 0; i < kTries; ++i) {
    name = makeTemporaryName();
    OwnedFile file(disk.openat(directory, name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644));
    if (file || errno != EEXIST) return file;
  }
  return {};
}

bool isTemporaryName(const std::string& name) {
  return name.size() == kTemporaryPrefix.size() + kTemporaryDigits && name.starts_with(kTemporaryPrefix) &&
         name.find_first_not_of(kDigits, kTemporaryPrefix.size()) == std::string::npos;
}

// --- directories ----------------------------------------------------------------------------------------------------

bool listDirectory(int directory, std::vector<std::string>& names) {
  names.clear();
  // A handle of its own, for its own position in the directory.
  const int handle = ::openat(directory, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (handle < 0) return false;
  const std::unique_ptr<DIR, int (*)(DIR*)> stream(::fdopendir(handle), &::closedir);
  if (!stream) {
    const int reason = errno;
    ::close(handle);
    errno = reason;
    return false;
  }
  errno = 0;
  while (const dirent* entry = ::readdir(stream.get())) {
    const std::string_view name = entry->d_name;
    if (name != "." && name != "..") names.emplace_back(name);
  }
  if (errno != 0) return false;
  std::sort(names.begin(), names.end());
  return true;
}

namespace {

// The walk holds the handle of one directory and comes back to the one above through "..", checked, so that depth
// costs memory for names only.
class TreeWalk {
 public:
  TreeWalk(Disk& disk, const std::function<int(const TreeEntry&)>& visit,
           const std::function<bool(const std::string& name)>& enters)
      : _disk(disk), _visit(visit), _enters(enters) {}

  int run(int directory) {
    if (!descend(openDirectoryAt(_disk, directory, "."), {}, {})) note(errno);
    while (!_levels.empty()) {
      Level& level = _levels.back();
      if (level.next < level.names.size()) {
        meet(level.names[level.next++]);
      } else if (!ascend()) {
        break;
      }
    }
    return _firstError;
  }

 private:
  struct Level {
    std::string name;  // of this directory in the one above
    struct stat status;
    std::vector<std::string> names;
    std::size_t next = 0;
  };

  void meet(const std::string& met) {
    const std::string name = met;  // what holds it moves when the walk goes deeper
    struct stat status;
    if (::fstatat(_current.get(), name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) {
      if (errno != ENOENT) note(errno);
    } else if (!S_ISDIR(status.st_mode)) {
      note(_visit({_current.get(), name, status}));
    } else if (_enters && !_enters(name)) {
      return;
    } else if (!descend(openDirectoryAt(_disk, _current.get(), name), name, status)) {
      note(errno);
      note(_visit({_current.get(), name, status}));
    }
  }

  bool descend(OwnedFile directory, const std::string& name, const struct stat& seen) {
    if (!directory) return false;
    Level level{name, seen, {}};
    if (::fstat(directory.get(), &level.status) != 0 || !listDirectory(directory.get(), level.names)) return false;
    _levels.push_back(std::move(level));
    _current = std::move(directory);
    return true;
  }

  bool ascend() {
    const Level left = std::move(_levels.back());
    _levels.pop_back();
    if (_levels.empty()) return true;
    OwnedFile above(_disk.openat(_current.get(), "..", O_RDONLY | O_DIRECTORY | O_CLOEXEC, 0));
    struct stat status;
    if (!above || ::fstat(above.get(), &status) != 0) return stop(errno);
    const struct stat& expected = _levels.back().status;
    // Somebody has moved the directory meanwhile: what is above now is none of this tree's.
    if (status.st_dev != expected.st_dev || status.st_ino != expected.st_ino) return stop(ESTALE);
    _current = std::move(above);
    note(_visit({_current.get(), left.name, left.status}));
    return true;
  }

  void note(int errorNumber) {
    if (_firstError == 0) _firstError = errorNumber;
  }
  bool stop(int errorNumber) {
    note(errorNumber);
    return false;
  }

  Disk& _disk;
  const std::function<int(const TreeEntry&)>& _visit;
  const std::function<bool(const std::string& name)>& _enters;
  OwnedFile _current;
  std::vector<Level> _levels;
  int _firstError = 0;
};

}  // namespace

int walkTree(Disk& disk, int directory, const std::function<int(const TreeEntry&)>& visit,
             const std::function<bool(const std::string& name)>& enters) {
  return TreeWalk(disk, visit, enters).run(directory);
}

}  // namespace appsync
