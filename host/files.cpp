#include "host/files.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "host/console.h"
#include "host/json.h"

namespace appsync {

namespace {

constexpr std::size_t kLargestInput = std::size_t{1} << 30;
constexpr std::size_t kBuffered = std::size_t{1} << 16;

Failure inputFailure(const std::string& path, const std::string& why, const std::string& hint) {
  return {FailureCode::InputUnusable, "\"" + path + "\" cannot be used: " + why, hint};
}

std::string resolved(const std::string& path) {
  char* real = ::realpath(path.c_str(), nullptr);
  if (real == nullptr) return path;
  std::string text = real;
  std::free(real);
  return text;
}

}  // namespace

std::optional<Bytes> readInput(const std::string& path, Failure& failure) {
  const int file = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
  Bytes bytes;
  int error = file < 0 ? errno : 0;
  std::size_t size = 0;
  while (error == 0) {
    if (bytes.size() - size < kBuffered) bytes.resize(bytes.size() + std::max(bytes.size() / 2, 2 * kBuffered));
    const ssize_t count = ::read(file, bytes.data() + size, bytes.size() - size);
    if (count == 0) break;
    if (count < 0 && errno != EINTR) error = errno;
    if (count > 0) size += static_cast<std::size_t>(count);
    if (size > kLargestInput) error = EFBIG;
  }
  if (file >= 0) ::close(file);
  if (error != 0) {
    failure = inputFailure(path, std::strerror(error),
                           error == ENOENT   ? "name a file that exists"
                           : error == EISDIR ? "name a file, not a directory"
                                             : "name a file that can be read");
    return std::nullopt;
  }
  bytes.resize(size);
  return bytes;
}

std::optional<PropertyList> readPropertyListOrJson(const std::string& path, Failure& failure) {
  const std::optional<Bytes> bytes = readInput(path, failure);
  if (!bytes) return std::nullopt;
  std::size_t first = 0;
  while (first < bytes->size() && std::strchr(" \t\r\n", (*bytes)[first]) != nullptr && (*bytes)[first] != 0) ++first;
  std::optional<Error> error;
  if (first < bytes->size() && ((*bytes)[first] == '{' || (*bytes)[first] == '[')) {
    const auto json = parseJson({reinterpret_cast<const char*>(bytes->data()), bytes->size()}, &error);
    if (json) return propertyListFromJson(*json);
  } else if (auto list = parsePropertyList(*bytes, &error)) {
    return list;
  }
  failure = inputFailure(path, error->text(), "give it a property list or a JSON document");
  return std::nullopt;
}

std::unique_ptr<OutputFile> OutputFile::create(const std::string& path, Failure& failure) {
  std::unique_ptr<OutputFile> output(new OutputFile);
  output->_path = resolved(path);
  struct stat information {};
  const bool exists = ::stat(output->_path.c_str(), &information) == 0;
  if (exists && !S_ISREG(information.st_mode)) {
    output->_file = ::open(output->_path.c_str(), O_WRONLY | O_CLOEXEC | O_NONBLOCK);
    if (output->_file >= 0) ::fcntl(output->_file, F_SETFL, 0);
  } else if (exists && ::access(output->_path.c_str(), W_OK) != 0) {
    output->_file = -1;
  } else {
    output->_temporary = output->_path + ".XXXXXX";
    output->_file = ::mkostemp(output->_temporary.data(), O_CLOEXEC);
    if (output->_file < 0) output->_temporary.clear();
    const mode_t mask = ::umask(0);
    ::umask(mask);
    if (output->_file >= 0) ::fchmod(output->_file, exists ? information.st_mode & 07777U : 0666U & ~mask);
  }
  if (output->_file >= 0) return output;
  failure = outputFailure(path, errno);
  return nullptr;
}

OutputFile::~OutputFile() {
  if (_file >= 0) ::close(_file);
  if (!_temporary.empty()) ::unlink(_temporary.c_str());
}

void OutputFile::write(std::string_view bytes) {
  _buffer += bytes;
  if (_buffer.size() >= kBuffered) flush();
}

void OutputFile::flush() {
  if (_error == 0) _error = writeAll(_file, _buffer);
  _buffer.clear();
}

bool OutputFile::finish(Failure& failure) {
  flush();
  if (!_temporary.empty()) {
    if (_error == 0 && ::fsync(_file) != 0) _error = errno;
    if (_error == 0 && ::rename(_temporary.c_str(), _path.c_str()) != 0) _error = errno;
    if (_error == 0) _temporary.clear();
  }
  if (_error == 0) return true;
  failure = outputFailure(_path, _error);
  return false;
}

int openOutput(const std::string& path, Failure& failure) {
  const int file = ::open(path.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0666);
  if (file < 0) failure = outputFailure(path, errno);
  return file;
}

int emptyOutput(int file) {
  struct stat information {};
  if (::fstat(file, &information) != 0) return errno;
  return S_ISREG(information.st_mode) && ::ftruncate(file, 0) != 0 ? errno : 0;
}

Failure outputFailure(const std::string& path, int errorNumber) {
  return {FailureCode::OutputUnwritable, "\"" + path + "\" cannot be written: " + std::strerror(errorNumber),
          "name a file in a directory that exists and can be written"};
}

}  // namespace appsync
