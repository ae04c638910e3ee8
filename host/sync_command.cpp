// `dovel sync`: one whole sync, with every call in the daemon's order.
#include <algorithm>
#include <chrono>
#include <set>

#include "embedded/coordination.h"
#include "embedded/file_manager.h"
#include "embedded/installer.h"
#include "embedded/waiting.h"
#include "host/commands.h"
#include "host/host_directory.h"
#include "host/install_watch.h"
#include "host/progress_display.h"
#include "host/session.h"
#include "host/sync_log.h"
#include "host/sync_report.h"
#include "host/transfers.h"

namespace appsync {

namespace {

constexpr char kAnchor[] = "dovel";
constexpr auto kPatienceWithInstalls = std::chrono::seconds(30);  // without any progress

class SyncRun {
 public:
  SyncRun(const SyncOptions& options, const HostDirectory& host, Session& session, const SyncLog& log, Console& console)
      : _options(options),
        _host(host),
        _session(session),
        _device(session.device()),
        _log(log),
        _console(console),
        _display(console, canDrawInPlace(options.common, console)),
        _watch(_display, session.trace()) {}

  ~SyncRun() {
    Failure ignored;
    _session.close(ignored);  // nothing is told here any more
  }
  SyncRun(const SyncRun&) = delete;
  SyncRun& operator=(const SyncRun&) = delete;

  // False, with the failure said, when the sync could not begin.
  bool run(Failure& failure) {
    if (!pushHost(failure)) return isInterrupted();
    if (!startClient(failure)) return false;
    _report.reconciled = askBeforehand() && !isInterrupted() && reconcile();
    bool success = false;
    if (_report.reconciled) {
      const bool phaseSuccess = transferPhase();
      waitForInstalls();
      success = phaseSuccess && !isInterrupted();
    }
    _session.client().syncEndedWithSuccess(success);
    _display.end();
    clearPackages(_device.files(), _device.coordination().packagePathsInUse());
    return true;
  }

  // What came of it. Asked before the session is closed.
  SyncReport report() {
    if (_hasAsked) {
      addSkipped();
      addApplications();
      addRemovals();
    }
    if (const auto uninstalled = _device.installer().KilnLookupUninstalled()) {
      for (const auto member : uninstalled->members()) _report.uninstalled.emplace_back(member.key);
    }
    if (isInterrupted()) _report.interruptedWith = _session.interrupt().exitStatus();
    const std::chrono::duration<double> took = std::chrono::steady_clock::now() - _begin;
    _report.seconds = took.count();
    return _report;
  }

 private:
  bool isInterrupted() { return _session.interrupt().signal() != 0; }

  bool pushHost(Failure& failure) {
    clearStaging(_device.files(), _device.coordination().packagePathsInUse());
    const CopySupervision supervision{[this](const std::string& line) { _console.problem(line); },
                                      [this] { return isInterrupted(); }};
    return _host.push(_device.files(), supervision, failure);
  }

  bool startClient(Failure& failure) {
    if (!_session.makeClient(failure)) return false;
    _device.coordination().setEventListener([this](const CoordinatorEvent& event) { _watch.hear(event); });
    _device.startWork();
    _session.announceStartup();
    return true;
  }

  // Whether the sync may go on.
  bool askBeforehand() {
    DovelClient& client = _session.client();
    std::optional<Error> error;
    if (!client.prepareForSyncWithHostAnchor(client.currentSyncAnchor(), {}, &error)) {
      _console.problem("the client does not agree to the sync" + (error ? ": " + reasonText(*error) : std::string()));
      return false;
    }
    const PropertyList assets = client.installedAssets();
    if (const PropertyList* deleted = assets.find("_Deleted")) {
      for (const PropertyList& application : deleted->elements()) {
        if (const auto identifier = textAt(application, "TefBundleIdentifier")) _report.deleted.push_back(*identifier);
      }
    }
    _report.metrics = client.installedAssetMetrics();
    return true;
  }

  bool reconcile() {
    std::optional<Error> error;
    const bool reconciled = _session.client().reconcileSync(_options.type, kAnchor, {}, &error);
    readTodoList(_todo);
    if (!reconciled) {
      _console.problem("the client could not take over the host's files" +
                       (error ? ": " + reasonText(*error) : std::string()));
      return false;
    }
    if (_device.files().fileExists(kTodoList) && !_todo) {
      _report.todoUnusable = true;
      _console.problem("the host's todo list ApplicationSync/ApplicationsSync.plist cannot be used" +
                       (error ? ": " + reasonText(*error) : std::string(": it is no property list of an array")));
    }
    return true;
  }

  // Everything from the packages that are asked for to the phase's end; whether that is a success.
  bool transferPhase() {
    DovelClient& client = _session.client();
    const std::vector<DovelAssetRef> assets = client.outstandingAssetTransfers();
    _hasAsked = true;
    for (const DovelAssetRef& asset : assets) {
      _assets[asset->identifier()] = asset;
      _report.requested.push_back(asset->identifier());
    }
    _watch.begin(_report.requested);
    _transfers =
        std::make_unique<Transfers>(_session, _host, _options, _display, _console, [this] { reportInstalls(); });
    _transfers->run(assets);
    _report.transferred = _transfers->transferred();
    const bool success = _transfers->allEnded() && !_options.failPhase && !isInterrupted();
    client.assetTransferEndedWithSuccess(success);
    return success;
  }

  // Reported installs can begin removals, so there is more to wait for until nothing is left to report.
  void waitForInstalls() {
    do {
      _device.coordination().waitUntilSettled(_device.waiting(), kPatienceWithInstalls);
    } while (reportInstalls());
  }

  // Whether there was anything to report. The client is only ever called on the daemon's own thread.
  bool reportInstalls() {
    if (!_options.reportInstalls) return false;
    const std::vector<InstallWatch::Result> results = _watch.takeResults();
    for (const InstallWatch::Result& result : results) {
      const DovelAssetRef& asset = _assets[result.identifier];
      if (result.error) {
        _session.client().assetInstallFailed(asset, result.error);
      } else {
        _session.client().assetInstallSucceeded(asset);
      }
    }
    return !results.empty();
  }

  void readTodoList(std::optional<PropertyList>& todo) {
    todo.reset();
    const std::optional<Bytes> bytes = _device.files().readFile(kTodoList, nullptr);
    if (bytes) todo = parsePropertyList(*bytes, nullptr);
    if (todo && !todo->isArray()) todo.reset();
  }

  static std::optional<std::string> textAt(const PropertyList& entry, const char* key) {
    const PropertyList* value = entry.find(key);
    return value == nullptr ? std::nullopt : value->string();
  }

  // What the todo list tells by itself comes first, then what the client said, then what is left: an application that
  // was neither requested nor ruled out is being installed already.
  void addSkipped() {
    std::set<std::string> accountedFor(_report.requested.begin(), _report.requested.end());
    const std::vector<SyncLog::Skipped> said = _log.skipped();
    for (const SyncLog::Skipped& one : said) accountedFor.insert(one.identifier);
    std::vector<SyncReport::Skipped> inProgress;
    for (const PropertyList& entry : todoEntries()) {
      const std::optional<std::string> operation = textAt(entry, "operation");
      if (operation != "install" && operation != "remove") continue;
      const std::optional<std::string> identifier = textAt(entry, "identifier");
      if (!identifier || identifier->find("/..") != std::string::npos) {
        _report.skipped.push_back({identifier, "invalid-identifier"});
      } else if (operation == "remove") {
        if (_log.removalsWereForbidden()) _report.skipped.push_back({identifier, "policy"});
      } else if (accountedFor.insert(*identifier).second) {
        inProgress.push_back({identifier, "in-progress"});
      }
    }
    for (const SyncLog::Skipped& one : said) {
      _report.skipped.push_back({one.identifier, std::string(one.reason)});
      if (one.reason == "refused") _report.refused = true;
    }
    _report.skipped.insert(_report.skipped.end(), inProgress.begin(), inProgress.end());
  }

  PropertyList::Array todoEntries() const { return _todo.value_or(PropertyList::array()).elements(); }

  void addApplications() {
    readTodoList(_todo);
    std::set<std::string> listed;
    for (const PropertyList& entry : todoEntries()) {
      const std::optional<std::string> identifier = textAt(entry, "identifier");
      const std::optional<std::string> operation = textAt(entry, "operation");
      if (identifier) listed.insert(*identifier);
      const bool isRemoval = operation == "remove" || !identifier;
      _report.applications.push_back(
          {identifier, operation, isRemoval ? std::nullopt : errorOf(*identifier, operation)});
    }
    for (const std::string& identifier : _report.requested) {
      if (listed.contains(identifier)) continue;
      _report.applications.push_back({identifier, std::nullopt, errorOf(identifier, std::nullopt)});
    }
  }

  // Why an application is not as it was asked for; none when it is, or when nothing was asked.
  std::optional<std::string> errorOf(const std::string& identifier, const std::optional<std::string>& operation) {
    if (operation == "INSTALLED") return std::nullopt;
    if (!_assets.contains(identifier)) {
      if (operation != "FAILED") return std::nullopt;
      return _log.preparationError(identifier).value_or("its install could not be prepared");
    }
    if (auto why = _transfers->failure(identifier)) return why;
    if (auto why = _watch.failure(identifier)) return why;
    if (_watch.isInstalled(identifier)) return std::nullopt;
    if (isInterrupted()) return "the sync was interrupted";
    return "its package arrived but was not installed";
  }

  void addRemovals() {
    for (const std::string& identifier : _log.removals()) {
      _report.removals.push_back({identifier, std::nullopt, _log.removalError(identifier)});
    }
  }

  const SyncOptions& _options;
  const HostDirectory& _host;
  Session& _session;
  Device& _device;
  const SyncLog& _log;
  Console& _console;
  const std::chrono::steady_clock::time_point _begin = std::chrono::steady_clock::now();

  ProgressDisplay _display;
  InstallWatch _watch;
  std::unique_ptr<Transfers> _transfers;
  std::optional<PropertyList> _todo;
  bool _hasAsked = false;  // the client has said what it wants
  std::map<std::string, DovelAssetRef> _assets;
  SyncReport _report;
};

}  // namespace

int runSync(const SyncOptions& options, Console& console) {
  Failure failure;
  SyncLog log;
  const std::optional<HostDirectory> host = HostDirectory::open(options.host, options.common.device, failure);
  if (!host) return console.fail(failure);
  const auto session = Session::open({.common = options.common, .listeners = {&log}}, console, failure);
  if (!session) return console.fail(failure);

  SyncRun run(options, *host, *session, log, console);
  if (!run.run(failure)) return console.fail(failure);
  const SyncReport report = run.report();
  if (!session->close(failure)) return console.fail(failure);
  printSyncReport(report, console);
  return report.status();
}

}  // namespace appsync
