// Log formats, checked against their arguments when the program is compiled.
//
// Directives: %{public}@ and %@ take anything with a description (absent values print as "(null)"); %s text; %d, %ld
// and %lld signed integers and booleans (as 0 or 1); %lu and %llu unsigned integers; %c one character; %f and %lf
// fractions (six digits). "%%" is a percent sign.
#pragma once

#include <array>
#include <concepts>
#include <cstdint>
#include <initializer_list>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <type_traits>
#include <vector>

namespace appsync {

// --- descriptions ---------------------------------------------------------------------------------------------------

template <class T>
concept HasDescription = requires(const T& value) {
  { value.description() } -> std::convertible_to<std::string>;
};

inline std::string describe(std::string_view text) {
  return std::string(text);
}
template <HasDescription T>
std::string describe(const T& value) {
  return value.description();
}
template <class T>
std::string describe(const std::optional<T>& value);
template <class T>
std::string describe(const std::shared_ptr<T>& value);
template <class T>
std::string describe(const std::vector<T>& values);
template <class T>
std::string describe(const std::set<T>& values);
inline std::string describe(std::nullopt_t) {
  return "(null)";
}

namespace log_detail {

template <class Collection>
std::string describeAll(const Collection& values) {
  std::string text = "[";
  for (const auto& value : values) {
    if (text.size() > 1) text += ", ";
    if (text.size() > 16384) return text + "…]";
    text += describe(value);
  }
  return text + "]";
}

}  // namespace log_detail

template <class T>
std::string describe(const std::optional<T>& value) {
  return value ? describe(*value) : "(null)";
}
template <class T>
std::string describe(const std::shared_ptr<T>& value) {
  return value ? describe(*value) : "(null)";
}
template <class T>
std::string describe(const std::vector<T>& values) {
  return log_detail::describeAll(values);
}
template <class T>
std::string describe(const std::set<T>& values) {
  return log_detail::describeAll(values);
}

// --- arguments ------------------------------------------------------------------------------------------------------

enum class LogArgumentKind : std::uint8_t { Signed, Unsigned, Character, Fraction, Text, Object };

template <class T>
consteval LogArgumentKind logArgumentKind() {
  using Plain = std::remove_cvref_t<T>;
  if constexpr (std::same_as<Plain, char>) {
    return LogArgumentKind::Character;
  } else if constexpr (std::floating_point<Plain>) {
    return LogArgumentKind::Fraction;
  } else if constexpr (std::same_as<Plain, bool> || std::signed_integral<Plain>) {
    return LogArgumentKind::Signed;
  } else if constexpr (std::unsigned_integral<Plain>) {
    return LogArgumentKind::Unsigned;
  } else if constexpr (std::convertible_to<const Plain&, std::string_view>) {
    return LogArgumentKind::Text;
  } else {
    return LogArgumentKind::Object;
  }
}

// One argument, by reference: valid for the call it is made for. Objects are described only when rendered.
struct LogArgument {
  template <class T>
  explicit LogArgument(const T& value) : kind(logArgumentKind<T>()) {
    if constexpr (logArgumentKind<T>() == LogArgumentKind::Fraction) {
      fraction = static_cast<double>(value);
    } else if constexpr (logArgumentKind<T>() == LogArgumentKind::Object) {
      object = &value;
      describeObject = [](const void* pointer) { return describe(*static_cast<const T*>(pointer)); };
    } else if constexpr (logArgumentKind<T>() == LogArgumentKind::Text) {
      text = std::string_view(value);
    } else {
      integer = static_cast<std::int64_t>(value);  // NOLINT(bugprone-signed-char-misuse): printed as it came
    }
  }

  LogArgumentKind kind;
  std::int64_t integer = 0;
  double fraction = 0;
  std::string_view text;
  const void* object = nullptr;
  std::string (*describeObject)(const void*) = nullptr;
};

namespace log_detail {

// The directive at the start of `rest` (which begins with '%'), or an empty view when there is none that is known.
constexpr std::string_view directiveAt(std::string_view rest) {
  constexpr std::string_view kKnown[] = {"%{public}@", "%lld", "%llu", "%ld", "%lu", "%lf",
                                         "%@",         "%d",   "%c",   "%s",  "%f",  "%%"};
  for (const std::string_view known : kKnown) {
    if (rest.starts_with(known)) return known;
  }
  return {};
}

constexpr bool directiveTakes(std::string_view directive, LogArgumentKind kind) {
  switch (directive.back()) {
    case '@':
      return kind == LogArgumentKind::Object || kind == LogArgumentKind::Text;
    case 'd':
      return kind == LogArgumentKind::Signed;
    case 'u':
      return kind == LogArgumentKind::Unsigned;
    case 'c':
      return kind == LogArgumentKind::Character;
    case 'f':
      return kind == LogArgumentKind::Fraction;
    default:
      return kind == LogArgumentKind::Text;
  }
}

// Never defined: reaching one of them while a format is checked is the compile error.
void formatHasAnUnknownDirective();
void formatDirectiveDoesNotFitItsArgument();
void formatAndArgumentsDifferInNumber();

}  // namespace log_detail

template <class... Arguments>
class LogFormat {
 public:
  // NOLINTNEXTLINE(google-explicit-constructor): a literal is to become a format where it stands
  consteval LogFormat(const char* literal) : text(literal) {
    constexpr std::size_t kCount = sizeof...(Arguments);
    constexpr std::array<LogArgumentKind, kCount + 1> kKinds{logArgumentKind<Arguments>()..., LogArgumentKind::Object};
    std::size_t used = 0;
    for (std::size_t at = text.find('%'); at != std::string_view::npos; at = text.find('%', at)) {
      const std::string_view directive = log_detail::directiveAt(text.substr(at));
      if (directive.empty()) log_detail::formatHasAnUnknownDirective();
      at += directive.size();
      if (directive == "%%") continue;
      if (used == kCount) log_detail::formatAndArgumentsDifferInNumber();
      if (!log_detail::directiveTakes(directive, kKinds[used])) log_detail::formatDirectiveDoesNotFitItsArgument();
      ++used;
    }
    if (used != kCount) log_detail::formatAndArgumentsDifferInNumber();
  }

  std::string_view text;
};

// The format with each directive replaced. The number and kinds of the arguments must fit, as `LogFormat` checks.
std::string renderLogFormat(std::string_view format, const LogArgument* arguments);

// Renders a path or another text of the system by its format: makeText("%s/%@.png", directory, id).
template <class... Arguments>
std::string makeText(LogFormat<std::type_identity_t<Arguments>...> format, const Arguments&... arguments) {
  const std::array<LogArgument, sizeof...(Arguments)> list{LogArgument(arguments)...};
  return renderLogFormat(format.text, list.data());
}

}  // namespace appsync
