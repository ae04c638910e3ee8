#include "embedded/file_manager.h"

#include <fcntl.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <new>
#include <string_view>
#include <utility>

namespace appsync {

namespace {

constexpr mode_t kDirectoryMode = 0755;
constexpr std::size_t kCopyPiece = 1U << 20U;
constexpr char kOwnerRecord[] = "user.appsync.owner";
constexpr char kGroupRecord[] = "user.appsync.group";

std::string textOfErrorNumber(int errorNumber) {
  std::array<char, 256> buffer{};
  return ::strerror_r(errorNumber, buffer.data(), buffer.size());
}

std::string whatWouldMend(int errorNumber) {
  switch (errorNumber) {
    case ENOSPC:
    case EDQUOT:
      return "; free some space for the device directory";
    case EACCES:
    case EPERM:
      return "; make the device directory accessible to this account";
    case EROFS:
      return "; put the device directory where it can be written";
    case EMFILE:
    case ENFILE:
      return "; raise the limit of open files";
    case EFBIG:
      return "; a file can have 256 MiB at most, and no more than the process may write";
    default:
      return "";
  }
}

// The components of a device path. False for a path that no file of the device can have.
bool splitPath(const std::string& path, bool namesOwnFiles, std::vector<std::string>& components) {
  if (!path.starts_with('/') || path.find('\0') != std::string::npos) return false;
  for (std::size_t at = 0; at < path.size();) {
    const std::size_t end = std::min(path.find('/', at), path.size());
    const std::string_view component = std::string_view(path).substr(at, end - at);
    if (component == "..") return false;
    if (!component.empty() && component != ".") components.emplace_back(component);
    at = end + 1;
  }
  if (namesOwnFiles || components.empty()) return true;
  return components.front() != "state" && components.front() != "lock";
}

int resultOf(bool success) {
  return success ? 0 : errno;
}

// Where the file system cannot hold the record there is none.
void recordAttributes(Disk& disk, int file, const FileAttributes& attributes) {
  const auto record = [&](const char* name, const std::optional<std::string>& account) {
    if (account) disk.fsetxattr(file, name, account->data(), account->size());
  };
  record(kOwnerRecord, attributes.ownerAccountName);
  record(kGroupRecord, attributes.groupOwnerAccountName);
}

std::optional<std::string> recordedAttribute(int file, const char* name) {
  std::array<char, 256> value{};
  const ssize_t size = ::fgetxattr(file, name, value.data(), value.size());
  if (size < 0) return std::nullopt;
  return std::string(value.data(), static_cast<std::size_t>(size));
}

int readToEnd(int file, Bytes& bytes) {
  struct stat status;
  if (::fstat(file, &status) != 0) return errno;
  if (static_cast<std::uint64_t>(status.st_size) > kLargestFileRead) return EFBIG;
  bytes.resize(static_cast<std::size_t>(status.st_size) + 1);  // one more, to see the end without another round
  std::size_t used = 0;
  while (true) {
    const ssize_t got = ::read(file, bytes.data() + used, bytes.size() - used);
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) return errno;
    if (got == 0) break;
    used += static_cast<std::size_t>(got);
    if (used > kLargestFileRead) return EFBIG;
    if (used == bytes.size()) bytes.resize(used + kCopyPiece);
  }
  bytes.resize(used);
  return 0;
}

int copyToEnd(Disk& disk, int from, int to) {
  Bytes piece(kCopyPiece);
  while (true) {
    const ssize_t got = ::read(from, piece.data(), piece.size());
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) return errno;
    if (got == 0) return 0;
    if (!writeAll(disk, to, piece.data(), static_cast<std::size_t>(got))) return errno;
  }
}

// Puts a temporary file in place for good. After a failed flush nobody knows what the disk holds: the file is given up.
int putInPlace(Disk& disk, int file, int directory, const std::string& temporary, const std::string& name) {
  if (disk.fsync(file) != 0) return errno;
  if (disk.renameat(directory, temporary.c_str(), directory, name.c_str()) != 0) return errno;
  return resultOf(disk.fsync(directory) == 0);
}

}  // namespace

Error fileError(const std::string& operation, const std::string& path, int errorNumber) {
  return Error(
      std::string(kFileErrorDomain), errorNumber,
      "Cannot " + operation + " \"" + path + "\": " + textOfErrorNumber(errorNumber) + whatWouldMend(errorNumber));
}

// --- a file in pieces -----------------------------------------------------------------------------------------------

FileSink::FileSink(Disk& disk, std::string path, OwnedFile directory, std::string name, OwnedFile file,
                   std::string temporary)
    : _disk(disk),
      _path(std::move(path)),
      _directory(std::move(directory)),
      _name(std::move(name)),
      _file(std::move(file)),
      _temporary(std::move(temporary)) {}

FileSink::~FileSink() {
  if (!_temporary.empty()) _disk.unlinkat(_directory.get(), _temporary.c_str(), 0);
}

bool FileSink::append(const void* bytes, std::size_t size, ErrorOut error) {
  if (_temporary.empty()) return fail(EBADF, error);
  return writeAll(_disk, _file.get(), bytes, size) || fail(errno, error);
}

bool FileSink::finish(ErrorOut error) {
  if (_temporary.empty()) return fail(EBADF, error);
  const int result = putInPlace(_disk, _file.get(), _directory.get(), _temporary, _name);
  if (result != 0) return fail(result, error);
  _temporary.clear();
  return true;
}

bool FileSink::fail(int errorNumber, ErrorOut error) {
  if (!_temporary.empty()) _disk.unlinkat(_directory.get(), _temporary.c_str(), 0);
  _temporary.clear();
  setError(error, fileError("write", _path, errorNumber));
  return false;
}

// --- walking to a path ----------------------------------------------------------------------------------------------

struct EmbeddedFileManager::Place {
  OwnedFile directory;
  std::string name;  // "." for the root itself
};

EmbeddedFileManager::EmbeddedFileManager(std::string root, Disk& disk)
    : EmbeddedFileManager(std::move(root), disk, false) {}

EmbeddedFileManager::EmbeddedFileManager(std::string root, Disk& disk, bool namesOwnFiles)
    : _root(std::move(root)), _disk(disk), _namesOwnFiles(namesOwnFiles) {}

int EmbeddedFileManager::walkTo(const std::string& path, Place& place) const {
  std::vector<std::string> components;
  if (!splitPath(path, _namesOwnFiles, components)) return ENOENT;
  place.directory = OwnedFile(_disk.openat(AT_FDCWD, _root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC, 0));
  if (!place.directory) return errno;
  for (std::size_t i = 0; i + 1 < components.size(); ++i) {
    place.directory = openDirectoryAt(_disk, place.directory.get(), components[i]);
    if (!place.directory) return errno;
  }
  place.name = components.empty() ? "." : components.back();
  return 0;
}

OwnedFile EmbeddedFileManager::openDirectory(const std::string& path, ErrorOut error) const {
  Place place;
  int result = walkTo(path, place);
  if (result == 0) {
    OwnedFile directory = openDirectoryAt(_disk, place.directory.get(), place.name);
    if (directory) return directory;
    result = errno;
  }
  setError(error, this->error("open directory", path, result));
  return {};
}

OwnedFile EmbeddedFileManager::openFile(const std::string& path, ErrorOut error) const {
  OwnedFile file;
  const int result = openRegularFile(path, file);
  if (result != 0) setError(error, this->error("open", path, result));
  return file;
}

// Without O_NONBLOCK the mere opening of a pipe could block for ever.
int EmbeddedFileManager::openRegularFile(const std::string& path, OwnedFile& file) const {
  Place place;
  if (const int result = walkTo(path, place)) return result;
  OwnedFile opened(_disk.openat(place.directory.get(), place.name.c_str(),
                                O_RDONLY | O_NONBLOCK | O_NOFOLLOW | O_NOCTTY | O_CLOEXEC, 0));
  struct stat status;
  if (!opened || ::fstat(opened.get(), &status) != 0) return errno;
  if (S_ISDIR(status.st_mode)) return EISDIR;
  if (!S_ISREG(status.st_mode)) return EINVAL;
  file = std::move(opened);
  return 0;
}

Error EmbeddedFileManager::error(const std::string& operation, const std::string& path, int errorNumber) const {
  return fileError(operation, _namesOwnFiles ? hostPath(path) : path, errorNumber);
}

// --- reading --------------------------------------------------------------------------------------------------------

std::string EmbeddedFileManager::temporaryDirectory() {
  return "/var/mobile/tmp";
}

bool EmbeddedFileManager::fileExists(const std::string& path) {
  Place place;
  struct stat status;
  return walkTo(path, place) == 0 &&
         ::fstatat(place.directory.get(), place.name.c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0;
}

std::optional<Bytes> EmbeddedFileManager::readFile(const std::string& path, ErrorOut error) {
  OwnedFile file;
  Bytes bytes;
  int result = openRegularFile(path, file);
  try {
    if (result == 0) result = readToEnd(file.get(), bytes);
  } catch (const std::bad_alloc&) {
    result = ENOMEM;
  }
  if (result == 0) return bytes;
  setError(error, this->error("read", path, result));
  return std::nullopt;
}

std::optional<FileInformation> EmbeddedFileManager::attributesOfItem(const std::string& path, ErrorOut error) {
  Place place;
  struct stat status;
  int result = walkTo(path, place);
  if (result == 0) {
    result = resultOf(::fstatat(place.directory.get(), place.name.c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0);
  }
  if (result != 0) {
    setError(error, this->error("read the attributes of", path, result));
    return std::nullopt;
  }
  FileInformation information;
  information.size = static_cast<std::uint64_t>(status.st_size);
  information.isDirectory = S_ISDIR(status.st_mode);
  if (information.isDirectory || S_ISREG(status.st_mode)) {
    const OwnedFile file(_disk.openat(place.directory.get(), place.name.c_str(),
                                      O_RDONLY | O_NONBLOCK | O_NOFOLLOW | O_NOCTTY | O_CLOEXEC, 0));
    if (file) {
      information.attributes.ownerAccountName = recordedAttribute(file.get(), kOwnerRecord);
      information.attributes.groupOwnerAccountName = recordedAttribute(file.get(), kGroupRecord);
    }
  }
  return information;
}

std::optional<std::vector<std::string>> EmbeddedFileManager::contentsOfDirectory(const std::string& path,
                                                                                 ErrorOut error) const {
  const OwnedFile directory = openDirectory(path, error);
  if (!directory) return std::nullopt;
  std::vector<std::string> names;
  if (listDirectory(directory.get(), names)) return names;
  setError(error, this->error("list", path, errno));
  return std::nullopt;
}

bool EmbeddedFileManager::isDirectory(const std::string& path) const {
  return static_cast<bool>(openDirectory(path, nullptr));
}

std::uint64_t EmbeddedFileManager::treeSize(const std::string& path) const {
  Place place;
  struct stat status;
  if (walkTo(path, place) != 0 ||
      ::fstatat(place.directory.get(), place.name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) {
    return 0;
  }
  const auto sizeOf = [](const struct stat& of) {
    return S_ISREG(of.st_mode) ? static_cast<std::uint64_t>(of.st_size) : 0;
  };
  std::uint64_t size = sizeOf(status);
  const OwnedFile directory = openDirectoryAt(_disk, place.directory.get(), place.name);
  if (!directory) return size;
  walkTree(_disk, directory.get(), [&](const TreeEntry& entry) {
    size += sizeOf(entry.status);
    return 0;
  });
  return size;
}

std::string EmbeddedFileManager::hostPath(const std::string& path) const {
  return _root + path;
}

std::string EmbeddedFileManager::strerror(int errorNumber) {
  return textOfErrorNumber(errorNumber);
}

// --- writing --------------------------------------------------------------------------------------------------------

bool EmbeddedFileManager::writeFile(const std::string& path, BytesView bytes, ErrorOut error) {
  const int result =
      replaceFile(path, {}, [&](int file) { return resultOf(writeAll(_disk, file, bytes.data(), bytes.size())); });
  if (result != 0) setError(error, this->error("write", path, result));
  return result == 0;
}

bool EmbeddedFileManager::createFile(const std::string& path, BytesView bytes, const FileAttributes& attributes) {
  return replaceFile(path, attributes,
                     [&](int file) { return resultOf(writeAll(_disk, file, bytes.data(), bytes.size())); }) == 0;
}

bool EmbeddedFileManager::copyItem(const std::string& from, const std::string& to, ErrorOut error) {
  OwnedFile source;
  int result = openRegularFile(from, source);
  if (result == 0) {
    result = replaceFile(to, {}, [&](int file) { return copyToEnd(_disk, source.get(), file); });
  }
  if (result != 0) setError(error, this->error("copy \"" + from + "\" to", to, result));
  return result == 0;
}

int EmbeddedFileManager::replaceFile(const std::string& path, const FileAttributes& attributes,
                                     const std::function<int(int file)>& fill) const {
  Place place;
  if (const int result = walkTo(path, place)) return result;
  if (place.name == ".") return EISDIR;
  std::string temporary;
  const OwnedFile file = makeTemporaryFile(_disk, place.directory.get(), temporary);
  if (!file) return errno;
  recordAttributes(_disk, file.get(), attributes);
  int result = fill(file.get());
  if (result == 0) result = putInPlace(_disk, file.get(), place.directory.get(), temporary, place.name);
  if (result != 0) _disk.unlinkat(place.directory.get(), temporary.c_str(), 0);
  return result;
}

std::unique_ptr<FileSink> EmbeddedFileManager::openSink(const std::string& path, ErrorOut error) const {
  Place place;
  int result = walkTo(path, place);
  if (result == 0 && (place.name == "." || openDirectoryAt(_disk, place.directory.get(), place.name))) result = EISDIR;
  if (result == 0) {
    std::string temporary;
    OwnedFile file = makeTemporaryFile(_disk, place.directory.get(), temporary);
    if (file) {
      return std::make_unique<FileSink>(_disk, path, std::move(place.directory), place.name, std::move(file),
                                        temporary);
    }
    result = errno;
  }
  setError(error, this->error("write", path, result));
  return nullptr;
}

bool EmbeddedFileManager::createDirectory(const std::string& path, bool intermediateDirectories,
                                          const FileAttributes& attributes, ErrorOut error) {
  std::vector<std::string> components;
  int result = splitPath(path, _namesOwnFiles, components) ? 0 : ENOENT;
  OwnedFile directory;
  if (result == 0) {
    directory = OwnedFile(_disk.openat(AT_FDCWD, _root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC, 0));
    result = resultOf(static_cast<bool>(directory));
  }
  if (result == 0 && components.empty() && !intermediateDirectories) result = EEXIST;
  for (std::size_t i = 0; i < components.size() && result == 0; ++i) {
    const bool last = i + 1 == components.size();
    OwnedFile next = openDirectoryAt(_disk, directory.get(), components[i]);
    if (next && last && !intermediateDirectories) {
      result = EEXIST;
    } else if (!next && errno == ENOENT && (last || intermediateDirectories)) {
      result = makeDirectory(directory.get(), components[i], attributes);
      if (result == EEXIST && intermediateDirectories) result = 0;  // somebody was faster
      if (result == 0) next = openDirectoryAt(_disk, directory.get(), components[i]);
    }
    if (result == 0 && !next) result = errno;
    directory = std::move(next);
  }
  if (result != 0) setError(error, this->error("create directory", path, result));
  return result == 0;
}

int EmbeddedFileManager::makeDirectory(int above, const std::string& name, const FileAttributes& attributes) const {
  if (_disk.mkdirat(above, name.c_str(), kDirectoryMode) != 0) return errno;
  if (attributes.ownerAccountName || attributes.groupOwnerAccountName) {
    const OwnedFile made = openDirectoryAt(_disk, above, name);
    if (made) recordAttributes(_disk, made.get(), attributes);
  }
  return resultOf(_disk.fsync(above) == 0);
}

bool EmbeddedFileManager::removeItem(const std::string& path, ErrorOut error) {
  Place place;
  int result = walkTo(path, place);
  if (result == 0 && place.name == ".") result = EBUSY;
  if (result == 0) {
    const char* name = place.name.c_str();
    int below = 0;
    const OwnedFile directory = openDirectoryAt(_disk, place.directory.get(), place.name);
    if (directory) {
      below = walkTree(_disk, directory.get(), [&](const TreeEntry& entry) {
        return resultOf(_disk.unlinkat(entry.directory, entry.name.c_str(), entry.isDirectory() ? AT_REMOVEDIR : 0) ==
                        0);
      });
    }
    result = resultOf(_disk.unlinkat(place.directory.get(), name, 0) == 0);
    if (result == EISDIR) result = resultOf(_disk.unlinkat(place.directory.get(), name, AT_REMOVEDIR) == 0);
    if (result != 0 && below != 0) result = below;
    if (result == 0) result = resultOf(_disk.fsync(place.directory.get()) == 0);
  }
  if (result != 0) setError(error, this->error("remove", path, result));
  return result == 0;
}

bool EmbeddedFileManager::moveItem(const std::string& from, const std::string& to, ErrorOut error) {
  Place source;
  Place destination;
  int result = walkTo(from, source);
  if (result == 0) result = walkTo(to, destination);
  if (result == 0 && source.name == ".") result = EBUSY;
  if (result == 0) {
    const int fromDirectory = source.directory.get();
    const int toDirectory = destination.directory.get();
    const char* name = source.name.c_str();
    const char* newName = destination.name.c_str();
    result = resultOf(_disk.renameat2(fromDirectory, name, toDirectory, newName, RENAME_NOREPLACE) == 0);
    if (result == EINVAL || result == ENOSYS) {
      // Not every file system can refuse by itself what is there already.
      struct stat status;
      const bool isThere = ::fstatat(toDirectory, newName, &status, AT_SYMLINK_NOFOLLOW) == 0;
      result = isThere ? EEXIST : resultOf(_disk.renameat(fromDirectory, name, toDirectory, newName) == 0);
    }
    if (result == 0) result = resultOf(_disk.fsync(toDirectory) == 0 && _disk.fsync(fromDirectory) == 0);
  }
  if (result != 0) setError(error, this->error("move \"" + from + "\" to", to, result));
  return result == 0;
}

int EmbeddedFileManager::utimes(const std::string& path) {
  Place place;
  if (const int result = walkTo(path, place)) return result;
  return resultOf(_disk.utimensat(place.directory.get(), place.name.c_str()) == 0);
}

bool EmbeddedFileManager::flushTree(const std::string& path, ErrorOut error) const {
  const OwnedFile directory = openDirectory(path, error);
  if (!directory) return false;
  int result = walkTree(_disk, directory.get(), [&](const TreeEntry& entry) {
    if (!entry.isDirectory() && !S_ISREG(entry.status.st_mode)) return 0;
    const OwnedFile file(
        _disk.openat(entry.directory, entry.name.c_str(), O_RDONLY | O_NONBLOCK | O_NOFOLLOW | O_CLOEXEC, 0));
    return resultOf(file && _disk.fsync(file.get()) == 0);
  });
  if (result == 0) result = resultOf(_disk.fsync(directory.get()) == 0);
  if (result != 0) setError(error, this->error("flush", path, result));
  return result == 0;
}

// What lies in an application's bundle is the application's own, whatever it is called.
std::size_t EmbeddedFileManager::removeLeftTemporaryFiles() const {
  constexpr std::string_view kContainers = "Containers";
  std::size_t removed = 0;
  const auto remove = [&](const TreeEntry& entry) {
    if (!S_ISREG(entry.status.st_mode) || !isTemporaryName(entry.name)) return 0;
    if (_disk.unlinkat(entry.directory, entry.name.c_str(), 0) != 0) return errno;
    ++removed;
    return 0;
  };
  const OwnedFile root(_disk.openat(AT_FDCWD, _root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC, 0));
  if (!root) return removed;
  walkTree(_disk, root.get(), remove, [&](const std::string& name) { return name != kContainers; });
  const OwnedFile containers = openDirectory("/var/mobile/Containers", nullptr);
  if (!containers) return removed;
  walkTree(_disk, containers.get(), remove, [](const std::string& name) { return !name.ends_with(".app"); });
  return removed;
}

}  // namespace appsync
