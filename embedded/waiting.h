// Bounded waits of the embedded device: real time that a host can cut short, or time that runs fast.
#pragma once

#include <atomic>
#include <condition_variable>
#include <vector>

#include "embedded/executor.h"
#include "platform/thread_annotations.h"
#include "platform/waiting.h"

namespace appsync {

class EmbeddedWaiting : public Waiting {
 public:
  EmbeddedWaiting() = default;

  Time now() override;
  bool wait(std::unique_lock<std::mutex>& lock, std::condition_variable& condition, Time deadline,
            const std::function<bool()>& ready) override;

  // Every wait, those that begin later too, returns as if its deadline had come. Any thread, but not from a signal
  // handler, and not under a lock that somebody waits with.
  void interrupt();
  bool isInterrupted() const { return _interrupted; }

  // From now on a wait whose condition is not ready jumps the clock to its deadline as soon as `executor` has no job
  // that could make it ready. Before the first wait; the executor must outlive this.
  void runFast(Executor& executor) { _fast = &executor; }

 private:
  struct Waiter;

  bool waitFast(std::unique_lock<std::mutex>& lock, std::condition_variable& condition, Time deadline,
                const std::function<bool()>& ready);
  void enter(Waiter& waiter);
  void leave(Waiter& waiter, std::unique_lock<std::mutex>& lock);

  std::atomic<bool> _interrupted{false};
  std::atomic<Clock::duration::rep> _ahead{0};  // how far the fast clock has jumped
  Executor* _fast = nullptr;

  Mutex _mutex;
  std::condition_variable _released;
  std::vector<Waiter*> _waiters APPSYNC_GUARDED_BY(_mutex);
};

}  // namespace appsync
