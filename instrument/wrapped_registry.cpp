// The application registry: its records, walks and observers.

#include <map>

#include "instrument/wrappers.h"

namespace appsync {

namespace {

// Stands between the registry and one observer.
class ObserverOfInstalls : public PellumApplicationWorkspaceObserverProtocol {
 public:
  ObserverOfInstalls(PellumApplicationWorkspace::Observer observer, bool hearsNoReports, Probe& probe)
      : _observer(std::move(observer)), _hearsNoReports(hearsNoReports), _probe(probe) {}

  void applicationInstallsArePrioritized(const PellumApplicationProxies& prioritized,
                                         const PellumApplicationProxies& arePaused) override {
    if (_hearsNoReports) return;
    PellumApplicationProxies first = prioritized;
    PellumApplicationProxies second = arePaused;
    const auto script = _probe.script();
    if (script->applicationInstallsArePrioritized) script->applicationInstallsArePrioritized(first, second);
    const std::string text = shown(first) + " paused " + shown(second);
    deliver("applicationInstallsArePrioritized", "", text,
            [observer = _observer, first, second] { observer->applicationInstallsArePrioritized(first, second); });
  }
  void applicationInstallsDidCancel(const PellumApplicationProxies& applications) override {
    const std::string bundleID = applications.empty() ? "" : applications.front().applicationIdentifier;
    deliver("applicationInstallsDidCancel", bundleID, shown(applications),
            [observer = _observer, applications] { observer->applicationInstallsDidCancel(applications); });
  }

 private:
  void deliver(std::string_view event, const std::string& bundleID, const std::string& text,
               std::function<void()> action) {
    _probe.deliver(InstrumentedService::Workspace, event, bundleID, this, text, std::move(action));
  }

  const PellumApplicationWorkspace::Observer _observer;
  const bool _hearsNoReports;
  Probe& _probe;
};

class WrappedWorkspace : public PellumApplicationWorkspace {
 public:
  WrappedWorkspace(PellumApplicationWorkspace& bare, Probe& probe) : _bare(bare), _probe(probe) {}

  void addObserver(const Observer& observer) override {
    const bool hearsNoReports = _probe.strike("reportInstalls", Subject::none()).has_value();
    const auto between = std::make_shared<ObserverOfInstalls>(observer, hearsNoReports, _probe);
    {
      MutexLock lock(_mutex);
      if (!_between.emplace(observer.get(), between).second) return;  // registered already
    }
    _probe.tell("addObserver", Subject::none(), [&] { _bare.addObserver(between); });
  }
  void removeObserver(const Observer& observer) override {
    _probe.tell("removeObserver", Subject::none(), [&] {
      Observer between;
      {
        MutexLock lock(_mutex);
        const auto found = _between.find(observer.get());
        if (found == _between.end()) return;
        between = found->second;
        _between.erase(found);
      }
      _bare.removeObserver(between);
      _probe.forget(between.get());
    });
  }

  bool applicationIsInstalled(const std::string& bundleID) override {
    const auto answer = [&](ErrorOut) {
      return scripted(
          _probe.script()->applicationIsInstalled, [&] { return _bare.applicationIsInstalled(bundleID); }, bundleID);
    };
    return _probe.call("applicationIsInstalled", Subject::application(bundleID), nullptr, answer, bundleID);
  }
  std::optional<PellumApplicationProxy> applicationProxyForIdentifier(const std::string& bundleID,
                                                                      bool placeholder) override {
    const auto answer = [&](ErrorOut) {
      return scripted(
          _probe.script()->applicationProxyForIdentifier,
          [&] { return _bare.applicationProxyForIdentifier(bundleID, placeholder); }, bundleID, placeholder);
    };
    return _probe.call("applicationProxyForIdentifier", Subject::application(bundleID), nullptr, answer, bundleID,
                       field("placeholder", placeholder));
  }
  void enumerateBundlesOfType(std::uint64_t type, const Block& block) override {
    const auto script = _probe.script();
    const Block recorded = [&](const PellumApplicationProxy& record, bool& stop) {
      if (_probe.recorder.isRecording()) {
        _probe.recorder.addCallback(InstrumentedService::Workspace, "record " + shown(record));
      }
      block(record, stop);
    };
    _probe.tell(
        "enumerateBundlesOfType", Subject::none(),
        [&] {
          if (script->enumerateBundlesOfType) {
            walk(changedRecords(*script, type), recorded);
          } else {
            _bare.enumerateBundlesOfType(type, recorded);
          }
        },
        type);
  }
  bool uninstallApplication(const std::string& bundleID, ErrorOut error) override {
    const auto forward = [&](ErrorOut out) { return _bare.uninstallApplication(bundleID, out); };
    return _probe.call("uninstallApplication", Subject::application(bundleID), error, forward, bundleID);
  }

 private:
  PellumApplicationProxies changedRecords(const ScriptedAnswers& script, std::uint64_t type) {
    PellumApplicationProxies records;
    _bare.enumerateBundlesOfType(
        type, [&](const PellumApplicationProxy& record, bool& /*stop*/) { records.push_back(record); });
    script.enumerateBundlesOfType(type, records);
    return records;
  }
  static void walk(const PellumApplicationProxies& records, const Block& block) {
    bool stop = false;
    for (const PellumApplicationProxy& record : records) {
      block(record, stop);
      if (stop) return;
    }
  }

  PellumApplicationWorkspace& _bare;
  Probe& _probe;
  Mutex _mutex;
  std::map<const void*, Observer> _between APPSYNC_GUARDED_BY(_mutex);  // by the observer that it stands for
};

}  // namespace

std::unique_ptr<PellumApplicationWorkspace> wrap(PellumApplicationWorkspace& bare, Probe& probe) {
  return std::make_unique<WrappedWorkspace>(bare, probe);
}

}  // namespace appsync
