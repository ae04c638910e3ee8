#include "platform/file_url.h"

#include <string_view>

namespace appsync {

std::optional<FileURL> FileURL::fileURLWithPath(const std::string& path, bool isDirectory) {
  if (path.empty() || path.find('\0') != std::string::npos) return std::nullopt;
  return FileURL(path, isDirectory);
}

std::string FileURL::description() const {
  constexpr std::string_view kPlain =
      "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789-._~/!$&'()*+,;=:@";
  constexpr char kHex[] = "0123456789ABCDEF";
  std::string text = "file://";
  for (const char c : _path) {
    if (kPlain.find(c) != std::string_view::npos) {
      text += c;
      continue;
    }
    const auto byte = static_cast<unsigned char>(c);
    text += {'%', kHex[byte >> 4U], kHex[byte & 15U]};
  }
  if (_isDirectory && !text.ends_with('/')) text += '/';
  return text;
}

}  // namespace appsync
