// Where the embedded device's log lines and transaction records go: to a sink that its host brings.
#pragma once

#include <chrono>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/system_log.h"

namespace appsync {

struct LogLine {
  std::chrono::system_clock::time_point time;
  LogLevel level = LogLevel::Default;
  std::string category;     // "8", "15", "0", or "SUBSYSTEM:CATEGORY" of a handle made by name
  std::string_view format;  // the literal, without the prefix
  std::string message;      // as rendered, with the prefix
};

struct TransactionRecord {
  std::chrono::system_clock::time_point time;
  std::optional<std::string> scenario;  // a scenario's record; otherwise a step's
  std::int32_t step = 0;
  std::int32_t party = 0;  // steps only
  std::int32_t phase = 0;  // steps only
  bool success = false;
  std::optional<std::string> bundleID;
  std::string description;

  // "scenario=… step=0 success=0 bundle=ID description=TEXT" or "step=3 party=1 phase=2 success=1 bundle=ID
  // description=TEXT"
  std::string message() const;
};

// Called on any thread, one call at a time; must not call a service.
class LogSink {
 public:
  virtual ~LogSink() = default;
  virtual bool isListening() { return true; }
  virtual void line(const LogLine& line) = 0;
  virtual void transaction(const TransactionRecord& record) = 0;
};

}  // namespace appsync
