// The file of --log: a line for each log line and transaction record.
//
// What stood in the file stays until `begin`; what is said before that is kept till then.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "embedded/log_sink.h"
#include "host/failure.h"

namespace appsync {

class LogFile : public LogSink {
 public:
  // "-" is standard error. Null, with the failure said, when it cannot be written.
  static std::unique_ptr<LogFile> open(const std::string& path, Failure& failure);
  ~LogFile() override;

  // From here on the file is this run's. Called once, while nobody logs.
  void begin();

  void line(const LogLine& line) override;
  void transaction(const TransactionRecord& record) override;

  // Why not everything has been written, if so.
  std::optional<Failure> writeFailure() const;

 private:
  LogFile(std::string path, int file);
  void add(std::chrono::system_clock::time_point time, LogLevel level, std::string_view category,
           std::string_view message);

  const std::string _path;
  const int _file;
  const bool _isTerminal;  // it is shown nothing that it would obey
  bool _hasBegun = false;
  std::string _early;  // said before the beginning
  int _error = 0;
};

// "2026-01-31T12:00:00.123456Z"
std::string rfc3339(std::chrono::system_clock::time_point time);

}  // namespace appsync
