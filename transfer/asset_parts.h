// The parts in which an application can travel; combined as bits.
#pragma once

#include <cstdint>

namespace appsync {

inline constexpr std::uint64_t kDovelAssetPartApplication = 1;      // the package
inline constexpr std::uint64_t kDovelAssetPartApplicationData = 2;  // the application's data, in a restore

}  // namespace appsync
