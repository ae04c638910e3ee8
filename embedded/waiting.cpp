#include "embedded/waiting.h"

#include <algorithm>

namespace appsync {

struct EmbeddedWaiting::Waiter {
  std::mutex& lock;
  std::condition_variable& condition;
  int users = 0;  // interrupts that are about to wake it
};

Waiting::Time EmbeddedWaiting::now() {
  return Clock::now() + Clock::duration(_ahead.load());
}

bool EmbeddedWaiting::wait(std::unique_lock<std::mutex>& lock, std::condition_variable& condition, Time deadline,
                           const std::function<bool()>& ready) {
  if (_fast != nullptr) return waitFast(lock, condition, deadline, ready);
  Waiter waiter{*lock.mutex(), condition};
  while (!ready() && !_interrupted && now() < deadline) {
    enter(waiter);
    if (!_interrupted) condition.wait_until(lock, deadline);
    leave(waiter, lock);
  }
  return ready();
}

// There is nothing that tells of the executor's last job, so this looks again and again; a job takes longer than that.
bool EmbeddedWaiting::waitFast(std::unique_lock<std::mutex>& lock, std::condition_variable& condition, Time deadline,
                               const std::function<bool()>& ready) {
  constexpr auto kBetweenLooks = std::chrono::microseconds(200);
  while (!_interrupted && now() < deadline) {
    // Asked in this order: a job that made the condition ready has done so before the executor was idle.
    const bool nothingToCome = _fast->isIdle();
    if (ready()) return true;
    if (nothingToCome) {
      _ahead.fetch_add(std::max(deadline - now(), Clock::duration::zero()).count());
    } else {
      condition.wait_for(lock, kBetweenLooks);
    }
  }
  return ready();
}

void EmbeddedWaiting::interrupt() {
  std::vector<Waiter*> waiters;
  {
    const MutexLock lock(_mutex);
    _interrupted = true;
    waiters = _waiters;
    for (Waiter* waiter : waiters) ++waiter->users;
  }
  for (Waiter* waiter : waiters) {
    // A waiter that looked at the flag before it was set holds its lock until it sleeps: then it can be woken.
    { const std::lock_guard<std::mutex> passing(waiter->lock); }
    waiter->condition.notify_all();
  }
  const MutexLock lock(_mutex);
  for (Waiter* waiter : waiters) --waiter->users;
  _released.notify_all();
}

void EmbeddedWaiting::enter(Waiter& waiter) {
  const MutexLock lock(_mutex);
  _waiters.push_back(&waiter);
}

// Gives the caller's lock away meanwhile: an interrupt that is about to wake this waiter needs it.
void EmbeddedWaiting::leave(Waiter& waiter, std::unique_lock<std::mutex>& lock) {
  lock.unlock();
  {
    MutexLock own(_mutex);
    while (waiter.users > 0) _released.wait(own.native());
    _waiters.erase(std::find(_waiters.begin(), _waiters.end(), &waiter));
  }
  lock.lock();
}

}  // namespace appsync
