#include "embedded/install_observers.h"

#include <algorithm>
#include <thread>
#include <utility>

namespace appsync {

// Guarded by the owner's mutex.
struct InstallObservers::Registration {
  PellumApplicationWorkspace::Observer observer;  // null: removed
  std::string strand;
  bool reportIsPosted = false;
  std::thread::id caller;  // of the running callback; none runs: no thread
};

InstallObservers::InstallObservers(Executor& executor, std::function<Installs()> installs)
    : _executor(executor), _installs(std::move(installs)) {}

void InstallObservers::add(const PellumApplicationWorkspace::Observer& observer) {
  if (observer == nullptr) return;
  const MutexLock lock(_mutex);  // held to the end: a callback takes it first
  const auto isThis = [&](const auto& registration) { return registration->observer == observer; };
  if (std::any_of(_registrations.begin(), _registrations.end(), isThis)) return;
  auto registration = std::make_shared<Registration>();
  registration->observer = observer;
  registration->strand = "registry observer " + std::to_string(++_added);
  _registrations.push_back(registration);
  postReport(registration);
}

void InstallObservers::remove(const PellumApplicationWorkspace::Observer& observer) {
  MutexLock lock(_mutex);
  const auto found = std::find_if(_registrations.begin(), _registrations.end(),
                                  [&](const auto& registration) { return registration->observer == observer; });
  if (found == _registrations.end()) return;
  const std::shared_ptr<Registration> registration = *found;
  _registrations.erase(found);
  registration->observer = nullptr;
  const std::thread::id self = std::this_thread::get_id();
  while (registration->caller != std::thread::id() && registration->caller != self) _callbackEnded.wait(lock.native());
}

void InstallObservers::installsChanged() {
  const MutexLock lock(_mutex);
  for (const auto& registration : _registrations) postReport(registration);
}

void InstallObservers::didCancel(const PellumApplicationProxy& application) {
  const MutexLock lock(_mutex);
  for (const auto& registration : _registrations) {
    _executor.post(registration->strand, [this, registration, application] {
      deliver(*registration, [&](auto& observer) { observer.applicationInstallsDidCancel({application}); });
    });
  }
}

void InstallObservers::postReport(const std::shared_ptr<Registration>& registration) {
  if (std::exchange(registration->reportIsPosted, true)) return;
  _executor.post(registration->strand, [this, registration] {
    {
      const MutexLock lock(_mutex);
      registration->reportIsPosted = false;
    }
    const Installs now = _installs();
    deliver(*registration,
            [&](auto& observer) { observer.applicationInstallsArePrioritized(now.prioritized, now.paused); });
  });
}

void InstallObservers::deliver(Registration& registration, const Callback& callback) {
  PellumApplicationWorkspace::Observer observer;
  {
    const MutexLock lock(_mutex);
    observer = registration.observer;
    if (observer == nullptr) return;
    registration.caller = std::this_thread::get_id();
  }
  callback(*observer);
  observer = nullptr;  // if this was the last that held it, it goes while `remove` still waits
  {
    const MutexLock lock(_mutex);
    registration.caller = std::thread::id();
  }
  _callbackEnded.notify_all();
}

}  // namespace appsync
