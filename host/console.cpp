#include "host/console.h"

#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "embedded/disk.h"
#include "host/json.h"
#include "host/text.h"

namespace appsync {

bool Console::isTerminal() const {
  return !_json && !_quiet && ::isatty(STDOUT_FILENO) == 1;
}

std::size_t Console::columns() const {
  winsize size{};
  if (::ioctl(STDOUT_FILENO, TIOCGWINSZ, &size) != 0 || size.ws_col == 0) return 80;
  return std::max<std::size_t>(size.ws_col, 20);
}

std::size_t Console::rows() const {
  winsize size{};
  if (::ioctl(STDOUT_FILENO, TIOCGWINSZ, &size) != 0 || size.ws_row == 0) return 24;
  return std::max<std::size_t>(size.ws_row, 4);
}

void Console::line(std::string_view text) {
  if (!_quiet) failureLine(text);
}

void Console::failureLine(std::string_view text) {
  if (!_json && !_isMute) raw(printable(text) + "\n");
}

void Console::picture(std::string_view bytes) {
  if (!_isMute) raw(bytes);
}

void Console::raw(std::string_view bytes) {
  const int error = writeAll(STDOUT_FILENO, bytes);
  if (error != 0 && error != EPIPE) _outputError = error;
}

void Console::document(const Json& fields) {
  if (!_json) return;
  Json document = Json::object();
  document["schema"] = 1;
  for (const auto& [key, value] : fields.items()) document[key] = value;
  raw(jsonText(document) + "\n");
}

void Console::problem(std::string_view text) {
  writeAll(STDERR_FILENO, "dovel: " + printable(text) + "\n");
}

int Console::fail(const Failure& failure) {
  const FailureKind& kind = failureKind(failure.code);
  problem(failure.hint.empty() ? failure.message : failure.message + "; " + failure.hint);
  document({{"ok", false}, {"error", {{"code", kind.name}, {"message", failure.message}, {"hint", failure.hint}}}});
  return kind.status;
}

std::optional<Failure> Console::outputFailure() const {
  if (_outputError == 0) return std::nullopt;
  return Failure{FailureCode::OutputUnwritable,
                 "standard output cannot be written: " + std::string(std::strerror(_outputError)),
                 "send it to a place with room for it"};
}

int writeAll(int file, std::string_view bytes) {
  Disk disk;
  return writeAll(disk, file, bytes.data(), bytes.size()) ? 0 : errno;
}

}  // namespace appsync
