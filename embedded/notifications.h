// System-wide notifications of the embedded device: state words that are kept from run to run, and a center that
// delivers on the executor.
#pragma once

#include <condition_variable>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "embedded/executor.h"
#include "embedded/state_store.h"
#include "platform/notifications.h"
#include "platform/property_list.h"
#include "platform/thread_annotations.h"

namespace appsync {

// Delivers messages one after the other, in the order of posting, on one strand of the executor; so an observer can
// always take a message, and its suspension behaviour does not matter. What is posted before `addObserver` is not
// delivered to that observer. `executor` must outlive this, and is drained before this is destroyed.
class EmbeddedNotificationCenter : public NotificationCenter {
 public:
  explicit EmbeddedNotificationCenter(Executor& executor) : _executor(executor) {}

  void addObserver(const std::shared_ptr<void>& observer, Callback callback, const std::string& name,
                   NotificationSuspension suspension) override;
  void removeObserver(const std::shared_ptr<void>& observer, const std::string& name) override;

  // Delivers a message of this name, without object and information, to all who observe it now. Returns at once.
  void post(const std::string& name);

 private:
  struct Registration;

  void deliver(const std::shared_ptr<Registration>& registration);

  Executor& _executor;
  Mutex _mutex;
  std::condition_variable _callbackEnded;
  std::vector<std::shared_ptr<Registration>> _registrations APPSYNC_GUARDED_BY(_mutex);
};

// A post goes to the center's observers of that name. Both must outlive this.
class EmbeddedNotificationService : public NotificationService {
 public:
  EmbeddedNotificationService(StateStore& store, EmbeddedNotificationCenter& center) : _store(store), _center(center) {}

  // 0, or 1 for an empty name.
  std::uint32_t registerCheck(const std::string& name, int& token) override;
  // A token that was never given out, and a state that cannot be kept, are ignored.
  void setState(int token, std::uint64_t state) override;
  void post(const std::string& name) override;

  // The state word of a name; 0 when none was ever set.
  std::uint64_t state(const std::string& name) const;
  // False, with an error, when it cannot be kept.
  bool setState(const std::string& name, std::uint64_t state, ErrorOut error);

 private:
  StateStore& _store;
  EmbeddedNotificationCenter& _center;
  mutable Mutex _mutex;
  std::vector<std::string> _names APPSYNC_GUARDED_BY(_mutex);  // a token is a position in it
};

// The name under which the home screen learns whether a sync runs: 1 while it does.
inline constexpr char kSyncStateNotification[] = "com.zelk.brelm.dovel.wsyncnotify";

// Part of the device's status: a dictionary of the state words that have been set, by name.
PropertyList notificationsStatus(const StateStore& store);

}  // namespace appsync
