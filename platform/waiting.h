// Waiting as a service: it owns the clock and every bounded wait, so that a host can end waits early and a test can let
// time run fast.
#pragma once

#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>

namespace appsync {

// A leaf service: any thread, never calls back but for `ready`, may be called under a lock.
class Waiting {
 public:
  using Clock = std::chrono::steady_clock;
  using Time = Clock::time_point;

  virtual ~Waiting() = default;

  // The time that deadlines are counted in. Never goes backwards.
  virtual Time now() = 0;

  // Blocks until `ready()` is true or the deadline has passed, and answers what `ready()` says at the end. `lock` is
  // held on entry, while `ready` runs and on return, and free in between; whoever makes `ready` true notifies
  // `condition`. After an interrupt of the host every wait, also one that begins later, returns as if its deadline had
  // come.
  virtual bool wait(std::unique_lock<std::mutex>& lock, std::condition_variable& condition, Time deadline,
                    const std::function<bool()>& ready) = 0;
};

}  // namespace appsync
