// `dovel play`: single calls on the client, in any order and with any arguments.
#include <filesystem>

#include "embedded/coordination.h"
#include "embedded/device_service.h"
#include "embedded/file_manager.h"
#include "host/commands.h"
#include "host/files.h"
#include "host/host_directory.h"
#include "host/json.h"
#include "host/play_script.h"
#include "host/session.h"
#include "platform/pellum.h"
#include "platform/thread_annotations.h"

namespace appsync {

namespace {

// Forwards to the registry, and knows who observes it, so that an event can be made for them.
class ObservedWorkspace : public PellumApplicationWorkspace {
 public:
  explicit ObservedWorkspace(PellumApplicationWorkspace& real) : _real(real) {}

  std::vector<Observer> observers() {
    MutexLock lock(_mutex);
    return _observers;
  }

  void addObserver(const Observer& observer) override {
    {
      MutexLock lock(_mutex);
      _observers.push_back(observer);
    }
    _real.addObserver(observer);
  }
  void removeObserver(const Observer& observer) override {
    {
      MutexLock lock(_mutex);
      std::erase(_observers, observer);
    }
    _real.removeObserver(observer);
  }
  bool applicationIsInstalled(const std::string& bundleID) override { return _real.applicationIsInstalled(bundleID); }
  std::optional<PellumApplicationProxy> applicationProxyForIdentifier(const std::string& bundleID,
                                                                      bool placeholder) override {
    return _real.applicationProxyForIdentifier(bundleID, placeholder);
  }
  void enumerateBundlesOfType(std::uint64_t type, const Block& block) override {
    _real.enumerateBundlesOfType(type, block);
  }
  bool uninstallApplication(const std::string& bundleID, ErrorOut error) override {
    return _real.uninstallApplication(bundleID, error);
  }

 private:
  PellumApplicationWorkspace& _real;
  Mutex _mutex;
  std::vector<Observer> _observers APPSYNC_GUARDED_BY(_mutex);
};

Json arrayOf(const auto& values) {
  Json array = Json::array();
  for (const auto& value : values) array.push_back(value);
  return array;
}

class PlayRun {
 public:
  PlayRun(const PlayScript& script, std::string device, Session& session, Console& console)
      : _script(script),
        _device(std::move(device)),
        _session(session),
        _console(console),
        _workspace(*session.platform().defaultWorkspace) {}
  ~PlayRun() {
    Failure ignored;
    _session.close(ignored);  // nobody may use the workspace any more
  }
  PlayRun(const PlayRun&) = delete;
  PlayRun& operator=(const PlayRun&) = delete;

  // False, with the failure said, when the client cannot be made or a file that a step names cannot be used.
  bool run(Failure& failure) {
    Platform platform = _session.platform();
    platform.defaultWorkspace = &_workspace;
    if (!_session.makeClient(platform, failure)) return false;
    _session.device().startWork();
    std::size_t number = 0;
    for (const PlayStep& step : _script.steps) {
      if (_session.interrupt().signal() != 0) return true;
      ++number;
      if (play(step, failure)) continue;
      failure.message = "step " + std::to_string(number) + " of the script: " + failure.message;
      return false;
    }
    return true;
  }

  const Json& steps() const { return _steps; }
  // The same for people, a line each. To be printed when nothing can fail any more: a step may name a file that is not
  // there, and then standard output stays empty.
  const std::vector<std::string>& lines() const { return _lines; }
  // Whether the client answered a call with NO.
  bool wasRefused() const { return _wasRefused; }

 private:
  bool play(const PlayStep& step, Failure& failure) {
    const Json arguments = Json::parse(step.content);
    Json result;
    std::optional<Error> error = errorArgument(arguments, "givenError");
    switch (step.kind) {
      case PlayStepKind::Call:
        result = call(step.action, arguments, flagArgument(arguments, "noErrorOut", false) ? nullptr : &error);
        if (result == false) _wasRefused = true;
        break;
      case PlayStepKind::Callback:
        deliver(step.action, arguments);
        break;
      case PlayStepKind::World:
        if (!changeWorld(step.action, arguments, failure)) return false;
    }
    Json shownError;
    if (error) shownError = {{"domain", error->domain()}, {"code", error->code()}};
    _lines.push_back(step.action + (result.is_null() ? "" : ": " + jsonLine(result)) +
                     (error ? ", error " + error->description() : ""));
    _steps.push_back({{"do", step.action}, {"result", std::move(result)}, {"error", std::move(shownError)}});
    return true;
  }

  Json call(const std::string& action, const Json& arguments, ErrorOut error) {
    DovelClient& client = _session.client();
    if (action == "supportedDataclasses") return arrayOf(client.supportedDataclasses());
    if (action == "currentSyncAnchor") return client.currentSyncAnchor();
    if (action == "prepareForSyncWithHostAnchor") {
      return client.prepareForSyncWithHostAnchor(textArgument(arguments, "hostAnchor"), {}, error);
    }
    if (action == "installedAssets") return jsonFromPropertyList(client.installedAssets());
    if (action == "installedAssetMetrics") return jsonFromPropertyList(client.installedAssetMetrics());
    if (action == "reconcileSync") {
      return client.reconcileSync(static_cast<std::uint32_t>(numberArgument(arguments, "type")),
                                  textArgument(arguments, "newAnchor"), {}, error);
    }
    if (action == "reconcileRestoreOfType") {
      return client.reconcileRestoreOfType(static_cast<std::int32_t>(numberArgument(arguments, "type")), error);
    }
    if (action == "outstandingAssetTransfers") return outstandingAssetTransfers();
    if (action == "zelkIDsForAssets") return arrayOf(client.zelkIDsForAssets());
    if (action == "accountsForAssets") return accountDocuments(client.accountsForAssets());
    if (action == "disabledAssetTypes") {
      return orNull(client.disabledAssetTypes());
    }
    callWithoutAnswer(action, arguments);
    return nullptr;
  }

  void callWithoutAnswer(const std::string& action, const Json& arguments) {
    DovelClient& client = _session.client();
    const bool success = flagArgument(arguments, "success", true);
    if (action == "syncEndedWithSuccess") return client.syncEndedWithSuccess(success);
    if (action == "assetTransferEndedWithSuccess") return client.assetTransferEndedWithSuccess(success);
    if (action == "clearSyncData") return client.clearSyncData();
    if (action == "prepareForBackup") return client.prepareForBackup();
    const DovelAssetRef asset = assetArgument(arguments);
    const std::optional<Error> error = errorArgument(arguments, "error");
    if (action == "assetTransferSucceeded") {
      client.assetTransferSucceeded(asset, flagArgument(arguments, "succeeded", true), error);
    } else if (action == "assetTransferUpdatedProgress") {
      client.assetTransferUpdatedProgress(asset, fractionArgument(arguments, "progress"));
    } else if (action == "assetInstallSucceeded") {
      client.assetInstallSucceeded(asset);
    } else if (action == "assetInstallFailed") {
      client.assetInstallFailed(asset, error);
    }
  }

  // What is asked for waits in the daemon's queue from then on, where the client can reorder and drop it.
  Json outstandingAssetTransfers() {
    Json assets = Json::array();
    std::vector<std::string> queue;
    for (const DovelAssetRef& asset : _session.client().outstandingAssetTransfers()) {
      assets.push_back(assetDocument(*asset));
      queue.push_back(asset->identifier());
    }
    _session.device().deviceService().setQueue(queue);
    return assets;
  }

  void deliver(const std::string& action, const Json& arguments) {
    const std::optional<std::string> identifier = identifierArgument(arguments);
    const std::optional<Error> error = errorArgument(arguments, "error");
    if (action == "applicationInstallsDidCancel") {
      PellumApplicationProxies records;
      if (identifier) {
        records.emplace_back();
        records.back().applicationIdentifier = records.back().bundleIdentifier = *identifier;
      }
      for (const auto& observer : _workspace.observers()) observer->applicationInstallsDidCancel(records);
      return;
    }
    const auto observer = _session.client().installObserverDelegate();
    const OstrelAppInstallCoordinator coordinator = _session.instruments()->makePhantomCoordinator(identifier, error);
    if (action == "coordinatorShouldPrioritize") {
      observer->coordinatorShouldPrioritize(coordinator);
    } else if (action == "coordinatorDidInstallPlaceholder") {
      observer->coordinatorDidInstallPlaceholder(coordinator);
    } else if (action == "coordinatorDidCompleteSuccessfully") {
      observer->coordinatorDidCompleteSuccessfully(coordinator);
    } else if (action == "coordinatorCanceledWithReason") {
      const Error reason =
          errorArgument(arguments, "reason").value_or(Error(std::string(kOstrelErrorDomain), kOstrelOver));
      observer->coordinatorCanceledWithReason(coordinator, reason,
                                              static_cast<OstrelClientID>(numberArgument(arguments, "client")));
    } else {
      observer->promiseDidBeginFulfillmentWithIdentifier(
          static_cast<std::uint64_t>(numberArgument(arguments, "number")));
    }
  }

  bool changeWorld(const std::string& action, const Json& arguments, Failure& failure) {
    if (action == "stage") return stage(textArgument(arguments, "host"), failure);
    if (action == "push") return push(textArgument(arguments, "file"), textArgument(arguments, "to"), failure);
    if (action == "startupComplete") {
      _session.announceStartup();
    } else if (action == "settle") {
      _session.drainExecutor();
    } else if (action == "lack") {
      const bool isPrioritize = textArgument(arguments, "operation") == "prioritizeAsset";
      _session.instruments()->setLacking(isPrioritize
                                             ? DovelDeviceService::Operation::PrioritizeAsset
                                             : DovelDeviceService::Operation::CancelAssetTransferForFailedAsset,
                                         true);
    } else if (action == "fault") {
      _session.instruments()->addFault(textArgument(arguments, "spec"), nullptr);
    }
    return true;
  }

  std::string besideScript(const std::string& name) const {
    return (std::filesystem::path(_script.directory) / name).string();
  }

  bool stage(const std::string& name, Failure& failure) {
    const auto host = HostDirectory::open(besideScript(name), _device, failure);
    if (!host) return false;
    EmbeddedFileManager& files = _session.device().files();
    clearStaging(files, _session.device().coordination().packagePathsInUse());
    const CopySupervision supervision{[this](const std::string& line) { _console.problem(line); },
                                      [this] { return _session.interrupt().signal() != 0; }};
    return host->push(files, supervision, failure) || _session.interrupt().signal() != 0;
  }

  bool push(const std::string& name, const std::string& path, Failure& failure) {
    const std::optional<Bytes> bytes = readInput(besideScript(name), failure);
    if (!bytes) return false;
    EmbeddedFileManager& files = _session.device().files();
    std::optional<Error> error;
    const std::string parent = std::filesystem::path(path).parent_path().string();
    if (files.createDirectory(parent, true, {}, &error) && files.writeFile(path, *bytes, &error)) return true;
    failure = failureFrom(FailureCode::InputUnusable, *error, "name an absolute path of the device with \"to\"");
    return false;
  }

  const PlayScript& _script;
  const std::string _device;  // its directory
  Session& _session;
  Console& _console;
  ObservedWorkspace _workspace;
  Json _steps = Json::array();
  std::vector<std::string> _lines;
  bool _wasRefused = false;
};

}  // namespace

int runPlay(const PlayOptions& options, Console& console) {
  Failure failure;
  const std::optional<PlayScript> script = readPlayScript(options.script, failure);
  if (!script) return console.fail(failure);
  const auto session = Session::open(
      {.common = options.common, .mainBundleIdentifier = script->mainBundleIdentifier, .wrapsServices = true}, console,
      failure);
  if (!session) return console.fail(failure);

  PlayRun run(*script, options.common.device, *session, console);
  if (!run.run(failure)) return console.fail(failure);
  const int status = session->exitStatus(run.wasRefused() ? kStatusSomethingFailed : kStatusDone);
  if (!session->close(failure)) return console.fail(failure);
  console.document({{"ok", status == kStatusDone}, {"steps", run.steps()}});
  for (const std::string& line : run.lines()) console.line(line);
  return status;
}

}  // namespace appsync
