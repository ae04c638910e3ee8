// What becomes of the installs of a sync, as the coordination service tells the device's host.
#pragma once

#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "embedded/coordination.h"
#include "host/progress_display.h"
#include "host/trace_file.h"
#include "platform/thread_annotations.h"

namespace appsync {

// Shows an event on its application's track. `trace` may be null.
void traceEvent(TraceFile* trace, const CoordinatorEvent& event);

// Any thread.
class InstallWatch {
 public:
  // `trace` may be null; both must outlive this.
  InstallWatch(ProgressDisplay& display, TraceFile* trace) : _display(display), _trace(trace) {}

  // From now on events of these applications count.
  void begin(const std::vector<std::string>& identifiers);
  void hear(const CoordinatorEvent& event);

  struct Result {
    std::string identifier;
    std::optional<Error> error;  // none: it is installed
  };

  // The installs that have ended since this was asked last, in the order of their ends.
  std::vector<Result> takeResults();

  // Whether the application has been installed, and why not.
  bool isInstalled(const std::string& identifier) const;
  std::optional<std::string> failure(const std::string& identifier) const;

 private:
  ProgressDisplay& _display;
  TraceFile* const _trace;
  mutable Mutex _mutex;
  std::set<std::string> _watched APPSYNC_GUARDED_BY(_mutex);
  std::map<std::string, std::optional<std::string>> _ends APPSYNC_GUARDED_BY(_mutex);
  std::vector<Result> _results APPSYNC_GUARDED_BY(_mutex);
};

}  // namespace appsync
