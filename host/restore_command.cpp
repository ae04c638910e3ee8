// `dovel restore`: the applications of a backup come back as placeholders.
#include <algorithm>
#include <array>
#include <cstdio>

#include "embedded/coordination.h"
#include "embedded/file_manager.h"
#include "embedded/registry.h"
#include "host/backup_directory.h"
#include "host/commands.h"
#include "host/install_watch.h"
#include "host/json.h"
#include "host/progress_display.h"
#include "host/restore_progress.h"
#include "host/session.h"
#include "host/text.h"

namespace appsync {

namespace {

using State = RestoreProgress::State;

// What the device has of an application at the end.
struct RestoredApplication {
  std::string identifier;
  std::optional<std::uint64_t> installType;  // of its placeholder; absent when there is none
  std::optional<std::string> error;
  bool hasFailed = false;
  bool isForgotten = false;  // its coordinator could not be written down
};

struct RestoreReport {
  int interruptedWith = 0;  // the exit status of an interrupted run; 0: it went to its end
  bool hasBegun = false;    // the client was called
  bool agreed = true;       // it did not answer NO
  std::optional<std::string> error;
  std::vector<RestoredApplication> applications;
  std::array<std::size_t, 6> counts{};  // by state
  std::chrono::duration<double> waited{0};

  int status() const {
    if (interruptedWith != 0) return interruptedWith;
    const bool isGood = agreed && !error &&
                        std::none_of(applications.begin(), applications.end(),
                                     [](const RestoredApplication& application) { return application.hasFailed; });
    return isGood ? kStatusDone : kStatusSomethingFailed;
  }
};

class RestoreRun {
 public:
  RestoreRun(const RestoreOptions& options, const BackupDirectory& backup, Session& session, RestoreProgress& progress,
             Console& console)
      : _options(options),
        _backup(backup),
        _session(session),
        _device(session.device()),
        _progress(progress),
        _console(console) {}

  ~RestoreRun() {
    Failure ignored;
    _session.close(ignored);  // nothing is told here any more
  }
  RestoreRun(const RestoreRun&) = delete;
  RestoreRun& operator=(const RestoreRun&) = delete;

  // False, with the failure said, when the restore could not begin.
  bool run(Failure& failure) {
    const CopySupervision supervision{[this](const std::string& line) { _console.problem(line); },
                                      [this] { return isInterrupted(); }};
    if (!_backup.push(_device.files(), supervision, failure)) return isInterrupted();
    if (!_session.makeClient(failure)) return false;
    _device.coordination().setEventListener([this](const CoordinatorEvent& event) {
      traceEvent(_session.trace(), event);
      _progress.hear(event);
    });
    _device.startWork();
    _session.announceStartup();
    if (isInterrupted()) return true;
    _report.hasBegun = true;
    std::optional<Error> error;
    _report.agreed = _session.client().reconcileRestoreOfType(_options.type, &error);
    if (error) _report.error = reasonText(*error);
    if (isInterrupted()) _device.coordination().stopWork();
    return true;
  }

  // What came of it. Asked before the session is closed.
  RestoreReport report() {
    _session.drainExecutor();  // a placeholder that came too late for the wait counts too
    _progress.end();
    if (const auto problem = _progress.listProblem()) {
      _report.error = "\"" + _backup.path() + "/" + kBackupRestoreList + "\" cannot be used: " + *problem;
    }
    for (const RestoreProgress::Application& application : _progress.applications()) {
      ++_report.counts.at(static_cast<std::size_t>(application.state));
      _report.applications.push_back(resultOf(application));
    }
    if (isInterrupted()) _report.interruptedWith = _session.interrupt().exitStatus();
    _report.waited = _progress.waited();
    return _report;
  }

 private:
  bool isInterrupted() { return _session.interrupt().signal() != 0; }

  RestoredApplication resultOf(const RestoreProgress::Application& application) {
    RestoredApplication result;
    result.identifier = application.identifier;
    const auto placeholder = _device.registry().applicationProxyForIdentifier(application.identifier, true);
    if (placeholder) result.installType = placeholder->installType;
    if (!application.why.empty()) result.error = application.why;
    const bool isMissing = application.state == State::Present && !placeholder;
    if (application.state == State::SetUp || isMissing) result.error = "its placeholder has not been installed";
    if (isMissing && application.isTheStores) result.error = "the store is responsible for it";
    if (application.state == State::Placed && !_device.coordination().isRecorded(application.identifier)) {
      result.isForgotten = true;
      result.error = "its coordinator could not be written down, so that later runs do not know it";
    }
    result.hasFailed = application.state == State::Failed || application.state == State::SetUp || result.isForgotten;
    return result;
  }

  const RestoreOptions& _options;
  const BackupDirectory& _backup;
  Session& _session;
  Device& _device;
  RestoreProgress& _progress;
  Console& _console;
  RestoreReport _report;
};

Json documentOf(const RestoreReport& report) {
  Json applications = Json::array();
  for (const RestoredApplication& application : report.applications) {
    applications.push_back({{"identifier", application.identifier},
                            {"placeholder", application.installType.has_value()},
                            {"installType", orNull(application.installType)},
                            {"error", orNull(application.error)}});
  }
  return {{"ok", report.status() == kStatusDone},
          {"error", orNull(report.error)},
          {"applications", applications},
          {"waited", report.waited.count()}};
}

void sayWhatIsForgotten(const RestoreReport& report, Console& console) {
  const auto isForgotten = [](const RestoredApplication& application) { return application.isForgotten; };
  const auto& all = report.applications;
  const auto count = static_cast<std::size_t>(std::count_if(all.begin(), all.end(), isForgotten));
  if (count == 0) return;
  const auto& first = *std::find_if(all.begin(), all.end(), isForgotten);
  console.problem("the coordinators of " + counted(count, "application", "applications") +
                  " could not be written down, so that later runs do not know them, the first of \"" +
                  printable(first.identifier) + "\"; see that the device's directory can be written");
}

void printSummary(const RestoreReport& report, std::int32_t type, Console& console) {
  if (!report.hasBegun) {
    console.line("Interrupted before the restore began.");
  } else if (report.applications.empty() && !report.error) {
    const bool isKnown = type == 2 || type == 3;
    console.line(isKnown ? "The backup lists no applications."
                         : "A restore of type " + std::to_string(type) + " brings none back; types 2 and 3 do.");
  }
  const auto count = [&](State state) { return std::to_string(report.counts.at(static_cast<std::size_t>(state))); };
  std::array<char, 32> seconds{};
  std::snprintf(seconds.data(), seconds.size(), "%.1f s", report.waited.count());
  if (!report.applications.empty()) console.line("");
  const std::string unfinished = count(State::SetUp);
  console.line(count(State::Placed) + " placed, " + count(State::Present) + " present, " + count(State::Skipped) +
               " skipped, " + count(State::Failed) + " failed" +
               (unfinished == "0" ? "" : ", " + unfinished + " unfinished") + "; waited " + seconds.data());
}

}  // namespace

int runRestore(const RestoreOptions& options, Console& console) {
  Failure failure;
  const std::optional<BackupDirectory> backup = BackupDirectory::open(options.backup, options.common.device, failure);
  if (!backup) return console.fail(failure);
  RestoreProgress progress(console, canDrawInPlace(options.common, console));
  const auto session =
      Session::open({.common = options.common, .mainBundleIdentifier = options.hostProcess, .listeners = {&progress}},
                    console, failure);
  if (!session) return console.fail(failure);

  RestoreRun run(options, *backup, *session, progress, console);
  if (!run.run(failure)) return console.fail(failure);
  const RestoreReport report = run.report();
  if (!session->close(failure)) return console.fail(failure);
  if (report.error) console.problem(*report.error);
  for (const std::string& line : progress.otherProblems()) console.problem(line);
  sayWhatIsForgotten(report, console);
  console.document(documentOf(report));
  printSummary(report, options.type, console);
  return report.status();
}

}  // namespace appsync
