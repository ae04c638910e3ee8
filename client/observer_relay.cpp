#include "client/observer_relay.h"

#include <algorithm>

#include "client/apps_client.h"

namespace appsync {

void ObserverRelay::open() {
  const MutexLock lock(_mutex);
  _isOpen = true;
}

void ObserverRelay::close() {
  MutexLock lock(_mutex);
  _isOpen = false;
  while (!onlyThisThreadIsInside()) _left.wait(lock.native());
}

bool ObserverRelay::onlyThisThreadIsInside() const {
  return std::ranges::all_of(_inside, [](std::thread::id id) { return id == std::this_thread::get_id(); });
}

bool ObserverRelay::enter() {
  const MutexLock lock(_mutex);
  if (_isOpen) _inside.push_back(std::this_thread::get_id());
  return _isOpen;
}

void ObserverRelay::leave() {
  const MutexLock lock(_mutex);
  _inside.erase(std::ranges::find(_inside, std::this_thread::get_id()));
  _left.notify_all();
}

// A callback has nobody to report an exception to: it ends here, and the event counts as lost.
template <class Callback>
void ObserverRelay::pass(const Callback& callback) {
  try {
    if (!enter()) return;
    try {
      callback(_client);
    } catch (...) {
    }
    leave();
  } catch (...) {
  }
}

void ObserverRelay::coordinatorShouldPrioritize(const OstrelAppInstallCoordinator& coordinator) {
  pass([&](AppsClient& client) { client.coordinatorShouldPrioritize(coordinator); });
}

void ObserverRelay::coordinatorDidInstallPlaceholder(const OstrelAppInstallCoordinator& coordinator) {
  pass([&](AppsClient& client) { client.coordinatorDidInstallPlaceholder(coordinator); });
}

void ObserverRelay::coordinatorDidCompleteSuccessfully(const OstrelAppInstallCoordinator& coordinator) {
  pass([&](AppsClient& client) { client.coordinatorDidCompleteSuccessfully(coordinator); });
}

void ObserverRelay::coordinatorCanceledWithReason(const OstrelAppInstallCoordinator& coordinator, const Error& reason,
                                                  OstrelClientID canceller) {
  pass([&](AppsClient& client) { client.coordinatorCanceledWithReason(coordinator, reason, canceller); });
}

void ObserverRelay::promiseDidBeginFulfillmentWithIdentifier(std::uint64_t identifier) {
  pass([&](AppsClient& client) { client.promiseDidBeginFulfillmentWithIdentifier(identifier); });
}

void ObserverRelay::applicationInstallsDidCancel(const PellumApplicationProxies& applications) {
  pass([&](AppsClient& client) { client.applicationInstallsDidCancel(applications); });
}

void ObserverRelay::startupCompleted() {
  pass([](AppsClient& client) { client.setupInstallCoordinatorObserver(); });
}

}  // namespace appsync
