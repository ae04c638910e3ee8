#include "embedded/executor.h"

#include <condition_variable>
#include <deque>
#include <map>
#include <optional>
#include <random>
#include <set>
#include <thread>
#include <utility>
#include <vector>

#include "platform/thread_annotations.h"

namespace appsync {

namespace {

// Threads over strands. A strand stands in `_ready` exactly when it has jobs and none of them runs.
class StrandExecutor : public Executor {
 public:
  StrandExecutor(unsigned threads, std::optional<std::uint64_t> seed) {
    if (seed) _choice.emplace(*seed);
    try {
      for (unsigned i = 0; i < threads; ++i) _threads.emplace_back([this] { work(); });
    } catch (...) {
      end();
      throw;
    }
  }

  ~StrandExecutor() override {
    drain();
    end();
  }

  void post(const std::string& strand, Job job) override {
    const MutexLock lock(_mutex);
    std::deque<Job>& jobs = _strands[strand];
    jobs.push_back(std::move(job));
    ++_unfinished;
    if (jobs.size() > 1 || _running.contains(strand)) return;
    _ready.push_back(strand);
    _changed.notify_one();
  }

  void drain() override {
    MutexLock lock(_mutex);
    while (_unfinished > 0) _idle.wait(lock.native());
  }

  bool isIdle() override {
    const MutexLock lock(_mutex);
    return _unfinished == 0;
  }

 private:
  void end() {
    {
      const MutexLock lock(_mutex);
      _ending = true;
      _changed.notify_all();
    }
    for (std::thread& thread : _threads) thread.join();
  }

  void work() {
    std::string strand;
    while (std::optional<Job> job = take(strand)) {
      (*job)();
      job.reset();  // what it holds goes before it counts as finished
      finish(strand);
    }
  }

  // The next job and its strand, waiting for one; none at the end.
  std::optional<Job> take(std::string& strand) {
    MutexLock lock(_mutex);
    while (_ready.empty() && !_ending) _changed.wait(lock.native());
    if (_ready.empty()) return std::nullopt;
    const std::size_t at = _choice ? (*_choice)() % _ready.size() : 0;
    strand = _ready[at];
    _ready.erase(_ready.begin() + static_cast<std::ptrdiff_t>(at));
    std::deque<Job>& jobs = _strands[strand];
    Job job = std::move(jobs.front());
    jobs.pop_front();
    _running.insert(strand);
    return job;
  }

  void finish(const std::string& strand) {
    const MutexLock lock(_mutex);
    _running.erase(strand);
    if (_strands[strand].empty()) {
      _strands.erase(strand);
    } else {
      _ready.push_back(strand);
      _changed.notify_one();
    }
    if (--_unfinished == 0) _idle.notify_all();
  }

  Mutex _mutex;
  std::condition_variable _changed;
  std::condition_variable _idle;
  std::map<std::string, std::deque<Job>> _strands APPSYNC_GUARDED_BY(_mutex);
  std::set<std::string> _running APPSYNC_GUARDED_BY(_mutex);
  std::deque<std::string> _ready APPSYNC_GUARDED_BY(_mutex);
  std::size_t _unfinished APPSYNC_GUARDED_BY(_mutex) = 0;
  bool _ending APPSYNC_GUARDED_BY(_mutex) = false;
  std::optional<std::mt19937_64> _choice APPSYNC_GUARDED_BY(_mutex);

  std::vector<std::thread> _threads;
};

}  // namespace

std::unique_ptr<Executor> makeThreadExecutor(unsigned threads) {
  return std::make_unique<StrandExecutor>(threads == 0 ? 1 : threads, std::nullopt);
}

std::unique_ptr<Executor> makeSeededExecutor(std::uint64_t seed) {
  return std::make_unique<StrandExecutor>(1, seed);
}

}  // namespace appsync
