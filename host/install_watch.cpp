#include "host/install_watch.h"

#include <utility>

#include "host/failure.h"
#include "host/json.h"

namespace appsync {

namespace {

const char* nameOf(const CoordinatorEvent& event) {
  switch (event.kind) {
    case CoordinatorEvent::Kind::PlaceholderInstalled:
      return "placeholder installed";
    case CoordinatorEvent::Kind::Completed:
      return event.error ? "install failed" : "installed";
    case CoordinatorEvent::Kind::Cancelled:
      return "install cancelled";
  }
  return "";
}

}  // namespace

void traceEvent(TraceFile* trace, const CoordinatorEvent& event) {
  if (trace == nullptr) return;
  Json details = Json::object();
  if (event.error) details["error"] = reasonText(*event.error);
  trace->moment(event.bundleID, nameOf(event), details);
}

void InstallWatch::begin(const std::vector<std::string>& identifiers) {
  MutexLock lock(_mutex);
  _watched.insert(identifiers.begin(), identifiers.end());
}

void InstallWatch::hear(const CoordinatorEvent& event) {
  traceEvent(_trace, event);
  if (event.kind == CoordinatorEvent::Kind::PlaceholderInstalled) return;
  {
    MutexLock lock(_mutex);
    if (!_watched.contains(event.bundleID)) return;
    _ends[event.bundleID] = event.error ? std::optional(reasonText(*event.error)) : std::nullopt;
    if (event.kind == CoordinatorEvent::Kind::Completed) _results.push_back({event.bundleID, event.error});
  }
  if (event.error) {
    _display.failed(event.bundleID, reasonText(*event.error));
  } else {
    _display.installed(event.bundleID);
  }
}

std::vector<InstallWatch::Result> InstallWatch::takeResults() {
  MutexLock lock(_mutex);
  return std::exchange(_results, {});
}

bool InstallWatch::isInstalled(const std::string& identifier) const {
  MutexLock lock(_mutex);
  const auto end = _ends.find(identifier);
  return end != _ends.end() && !end->second;
}

std::optional<std::string> InstallWatch::failure(const std::string& identifier) const {
  MutexLock lock(_mutex);
  const auto end = _ends.find(identifier);
  return end == _ends.end() ? std::nullopt : end->second;
}

}  // namespace appsync
