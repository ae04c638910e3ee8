// The steps that the client records in the install transaction log.
#pragma once

#include <cstdint>
#include <string>

#include "platform/install_transaction_log.h"

namespace appsync {

enum class TransactionStep : std::uint8_t {
  InstallApp = 1,
  RestoreApp = 2,
  CreateCoordinator = 3,
  CreatePlaceholder = 4,
  CopyIcon = 5,
  UninstallApp = 7,
};

inline void stepBegins(InstallTransactionLog& log, TransactionStep step, const std::string& bundleID,
                       const char* description) {
  log.logStep(static_cast<std::int32_t>(step), 1, 1, true, bundleID, description);
}

inline void stepEnds(InstallTransactionLog& log, TransactionStep step, bool success, const std::string& bundleID,
                     const char* description) {
  log.logStep(static_cast<std::int32_t>(step), 1, 2, success, bundleID, description);
}

}  // namespace appsync
