#include "host/log_file.h"

#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdio>
#include <ctime>
#include <utility>

#include "host/console.h"
#include "host/files.h"
#include "host/text.h"

namespace appsync {

namespace {

std::string escaped(std::string_view message) {
  std::string text;
  text.reserve(message.size());
  for (const char c : message) {
    switch (c) {
      case '\n':
        text += "\\n";
        break;
      case '\t':
        text += "\\t";
        break;
      case '\\':
        text += "\\\\";
        break;
      default:
        text += c;
    }
  }
  return text;
}

}  // namespace

std::unique_ptr<LogFile> LogFile::open(const std::string& path, Failure& failure) {
  if (path == "-") return std::unique_ptr<LogFile>(new LogFile(path, STDERR_FILENO));
  const int file = openOutput(path, failure);
  if (file < 0) return nullptr;
  return std::unique_ptr<LogFile>(new LogFile(path, file));
}

LogFile::LogFile(std::string path, int file) : _path(std::move(path)), _file(file), _isTerminal(::isatty(file) == 1) {}

LogFile::~LogFile() {
  if (_file != STDERR_FILENO) ::close(_file);
}

void LogFile::begin() {
  _hasBegun = true;
  if (_file != STDERR_FILENO) _error = emptyOutput(_file);
  if (_error == 0) _error = writeAll(_file, std::exchange(_early, {}));
}

void LogFile::line(const LogLine& line) {
  add(line.time, line.level, line.category, line.message);
}

void LogFile::transaction(const TransactionRecord& record) {
  add(record.time, LogLevel::Default, "transaction", record.message());
}

void LogFile::add(std::chrono::system_clock::time_point time, LogLevel level, std::string_view category,
                  std::string_view message) {
  if (_error != 0) return;
  std::string text = rfc3339(time);
  text += level == LogLevel::Error ? "\terror\t" : "\tdefault\t";
  text += category;
  text += '\t';
  text += (_isTerminal ? printable(escaped(message)) : escaped(message)) + '\n';
  if (_hasBegun) {
    _error = writeAll(_file, text);
  } else {
    _early += text;
  }
}

std::optional<Failure> LogFile::writeFailure() const {
  if (_error == 0 || _error == EPIPE) return std::nullopt;
  return outputFailure(_path, _error);
}

std::string rfc3339(std::chrono::system_clock::time_point time) {
  const auto microseconds = std::chrono::duration_cast<std::chrono::microseconds>(time.time_since_epoch()).count();
  const std::time_t seconds = microseconds / 1'000'000;
  std::tm calendar{};
  ::gmtime_r(&seconds, &calendar);
  std::array<char, 80> text{};
  std::snprintf(text.data(), text.size(), "%04d-%02d-%02dT%02d:%02d:%02d.%06dZ", calendar.tm_year + 1900,
                calendar.tm_mon + 1, calendar.tm_mday, calendar.tm_hour, calendar.tm_min, calendar.tm_sec,
                static_cast<int>(microseconds % 1'000'000));
  return text.data();
}

}  // namespace appsync
