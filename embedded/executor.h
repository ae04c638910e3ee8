// Where the workers of the embedded device run.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

namespace appsync {

// Runs jobs later, never on the thread that posts them and never before `post` has returned. Any thread.
class Executor {
 public:
  using Job = std::function<void()>;

  virtual ~Executor() = default;

  // Jobs of one strand run one after the other, in the order of posting; jobs of different strands run at the same
  // time.
  virtual void post(const std::string& strand, Job job) = 0;

  // Blocks until no job is queued or running. Not to be called from a job.
  virtual void drain() = 0;

  // Whether no job is queued or running just now. A leaf: may be called under a lock.
  virtual bool isIdle() = 0;
};

// Threads of its own; the destructor drains. Throws `std::system_error` when the machine has no thread to give.
std::unique_ptr<Executor> makeThreadExecutor(unsigned threads);

// One thread of its own that takes, of all strands that have a job, the one that the seed says: the same seed and the
// same posts give the same order. The destructor drains.
std::unique_ptr<Executor> makeSeededExecutor(std::uint64_t seed);

}  // namespace appsync
