// Which installs are under way on the device, asked of the registry once.
#pragma once

#include <chrono>
#include <optional>
#include <string>
#include <vector>

#include "client/client_log.h"
#include "platform/pellum.h"
#include "platform/queues.h"
#include "platform/thread_annotations.h"
#include "platform/waiting.h"

namespace appsync {

// Observes the registry for one report of installs, sorts it, and goes. The registry's thread fills the lists while the
// caller's waits.
class InProgressAssetQuery final : public PellumApplicationWorkspaceObserver {
 public:
  using Identifiers = std::vector<std::string>;

  // How long a caller is blocked at most.
  static constexpr std::chrono::seconds kTimeLimit{10};

  // The bundle identifiers of the applications that are being installed, and of those that are being restored; none in
  // both when the registry does not report in time. Blocks for `kTimeLimit` at most.
  static void currentInProgressAssetIDs(PellumApplicationWorkspace& workspace, Waiting& waiting, const ClientLog& log,
                                        std::optional<Identifiers>& inProgressAssetIDs,
                                        std::optional<Identifiers>& restoringAssetIDs);

  explicit InProgressAssetQuery(ClientLog log) : _log(std::move(log)) {}

  // Only the first report counts.
  void applicationInstallsArePrioritized(const PellumApplicationProxies& prioritized,
                                         const PellumApplicationProxies& arePaused) override;

 private:
  bool _fetchResults(Waiting& waiting);
  void classify(const PellumApplicationProxy& application) APPSYNC_REQUIRES(_lock);

  const ClientLog _log;
  Semaphore _waitForInitialObservationData;
  Mutex _lock;
  std::optional<Identifiers> _inProgressAssetIDs APPSYNC_GUARDED_BY(_lock);
  std::optional<Identifiers> _restoringAssetIDs APPSYNC_GUARDED_BY(_lock);
};

}  // namespace appsync
