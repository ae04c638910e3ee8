// Whether and how an application had been demoted (its package given up, its data kept) when the backup was taken.
#pragma once

#include <cstdint>

namespace appsync {

inline constexpr std::uint64_t kNotDemoted = 0;
inline constexpr std::uint64_t kIntentionallyDemoted = 1;  // by the person
inline constexpr std::uint64_t kAutomaticallyDemoted = 2;  // by the system

}  // namespace appsync
