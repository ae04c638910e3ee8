// Ctrl-C and termination: the first ends the run in order, the second at once.
#pragma once

#include <atomic>
#include <functional>
#include <thread>

#include "embedded/disk.h"
#include "host/failure.h"
#include "platform/thread_annotations.h"

namespace appsync {

// From its start to its end, signals 2 and 15 come to a thread of its own.
class Interrupt {
 public:
  Interrupt() = default;
  ~Interrupt();
  Interrupt(const Interrupt&) = delete;
  Interrupt& operator=(const Interrupt&) = delete;

  // Once, before any other thread is made. False, with the failure said, when signals cannot be watched.
  bool start(Failure& failure);

  // 0, or the signal that has come.
  int signal() const { return _signal; }
  // What the program's exit status is then.
  int exitStatus() const { return 128 + _signal; }

  // Called on that thread when the first signal comes; at once when it has come already. Empty: nobody is told.
  void setHandler(std::function<void()> handler);

 private:
  void listen();

  std::atomic<int> _signal{0};
  Mutex _mutex;
  std::function<void()> _handler APPSYNC_GUARDED_BY(_mutex);
  OwnedFile _signals;
  OwnedFile _stop;
  std::thread _thread;
};

}  // namespace appsync
