// The system log: where every line of the client goes, and the handles it goes through.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

namespace appsync {

enum class LogLevel : std::uint8_t { Default, Error };

// A place in the log. A leaf service: any thread, never calls back, may be called under a lock, never fails.
class LogHandle {
 public:
  virtual ~LogHandle() = default;

  // Whether anybody listens to lines of this level; a line need not be rendered when nobody does.
  virtual bool isEnabled(LogLevel level) = 0;

  // Records one line. `format` is the literal that it was rendered from, without the prefix that `message` may begin
  // with, so that a program can ask which line this is; it lives as long as the program.
  virtual void write(LogLevel level, std::string_view format, std::string message) = 0;
};

// A leaf service, like its handles.
class SystemLog {
 public:
  virtual ~SystemLog() = default;

  // The daemon's log handle of this category number (8, 15 or 0 for this client). Never null.
  virtual std::shared_ptr<LogHandle> DovelGetLogCategory(std::uint32_t category) = 0;

  // A handle of a subsystem and category by name. Never null.
  virtual std::shared_ptr<LogHandle> makeLogHandle(const std::string& subsystem, const std::string& category) = 0;
};

}  // namespace appsync
