#include "host/restore_progress.h"

#include <algorithm>
#include <array>
#include <charconv>
#include <system_error>

#include "host/failure.h"
#include "host/sync_log.h"
#include "host/text.h"

namespace appsync {

namespace {

constexpr std::int32_t kRestoreStep = 2;
constexpr std::size_t kIdentifierWidth = 28;
constexpr std::size_t kNamesShown = 3;

constexpr std::string_view kBegins = "processing tarvo restore info for '%{public}@' demotionStatus :%lu";
constexpr std::string_view kNoInfo = "no tarvo restore info for '%{public}@' - skipping";
constexpr std::string_view kNoMetadata = "no TarvoMetadata for '%{public}@' - ignoring";
constexpr std::string_view kPlaceholderMade = "Created placeholder %{public}@ for '%{public}@' of type %lu";
constexpr std::string_view kTheStores = "App asset DRI for %{public}@ is set to %lu - nothing more for dovel to do";
constexpr std::string_view kAnnounced =
    "DataMigrator will wait for Ostrel to install placeholder for %{public}@, _restoringPlaceholderCount %lld";
constexpr std::string_view kListUnreadable = "failed to read tarvo app restore info. err=%{public}@";
constexpr std::string_view kListUnparsable = "failed to parse tarvo app restore info. err=%{public}@";
constexpr std::string_view kDemotedUnparsable = "couldn't parse demoted apps list";
constexpr std::string_view kDemotedNoDictionary = "demoted apps list is not a dictionary";
constexpr std::string_view kNotMoved = "failed to copy tarvo metadata. err=%{public}@";
constexpr std::string_view kWaits = "Will wait for %lld seconds for %lld placeholders to install";
constexpr std::string_view kWaited = "Finished waiting for placeholder installs";

// A line one of whose arguments says why an application cannot be set up.
struct ReasonLine {
  std::string_view format;
  bool isLast;  // the last argument, otherwise the first
};

constexpr std::array kReasonLines{
    ReasonLine{"Created app directory for '%{public}@' at %{public}@ with err=%{public}@", true},
    ReasonLine{"Error %{public}@ adding icon promise to placeholder for '%{public}@'", false},
    ReasonLine{"Error %{public}@ setting placeholder attributes for '%{public}@'", false},
    ReasonLine{"Error %{public}@ setting store metadata for '%{public}@'", false},
    ReasonLine{"Error %{public}@ setting placeholder configuration as complete for '%{public}@'", false},
    ReasonLine{"processing app restore for %{public}@ finished with status %d error %{public}@", true},
    ReasonLine{"processing app restore for demoted app %{public}@ finished with status %d error %{public}@", true},
};

std::string lastArgument(std::string_view format, std::string_view message) {
  const auto arguments = argumentsOfLine(format, message);
  return arguments && !arguments->empty() ? arguments->back() : std::string(message);
}

// The reason that a line of this application tells. The identifier is what it is, whatever it looks like.
std::string reasonIn(std::string_view message, const ReasonLine& line, const std::string& identifier) {
  constexpr std::string_view kObject = "%{public}@";
  const std::size_t object = line.format.find(kObject);
  const std::string head(line.format.substr(0, object));
  std::string tail(line.format.substr(object + kObject.size()));
  if (line.isLast) return lastArgument(tail, message.substr(std::min(message.size(), head.size() + identifier.size())));
  tail.replace(tail.find(kObject), kObject.size(), identifier);
  if (message.size() < head.size() + tail.size()) return std::string(message);
  return std::string(message.substr(head.size(), message.size() - head.size() - tail.size()));
}

// The number at the end of a line.
std::uint64_t lastNumber(std::string_view message) {
  std::uint64_t number = 0;
  const std::size_t digits = message.find_last_not_of("0123456789") + 1;
  std::from_chars(message.data() + digits, message.data() + message.size(), number);
  return number;
}

std::string_view wordFor(RestoreProgress::State state) {
  switch (state) {
    case RestoreProgress::State::Skipped:
      return "skipped";
    case RestoreProgress::State::Failed:
      return "failed";
    case RestoreProgress::State::Placed:
      return "placed";
    case RestoreProgress::State::Present:
      return "present";
    case RestoreProgress::State::Begun:
    case RestoreProgress::State::SetUp:
      break;
  }
  return "";
}

}  // namespace

void RestoreProgress::end() {
  {
    const MutexLock lock(_mutex);
    _isWaiting = false;
    _changed.notify_all();
  }
  if (_drawer.joinable()) _drawer.join();
}

// --- what is heard --------------------------------------------------------------------------------------------------

void RestoreProgress::line(const LogLine& line) {
  const std::string_view message = withoutPrefix(line.message);
  const MutexLock lock(_mutex);
  if (line.format == kBegins) {
    begin(message);
  } else if (line.format == kListUnreadable || line.format == kListUnparsable) {
    _listProblem = lastArgument(line.format, message);
  } else if (line.format == kDemotedUnparsable || line.format == kDemotedNoDictionary) {
    _otherProblems.push_back("the list of demoted applications cannot be used, so none counts as demoted");
  } else if (line.format == kNotMoved) {
    _otherProblems.push_back("the list could not be moved away: " + lastArgument(line.format, message));
  } else if (line.format == kWaits) {
    beginWait(message);
  } else if (line.format == kWaited && _isWaiting) {
    _isWaiting = false;
    _waited = Clock::now() - _waitBegin;
    _changed.notify_all();
  }
  if (_applications.empty()) return;
  Application& current = _applications.back();
  if (line.format == kNoInfo) {
    change(current, State::Skipped, "its entry in the list is no dictionary");
  } else if (line.format == kNoMetadata) {
    change(current, State::Skipped, "its entry in the list has no TarvoMetadata");
  } else if (line.format == kPlaceholderMade) {
    current.installType = lastNumber(message);
  } else if (line.format == kTheStores) {
    current.isTheStores = true;
  } else if (line.format == kAnnounced) {
    change(current, State::SetUp, "");
  }
  for (const ReasonLine& reason : kReasonLines) {
    if (line.format != reason.format) continue;
    const std::string text = reasonIn(message, reason, current.identifier);
    if (text != "(null)") _reason = text;
  }
}

void RestoreProgress::begin(std::string_view message) {
  const std::size_t from = kBegins.find('%');
  const std::size_t to = message.rfind("' demotionStatus :");
  if (message.size() < from || to == std::string_view::npos) return;
  const std::string identifier(message.substr(from, to - from));
  _places[identifier] = _applications.size();
  _applications.push_back({identifier, State::Begun, "", false, std::nullopt});
  _reason.clear();
}

void RestoreProgress::transaction(const TransactionRecord& record) {
  if (record.scenario || record.step != kRestoreStep || record.phase != 2) return;
  const MutexLock lock(_mutex);
  if (_applications.empty()) return;
  Application& current = _applications.back();
  if (!record.success) {
    change(current, State::Failed, _reason.empty() ? "its placeholder could not be made" : _reason);
  } else if (current.state == State::Begun) {
    change(current, State::Present, "");
  }
}

void RestoreProgress::hear(const CoordinatorEvent& event) {
  const MutexLock lock(_mutex);
  const auto place = _places.find(event.bundleID);
  if (place == _places.end()) return;
  Application& application = _applications[place->second];
  const bool isSetUp = application.state == State::SetUp;
  if (event.error && (isSetUp || application.state == State::Present)) {
    change(application, State::Failed, reasonText(*event.error));
  } else if (event.kind == CoordinatorEvent::Kind::PlaceholderInstalled && isSetUp) {
    change(application, State::Placed, "");
  }
}

void RestoreProgress::change(Application& application, State state, const std::string& why) {
  application.state = state;
  application.why = why;
  const std::string_view word = wordFor(state);
  if (word.empty()) return;
  std::string text = printable(application.identifier);
  if (displayWidth(text) < kIdentifierWidth) text = fitted(text, kIdentifierWidth);
  text += "  " + std::string(word);
  if (state == State::Placed && application.installType) text += "   " + installTypeText(*application.installType);
  if (state == State::Present) text += application.isTheStores ? "  left to the store" : "  set up already";
  if (!why.empty()) text += std::string(9 - word.size(), ' ') + why;
  print(text, state == State::Failed);
}

// --- the wait -------------------------------------------------------------------------------------------------------

void RestoreProgress::beginWait(std::string_view message) {
  const auto arguments = argumentsOfLine(kWaits, message);
  if (!arguments || arguments->size() != 2) return;
  if (lastNumber(arguments->at(1)) == 0) return;
  _waitBegin = Clock::now();
  _deadline = _waitBegin + std::chrono::seconds(lastNumber(arguments->at(0)));
  _isWaiting = true;
  if (_drawsInPlace) {
    try {
      _drawer = std::thread([this] { drawWait(); });
      return;
    } catch (const std::system_error&) {
      // Without a thread to draw it, the wait is said once.
    }
  }
  _console.line(waitText());
}

std::string RestoreProgress::waitText() const {
  std::size_t pending = 0;
  std::string names;
  for (const Application& application : _applications) {
    if (application.state != State::SetUp || ++pending > kNamesShown) continue;
    names += (names.empty() ? "" : ", ") + printable(application.identifier);
  }
  const auto left = std::chrono::ceil<std::chrono::seconds>(std::max(_deadline - Clock::now(), Clock::duration(0)));
  const std::string most = "at most " + std::to_string(left.count()) + " s";
  if (pending == 0) return "waiting " + most + ": the client has not heard of every placeholder";
  if (pending > kNamesShown) names += " and " + std::to_string(pending - kNamesShown) + " more";
  return "waiting for " + counted(pending, "placeholder", "placeholders") + ", " + most + ": " + names;
}

void RestoreProgress::drawWait() {
  MutexLock lock(_mutex);
  while (_isWaiting) {
    std::string text = waitText();
    const std::size_t room = _console.columns() - 4;  // the terminal shows "^C" behind it
    if (displayWidth(text) > room) text = fitted(text, room);
    _console.picture("\r\x1b[K" + text);
    _isDrawn = true;
    _changed.wait_for(lock.native(), std::chrono::seconds(1),
                      [this]() APPSYNC_NO_THREAD_ANALYSIS { return !_isWaiting || !_isDrawn; });
  }
  if (_isDrawn) _console.picture("\r\x1b[K");
  _isDrawn = false;
}

// The line of the wait makes room and is drawn again below.
void RestoreProgress::print(const std::string& text, bool isFailure) {
  if (_isDrawn) {
    _console.picture("\r\x1b[K");
    _isDrawn = false;
    _changed.notify_all();
  }
  if (isFailure) {
    _console.failureLine(text);
  } else {
    _console.line(text);
  }
}

// --- the result -----------------------------------------------------------------------------------------------------

std::vector<RestoreProgress::Application> RestoreProgress::applications() const {
  const MutexLock lock(_mutex);
  return _applications;
}

std::optional<std::string> RestoreProgress::listProblem() const {
  const MutexLock lock(_mutex);
  return _listProblem;
}

std::vector<std::string> RestoreProgress::otherProblems() const {
  const MutexLock lock(_mutex);
  return _otherProblems;
}

std::chrono::duration<double> RestoreProgress::waited() const {
  const MutexLock lock(_mutex);
  return _waited;
}

}  // namespace appsync
