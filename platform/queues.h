// The client's means of ordering work: serial queues whose jobs run on the caller's thread, a group of things awaited,
// and a semaphore. None of them owns a thread.
#pragma once

#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <string>
#include <thread>

#include "platform/thread_annotations.h"
#include "platform/waiting.h"

namespace appsync {

// A serial queue that only ever runs jobs synchronously on the caller's thread: a lock with a label. A job that enters
// its own queue again could only hang; the program is stopped instead, with a message that names the queue.
class APPSYNC_CAPABILITY("serial queue") SerialQueue {
 public:
  explicit SerialQueue(std::string label);
  const std::string& label() const { return _label; }

  void enter() APPSYNC_ACQUIRE();
  void leave() APPSYNC_RELEASE();

 private:
  const std::string _label;
  std::mutex _mutex;
  std::atomic<std::thread::id> _owner{};
};

// One synchronous job on a queue: the scope in which this stands.
class APPSYNC_SCOPED_CAPABILITY OnQueue {
 public:
  explicit OnQueue(SerialQueue& queue) APPSYNC_ACQUIRE(queue) : _queue(queue) { _queue.enter(); }
  ~OnQueue() APPSYNC_RELEASE() { _queue.leave(); }
  OnQueue(const OnQueue&) = delete;
  OnQueue& operator=(const OnQueue&) = delete;

 private:
  SerialQueue& _queue;
};

// Counts what is awaited. Any thread; `leave` without an `enter` before it is a programming error and stops the
// program.
class WaitGroup {
 public:
  void enter();
  void leave();

  // Blocks until everything entered has left, or the deadline has passed; true in the first case.
  bool wait(Waiting& waiting, Waiting::Time deadline);

 private:
  Mutex _mutex;
  std::condition_variable _condition;
  std::int64_t _count APPSYNC_GUARDED_BY(_mutex) = 0;
};

// A counting semaphore that starts at 0. Any thread.
class Semaphore {
 public:
  void signal();

  // Takes one signal, blocking until there is one or the deadline has passed; true when it took one.
  bool wait(Waiting& waiting, Waiting::Time deadline);

 private:
  Mutex _mutex;
  std::condition_variable _condition;
  std::int64_t _signals APPSYNC_GUARDED_BY(_mutex) = 0;
};

}  // namespace appsync
