// System-wide notifications: named states that anybody can read, and a center that delivers named messages.
#pragma once

#include <cstdint>
#include <memory>
#include <string>

namespace appsync {

// A leaf service: any thread, may be called under a lock.
class NotificationService {
 public:
  virtual ~NotificationService() = default;

  // Registers for checking a name. 0 and a token; another status, and the token untouched, when that failed.
  virtual std::uint32_t registerCheck(const std::string& name, int& token) = 0;
  // Sets the state word of the token's name, which everybody sees and which outlives the process.
  virtual void setState(int token, std::uint64_t state) = 0;
  virtual void post(const std::string& name) = 0;
};

// What happens to a message for an observer that cannot take it just now.
enum class NotificationSuspension : std::uint8_t { Drop, DeliverImmediately };

// Any thread. Delivers on a thread of its own, at any moment until `removeObserver` has returned: never to be called
// under a lock that a callback takes.
class NotificationCenter {
 public:
  // `observer` is what was given to `addObserver`.
  using Callback = void (*)(NotificationCenter* center, void* observer, const std::string& name, const void* object,
                            const void* userInfo);

  virtual ~NotificationCenter() = default;

  virtual void addObserver(const std::shared_ptr<void>& observer, Callback callback, const std::string& name,
                           NotificationSuspension suspension) = 0;
  // Returns when no callback of this observer runs any more, except one that this is called from.
  virtual void removeObserver(const std::shared_ptr<void>& observer, const std::string& name) = 0;
};

}  // namespace appsync
