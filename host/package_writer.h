// Writes packages: ZIP archives, the same bytes for the same content.
#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace appsync {

struct PackageEntry {
  std::string path;  // a directory's ends with a slash
  std::string content;
  bool executable = false;
};

// None when the archive cannot be made.
std::optional<std::string> packageBytes(const std::vector<PackageEntry>& entries);

}  // namespace appsync
