// How a restore goes, as the client's log and the coordination service tell it: kept for the result, and shown to a
// person with a line for each application and, during the wait, one that says what is waited for.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "embedded/coordination.h"
#include "embedded/log_sink.h"
#include "host/console.h"
#include "platform/thread_annotations.h"

namespace appsync {

// Any thread.
class RestoreProgress : public LogSink {
 public:
  enum class State : std::uint8_t {
    Begun,
    Skipped,  // the list does not say enough of it
    Failed,
    SetUp,    // a placeholder has been handed over and is not installed yet
    Placed,   // the placeholder is installed
    Present,  // everything was set up already
  };
  struct Application {
    std::string identifier;
    State state = State::Begun;
    std::string why;                           // Skipped, Failed
    bool isTheStores = false;                  // Present: the store answers for it
    std::optional<std::uint64_t> installType;  // of the placeholder, once it is made
  };

  // `drawsInPlace`: the line of the wait is drawn anew each second. The console must outlive this.
  RestoreProgress(Console& console, bool drawsInPlace) : _console(console), _drawsInPlace(drawsInPlace) {}
  ~RestoreProgress() override { end(); }
  RestoreProgress(const RestoreProgress&) = delete;
  RestoreProgress& operator=(const RestoreProgress&) = delete;

  void line(const LogLine& line) override;
  void transaction(const TransactionRecord& record) override;
  void hear(const CoordinatorEvent& event);

  // The line of the wait is gone when this returns, and what is written to the console from then on comes below.
  void end();

  // What has come of it so far, in the order of the list.
  std::vector<Application> applications() const;
  // Why the list could not be used; none when it could, or was not there.
  std::optional<std::string> listProblem() const;
  // The same of the list of demoted applications, and of moving the list away.
  std::vector<std::string> otherProblems() const;
  std::chrono::duration<double> waited() const;

 private:
  using Clock = std::chrono::steady_clock;

  void begin(std::string_view message) APPSYNC_REQUIRES(_mutex);
  void change(Application& application, State state, const std::string& why) APPSYNC_REQUIRES(_mutex);
  void beginWait(std::string_view message) APPSYNC_REQUIRES(_mutex);
  void drawWait();
  std::string waitText() const APPSYNC_REQUIRES(_mutex);
  void print(const std::string& text, bool isFailure) APPSYNC_REQUIRES(_mutex);

  Console& _console;
  const bool _drawsInPlace;
  mutable Mutex _mutex;
  std::condition_variable _changed;
  std::vector<Application> _applications APPSYNC_GUARDED_BY(_mutex);
  std::map<std::string, std::size_t> _places APPSYNC_GUARDED_BY(_mutex);
  std::string _reason APPSYNC_GUARDED_BY(_mutex);  // the last error told of the application that is being set up
  std::optional<std::string> _listProblem APPSYNC_GUARDED_BY(_mutex);
  std::vector<std::string> _otherProblems APPSYNC_GUARDED_BY(_mutex);
  bool _isWaiting APPSYNC_GUARDED_BY(_mutex) = false;
  bool _isDrawn APPSYNC_GUARDED_BY(_mutex) = false;  // the line of the wait stands there
  Clock::time_point _waitBegin APPSYNC_GUARDED_BY(_mutex);
  Clock::time_point _deadline APPSYNC_GUARDED_BY(_mutex);
  Clock::duration _waited APPSYNC_GUARDED_BY(_mutex){0};
  std::thread _drawer;
};

}  // namespace appsync
