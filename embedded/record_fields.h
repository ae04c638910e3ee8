// The fields of a record or of a seed's entry; an absent one has no key. Private to the services of the device.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/property_list.h"

namespace appsync {

// Each reader answers none when the field is absent or of another type.
inline std::optional<std::string> textIn(const PropertyList& record, std::string_view key) {
  const PropertyList* value = record.find(key);
  return value == nullptr ? std::nullopt : value->string();
}

inline std::optional<std::uint64_t> numberIn(const PropertyList& record, std::string_view key) {
  const PropertyList* value = record.find(key);
  return value == nullptr ? std::nullopt : value->unsignedInteger();
}

inline std::optional<bool> flagIn(const PropertyList& record, std::string_view key) {
  const PropertyList* value = record.find(key);
  return value == nullptr ? std::nullopt : value->boolean();
}

// Whether it is there and true.
inline bool isTrueIn(const PropertyList& record, std::string_view key) {
  return flagIn(record, key).value_or(false);
}

template <class Value>
void setIfPresent(PropertyList& record, std::string_view key, const std::optional<Value>& value) {
  if (value) record.set(key, *value);
}

}  // namespace appsync
