#include "client/apps_client.h"
#include "client/observer_relay.h"
#include "client/paths.h"
#include "platform/device_policy.h"

namespace appsync {

AppsClient::AppsClient(const Platform& platform)
    : _platform(platform),
      _log(*platform.log),
      _relay(std::make_shared<ObserverRelay>(*this)),
      _backupManager(platform.backup->makeVaultryManager()) {
  _platform.defaultWorkspace->addObserver(_relay);
  _platform.transactionLog->initializeWithLog(
      _platform.log->makeLogHandle("com.zelk.appinstallation", "dovel.appsync"));
  if (isHostedBySyncDaemon()) {
    {
      const OnQueue on(_restoreQueue);
      _finishedWaitingForPlaceHolderInstalls = true;
    }
    _platform.notificationCenter->addObserver(_relay, &_handleDovelStartupCompletedNotification,
                                              kStartupCompleteNotification, NotificationSuspension::Drop);
  }
  _relay->open();
}

AppsClient::~AppsClient() {
  _relay->close();
  {
    const MutexLock lock(_memberLock);
    if (!_outstandingWispTransfers.empty()) {
      _log.error("%{public}@ getting dealloc'd with %lu outstanding Wisp transfers!", *this,
                 _outstandingWispTransfers.size());
    }
  }
  {
    const OnQueue on(_restoreQueue);
    if (!_placeholdersForRestoringApps.empty()) {
      _log.error("%{public}@ getting dealloc'd with %{public}@pending placeholder install complete notifications",
                 *this, _placeholdersForRestoringApps);
    }
  }
  _platform.defaultWorkspace->removeObserver(_relay);
  if (!isHostedBySyncDaemon()) return;
  _platform.notificationCenter->removeObserver(_relay, kStartupCompleteNotification);
  OstrelAppInstallObserver dropped;
  const MutexLock lock(_memberLock);
  std::swap(dropped, _appInstallObserver);
}

std::vector<std::string> AppsClient::supportedDataclasses() {
  return {kDataclass};
}

std::string AppsClient::currentSyncAnchor() {
  return "NO_APP_SYNC_ANCHOR";
}

bool AppsClient::prepareForSyncWithHostAnchor(const std::string& /*hostAnchor*/,
                                              const ProgressCallback& /*progressCallback*/, ErrorOut /*error*/) {
  return true;
}

std::shared_ptr<OstrelAppInstallObserverDelegate> AppsClient::installObserverDelegate() {
  return _relay;
}

void AppsClient::_handleDovelStartupCompletedNotification(NotificationCenter* /*center*/, void* observer,
                                                          const std::string& /*name*/, const void* /*object*/,
                                                          const void* /*userInfo*/) {
  if (observer != nullptr) static_cast<ObserverRelay*>(observer)->startupCompleted();
}

void AppsClient::setupInstallCoordinatorObserver() {
  {
    const MutexLock lock(_memberLock);
    if (_observerIsSetUp) return;
    _observerIsSetUp = true;
  }
  OstrelAppInstallObserver observer = OstrelAppInstallObserver::initWithMachServiceName(
      *_platform.coordination, kInstallObserverServiceName, {OstrelClientDovel}, _relay);
  const MutexLock lock(_memberLock);
  std::swap(_appInstallObserver, observer);
}

bool AppsClient::isHostedBySyncDaemon() const {
  return _platform.mainBundleIdentifier == kSyncDaemonBundleIdentifier;
}

bool AppsClient::_appInstallationAllowed() {
  return _platform.sharedConnection->effectiveBoolValueForSetting(TessaFeatureAppInstallationAllowed) !=
         TessaBoolean::No;
}

bool AppsClient::_appRemovalAllowed() {
  return _platform.sharedConnection->effectiveBoolValueForSetting(TessaFeatureAppRemovalAllowed) != TessaBoolean::No;
}

}  // namespace appsync
