// The seam to the disk: the few calls of the operating system that change files, relative to directory handles.
//
// Everything that the embedded device writes goes through here, so that crash points, short writes and a full disk can
// be made by overriding a call.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <cstddef>
#include <functional>
#include <string>
#include <utility>
#include <vector>

namespace appsync {

// Each call is the system's own of that name, with its results and errno. Any thread.
class Disk {
 public:
  virtual ~Disk() = default;

  virtual int openat(int directory, const char* name, int flags, mode_t mode);
  virtual ssize_t write(int file, const void* bytes, std::size_t size);
  virtual int fsync(int file);
  virtual int mkdirat(int directory, const char* name, mode_t mode);
  virtual int renameat(int fromDirectory, const char* from, int toDirectory, const char* to);
  // Fails with EINVAL or ENOSYS where the file system does not know the flags.
  virtual int renameat2(int fromDirectory, const char* from, int toDirectory, const char* to, unsigned flags);
  virtual int unlinkat(int directory, const char* name, int flags);
  virtual int symlinkat(const char* target, int directory, const char* name);
  virtual int fsetxattr(int file, const char* name, const void* value, std::size_t size);
  virtual int utimensat(int directory, const char* name);  // both times to now; a link itself, not what it points to
};

// An open file or directory, closed with its owner.
class OwnedFile {
 public:
  OwnedFile() = default;
  explicit OwnedFile(int file) : _file(file) {}
  OwnedFile(OwnedFile&& other) noexcept : _file(std::exchange(other._file, -1)) {}
  OwnedFile& operator=(OwnedFile&& other) noexcept {
    std::swap(_file, other._file);
    return *this;
  }
  ~OwnedFile();

  explicit operator bool() const { return _file >= 0; }
  int get() const { return _file; }

 private:
  int _file = -1;
};

// Opens a directory below a handle for reading; a link is not followed. None, with errno.
OwnedFile openDirectoryAt(Disk& disk, int directory, const std::string& name);

// Writes all of it, however short the single writes are. False, with errno; the file then holds a part.
bool writeAll(Disk& disk, int file, const void* bytes, std::size_t size);

// Makes a file beside its final place, for writing, under a name of the one pattern that temporary files have. The name
// is unique; none, with errno, when it cannot be made.
OwnedFile makeTemporaryFile(Disk& disk, int directory, std::string& name);

// Whether a file of this name is one that `makeTemporaryFile` made.
bool isTemporaryName(const std::string& name);

// The names in a directory, without "." and "..", sorted. False, with errno, when it cannot be read to its end.
bool listDirectory(int directory, std::vector<std::string>& names);

// One thing below a directory, as a walk meets it.
struct TreeEntry {
  int directory;  // the handle of the directory that holds it
  const std::string& name;
  const struct stat& status;  // of the thing itself, never of what a link points to

  bool isDirectory() const { return S_ISDIR(status.st_mode); }
};

// Visits everything below a directory, what a directory holds before the directory itself. Follows no link, and takes a
// tree of any depth: it holds no more than three handles at a time. `visit` answers 0 or an error number; the walk goes
// on after an error. A directory whose name `enters` answers false for is passed over whole. Answers 0 or the first error
// number, of a visit or of a directory that could not be read.
int walkTree(Disk& disk, int directory, const std::function<int(const TreeEntry&)>& visit,
             const std::function<bool(const std::string& name)>& enters = {});

}  // namespace appsync
