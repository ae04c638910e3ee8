// A mutex that Clang's thread-safety analysis understands. Guarded members say so (`APPSYNC_GUARDED_BY(_mutex)`), and a
// Clang build fails where one is touched without its lock.
#pragma once

#include <mutex>

#if defined(__clang__)
#define APPSYNC_THREAD_ATTRIBUTE(x) __attribute__((x))
#else
#define APPSYNC_THREAD_ATTRIBUTE(x)
#endif

#define APPSYNC_CAPABILITY(name) APPSYNC_THREAD_ATTRIBUTE(capability(name))
#define APPSYNC_SCOPED_CAPABILITY APPSYNC_THREAD_ATTRIBUTE(scoped_lockable)
#define APPSYNC_GUARDED_BY(lock) APPSYNC_THREAD_ATTRIBUTE(guarded_by(lock))
#define APPSYNC_REQUIRES(...) APPSYNC_THREAD_ATTRIBUTE(requires_capability(__VA_ARGS__))
#define APPSYNC_EXCLUDES(...) APPSYNC_THREAD_ATTRIBUTE(locks_excluded(__VA_ARGS__))
#define APPSYNC_ACQUIRE(...) APPSYNC_THREAD_ATTRIBUTE(acquire_capability(__VA_ARGS__))
#define APPSYNC_RELEASE(...) APPSYNC_THREAD_ATTRIBUTE(release_capability(__VA_ARGS__))
#define APPSYNC_NO_THREAD_ANALYSIS APPSYNC_THREAD_ATTRIBUTE(no_thread_safety_analysis)

namespace appsync {

class APPSYNC_CAPABILITY("mutex") Mutex {
 public:
  void lock() APPSYNC_ACQUIRE() { _mutex.lock(); }
  void unlock() APPSYNC_RELEASE() { _mutex.unlock(); }

 private:
  friend class MutexLock;
  std::mutex _mutex;
};

// Holds a `Mutex` for a scope. `native()` is for waiting on a condition variable, which hands the mutex back locked.
class APPSYNC_SCOPED_CAPABILITY MutexLock {
 public:
  explicit MutexLock(Mutex& mutex) APPSYNC_ACQUIRE(mutex) : _lock(mutex._mutex) {}
  ~MutexLock() APPSYNC_RELEASE() = default;
  MutexLock(const MutexLock&) = delete;
  MutexLock& operator=(const MutexLock&) = delete;

  std::unique_lock<std::mutex>& native() { return _lock; }

 private:
  std::unique_lock<std::mutex> _lock;
};

}  // namespace appsync
