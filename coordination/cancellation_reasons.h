// Why the client cancels coordinators, placeholders and promises: codes of the daemon's error domain.
#pragma once

#include <cstdint>
#include <string>

#include "platform/error.h"

namespace appsync {

inline constexpr std::int64_t kReasonInstallNotSetUp = 1;    // an install or update could not be set up
inline constexpr std::int64_t kReasonRestoreNotSetUp = 29;   // a restore, or its icon, could not be set up
inline constexpr std::int64_t kReasonPromiseNotAdded = 30;   // a promise of an install could not be added
inline constexpr std::int64_t kReasonNeverTransferred = 30;  // the transfers ended without the package

inline Error cancellationReason(std::int64_t code) {
  return {std::string(kDovelErrorDomain), code};
}

}  // namespace appsync
