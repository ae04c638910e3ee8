#include <algorithm>
#include <utility>

#include "embedded/coordination.h"
#include "embedded/coordination_objects.h"
#include "embedded/installer.h"
#include "embedded/registry.h"
#include "platform/ostrel_objects.h"

namespace appsync {

namespace {

using Life = InstallCoordinator::Life;
using Shown = InstallCoordinator::Shown;

constexpr std::chrono::milliseconds kLongestPatience = std::chrono::hours(24);

// From this fraction on the installer is about to put the application in place; it asks once more whether it may.
constexpr double kUnpacked = 1.0;

bool canInstall(const InstallCoordinator& coordinator) {
  return coordinator.isPlaceholderInstalled && coordinator.hasPackage() &&
         (!coordinator.userData || coordinator.userData->isComplete);
}

Shown whatToShow(const InstallCoordinator& coordinator) {
  if (coordinator.hasEnded()) return Shown::Nothing;
  return coordinator.package && coordinator.package->fraction > 0 ? Shown::Loading : Shown::Waiting;
}

std::optional<InstallDisplay> displayOf(Shown shown) {
  switch (shown) {
    case Shown::Waiting:
      return InstallDisplay{{kPellumInstallStateWaiting, kPellumInstallPhaseLoading}};
    case Shown::Loading:
      return InstallDisplay{{kPellumInstallStateActive, kPellumInstallPhaseLoading}};
    case Shown::Installing:
      return InstallDisplay{{kPellumInstallStateActive, kPellumInstallPhaseInstalling}};
    case Shown::Nothing:
      break;
  }
  return std::nullopt;
}

}  // namespace

// What a coordinator's worker does next. It follows from the coordinator alone, so it does not matter which call, or
// which process, brought it to where it is.
enum class EmbeddedCoordination::Step : std::uint8_t {
  None,
  Save,
  InstallPlaceholder,
  Install,
  Show,
  TidyUp,
  TellEnding,
};

EmbeddedCoordination::Step EmbeddedCoordination::nextStep(const InstallCoordinator& coordinator) const {
  if (coordinator.life == Life::Finished) return Step::None;
  if (coordinator.life == Life::Dead) {
    if (coordinator.isUnwritten) return Step::Save;
    if (!coordinator.isTidy) return Step::TidyUp;
    return coordinator.ending ? Step::TellEnding : Step::None;
  }
  if (coordinator.holds > 0) return Step::None;
  if (coordinator.isUnwritten) return Step::Save;
  if (!_working) return Step::None;
  if (coordinator.placeholder && !coordinator.isPlaceholderInstalled) return Step::InstallPlaceholder;
  if (canInstall(coordinator)) return Step::Install;
  if (coordinator.isPlaceholderInstalled && whatToShow(coordinator) != coordinator.shown) return Step::Show;
  return Step::None;
}

// --- setting it to work ---------------------------------------------------------------------------------------------

void EmbeddedCoordination::startWork() {
  MutexLock lock(_mutex);
  _working = true;
  for (const auto& [bundleID, coordinator] : _coordinators) consider(coordinator);
}

void EmbeddedCoordination::stopWork() {
  MutexLock lock(_mutex);
  _working = false;
}

bool EmbeddedCoordination::isRecorded(const std::string& bundleID) const {
  return _store.load(coordinatorRecordName(bundleID), nullptr).has_value();
}

void EmbeddedCoordination::consider(const std::shared_ptr<InstallCoordinator>& coordinator) {
  if (coordinator->isScheduled || _drained || nextStep(*coordinator) == Step::None) return;
  coordinator->isScheduled = true;
  post(coordinator->bundleID, [this, coordinator] { work(coordinator); });
}

void EmbeddedCoordination::post(const std::string& strand, Executor::Job job) {
  ++_jobs;
  _executor.post(strand, [this, job = std::move(job)] {
    job();
    MutexLock lock(_mutex);
    --_jobs;
    ++_moves;
    _changed.notify_all();
  });
}

void EmbeddedCoordination::work(const std::shared_ptr<InstallCoordinator>& coordinator) {
  while (true) {
    Step step = Step::None;
    {
      MutexLock lock(_mutex);
      step = nextStep(*coordinator);
      ++_moves;
      _changed.notify_all();
      if (step == Step::None) {
        coordinator->isScheduled = false;
        return;
      }
    }
    switch (step) {
      case Step::Save:
        save(coordinator);
        break;
      case Step::InstallPlaceholder:
        installPlaceholder(coordinator);
        break;
      case Step::Install:
        install(coordinator);
        break;
      case Step::Show:
        show(coordinator);
        break;
      case Step::TidyUp:
        tidyUp(coordinator);
        break;
      case Step::TellEnding:
        tellEnding(coordinator);
        break;
      case Step::None:
        break;
    }
  }
}

// --- the steps ------------------------------------------------------------------------------------------------------

// A record that cannot be written is tried again with the next change: the coordinator works on without it, and a later
// process finds the older state.
void EmbeddedCoordination::save(const std::shared_ptr<InstallCoordinator>& coordinator) {
  std::optional<PropertyList> record;
  {
    MutexLock lock(_mutex);
    coordinator->isUnwritten = false;
    if (current(coordinator->bundleID) == coordinator) record = coordinatorRecord(*coordinator);
  }
  if (record) _store.save(coordinatorRecordName(coordinator->bundleID), *record, nullptr);
}

// Not worth a record of its own: a later process asks the registry whether it has this placeholder.
void EmbeddedCoordination::installPlaceholder(const std::shared_ptr<InstallCoordinator>& coordinator) {
  std::optional<PlaceholderDescription> placeholder;
  {
    MutexLock lock(_mutex);
    if (!coordinator->isLive()) return;
    placeholder = coordinator->placeholder;
  }
  beginFulfillment(coordinator, 2);
  std::optional<Error> problem;
  if (!_registry.installPlaceholder(*placeholder, &problem)) {
    return fail(coordinator, kOstrelPlaceholderFailed,
                "The placeholder of \"" + coordinator->bundleID + "\" could not be installed", problem);
  }
  {
    MutexLock lock(_mutex);
    coordinator->isPlaceholderInstalled = true;
    coordinator->placeholder->icon.reset();  // the registry has its own copy
    coordinator->shown = Shown::Nothing;
    if (!coordinator->isLive()) return;
  }
  show(coordinator);
  tell(coordinator, [](auto& observer, const auto& handle) { observer.coordinatorDidInstallPlaceholder(handle); });
  tellHost({coordinator->bundleID, CoordinatorEvent::Kind::PlaceholderInstalled, std::nullopt});
}

void EmbeddedCoordination::install(const std::shared_ptr<InstallCoordinator>& coordinator) {
  bool hasUserData = false;
  {
    MutexLock lock(_mutex);
    if (!coordinator->isLive() || !canInstall(*coordinator)) return;
    coordinator->isInstalling = true;
    coordinator->shown = Shown::Installing;
    hasUserData = coordinator->userData != nullptr;
  }
  _registry.setInstallDisplay(coordinator->bundleID, displayOf(Shown::Installing));
  if (hasUserData) beginFulfillment(coordinator, 3);
  beginFulfillment(coordinator, 1);
  std::optional<Error> problem;
  if (unpack(coordinator, &problem)) return finish(coordinator);
  fail(coordinator, kOstrelInstallFailed, "\"" + coordinator->bundleID + "\" could not be installed", problem);
}

bool EmbeddedCoordination::unpack(const std::shared_ptr<InstallCoordinator>& coordinator, ErrorOut error) {
  std::string package;
  KilnInstallOptions options;
  std::function<std::optional<Error>(const std::string&)> gate;
  {
    MutexLock lock(_mutex);
    package = *coordinator->package->path;
    if (coordinator->installOptions) options = *coordinator->installOptions;
    gate = _installGate;
  }
  if (gate) {
    if (const auto refusal = gate(coordinator->bundleID)) return setError(error, refusal), false;
  }
  const auto progress = [this, &coordinator](double fraction) {
    MutexLock lock(_mutex);
    if (fraction >= kUnpacked && coordinator->isLive()) coordinator->isCommitting = true;
    ++_moves;
    _changed.notify_all();
  };
  const auto cancelled = [this, &coordinator] {
    MutexLock lock(_mutex);
    return !coordinator->isLive();
  };
  return _installer.install(coordinator->bundleID, package, options, progress, cancelled, error);
}

// The record goes before the package: a crash in between leaves a file, not a coordinator that has lost its package.
// One that was cancelled after the installer had asked for the last time stays cancelled, as it has been answered.
void EmbeddedCoordination::finish(const std::shared_ptr<InstallCoordinator>& coordinator) {
  {
    MutexLock lock(_mutex);
    coordinator->isInstalling = coordinator->isCommitting = false;
    if (!coordinator->isLive()) return;
    coordinator->life = Life::Finished;
    if (current(coordinator->bundleID) == coordinator) _coordinators.erase(coordinator->bundleID);
  }
  _store.remove(coordinatorRecordName(coordinator->bundleID), nullptr);
  _registry.setInstallDisplay(coordinator->bundleID, std::nullopt);
  deletePackage(coordinator);
  tell(coordinator, [](auto& observer, const auto& handle) { observer.coordinatorDidCompleteSuccessfully(handle); });
  tellHost({coordinator->bundleID, CoordinatorEvent::Kind::Completed, std::nullopt});
}

void EmbeddedCoordination::fail(const std::shared_ptr<InstallCoordinator>& coordinator, std::int64_t code,
                                const std::string& text, const std::optional<Error>& cause) {
  MutexLock lock(_mutex);
  coordinator->isInstalling = coordinator->isCommitting = false;
  if (!coordinator->isLive()) return;
  coordinator->life = Life::Dead;
  coordinator->error = cause ? Error(std::string(kOstrelErrorDomain), code, text, *cause) : ostrelError(code, text);
  coordinator->ending = InstallCoordinator::Ending{false, 0};
  coordinator->isUnwritten = true;
}

void EmbeddedCoordination::show(const std::shared_ptr<InstallCoordinator>& coordinator) {
  Shown shown = Shown::Nothing;
  {
    MutexLock lock(_mutex);
    shown = coordinator->shown = whatToShow(*coordinator);
  }
  _registry.setInstallDisplay(coordinator->bundleID, displayOf(shown));
}

void EmbeddedCoordination::tidyUp(const std::shared_ptr<InstallCoordinator>& coordinator) {
  bool hasPlaceholder = false;
  bool isCancelled = false;
  {
    MutexLock lock(_mutex);
    coordinator->isTidy = true;
    hasPlaceholder = std::exchange(coordinator->isPlaceholderInstalled, false);
    isCancelled = coordinator->ending && coordinator->ending->isCancellation;
    if (coordinator->placeholder) coordinator->placeholder->icon.reset();
    coordinator->isUnwritten = hasPlaceholder || coordinator->hasPackage();
  }
  if (isCancelled) _registry.installsDidCancel(coordinator->bundleID);
  if (hasPlaceholder) {
    _registry.setInstallDisplay(coordinator->bundleID, std::nullopt);
    _registry.removePlaceholder(coordinator->bundleID, nullptr);
  }
  deletePackage(coordinator);
}

// Packages that are promised complete are the service's to delete; a partial one is not.
void EmbeddedCoordination::deletePackage(const std::shared_ptr<InstallCoordinator>& coordinator) {
  std::string path;
  {
    MutexLock lock(_mutex);
    if (!coordinator->hasPackage()) return;
    path = *std::exchange(coordinator->package->path, std::nullopt);
  }
  const auto attributes = _files.attributesOfItem(path, nullptr);
  if (attributes && !attributes->isDirectory) _files.removeItem(path, nullptr);
}

// --- telling --------------------------------------------------------------------------------------------------------

void EmbeddedCoordination::tellEnding(const std::shared_ptr<InstallCoordinator>& coordinator) {
  InstallCoordinator::Ending ending;
  std::optional<Error> reason;
  {
    MutexLock lock(_mutex);
    ending = *std::exchange(coordinator->ending, std::nullopt);
    reason = coordinator->error;
  }
  tell(coordinator, [&](auto& observer, const auto& handle) {
    if (ending.isCancellation) {
      observer.coordinatorCanceledWithReason(handle, *reason, ending.client);
    } else {
      observer.coordinatorDidCompleteSuccessfully(handle);
    }
  });
  tellHost({coordinator->bundleID,
            ending.isCancellation ? CoordinatorEvent::Kind::Cancelled : CoordinatorEvent::Kind::Completed, reason});
}

void EmbeddedCoordination::beginFulfillment(const std::shared_ptr<InstallCoordinator>& coordinator,
                                            std::uint64_t promise) {
  {
    MutexLock lock(_mutex);
    if (!coordinator->begunPromises.insert(promise).second) return;
  }
  tell(coordinator, [promise](auto& observer, const auto& /*handle*/) {
    observer.promiseDidBeginFulfillmentWithIdentifier(promise);
  });
}

void EmbeddedCoordination::personPrioritizes(const std::string& bundleID) {
  MutexLock lock(_mutex);
  const auto coordinator = current(bundleID);
  if (!coordinator || !coordinator->isLive() || _drained) return;
  post(bundleID, [this, coordinator] {
    tell(coordinator, [](auto& observer, const auto& handle) { observer.coordinatorShouldPrioritize(handle); });
  });
}

void EmbeddedCoordination::tell(const std::shared_ptr<InstallCoordinator>& coordinator, const Event& event) {
  std::vector<Observer> observers;
  std::vector<std::shared_ptr<InstallObserverRegistration>> registered;
  OstrelRef held;
  {
    MutexLock lock(_mutex);
    if (coordinator->observer) {
      observers.push_back(coordinator->observer);
    } else {
      for (const auto& registration : _registrations) {
        if (registration->clients.contains(coordinator->creator)) registered.push_back(registration);
      }
      for (const auto& registration : registered) {
        registration->running.insert(std::this_thread::get_id());
        observers.push_back(registration->observer);
      }
    }
    if (observers.empty()) return;
    held = hold(coordinator);
  }
  {
    const OstrelAppInstallCoordinator handle(*this, held);
    for (const Observer& observer : observers) event(*observer, handle);
  }
  MutexLock lock(_mutex);
  for (const auto& registration : registered) {
    registration->running.erase(registration->running.find(std::this_thread::get_id()));
  }
  _changed.notify_all();
}

void EmbeddedCoordination::tellHost(const CoordinatorEvent& event) {
  std::function<void(const CoordinatorEvent&)> listener;
  {
    MutexLock lock(_mutex);
    listener = _eventListener;
  }
  if (listener) listener(event);
}

// --- removing -------------------------------------------------------------------------------------------------------

void EmbeddedCoordination::remove(const std::string& bundleID, const Completion& completion) {
  std::optional<Error> problem;
  if (_installer.uninstall(bundleID, &problem)) {
    problem.reset();
    bool wasDead = false;
    {
      MutexLock lock(_mutex);
      const auto coordinator = current(bundleID);
      wasDead = coordinator && coordinator->life == Life::Dead;
      if (wasDead) _coordinators.erase(bundleID);
    }
    if (wasDead) forgetRecord(bundleID);
  }
  if (completion) completion(problem);
}

// Records are written on the application's strand only, as this is: no new coordinator's is there yet.
void EmbeddedCoordination::forgetRecord(const std::string& bundleID) {
  {
    MutexLock lock(_mutex);
    if (current(bundleID)) return;
  }
  _store.remove(coordinatorRecordName(bundleID), nullptr);
}

// --- coming to rest -------------------------------------------------------------------------------------------------

bool EmbeddedCoordination::isSettled() const {
  if (_jobs > 0) return false;
  return std::none_of(_coordinators.begin(), _coordinators.end(), [](const auto& entry) {
    const InstallCoordinator& coordinator = *entry.second;
    return coordinator.isLive() && coordinator.holds > 0 && coordinator.hasPackage();
  });
}

bool EmbeddedCoordination::waitUntilSettled(Waiting& waiting, std::chrono::milliseconds patience) {
  MutexLock lock(_mutex);
  while (!isSettled()) {
    const std::uint64_t seen = _moves;
    const auto deadline = waiting.now() + std::min(patience, kLongestPatience);
    waiting.wait(lock.native(), _changed, deadline,
                 [this, seen]() APPSYNC_REQUIRES(_mutex) { return _moves != seen || isSettled(); });
    if (_moves == seen && !isSettled()) return false;
  }
  return true;
}

void EmbeddedCoordination::drain() {
  _executor.drain();
  std::vector<std::shared_ptr<InstallCoordinator>> unwritten;
  {
    MutexLock lock(_mutex);
    _drained = true;
    for (const auto& [bundleID, coordinator] : _coordinators) {
      if (coordinator->isUnwritten) unwritten.push_back(coordinator);
    }
  }
  _executor.drain();
  for (const auto& coordinator : unwritten) save(coordinator);
}

}  // namespace appsync
