#include "instrument/instruments.h"

#include "instrument/probe.h"
#include "instrument/wrapped_coordination.h"
#include "instrument/wrappers.h"

namespace appsync {

struct Instruments::Parts {
  Parts(const Platform& bare, const InstrumentOptions& options)
      : probe(options.recording, options.reachedTextsFile),
        mainBundleIdentifier(bare.mainBundleIdentifier),
        log(wrap(*bare.log, probe)),
        transactionLog(wrap(*bare.transactionLog, probe)),
        files(wrap(*bare.files, probe)),
        waiting(wrap(*bare.waiting, probe)),
        defaultWorkspace(wrap(*bare.defaultWorkspace, probe)),
        coordination(*bare.coordination, probe),
        installer(wrap(*bare.installer, probe)),
        backup(wrap(*bare.backup, probe)),
        sharedConnection(wrap(*bare.sharedConnection, probe)),
        shell(wrap(*bare.shell, probe)),
        icons(wrap(*bare.icons, probe)),
        notifications(wrap(*bare.notifications, probe)),
        notificationCenter(wrap(*bare.notificationCenter, probe)),
        deviceService(wrap(*bare.sharedInstance, probe, lacking)) {}

  Probe probe;
  LackingOperations lacking;
  std::string mainBundleIdentifier;
  std::unique_ptr<SystemLog> log;
  std::unique_ptr<InstallTransactionLog> transactionLog;
  std::unique_ptr<FileManager> files;
  std::unique_ptr<Waiting> waiting;
  std::unique_ptr<PellumApplicationWorkspace> defaultWorkspace;
  WrappedCoordination coordination;
  std::unique_ptr<KilnInstaller> installer;
  std::unique_ptr<VaultryService> backup;
  std::unique_ptr<TessaProfileConnection> sharedConnection;
  std::unique_ptr<BrelmShell> shell;
  std::unique_ptr<IconServices> icons;
  std::unique_ptr<NotificationService> notifications;
  std::unique_ptr<NotificationCenter> notificationCenter;
  std::unique_ptr<DovelDeviceService> deviceService;
};

Instruments::Instruments(const Platform& bare, const InstrumentOptions& options)
    : _parts(std::make_unique<Parts>(bare, options)) {}

Instruments::~Instruments() {
  dropHeldEvents();  // they may hold handles of the wrappers
}

Platform Instruments::platform() {
  Platform platform;
  platform.mainBundleIdentifier = _parts->mainBundleIdentifier;
  platform.log = _parts->log.get();
  platform.transactionLog = _parts->transactionLog.get();
  platform.files = _parts->files.get();
  platform.waiting = _parts->waiting.get();
  platform.defaultWorkspace = _parts->defaultWorkspace.get();
  platform.coordination = &_parts->coordination;
  platform.installer = _parts->installer.get();
  platform.backup = _parts->backup.get();
  platform.sharedConnection = _parts->sharedConnection.get();
  platform.shell = _parts->shell.get();
  platform.icons = _parts->icons.get();
  platform.notifications = _parts->notifications.get();
  platform.notificationCenter = _parts->notificationCenter.get();
  platform.sharedInstance = _parts->deviceService.get();
  return platform;
}

bool Instruments::addFault(const std::string& spec, ErrorOut error) {
  return _parts->probe.faults.add(spec, false, std::nullopt, error);
}

bool Instruments::addFaultWithError(const std::string& spec, const std::optional<Error>& given, ErrorOut error) {
  return _parts->probe.faults.add(spec, true, given, error);
}

void Instruments::clearFaults() {
  _parts->probe.faults.clear();
}

FaultQuery Instruments::faultQuery() {
  return [&faults = _parts->probe.faults](const std::string& operation,
                                          const std::string& bundleID) -> std::optional<Error> {
    const auto hit = faults.strike(operation, Subject::application(bundleID));
    if (!hit) return std::nullopt;
    return hit->error.value_or(Error(std::string(kFaultErrorDomain), kFaultMade));
  };
}

Recorder& Instruments::recorder() {
  return _parts->probe.recorder;
}

void Instruments::setAnswers(ScriptedAnswers answers) {
  _parts->probe.setScript(std::move(answers));
}

std::size_t Instruments::releaseHeldEvents() {
  return _parts->probe.releaseHeldEvents();
}

void Instruments::dropHeldEvents() {
  _parts->probe.dropHeldEvents();
}

OstrelAppInstallCoordinator Instruments::makePhantomCoordinator(std::optional<std::string> bundleID,
                                                                std::optional<Error> error) {
  return _parts->coordination.makePhantom(std::move(bundleID), std::move(error));
}

void Instruments::setLacking(DovelDeviceService::Operation operation, bool lacking) {
  _parts->lacking.of(operation) = lacking;
}

}  // namespace appsync
