// What every wrapper passes its calls through: faults, the script's hooks and the recorder.
#pragma once

#include <cerrno>
#include <cstddef>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <type_traits>
#include <utility>
#include <vector>

#include "instrument/answers.h"
#include "instrument/faults.h"
#include "instrument/operations.h"
#include "instrument/recorder.h"
#include "instrument/shown.h"
#include "platform/thread_annotations.h"

namespace appsync {

// What an operation answers when it is made to fail.
template <class Result>
Result failedResult() {
  if constexpr (std::is_same_v<Result, int> || std::is_same_v<Result, std::uint32_t>) {
    return EIO;  // a status or error number: anything but 0
  } else {
    return Result{};
  }
}

// Any thread. Holds no lock while it calls anything.
class Probe {
 public:
  Probe(bool recording, std::string reachedTextsFile) : recorder(recording, std::move(reachedTextsFile)) {}

  // One call: fails it, or has `forward` make it; and records it with `shown` as its arguments. `forward` takes the
  // place for the error and makes the call on the bare service, or answers for it.
  template <class Forward, class... Shown>
  std::invoke_result_t<Forward, ErrorOut> call(Operation operation, const Subject& subject, ErrorOut error,
                                               const Forward& forward, const Shown&... shown) {
    using Result = std::invoke_result_t<Forward, ErrorOut>;
    const std::shared_ptr<const ScriptedAnswers> around = script();
    before(*around, operation, subject);
    std::optional<Error> unasked;
    ErrorOut out = error != nullptr || !recorder.isRecording() ? error : &unasked;
    const std::optional<Faults::Hit> hit = strike(operation, subject);
    if (hit) setError(out, hit->error);
    Result result = hit ? failedResult<Result>() : forward(out);
    if (recorder.isRecording()) {
      recorder.add(operation.info().service,
                   line(operation, shown...) + " -> " + shownResult(operation, result) + shownError(result, out));
    }
    after(*around, operation, subject);
    return result;
  }

  // A call that cannot fail and answers nothing.
  template <class Forward, class... Shown>
  void tell(Operation operation, const Subject& subject, const Forward& forward, const Shown&... shown) {
    const std::shared_ptr<const ScriptedAnswers> around = script();
    before(*around, operation, subject);
    if (recorder.isRecording()) recorder.add(operation.info().service, line(operation, shown...));
    forward();
    after(*around, operation, subject);
  }

  // A call that cannot fail at once and answers later, through `completion`: `forward` passes the completion that it is
  // given on to the bare service. A fault's completion runs on the caller's thread.
  template <class Completion, class Forward, class... Shown>
  void start(Operation operation, const std::string& bundleID, const Completion& completion, const Forward& forward,
             const Shown&... shown) {
    const auto complete = [this, operation, bundleID, completion](const std::optional<Error>& error) {
      deliver(operation.info().service, operation.name(), bundleID, nullptr,
              bundleID + (error ? " failed: " + error->description() : " ok"), [completion, error] {
                if (completion) completion(error);
              });
    };
    tell(
        operation, Subject::application(bundleID),
        [&] {
          if (const auto hit = strike(operation, Subject::application(bundleID))) {
            complete(hit->error);
          } else {
            forward(complete);
          }
        },
        shown...);
  }

  // Has an event reach its observer by `action`, as the script wants it. `owner` says whose event it is (for `forget`).
  void deliver(InstrumentedService service, std::string_view event, const std::string& bundleID, const void* owner,
               const std::string& shown, std::function<void()> action);

  std::size_t releaseHeldEvents();
  void dropHeldEvents();
  // Drops the held events of an observer that has been removed.
  void forget(const void* owner);

  std::optional<Faults::Hit> strike(Operation operation, const Subject& subject) {
    return faults.strike(operation.name(), subject);
  }
  std::shared_ptr<const ScriptedAnswers> script() const;
  void setScript(ScriptedAnswers answers);

  Recorder recorder;
  Faults faults;

 private:
  struct HeldEvent {
    const void* owner;
    std::function<void()> action;
  };

  template <class... Shown>
  static std::string line(Operation operation, const Shown&... shown) {
    std::string text(operation.name());
    ((text += ' ', text += appsync::shown(shown)), ...);
    return text;
  }
  template <class Result>
  static std::string shownResult(Operation operation, const Result& result) {
    if constexpr (std::is_same_v<Result, bool>) {
      if (operation.info().canFail()) return result ? "ok" : "failed";
    }
    return shown(result);
  }
  // Only what a failure leaves is the call's own.
  template <class Result>
  static std::string shownError(const Result& result, ErrorOut error) {
    if constexpr (requires { static_cast<bool>(result); }) {
      if (!static_cast<bool>(result) && error != nullptr && *error) return ": " + (*error)->description();
    }
    return "";
  }

  static void before(const ScriptedAnswers& around, Operation operation, const Subject& subject) {
    if (around.beforeCall) around.beforeCall(std::string(operation.name()), subject.text());
  }
  static void after(const ScriptedAnswers& around, Operation operation, const Subject& subject) {
    if (around.afterCall) around.afterCall(std::string(operation.name()), subject.text());
  }

  mutable Mutex _mutex;
  std::shared_ptr<const ScriptedAnswers> _script APPSYNC_GUARDED_BY(_mutex) = std::make_shared<ScriptedAnswers>();
  std::vector<HeldEvent> _held APPSYNC_GUARDED_BY(_mutex);
};

// The script's answer, or else what `otherwise` answers.
template <class Value, class... Parameters, class Otherwise, class... Arguments>
Value scripted(const std::function<std::optional<Value>(Parameters...)>& answer, const Otherwise& otherwise,
               const Arguments&... arguments) {
  if (answer) {
    if (std::optional<Value> given = answer(arguments...)) return std::move(*given);
  }
  return otherwise();
}

}  // namespace appsync
