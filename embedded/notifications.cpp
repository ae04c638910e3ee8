#include "embedded/notifications.h"

#include <algorithm>
#include <thread>

namespace appsync {

namespace {

constexpr char kStatesRecord[] = "notifications";
constexpr char kStrand[] = "notifications";
constexpr std::uint32_t kBadName = 1;

}  // namespace

// --- the center -----------------------------------------------------------------------------------------------------

struct EmbeddedNotificationCenter::Registration {
  const std::shared_ptr<void> observer;
  const Callback callback;
  const std::string name;
  bool removed = false;         // under the center's lock, like the next
  std::thread::id runningOn{};  // the thread that a callback runs on
};

void EmbeddedNotificationCenter::addObserver(const std::shared_ptr<void>& observer, Callback callback,
                                             const std::string& name, NotificationSuspension /*suspension*/) {
  const MutexLock lock(_mutex);
  _registrations.push_back(std::make_shared<Registration>(Registration{observer, callback, name}));
}

void EmbeddedNotificationCenter::removeObserver(const std::shared_ptr<void>& observer, const std::string& name) {
  std::vector<std::shared_ptr<Registration>> removed;  // the last to hold the observer, perhaps: goes after the lock
  MutexLock lock(_mutex);
  for (const auto& registration : _registrations) {
    if (registration->observer == observer && registration->name == name) removed.push_back(registration);
  }
  for (const auto& registration : removed) {
    registration->removed = true;
    std::erase(_registrations, registration);
  }
  for (const auto& registration : removed) {
    while (registration->runningOn != std::thread::id{} && registration->runningOn != std::this_thread::get_id()) {
      _callbackEnded.wait(lock.native());
    }
  }
}

void EmbeddedNotificationCenter::post(const std::string& name) {
  const MutexLock lock(_mutex);
  for (const auto& registration : _registrations) {
    if (registration->name == name) _executor.post(kStrand, [this, registration] { deliver(registration); });
  }
}

void EmbeddedNotificationCenter::deliver(const std::shared_ptr<Registration>& registration) {
  {
    const MutexLock lock(_mutex);
    if (registration->removed) return;
    registration->runningOn = std::this_thread::get_id();
  }
  registration->callback(this, registration->observer.get(), registration->name, nullptr, nullptr);
  const MutexLock lock(_mutex);
  registration->runningOn = {};
  _callbackEnded.notify_all();
}

// --- states ---------------------------------------------------------------------------------------------------------

std::uint32_t EmbeddedNotificationService::registerCheck(const std::string& name, int& token) {
  if (name.empty()) return kBadName;
  const MutexLock lock(_mutex);
  const auto found = std::find(_names.begin(), _names.end(), name);
  token = static_cast<int>(found - _names.begin());
  if (found == _names.end()) _names.push_back(name);
  return 0;
}

void EmbeddedNotificationService::setState(int token, std::uint64_t state) {
  std::string name;
  {
    const MutexLock lock(_mutex);
    if (token < 0 || static_cast<std::size_t>(token) >= _names.size()) return;
    name = _names[static_cast<std::size_t>(token)];
  }
  setState(name, state, nullptr);
}

void EmbeddedNotificationService::post(const std::string& name) {
  _center.post(name);
}

std::uint64_t EmbeddedNotificationService::state(const std::string& name) const {
  const PropertyList states = notificationsStatus(_store);
  const PropertyList* state = states.find(name);
  return state == nullptr ? 0 : state->unsignedInteger().value_or(0);
}

bool EmbeddedNotificationService::setState(const std::string& name, std::uint64_t state, ErrorOut error) {
  const MutexLock lock(_mutex);
  PropertyList states = notificationsStatus(_store);
  states.set(name, PropertyList::unsignedInteger(state));
  return _store.save(kStatesRecord, states, error);
}

PropertyList notificationsStatus(const StateStore& store) {
  const std::optional<PropertyList> record = store.load(kStatesRecord, nullptr);
  return record && record->isDictionary() ? *record : PropertyList::dictionary();
}

}  // namespace appsync
