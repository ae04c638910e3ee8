// JSON, and property lists as JSON. Nothing else in the program reads or writes JSON by itself.
//
// Dictionaries, arrays, strings, booleans and numbers stand for themselves; data is {"$data": "base64"}, a date
// {"$date": "2026-01-31T12:00:00Z"} (with a fraction of a second where it has one; outside the years 1 to 9999 the
// number of seconds since 2001), a UID {"$uid": 5}; a real number that is no number {"$real": "nan"}, "inf" or "-inf".
#pragma once

#include <functional>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "host/json_forward.h"
#include "platform/dovel_client.h"
#include "platform/error.h"
#include "platform/property_list.h"

namespace appsync {

inline constexpr std::string_view kJsonErrorDomain = "JSONError";

// Indented text, without a newline at its end. Bytes that are no UTF-8 are replaced.
std::string jsonText(const Json& value);

// One line, for logs and traces.
std::string jsonLine(const Json& value);

// None, with an error, when the text is no JSON (the error names line and column) or nests deeper than 512 levels.
std::optional<Json> parseJson(std::string_view text, ErrorOut error);

// Absent values (null) are left out.
PropertyList propertyListFromJson(const Json& value);
Json jsonFromPropertyList(const PropertyList& value);

// Writes a property list as indented JSON, piece by piece: it may be much larger written out than it is in memory.
void writePropertyListAsJson(const PropertyList& value, const std::function<void(std::string_view)>& write);

// The value, null where there is none.
template <class Value>
Json orNull(const std::optional<Value>& value) {
  return value ? Json(*value) : Json(nullptr);
}

// Store accounts in the order of their ids, an object each; absent values are null.
Json accountDocuments(std::vector<DovelMutableAccountInfo> accounts);

// "2026-01-31T12:00:00Z"; none outside the years 1 to 9999.
std::optional<std::string> isoDateText(double secondsSince2001);

}  // namespace appsync
