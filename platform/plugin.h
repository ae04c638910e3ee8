// What a plug-in exports: one constant descriptor, under the symbol "DovelClientPlugin".
#pragma once

#include <cstdint>

namespace appsync {

class DovelClient;
struct Platform;

// Changes whenever anything that crosses the boundary changes: the descriptor, `Platform`, the protocol, a service, or
// a value type. A host refuses every number but its own.
inline constexpr std::uint32_t kDovelPluginABI = 1;

inline constexpr char kDovelPluginSymbol[] = "DovelClientPlugin";

struct DovelPluginDescriptor {
  std::uint32_t size;            // of this structure, in bytes: checked with `abi` before anything else is read
  std::uint32_t abi;             // kDovelPluginABI of the headers that the plug-in was built with
  const char* bundleIdentifier;  // of the plug-in's own bundle
  const char* version;           // for people

  // Makes the client; null when it cannot be made. The caller owns it and deletes it before it takes the platform down.
  // Throws nothing.
  DovelClient* (*makeClient)(const Platform& platform) noexcept;
};

}  // namespace appsync
