// What the client's log tells about the applications of a sync: which ones a rule left out, and what became of
// removals.
#pragma once

#include <map>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "embedded/log_sink.h"
#include "platform/thread_annotations.h"

namespace appsync {

// Any thread.
class SyncLog : public LogSink {
 public:
  struct Skipped {
    std::string identifier;
    std::string_view reason;  // a stable word
  };

  void line(const LogLine& line) override;
  void transaction(const TransactionRecord& record) override;

  // What was left out, in the order of the lines; each application once.
  std::vector<Skipped> skipped() const;
  // Whether the device's policy kept every removal from being done.
  bool removalsWereForbidden() const;
  // Applications whose removal was begun, in order; a repeated one once.
  std::vector<std::string> removals() const;
  // Why a removal failed; none when it succeeded. One that has not ended has failed.
  std::optional<std::string> removalError(const std::string& identifier) const;
  // Why an install could not be prepared, as the client told it; none when it was not said.
  std::optional<std::string> preparationError(const std::string& identifier) const;

 private:
  mutable Mutex _mutex;
  std::vector<Skipped> _skipped APPSYNC_GUARDED_BY(_mutex);
  std::set<std::string> _skippedIdentifiers APPSYNC_GUARDED_BY(_mutex);
  bool _removalsWereForbidden APPSYNC_GUARDED_BY(_mutex) = false;
  std::vector<std::string> _removals APPSYNC_GUARDED_BY(_mutex);
  std::map<std::string, bool> _removalEnds APPSYNC_GUARDED_BY(_mutex);
  std::vector<std::string> _removalLines APPSYNC_GUARDED_BY(_mutex);
  std::map<std::string, std::string> _preparationErrors APPSYNC_GUARDED_BY(_mutex);
};

// A line's message without the plug-in's identifier and bar in front of it.
std::string_view withoutPrefix(std::string_view message);

// The arguments of a line, found by laying its format over its message (without the prefix). None when they do not fit.
std::optional<std::vector<std::string>> argumentsOfLine(std::string_view format, std::string_view message);

}  // namespace appsync
