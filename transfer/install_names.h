// Names of the registry's install types, states and phases, for log lines.
#pragma once

#include <cstdint>
#include <string>

namespace appsync {

std::string installTypeName(std::uint64_t type);
std::string installStateName(std::uint64_t state);
std::string installPhaseName(std::uint64_t phase);

}  // namespace appsync
