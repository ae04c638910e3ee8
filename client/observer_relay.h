// Where the services' callbacks meet the client: registered in its place, outliving it, closed before it goes.
#pragma once

#include <condition_variable>
#include <memory>
#include <thread>
#include <vector>

#include "platform/notifications.h"
#include "platform/ostrel_objects.h"
#include "platform/pellum.h"
#include "platform/thread_annotations.h"

namespace appsync {

class AppsClient;

// Passes callbacks on to the client while it is open, and drops them otherwise. Any thread.
class ObserverRelay final : public OstrelAppInstallObserverDelegate, public PellumApplicationWorkspaceObserverProtocol {
 public:
  // Closed; `client` is used only between `open` and the return of `close`.
  explicit ObserverRelay(AppsClient& client) : _client(client) {}

  // Construction of the client is done.
  void open();
  // Refuses new callbacks and returns when none runs any more, except those that this is called from.
  void close();

  void coordinatorShouldPrioritize(const OstrelAppInstallCoordinator& coordinator) override;
  void coordinatorDidInstallPlaceholder(const OstrelAppInstallCoordinator& coordinator) override;
  void coordinatorDidCompleteSuccessfully(const OstrelAppInstallCoordinator& coordinator) override;
  void coordinatorCanceledWithReason(const OstrelAppInstallCoordinator& coordinator, const Error& reason,
                                     OstrelClientID client) override;
  void promiseDidBeginFulfillmentWithIdentifier(std::uint64_t identifier) override;
  void applicationInstallsDidCancel(const PellumApplicationProxies& applications) override;

  // The daemon's start-up is complete.
  void startupCompleted();

 private:
  // Runs `callback` with the client, unless the relay is closed.
  template <class Callback>
  void pass(const Callback& callback);
  bool enter();
  void leave();
  bool onlyThisThreadIsInside() const APPSYNC_REQUIRES(_mutex);

  AppsClient& _client;
  Mutex _mutex;
  std::condition_variable _left;
  bool _isOpen APPSYNC_GUARDED_BY(_mutex) = false;
  std::vector<std::thread::id> _inside APPSYNC_GUARDED_BY(_mutex);  // the threads of running callbacks
};

}  // namespace appsync
