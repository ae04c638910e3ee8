#include "host/json.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <limits>
#include <vector>

namespace appsync {

namespace {

constexpr std::size_t kDeepest = 512;
constexpr std::string_view kBase64 = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
constexpr double kSecondsFrom1970 = 978307200;

std::string base64(BytesView bytes) {
  std::string text;
  text.reserve((bytes.size() + 2) / 3 * 4);
  for (std::size_t at = 0; at < bytes.size(); at += 3) {
    std::uint32_t group = 0;
    for (std::size_t i = 0; i < 3; ++i) {
      group = (group << 8U) | (at + i < bytes.size() ? std::uint32_t{bytes[at + i]} : 0U);
    }
    for (std::size_t i = 0; i < 4; ++i) {
      const bool filled = at + i > bytes.size();
      text += filled ? '=' : kBase64[(group >> (18 - 6 * i)) & 63U];
    }
  }
  return text;
}

std::optional<Bytes> fromBase64(std::string_view text) {
  Bytes bytes;
  std::uint32_t group = 0;
  std::size_t digits = 0;
  while (text.ends_with('=')) text.remove_suffix(1);
  for (const char c : text) {
    const std::size_t digit = kBase64.find(c);
    if (digit == std::string_view::npos) return std::nullopt;
    group = (group << 6U) | static_cast<std::uint32_t>(digit);
    if (++digits % 4 == 0) {
      for (const unsigned shift : {16U, 8U, 0U}) bytes.push_back(static_cast<std::uint8_t>(group >> shift));
    }
  }
  if (digits % 4 == 1) return std::nullopt;
  if (digits % 4 == 2) bytes.push_back(static_cast<std::uint8_t>(group >> 4U));
  if (digits % 4 == 3) {
    bytes.push_back(static_cast<std::uint8_t>(group >> 10U));
    bytes.push_back(static_cast<std::uint8_t>(group >> 2U));
  }
  return bytes;
}

// Days since 1970-01-01 of a date of the Gregorian calendar, and back.
std::int64_t daysFromDate(std::int64_t year, unsigned month, unsigned day) {
  year -= month <= 2 ? 1 : 0;
  const std::int64_t era = (year >= 0 ? year : year - 399) / 400;
  const auto yearOfEra = static_cast<unsigned>(year - era * 400);
  const unsigned dayOfYear = (153 * (month > 2 ? month - 3 : month + 9) + 2) / 5 + day - 1;
  return era * 146097 + static_cast<std::int64_t>(yearOfEra * 365 + yearOfEra / 4 - yearOfEra / 100 + dayOfYear) -
         719468;
}

struct CalendarDate {
  std::int64_t year;
  unsigned month;
  unsigned day;
};

CalendarDate dateFromDays(std::int64_t days) {
  days += 719468;
  const std::int64_t era = (days >= 0 ? days : days - 146096) / 146097;
  const auto dayOfEra = static_cast<unsigned>(days - era * 146097);
  const unsigned yearOfEra = (dayOfEra - dayOfEra / 1460 + dayOfEra / 36524 - dayOfEra / 146096) / 365;
  const unsigned dayOfYear = dayOfEra - (365 * yearOfEra + yearOfEra / 4 - yearOfEra / 100);
  const unsigned shifted = (5 * dayOfYear + 2) / 153;
  const unsigned month = shifted < 10 ? shifted + 3 : shifted - 9;
  return {yearOfEra + era * 400 + (month <= 2 ? 1 : 0), month, dayOfYear - (153 * shifted + 2) / 5 + 1};
}

std::optional<double> secondsFromText(const std::string& text) {
  int year = 0;
  unsigned month = 0;
  unsigned day = 0;
  unsigned hour = 0;
  unsigned minute = 0;
  double second = 0;
  int end = 0;
  if (std::sscanf(text.c_str(), "%4d-%2u-%2uT%2u:%2u:%lfZ%n", &year, &month, &day, &hour, &minute, &second, &end) !=
          6 ||
      static_cast<std::size_t>(end) != text.size() || month < 1 || month > 12 || day < 1 || day > 31 || hour > 23 ||
      minute > 59 || !(second >= 0 && second < 61)) {
    return std::nullopt;
  }
  return static_cast<double>(daysFromDate(year, month, day)) * 86400 + hour * 3600 + minute * 60 + second -
         kSecondsFrom1970;
}

// The one member of an object of that shape, or null.
const Json* onlyMember(const Json& object, const char* key) {
  if (!object.is_object() || object.size() != 1) return nullptr;
  const auto found = object.find(key);
  return found == object.end() ? nullptr : &*found;
}

std::optional<PropertyList> tagged(const Json& value) {
  constexpr double kInfinity = std::numeric_limits<double>::infinity();
  if (const Json* data = onlyMember(value, "$data"); data != nullptr && data->is_string()) {
    if (auto bytes = fromBase64(data->get_ref<const std::string&>())) return PropertyList::data(*bytes);
  }
  if (const Json* date = onlyMember(value, "$date"); date != nullptr) {
    if (date->is_number()) return PropertyList::date(date->get<double>());
    if (date->is_string()) {
      if (const auto seconds = secondsFromText(*date)) return PropertyList::date(*seconds);
    }
  }
  if (const Json* uid = onlyMember(value, "$uid"); uid != nullptr && uid->is_number_unsigned()) {
    return PropertyList::uid(uid->get<std::uint64_t>());
  }
  if (const Json* real = onlyMember(value, "$real"); real != nullptr && real->is_string()) {
    const auto& text = real->get_ref<const std::string&>();
    if (text == "nan") return PropertyList::real(std::nan(""));
    if (text == "inf") return PropertyList::real(kInfinity);
    if (text == "-inf") return PropertyList::real(-kInfinity);
  }
  return std::nullopt;
}

Json jsonFromScalar(const PropertyList& value) {
  switch (value.type()) {
    case PropertyList::Type::String:
      return std::string(*value.stringView());
    case PropertyList::Type::Boolean:
      return *value.boolean();
    case PropertyList::Type::Integer:
      if (const auto number = value.integer()) return *number;
      return *value.unsignedInteger();
    case PropertyList::Type::Real: {
      const double number = *value.real();
      if (std::isfinite(number)) return number;
      return {{"$real", std::isnan(number) ? "nan" : number > 0 ? "inf" : "-inf"}};
    }
    case PropertyList::Type::Date: {
      const double seconds = *value.date();
      if (auto text = isoDateText(seconds)) return {{"$date", *std::move(text)}};
      return {{"$date", jsonFromScalar(PropertyList::real(seconds))}};
    }
    case PropertyList::Type::Data:
      return {{"$data", base64(*value.data())}};
    case PropertyList::Type::UID:
      return {{"$uid", *value.uid()}};
    default:
      return nullptr;
  }
}

// A reader's stack: how deep brackets nest outside of strings.
std::size_t nesting(std::string_view text) {
  std::size_t depth = 0;
  std::size_t deepest = 0;
  bool inString = false;
  for (std::size_t i = 0; i < text.size(); ++i) {
    const char c = text[i];
    if (inString) {
      if (c == '\\') ++i;
      if (c == '"') inString = false;
    } else if (c == '"') {
      inString = true;
    } else if (c == '[' || c == '{') {
      deepest = std::max(deepest, ++depth);
    } else if ((c == ']' || c == '}') && depth > 0) {
      --depth;
    }
  }
  return deepest;
}

class JsonTreeWriter {
 public:
  explicit JsonTreeWriter(const std::function<void(std::string_view)>& write) : _write(write) {}

  void value(const PropertyList& value, std::size_t depth) {
    if (value.count() == 0 || !(value.isArray() || value.isDictionary())) {
      _write(value.isArray() ? "[]" : value.isDictionary() ? "{}" : jsonLine(jsonFromScalar(value)));
      return;
    }
    std::string_view separator = "\n";
    if (value.isArray()) {
      _write("[");
      for (const PropertyList& element : value.elements()) {
        _write(separator);
        indent(depth + 1);
        this->value(element, depth + 1);
        separator = ",\n";
      }
    } else {
      _write("{");
      for (const auto member : value.members()) {
        _write(separator);
        indent(depth + 1);
        _write(jsonLine(std::string(member.key)) + ": ");
        this->value(member.value, depth + 1);
        separator = ",\n";
      }
    }
    _write("\n");
    indent(depth);
    _write(value.isArray() ? "]" : "}");
  }

 private:
  // Deep nesting gets no deeper indentation: the output would grow with the square of the depth.
  void indent(std::size_t depth) { _write(std::string(2 * std::min<std::size_t>(depth, 32), ' ')); }

  const std::function<void(std::string_view)>& _write;
};

}  // namespace

std::string jsonText(const Json& value) {
  return value.dump(2, ' ', false, Json::error_handler_t::replace);
}

std::string jsonLine(const Json& value) {
  return value.dump(-1, ' ', false, Json::error_handler_t::replace);
}

std::optional<Json> parseJson(std::string_view text, ErrorOut error) {
  if (nesting(text) > kDeepest) {
    setError(error, Error(std::string(kJsonErrorDomain), 1, "it nests deeper than 512 levels"));
    return std::nullopt;
  }
  try {
    return Json::parse(text);
  } catch (const nlohmann::json::exception& failure) {
    std::string what = failure.what();
    if (const std::size_t at = what.find("] "); at != std::string::npos) what.erase(0, at + 2);
    setError(error, Error(std::string(kJsonErrorDomain), 1, what));
    return std::nullopt;
  }
}

PropertyList propertyListFromJson(const Json& value) {
  if (auto special = tagged(value)) return *std::move(special);
  switch (value.type()) {
    case Json::value_t::object: {
      PropertyList dictionary = PropertyList::dictionary();
      for (const auto& [key, member] : value.items()) {
        if (!member.is_null()) dictionary.set(key, propertyListFromJson(member));
      }
      return dictionary;
    }
    case Json::value_t::array: {
      PropertyList array = PropertyList::array();
      for (const Json& element : value) {
        if (!element.is_null()) array.append(propertyListFromJson(element));
      }
      return array;
    }
    case Json::value_t::string:
      return PropertyList(value.get_ref<const std::string&>());
    case Json::value_t::boolean:
      return PropertyList(value.get<bool>());
    case Json::value_t::number_integer:
      return PropertyList::integer(value.get<std::int64_t>());
    case Json::value_t::number_unsigned:
      return PropertyList::unsignedInteger(value.get<std::uint64_t>());
    case Json::value_t::number_float:
      return PropertyList::real(value.get<double>());
    default:
      return PropertyList("");
  }
}

Json jsonFromPropertyList(const PropertyList& value) {
  if (value.isDictionary()) {
    Json object = Json::object();
    for (const auto member : value.members()) {
      object.get_ref<Json::object_t&>().emplace_back(std::string(member.key), jsonFromPropertyList(member.value));
    }
    return object;
  }
  if (value.isArray()) {
    Json array = Json::array();
    for (const PropertyList& element : value.elements()) array.push_back(jsonFromPropertyList(element));
    return array;
  }
  return jsonFromScalar(value);
}

void writePropertyListAsJson(const PropertyList& value, const std::function<void(std::string_view)>& write) {
  JsonTreeWriter(write).value(value, 0);
  write("\n");
}

Json accountDocuments(std::vector<DovelMutableAccountInfo> accounts) {
  std::sort(accounts.begin(), accounts.end(), [](const auto& a, const auto& b) { return a.zelkID() < b.zelkID(); });
  Json documents = Json::array();
  for (const DovelMutableAccountInfo& account : accounts) {
    documents.push_back({{"zelkID", orNull(account.zelkID())},
                         {"qenID", account.qenID() ? jsonFromPropertyList(*account.qenID()) : Json(nullptr)},
                         {"altQenID", orNull(account.altQenID())}});
  }
  return documents;
}

std::optional<std::string> isoDateText(double secondsSince2001) {
  const double whole = std::floor(secondsSince2001);
  const double since1970 = whole + kSecondsFrom1970;
  if (!(since1970 >= -62135596800.0 && since1970 <= 253402300799.0)) return std::nullopt;
  const auto seconds = static_cast<std::int64_t>(since1970);
  const std::int64_t days = (seconds >= 0 ? seconds : seconds - 86399) / 86400;
  const auto rest = static_cast<int>(seconds - days * 86400);
  const CalendarDate date = dateFromDays(days);
  std::array<char, 48> text{};
  std::snprintf(text.data(), text.size(), "%04d-%02u-%02uT%02d:%02d:%02d", static_cast<int>(date.year), date.month,
                date.day, rest / 3600, rest / 60 % 60, rest % 60);
  std::string made = text.data();
  if (const double fraction = secondsSince2001 - whole; fraction > 0) {
    std::snprintf(text.data(), text.size(), "%.6f", std::min(fraction, 0.999999));
    made += std::string_view(text.data()).substr(1);
    while (made.ends_with('0')) made.pop_back();
    if (made.ends_with('.')) made.pop_back();
  }
  return made + "Z";
}

}  // namespace appsync
