// Arguments and results, as the recorder's lines show them.
#pragma once

#include <concepts>
#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "platform/brelm.h"
#include "platform/device_policy.h"
#include "platform/error.h"
#include "platform/file_manager.h"
#include "platform/file_url.h"
#include "platform/kiln.h"
#include "platform/ostrel.h"
#include "platform/pellum.h"
#include "platform/property_list.h"

namespace appsync {

// An object of the coordination service under its name for people; the name of none is "none".
struct NamedRef {
  OstrelRef ref;
  std::string name = "none";

  explicit operator bool() const { return static_cast<bool>(ref); }
};

inline std::string shown(std::string_view text) {
  return std::string(text);
}
inline std::string shown(const std::string& text) {
  return text;
}
inline std::string shown(const char* text) {
  return text;
}
inline std::string shown(bool value) {
  return value ? "yes" : "no";
}
template <std::integral Number>
requires(!std::same_as<Number, bool>) std::string shown(Number number) {
  return std::to_string(number);
}
inline std::string shown(const NamedRef& object) {
  return object.name;
}
inline std::string shown(const FileURL& url) {
  return url.path();
}
inline std::string shown(const PropertyList& value) {
  return value.description();
}
inline std::string shown(const Error& error) {
  return error.description();
}
std::string shown(double fraction);  // the shortest text of the number
std::string shown(BytesView bytes);
std::string shown(const FileInformation& information);
std::string shown(const FileAttributes& attributes);  // "as OWNER:GROUP"; a name that is absent is "-"
std::string shown(const std::set<OstrelClientID>& clients);
std::string shown(const std::vector<std::string>& texts);
std::string shown(const KilnStoreMetadata& metadata);
std::string shown(const KilnInstallOptions& options);
std::string shown(const OstrelPlaceholderAttributes& attributes);
std::string shown(OstrelCoordinatorKind kind);
std::string shown(OstrelPromiseKind kind);
std::string shown(TessaBoolean value);
std::string shown(const PellumApplicationProxy& record);
std::string shown(const PellumApplicationProxies& records);
std::string shown(const Bundle& bundle);
std::string shown(const Image& image);

template <class T>
std::string shown(const std::optional<T>& value) {
  return value ? shown(*value) : "none";
}
template <class T>
std::string shown(const std::unique_ptr<T>& value) {
  return value ? "ok" : "none";
}

// NAME=VALUE
template <class T>
std::string field(std::string_view name, const T& value) {
  return std::string(name) + "=" + shown(value);
}
inline std::string field(std::string_view name, bool value) {
  return std::string(name) + (value ? "=1" : "=0");
}

}  // namespace appsync
