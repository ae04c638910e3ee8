// The install transaction log: a short record of each step of an application's install, update, restore or removal.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "platform/system_log.h"

namespace appsync {

// A leaf service: any thread, never calls back, may be called under a lock, never fails.
class InstallTransactionLog {
 public:
  virtual ~InstallTransactionLog() = default;

  // Names the handle that records also go to. Called once for each client, before its first record.
  virtual void initializeWithLog(std::shared_ptr<LogHandle> log) = 0;

  // `phase` is 1 where the step begins and 2 where it ends; `success` is true at a beginning.
  virtual void logStep(std::int32_t step, std::int32_t party, std::int32_t phase, bool success,
                       const std::optional<std::string>& bundleID, const std::string& description) = 0;

  virtual void logScenario(const std::string& scenario, std::int32_t step, bool success,
                           const std::optional<std::string>& bundleID, const std::string& description) = 0;
};

}  // namespace appsync
