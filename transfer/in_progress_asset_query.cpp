#include "transfer/in_progress_asset_query.h"

#include <memory>

#include "transfer/install_names.h"

namespace appsync {

void InProgressAssetQuery::currentInProgressAssetIDs(PellumApplicationWorkspace& workspace, Waiting& waiting,
                                                     const ClientLog& log,
                                                     std::optional<Identifiers>& inProgressAssetIDs,
                                                     std::optional<Identifiers>& restoringAssetIDs) {
  inProgressAssetIDs.reset();
  restoringAssetIDs.reset();
  const auto query = std::make_shared<InProgressAssetQuery>(log);
  workspace.addObserver(query);
  if (query->_fetchResults(waiting)) {
    const MutexLock lock(query->_lock);
    inProgressAssetIDs = query->_inProgressAssetIDs;
    restoringAssetIDs = query->_restoringAssetIDs;
  }
  workspace.removeObserver(query);
}

bool InProgressAssetQuery::_fetchResults(Waiting& waiting) {
  _log("Waiting for -applicationInstallsArePrioritized:arePaused: to complete...");
  const bool reported = _waitForInitialObservationData.wait(waiting, waiting.now() + kTimeLimit);
  if (reported) {
    _log("Wait completed");
  } else {
    _log.error("Query for in progress assets timed out");
  }
  return reported;
}

void InProgressAssetQuery::applicationInstallsArePrioritized(const PellumApplicationProxies& prioritized,
                                                             const PellumApplicationProxies& arePaused) {
  _log.summary("prioritized proxies %{public}@ paused proxies %{public}@", prioritized, arePaused);
  {
    const MutexLock lock(_lock);
    if (_inProgressAssetIDs) return;
    _inProgressAssetIDs.emplace();
    _restoringAssetIDs.emplace();
    if (prioritized.empty()) _log("No assets currently in progress.");
    for (const PellumApplicationProxy& application : prioritized) classify(application);
  }
  _log("signaling semaphore");
  _waitForInitialObservationData.signal();
}

void InProgressAssetQuery::classify(const PellumApplicationProxy& application) {
  const std::string& id = application.applicationIdentifier;
  if (!application.isPlaceholder()) {
    _log("No placeholder for asset identifier %{public}@", id);
    return;
  }
  const std::optional<PellumInstallProgress>& progress = application.installProgressSync;
  if (!progress) {
    _log("No install progress found for asset identifier %{public}@", id);
    return;
  }
  const std::uint64_t type = application.installType;
  const std::uint64_t phase = progress->installPhase;
  _log("Got install type=%{public}@ state=%{public}@ phase=%{public}@ for %{public}@", installTypeName(type),
       installStateName(progress->installState), installPhaseName(phase), id);
  if (progress->installState != kPellumInstallStateActive) return;
  const bool loading = phase == kPellumInstallPhaseLoading;
  const bool installing = phase == kPellumInstallPhaseInstalling;
  if ((type != kPellumInstallTypeRestore && installing) || (type == kPellumInstallTypeStoreDownload && loading)) {
    _inProgressAssetIDs->push_back(id);
  } else if (type == kPellumInstallTypeRestore && (loading || installing)) {
    _restoringAssetIDs->push_back(id);
  }
}

}  // namespace appsync
