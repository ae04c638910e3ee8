// The applications client of the sync daemon.
//
// The daemon calls the operations of `DovelClient` one at a time, each on its own thread; the services call the
// callbacks on theirs, at any moment. The client owns no thread. What it needs of the world stands in `Platform`, which
// must outlive it.
//
// Settled here: a member for which no queue is named has a lock of its own; updates of the todo list, and of the
// restore state file, are made one after the other, so none is lost; an entry of a list that is of an unexpected type
// is handled as an absent one, be it an application, its store metadata, its icon or an identifier; a list, or an
// application's store metadata, whose outermost value has to be a dictionary and is none is handled as one that cannot
// be parsed.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "client/client_log.h"
#include "platform/brelm.h"
#include "platform/dovel_client.h"
#include "platform/file_manager.h"
#include "platform/install_transaction_log.h"
#include "platform/notifications.h"
#include "platform/ostrel_objects.h"
#include "platform/pellum.h"
#include "platform/platform.h"
#include "platform/property_list.h"
#include "platform/queues.h"
#include "platform/thread_annotations.h"
#include "platform/vaultry.h"

namespace appsync {

class ObserverRelay;

class AppsClient final : public DovelClient {
 public:
  // --- client/lifecycle.cpp -----------------------------------------------------------------------------------------

  // Hosted by the sync daemon itself, the client waits for the daemon's start-up to complete and then registers with
  // the install coordination service, and it ignores installed placeholders from the start; hosted by another process
  // it never registers.
  explicit AppsClient(const Platform& platform);
  // No callback reaches the client any more; then what is left undone is logged.
  ~AppsClient() override;
  AppsClient(const AppsClient&) = delete;
  AppsClient& operator=(const AppsClient&) = delete;

  std::vector<std::string> supportedDataclasses() override;
  std::string currentSyncAnchor() override;
  bool prepareForSyncWithHostAnchor(const std::string& hostAnchor, const ProgressCallback& progressCallback,
                                    ErrorOut error) override;
  std::shared_ptr<OstrelAppInstallObserverDelegate> installObserverDelegate() override;

  // Registers for install events, once.
  void setupInstallCoordinatorObserver();

  std::string description() const { return "<AppsClient>"; }

  // --- client/sync_working_files.cpp --------------------------------------------------------------------------------

  // The array in a property-list file; none when there is no such file, it is empty, or it holds something else. An
  // empty file and a root that is no array leave `error` as it was.
  static std::optional<PropertyList> _loadPlist(FileManager& files, const ClientLog& log, const std::string& path,
                                                ErrorOut error);

  // Sets the operation of the application's first entry in the todo list. Any thread; no update is lost to another one,
  // and none reaches a list that came after it.
  void changeAssetID(const std::string& bundleID, const std::string& toDo);

  void clearSyncData() override;

  // --- client/restore_state_store.cpp -------------------------------------------------------------------------------

  // What is recorded for an application's version; none when nothing is. Without a version there is nothing.
  std::optional<PropertyList> _restoreStatePropertyForKey(const std::string& key, const std::string& identifier,
                                                          const std::optional<std::string>& version);
  // Forgets the application, all its versions. A file whose root is no dictionary goes, like one that cannot be parsed.
  void cleanRestoreStateForIdentifier(const std::string& identifier);

  void dataMigratorSetPlaceHolderPromiseForRestoreAppBundle(const std::string& bundleID);
  void dataMigratorCancelledCoordinatorForRestoreAppBundle(const std::string& bundleID);
  void ostrelDidInstallPlaceHolderForAppBundle(const std::optional<std::string>& bundleID);

  // --- client/installed_assets_report.cpp ---------------------------------------------------------------------------

  PropertyList installedAssets() override;
  PropertyList installedAssetMetrics() override;

  // --- client/sync_reconciliation.cpp -------------------------------------------------------------------------------

  bool reconcileSync(std::uint32_t type, const std::string& newAnchor, const ProgressCallback& progressCallback,
                     ErrorOut error) override;
  void syncEndedWithSuccess(bool success) override;

  // Whether a value from the host may become part of a path: a string in which "/.." does not occur.
  static bool isValidPath(const PropertyList* value);
  static bool isValidPath(const std::optional<std::string>& path);

  // --- client/transfer_phase_end.cpp --------------------------------------------------------------------------------

  void assetTransferEndedWithSuccess(bool success) override;

  // --- transfer/outstanding_transfers.cpp ---------------------------------------------------------------------------

  // Blocks for the query of installs in progress, at most 10 seconds.
  std::vector<DovelAssetRef> outstandingAssetTransfers() override;

  // --- transfer/asset_reception.cpp ---------------------------------------------------------------------------------

  void assetTransferUpdatedProgress(const DovelAssetRef& asset, double progress) override;
  // A failed transfer of a restore ends here: the backup service is told nothing.
  void assetTransferSucceeded(const DovelAssetRef& asset, bool succeeded, const std::optional<Error>& error) override;

  // --- transfer/install_results.cpp ---------------------------------------------------------------------------------

  void assetInstallSucceeded(const DovelAssetRef& asset) override;
  void assetInstallFailed(const DovelAssetRef& asset, const std::optional<Error>& error) override;
  bool _isRecoverableError(const std::optional<Error>& error);

  // --- coordination/coordinators.cpp --------------------------------------------------------------------------------

  // The application's coordinator, when this client made it; `error` is always overwritten with the look-up's.
  OstrelAppInstallCoordinator _initiatingOrUpdatingAppInstallCoordinatorForBundleIdentifier(const std::string& bundleID,
                                                                                            bool existingApp,
                                                                                            bool createIfNotExisting,
                                                                                            ErrorOut error);
  OstrelPlaceholder _placeHolderForBundleIdentifierName(const std::string& bundleID, const std::string& name,
                                                        std::uint64_t installType);
  // `transferPath` names an icon file that is there, so the promise is fulfilled from the start.
  OstrelPromisedTransferToPath _createIconPromiseForBundleIdentifier(const std::string& bundleID,
                                                                     const std::string& transferPath,
                                                                     std::uint64_t diskSpaceNeeded,
                                                                     const OstrelPlaceholder& placeHolder,
                                                                     bool forAppInstall);
  OstrelPromisedTransferToPath _createAppAssetPromiseForBundleIdentifier(
      const std::string& bundleID, const std::optional<std::string>& path,
      const OstrelAppInstallCoordinator& coordinatinator);
  // Fulfilled from the start: the data of a restored application are on the device already.
  OstrelPromisedOutOfBandTransfer _userDataPromiseForBundleIdentifier(const std::string& bundleID);

  // --- coordination/coordinated_install.cpp -------------------------------------------------------------------------

  // Whether the application's coordinator is set up and waits for the package.
  bool prepareAppForInstallUsingCoordination(const DovelAssetRef& asset, bool existingApp);
  // Returns at once; the outcome is only logged and recorded.
  void uninstallAppUsingCoordination(const std::string& bundleID);

  // --- coordination/coordinated_transfer.cpp ------------------------------------------------------------------------

  bool updateTransferProgressForApp(const DovelAssetRef& asset, bool existingApp);
  void transferCompleteForApp(const DovelAssetRef& asset, const std::optional<Error>& error, bool isExistingApp);
  void assetSyncFinishedWithStatus(bool status, const std::set<std::string>& outstandingItems);

  // --- coordination/observer_callbacks.cpp --------------------------------------------------------------------------

  void coordinatorShouldPrioritize(const OstrelAppInstallCoordinator& coordinator);
  void coordinatorDidInstallPlaceholder(const OstrelAppInstallCoordinator& coordinator);
  void coordinatorDidCompleteSuccessfully(const OstrelAppInstallCoordinator& coordinator);
  void coordinatorCanceledWithReason(const OstrelAppInstallCoordinator& coordinator, const Error& reason,
                                     OstrelClientID client);
  void promiseDidBeginFulfillmentWithIdentifier(std::uint64_t identifier);
  void applicationInstallsDidCancel(const PellumApplicationProxies& applications);

  // --- restore/restore_info.cpp -------------------------------------------------------------------------------------

  // Types 2 and 3 bring back the applications of the restore list, if the backup service agrees; others process
  // nothing. Blocks for the placeholders, at most 5 seconds for each. Always true, and `error` always overwritten, with
  // the backup service's or none.
  bool reconcileRestoreOfType(std::int32_t type, ErrorOut error) override;
  // Whether the application that was handled last is set up, or there was no list. The list is moved away afterwards.
  bool _processTarvoRestoreInfo();
  // The dictionary in the backup service's list of demoted applications; none when there is no such file, it is empty,
  // or it holds something else. An empty file and a root that is no dictionary leave `error` as it was.
  static std::optional<PropertyList> _loadDemotedAppsPlist(FileManager& files, const ClientLog& log,
                                                           const std::string& path, ErrorOut error);

  // --- restore/coordinated_restore.cpp ------------------------------------------------------------------------------

  // Whether the application's coordinator is set up, or the store answers for the application already. `tarvoMetadata`
  // is a serialised property list, `iconData` an image file; `demotionStatus` is one of "restore/demotion_status.h", any
  // other value than these is restored as demoted, with a placeholder of a plain restore.
  bool prepareAppForRestoreUsingCoordination(const std::string& bundleID, BytesView tarvoMetadata,
                                             std::optional<BytesView> iconData, std::uint64_t demotionStatus);
  bool _prepareDemotedAppForRestoreWithBundleId(const std::string& bundleID, BytesView tarvoMetadata,
                                                std::optional<BytesView> iconData, std::uint64_t demotionStatus);
  bool _prepareNonDemotedAppForRestoreWithBundleId(const std::string& bundleID, BytesView tarvoMetadata,
                                                   std::optional<BytesView> iconData);
  // A placeholder that is fully configured; one that could not be has been cancelled.
  OstrelPlaceholder _placeHolderForBundleIdentifierWithTarvoMetadata(const std::string& bundleID,
                                                                     const PropertyList& tarvoMetadata,
                                                                     std::optional<BytesView> iconData,
                                                                     std::uint64_t demotionStatus);

  // --- restore/placeholder_applications.cpp -------------------------------------------------------------------------

  std::string placeholderAppPathForBundleIdentifier(const std::string& bundleID);
  bool createPlaceHolderPath(const std::string& path, const std::string& forBundleIdentifier,
                             const FileAttributes& attributes);
  bool writeIconData(std::optional<BytesView> iconData, const std::string& path, std::uint64_t* returningFileSize,
                     const std::string& forBundleIdentifier, const FileAttributes& attributes);
  void _enumeratePlaceholdersWithBlock(const PellumApplicationWorkspace::Block& block);
  std::set<std::string> _getSystemAppPlaceholders();

  // --- device/store_accounts.cpp ------------------------------------------------------------------------------------

  std::set<std::string> zelkIDsForAssets() override;
  // In the registry's order; of several applications of one account the first decides what the account's record says.
  std::vector<DovelMutableAccountInfo> accountsForAssets() override;
  std::optional<std::set<std::string>> disabledAssetTypes() override;
  // A file that is rewritten keeps its format, so that no other value changes.
  void prepareForBackup() override;

  // --- device/home_screen.cpp ---------------------------------------------------------------------------------------

  static void _notifyBrelm(NotificationService& notifications, BrelmShell& shell, const ClientLog& log, bool starting);
  static bool _makeIconFromBundlePath(IconServices& icons, FileManager& files, const ClientLog& log,
                                      const std::optional<std::string>& bundlePath, const std::string& saveTo);
  // The wanted items (by identifier) in home-screen order, then the others in the dictionary's order; `items` is left
  // with those others.
  static std::vector<PropertyList> _orderTheItems(BrelmShell& shell, FileManager& files, const ClientLog& log,
                                                  PropertyList& items);

 private:
  // client/lifecycle.cpp
  bool isHostedBySyncDaemon() const;
  static void _handleDovelStartupCompletedNotification(NotificationCenter* center, void* observer,
                                                       const std::string& name, const void* object,
                                                       const void* userInfo);
  bool _appInstallationAllowed();
  bool _appRemovalAllowed();

  // client/sync_reconciliation.cpp
  bool takeOverStagedFiles(ErrorOut error, bool& nothingToDo);
  void removeUnwantedApps(const PropertyList& todoList);
  void sendIconLayout();

  // client/restore_state_store.cpp
  std::optional<PropertyList> readRestoreState(bool& fileIsReadable);

  // transfer/outstanding_transfers.cpp
  struct WantedApp;
  void addTodoEntries(const PropertyList& todoList, PropertyList& idsWeWant, std::set<std::string>& requested);
  void dropAppsInProgress(PropertyList& idsWeWant);
  void recreateIconScratchDirectory();
  bool isRuledOut(const WantedApp& app, bool installationAllowed, bool requested,
                  const std::set<std::string>& systemAppPlaceholders);
  DovelAssetRef assetForApp(const WantedApp& app);
  bool requestApp(const DovelAssetRef& asset);
  void logRestorePath(const WantedApp& app);

  // transfer/asset_reception.cpp
  void receiveAsset(const DovelAssetRef& asset, bool existingApp);
  void settlePath(DovelAsset& asset);

  // coordination/coordinated_install.cpp
  struct InstallPreparation;
  bool setUpCoordinator(InstallPreparation& install);
  bool setInstallOptions(InstallPreparation& install);
  bool setVeylAssetPromises(InstallPreparation& install);
  void copyIcon(InstallPreparation& install);
  void makePlaceholder(InstallPreparation& install);
  void configurePlaceholder(InstallPreparation& install);
  void cancelPreparation(const InstallPreparation& install);
  std::optional<PropertyList> dictionaryAtPath(const std::optional<std::string>& path);

  // coordination/coordinated_transfer.cpp
  OstrelAppInstallCoordinator liveCoordinator(const std::string& bundleID, bool existingApp);

  // restore/restore_info.cpp
  std::optional<PropertyList> readRestoreInfo();
  bool restoreApps(const PropertyList& restoreInfo);
  void waitForPlaceholderInstalls();
  void moveRestoreListAway();

  // restore/coordinated_restore.cpp
  struct RestorePreparation;
  bool setUpDemotedRestore(RestorePreparation& restore);
  bool setUpRestore(RestorePreparation& restore);
  std::optional<PropertyList> parseTarvoMetadata(RestorePreparation& restore);
  bool failForWantOfCoordinator(const RestorePreparation& restore);
  bool provideUserData(RestorePreparation& restore);
  bool providePlaceholder(RestorePreparation& restore, const PropertyList& metadata);
  void giveRestoreUp(const RestorePreparation& restore);
  bool configureRestorePlaceholder(const std::string& bundleID, const OstrelPlaceholder& placeholder,
                                   const PropertyList& tarvoMetadata);

  // --- members ------------------------------------------------------------------------------------------------------

  // Constant after construction.
  const Platform _platform;
  const ClientLog _log;
  const std::shared_ptr<ObserverRelay> _relay;

  // Have locks of their own.
  WaitGroup _restorePlaceHoldersWaitGroup;
  std::unique_ptr<VaultryManager> _backupManager;
  SerialQueue _accessQueue{"com.zelk.kest.Dovel.AppSync"};
  SerialQueue _restoreQueue{"com.zelk.kest.Dovel.AppRestore"};

  // Guarded by the access queue.
  std::set<std::string> _updatingApps APPSYNC_GUARDED_BY(_accessQueue);
  std::set<std::string> _userCancelledApps APPSYNC_GUARDED_BY(_accessQueue);

  // Guarded by the restore queue; the count is read without it.
  std::set<std::string> _placeholdersForRestoringApps APPSYNC_GUARDED_BY(_restoreQueue);
  bool _finishedWaitingForPlaceHolderInstalls APPSYNC_GUARDED_BY(_restoreQueue) = false;
  std::atomic<std::int64_t> _restoringPlaceholderCount = 0;

  // Guarded by the lock of the members that have no queue.
  Mutex _memberLock;
  std::optional<std::vector<std::string>> _uninstalledApps APPSYNC_GUARDED_BY(_memberLock);
  std::set<std::string> _outstandingWispTransfers APPSYNC_GUARDED_BY(_memberLock);
  OstrelAppInstallObserver _appInstallObserver APPSYNC_GUARDED_BY(_memberLock);
  bool _observerIsSetUp APPSYNC_GUARDED_BY(_memberLock) = false;

  // Held while the todo list, or the area that it lies in, is replaced; and while the restore state file is. Where both
  // are held the todo list's comes first.
  Mutex _todoListLock;
  Mutex _restoreStateLock;
};

}  // namespace appsync
