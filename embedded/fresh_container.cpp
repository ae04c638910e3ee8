#include "embedded/fresh_container.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <optional>
#include <utility>

#include "embedded/file_manager.h"

namespace appsync {

namespace {

constexpr mode_t kPlainFile = 0644;
constexpr mode_t kExecutable = 0755;

}  // namespace

FreshContainer::FreshContainer(EmbeddedFileManager& files, const std::string& parent, const std::string& name,
                               std::string subject)
    : _files(files),
      _disk(files.disk()),
      _finalPath(parent + "/" + name),
      _subject(std::move(subject)),
      _path(parent + "/.incoming-" + name) {}

FreshContainer::~FreshContainer() {
  if (_made && !_kept) _files.removeItem(_path, nullptr);
}

bool FreshContainer::bundle(const std::string& name, ErrorOut error) {
  std::optional<Error> cause;
  const std::string parent = _path.substr(0, _path.rfind('/'));
  if (!_files.createDirectory(parent, true, {}, &cause)) return fail(*cause, error);
  _made = true;  // what could be made but not flushed goes too
  if (!_files.createDirectory(_path, false, {}, &cause)) return fail(*cause, error);
  _container = _files.openDirectory(_path, &cause);
  if (!_container) return fail(*cause, error);
  if (_disk.mkdirat(_container.get(), name.c_str(), kExecutable) != 0) return fail("make", name, errno, error);
  _bundle = openDirectoryAt(_disk, _container.get(), name);
  if (!_bundle) return fail("open", name, errno, error);
  _bundleName = name;
  return true;
}

bool FreshContainer::directory(const std::string& path, ErrorOut error) {
  std::string name;
  const int parent = directoryOf(path, name);
  if (parent < 0 || _disk.mkdirat(parent, name.c_str(), kExecutable) != 0) return fail("make", path, errno, error);
  return true;
}

bool FreshContainer::beginFile(const std::string& path, bool executable, ErrorOut error) {
  std::string name;
  const mode_t mode = executable ? kExecutable : kPlainFile;
  const int parent = directoryOf(path, name);
  if (parent >= 0) {
    _file = OwnedFile(_disk.openat(parent, name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode));
  }
  if (parent < 0 || !_file || ::fchmod(_file.get(), mode) != 0) return fail("make", path, errno, error);
  _filePath = path;
  return true;
}

bool FreshContainer::bytes(const void* data, std::size_t size, ErrorOut error) {
  return writeAll(_disk, _file.get(), data, size) || fail("write", _filePath, errno, error);
}

bool FreshContainer::endFile(ErrorOut /*error*/) {
  _file = OwnedFile();
  return true;
}

bool FreshContainer::link(const std::string& path, const std::string& target, ErrorOut error) {
  std::string name;
  const int parent = directoryOf(path, name);
  return (parent >= 0 && _disk.symlinkat(target.c_str(), parent, name.c_str()) == 0) ||
         fail("make", path, errno, error);
}

bool FreshContainer::file(const std::string& path, const Bytes& content, ErrorOut error) {
  return beginFile(path, false, error) && bytes(content.data(), content.size(), error) && endFile(error);
}

bool FreshContainer::emptyFile(const std::string& path, std::uint64_t size, ErrorOut error) {
  if (!beginFile(path, false, error)) return false;
  if (::ftruncate(_file.get(), static_cast<off_t>(size)) != 0) return fail("write", path, errno, error);
  return endFile(error);
}

bool FreshContainer::propertyListBeside(const std::string& name, const PropertyList& content, ErrorOut error) {
  return propertyList("../" + name, content, error);
}

bool FreshContainer::propertyList(const std::string& path, const PropertyList& content, ErrorOut error) {
  std::optional<Error> cause;
  const std::optional<Bytes> written = serializePropertyList(content, PropertyListFormat::Binary, &cause);
  if (!written) return fail(*cause, error);
  return file(path, *written, error);
}

std::uint64_t FreshContainer::size() const {
  return _files.treeSize(_path);
}

bool FreshContainer::keep(ErrorOut error) {
  std::optional<Error> cause;
  if (!_files.flushTree(_path, &cause)) return fail(*cause, error);
  if (!_files.moveItem(_path, _finalPath, &cause)) {
    if (!_files.fileExists(_path)) _path = _finalPath;  // moved, but not flushed
    return fail(*cause, error);
  }
  _kept = true;
  _path = _finalPath;
  return true;
}

bool FreshContainer::fail(const std::string& what, const std::string& path, int errorNumber, ErrorOut error) const {
  return fail(fileError(what, _path + "/" + _bundleName + "/" + path, errorNumber), error);
}

bool FreshContainer::fail(const Error& underlying, ErrorOut error) const {
  setError(error, Error(std::string(kInstallerErrorDomain), kInstallerDisk, _subject + " could not be put on the disk",
                        underlying));
  return false;
}

int FreshContainer::directoryOf(const std::string& path, std::string& name) {
  const std::size_t slash = path.rfind('/');
  name = path.substr(slash == std::string::npos ? 0 : slash + 1);
  if (slash == std::string::npos) return _bundle.get();
  const std::string parent = path.substr(0, slash);
  if (parent == "..") return _container.get();
  if (_openDirectory && parent == _openPath) return _openDirectory.get();

  OwnedFile walked;
  for (std::size_t at = 0, end = 0; at < parent.size(); at = end + 1) {
    end = std::min(parent.find('/', at), parent.size());
    walked = openDirectoryAt(_disk, walked ? walked.get() : _bundle.get(), parent.substr(at, end - at));
    if (!walked) return -1;
  }
  _openDirectory = std::move(walked);
  _openPath = parent;
  return _openDirectory.get();
}

}  // namespace appsync
