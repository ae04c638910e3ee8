// The daemon's transfer queue: the packages that the host still has to send, in the order in which they are wanted.
#pragma once

#include <condition_variable>
#include <deque>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "embedded/executor.h"
#include "platform/dovel_client.h"
#include "platform/thread_annotations.h"
#include "platform/waiting.h"

namespace appsync {

inline constexpr std::string_view kTransferErrorDomain = "TransferError";
inline constexpr std::int64_t kTransferUnknown = 1;    // there is no such transfer
inline constexpr std::int64_t kTransferMissing = 2;    // the host does not have the package
inline constexpr std::int64_t kTransferCancelled = 3;  // its install was cancelled
inline constexpr std::int64_t kTransferBroken = 4;     // reading or writing failed on the way
inline constexpr std::int64_t kTransferStopped = 5;    // the daemon was interrupted

// Two sides: the client reorders and drops transfers from any thread, the daemon takes them one by one on its own.
class EmbeddedDeviceService : public DovelDeviceService {
 public:
  // Completions run on `executor`, which must outlive the service.
  explicit EmbeddedDeviceService(Executor& executor) : _executor(executor) {}

  // --- the client's side --------------------------------------------------------------------------------------------

  bool offers(Operation) override { return true; }
  // Ahead of everything that waits; a transfer in flight goes on, and counts as ahead already.
  void prioritizeAsset(const DovelAssetRef& asset, Completion completion) override;
  // A waiting transfer and the one in flight become dropped ones.
  void cancelAssetTransferForFailedAsset(const DovelAssetRef& asset) override;

  // --- the daemon's side --------------------------------------------------------------------------------------------

  struct Turn {
    std::string identifier;
    bool dropped = false;  // not to be begun: to be reported as one that failed
  };

  // A new queue, in this order, in place of what is left of an earlier one.
  void setQueue(const std::vector<std::string>& identifiers);

  // The transfer whose turn it is, which is in flight from then on until the next call; dropped ones first. None when
  // nothing waits any more.
  std::optional<Turn> takeNext();

  // Whether this transfer, which is in flight or set aside, has been dropped.
  bool isDropped(const std::string& identifier);

  // Blocks until the transfer has been dropped or prioritised, or the deadline has passed; whether it has.
  bool waitUntilDropped(const std::string& identifier, Waiting& waiting, Waiting::Time deadline);
  bool waitUntilPrioritized(const std::string& identifier, Waiting& waiting, Waiting::Time deadline);

 private:
  Executor& _executor;
  Mutex _mutex;
  std::condition_variable _changed;
  std::deque<std::string> _waiting APPSYNC_GUARDED_BY(_mutex);
  std::set<std::string> _begun APPSYNC_GUARDED_BY(_mutex);  // in flight, set aside or ended
  std::optional<std::string> _inFlight APPSYNC_GUARDED_BY(_mutex);
  std::set<std::string> _dropped APPSYNC_GUARDED_BY(_mutex);
  std::set<std::string> _prioritized APPSYNC_GUARDED_BY(_mutex);
};

}  // namespace appsync
