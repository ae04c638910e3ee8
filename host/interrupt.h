// Ctrl-C and termination: the first ends the run in order, the second at once.
#pragma once

#include <atomic>
#include <functional>
#include <thread>

#include "platform/thread_annotations.h"

namespace appsync {

// While one of these lives, signals 2 and 15 come to a thread of its own. To be made before any other thread is.
class Interrupt {
 public:
  Interrupt();
  ~Interrupt();
  Interrupt(const Interrupt&) = delete;
  Interrupt& operator=(const Interrupt&) = delete;

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
  int _signals = -1;  // file descriptors
  int _stop = -1;
  std::thread _thread;
};

}  // namespace appsync
