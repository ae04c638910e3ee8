#include "client/apps_client.h"

namespace appsync {

void AppsClient::assetTransferEndedWithSuccess(bool success) {
  _log("asset transfer ended withsuccess: %c", yesOrNo(success));
  _notifyBrelm(*_platform.notifications, *_platform.shell, _log, false);
  std::set<std::string> outstanding;
  {
    const MutexLock lock(_memberLock);
    outstanding = _outstandingWispTransfers;
  }
  if (outstanding.empty()) return;
  assetSyncFinishedWithStatus(success, outstanding);
  if (success) {
    _log.error("Called with success == YES but with %lu outstanding Wisp transfers!", outstanding.size());
  }
  {
    const MutexLock lock(_memberLock);
    _outstandingWispTransfers.clear();
  }
  const OnQueue on(_accessQueue);
  _updatingApps.clear();
  _userCancelledApps.clear();
}

}  // namespace appsync
