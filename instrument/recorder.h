// What went through the wrappers, as one ordered list of lines of text.
//
//   OPERATION ARGUMENTS [-> RESULT]     moveItem /a to /b -> failed: FileError 17: ...
//                                       coordinatorForAppWithBundleID initiating org.a client=3 create=1 ->
//                                       coordinator(org.a) fileExists /a -> yes
//   <- CALLBACK ARGUMENTS               <- coordinatorDidInstallPlaceholder coordinator(org.a)
//   log CATEGORY[ error]: MESSAGE       log 8 error: ...
//   transaction FIELDS                  transaction step=3 party=1 phase=1 success=1 bundle=org.a description=TEXT
//
// An operation that succeeds or fails answers "ok" or "failed", a question "yes" or "no", one that gives something the
// thing or "none"; the error follows where there is one. Objects of the coordination service are called by what they
// are and for whom: coordinator(org.a), placeholder(org.a), promise(org.a-Asset). Bytes are counted, times left out. A
// line is added when the call returns; that of a call which answers nothing, before it is made. A newline inside a line
// is written "\n".
#pragma once

#include <atomic>
#include <cstddef>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <thread>
#include <tuple>
#include <vector>

#include "instrument/operations.h"
#include "platform/system_log.h"
#include "platform/thread_annotations.h"

namespace appsync {

// Any thread. Never calls anything; its lock may be taken under every other.
class Recorder {
 public:
  // Which lines are wanted.
  struct Selection {
    std::set<InstrumentedService> services = {};  // empty: all
    std::optional<std::thread::id> thread = {};   // only what this thread did, so that the order is the same
                                                  // whatever the services' threads do meanwhile
    bool callbacks = true;                        // those that begin with "<- "
  };

  // One place in the program's text from which a line was written.
  struct Format {
    std::string category;
    LogLevel level = LogLevel::Default;
    std::string text;

    friend bool operator<(const Format& a, const Format& b) {
      return std::tie(a.category, a.level, a.text) < std::tie(b.category, b.level, b.text);
    }
    friend bool operator==(const Format&, const Format&) = default;
  };

  // With a file, every distinct format is appended to it once (not once per file: several programs may share one), as
  // CATEGORY, "default" or "error", and the format, separated by tabs.
  Recorder(bool recording, std::string reachedTextsFile);

  bool isRecording() const { return _recording.load(std::memory_order_relaxed); }
  void setRecording(bool recording) { _recording.store(recording, std::memory_order_relaxed); }
  // Whether somebody wants to see log lines.
  bool wantsFormats() const { return isRecording() || !_reachedTextsFile.empty(); }

  void add(InstrumentedService service, const std::string& text);
  void addCallback(InstrumentedService service, const std::string& text) { add(service, "<- " + text); }
  void addFormat(Format format);

  std::vector<std::string> lines(const Selection& selection) const;
  std::vector<std::string> lines() const { return lines(Selection()); }
  // The lines with a newline after each.
  std::string transcript(const Selection& selection) const;
  std::string transcript() const { return transcript(Selection()); }
  // Forgets the lines, not the formats.
  void clear();

  // Every distinct format that has been written since the start.
  std::set<Format> setOfFormats() const;

 private:
  struct Line {
    InstrumentedService service;
    std::thread::id thread;
    std::string text;
  };

  std::atomic<bool> _recording;
  const std::string _reachedTextsFile;
  mutable Mutex _mutex;
  std::vector<Line> _lines APPSYNC_GUARDED_BY(_mutex);
  std::set<Format> _formats APPSYNC_GUARDED_BY(_mutex);
};

}  // namespace appsync
