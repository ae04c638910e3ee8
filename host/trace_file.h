// The file of --trace: install transactions and transfers as Chrome trace events, every application on a track of its
// own.
//
// What stood in the file stays until `begin`; what happens before that is kept till then.
#pragma once

#include <chrono>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "embedded/log_sink.h"
#include "host/failure.h"
#include "host/json_forward.h"
#include "platform/thread_annotations.h"

namespace appsync {

// Any thread.
class TraceFile : public LogSink {
 public:
  using Time = std::chrono::system_clock::time_point;

  // Null, with the failure said, when it cannot be written.
  static std::unique_ptr<TraceFile> open(const std::string& path, Failure& failure);
  ~TraceFile() override;

  // From here on the file is this run's. Called once.
  void begin();
  // Ends the document, and with it what is still open. Nothing may happen after this; called again it does nothing.
  void finish();

  void line(const LogLine&) override {}
  void transaction(const TransactionRecord& record) override;

  // Something of an application that took from `begin` until now, and something that happened now.
  void span(const std::string& identifier, const std::string& name, Time begin, const Json& details);
  void moment(const std::string& identifier, const std::string& name, const Json& details);

  // Why not everything has been written, if so.
  std::optional<Failure> writeFailure() const;

 private:
  struct OpenStep {
    Time begin;
    TransactionRecord record;
  };

  TraceFile(std::string path, int file);
  void addSpan(int track, const std::string& name, Time begin, Time end, const Json& details) APPSYNC_REQUIRES(_mutex);
  void addMoment(int track, const std::string& name, Time time, const Json& details) APPSYNC_REQUIRES(_mutex);
  int trackOf(const std::optional<std::string>& identifier) APPSYNC_REQUIRES(_mutex);
  void add(const Json& event) APPSYNC_REQUIRES(_mutex);
  void write(const std::string& text) APPSYNC_REQUIRES(_mutex);

  const std::string _path;
  const int _file;
  mutable Mutex _mutex;
  int _error APPSYNC_GUARDED_BY(_mutex) = 0;
  bool _hasBegun APPSYNC_GUARDED_BY(_mutex) = false;
  bool _isFinished APPSYNC_GUARDED_BY(_mutex) = false;
  std::string _early APPSYNC_GUARDED_BY(_mutex);  // from before the beginning
  bool _hasEvents APPSYNC_GUARDED_BY(_mutex) = false;
  std::map<std::string, int> _tracks APPSYNC_GUARDED_BY(_mutex);
  std::map<std::pair<int, std::int32_t>, std::vector<OpenStep>> _openSteps APPSYNC_GUARDED_BY(_mutex);
};

}  // namespace appsync
