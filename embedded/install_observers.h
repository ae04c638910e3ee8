// The registry's observers, and when each hears what.
#pragma once

#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "embedded/executor.h"
#include "platform/pellum.h"
#include "platform/thread_annotations.h"

namespace appsync {

// An observer's callbacks run one at a time, on a strand of its own. Any thread; may be called under a lock of the
// registry that `installs` does not take. The executor has been drained when it is destroyed.
class InstallObservers {
 public:
  struct Installs {
    PellumApplicationProxies prioritized;
    PellumApplicationProxies paused;
  };

  // `installs` is asked on the executor's threads, for what is under way at that moment.
  InstallObservers(Executor& executor, std::function<Installs()> installs);

  // With a first report, which begins when this has returned. An observer that is there already is left alone.
  void add(const PellumApplicationWorkspace::Observer& observer);

  // Returns when no callback of the observer runs, except one that it is called from.
  void remove(const PellumApplicationWorkspace::Observer& observer);

  // Reports to all what is under way. Calls that come before an observer's report has begun make one report.
  void installsChanged();

  void didCancel(const PellumApplicationProxy& application);

 private:
  struct Registration;
  using Callback = std::function<void(PellumApplicationWorkspaceObserverProtocol&)>;

  void postReport(const std::shared_ptr<Registration>& registration) APPSYNC_REQUIRES(_mutex);
  void deliver(Registration& registration, const Callback& callback);

  Executor& _executor;
  const std::function<Installs()> _installs;

  Mutex _mutex;
  std::vector<std::shared_ptr<Registration>> _registrations APPSYNC_GUARDED_BY(_mutex);
  std::uint64_t _added APPSYNC_GUARDED_BY(_mutex) = 0;
  std::condition_variable _callbackEnded;
};

}  // namespace appsync
