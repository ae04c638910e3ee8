#include "platform/queues.h"

#include <cstdio>
#include <cstdlib>
#include <utility>

namespace appsync {

namespace {

[[noreturn]] void stopProgram(const char* what, const std::string& label) {
  std::fprintf(stderr, "appsync: %s: %s\n", what, label.c_str());
  std::abort();
}

}  // namespace

SerialQueue::SerialQueue(std::string label) : _label(std::move(label)) {}

// The analysis cannot see through the members: the queue itself is the capability.
void SerialQueue::enter() APPSYNC_NO_THREAD_ANALYSIS {
  if (_owner.load(std::memory_order_relaxed) == std::this_thread::get_id()) {
    stopProgram("a job waits for the serial queue that it runs on", _label);
  }
  _mutex.lock();
  _owner.store(std::this_thread::get_id(), std::memory_order_relaxed);
}

void SerialQueue::leave() APPSYNC_NO_THREAD_ANALYSIS {
  _owner.store(std::thread::id{}, std::memory_order_relaxed);
  _mutex.unlock();
}

void WaitGroup::enter() {
  const MutexLock lock(_mutex);
  ++_count;
}

void WaitGroup::leave() {
  const MutexLock lock(_mutex);
  if (_count == 0) stopProgram("a wait group is left more often than entered", "WaitGroup");
  if (--_count == 0) _condition.notify_all();
}

bool WaitGroup::wait(Waiting& waiting, Waiting::Time deadline) {
  MutexLock lock(_mutex);
  return waiting.wait(lock.native(), _condition, deadline, [this]() APPSYNC_NO_THREAD_ANALYSIS { return _count == 0; });
}

void Semaphore::signal() {
  const MutexLock lock(_mutex);
  ++_signals;
  _condition.notify_one();
}

bool Semaphore::wait(Waiting& waiting, Waiting::Time deadline) {
  MutexLock lock(_mutex);
  const bool signalled =
      waiting.wait(lock.native(), _condition, deadline, [this]() APPSYNC_NO_THREAD_ANALYSIS { return _signals > 0; });
  if (signalled) --_signals;
  return signalled;
}

}  // namespace appsync
