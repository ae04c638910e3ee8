#include "platform/log_format.h"

#include <array>
#include <cstdio>

namespace appsync {

namespace {

std::string fractionText(double value) {
  std::array<char, 400> digits{};
  const int length = std::snprintf(digits.data(), digits.size(), "%f", value);
  return {digits.data(), static_cast<std::size_t>(length)};
}

std::string argumentText(const LogArgument& argument) {
  switch (argument.kind) {
    case LogArgumentKind::Signed:
      return std::to_string(argument.integer);
    case LogArgumentKind::Unsigned:
      return std::to_string(static_cast<std::uint64_t>(argument.integer));
    case LogArgumentKind::Character:
      return std::string(1, static_cast<char>(argument.integer));
    case LogArgumentKind::Fraction:
      return fractionText(argument.fraction);
    case LogArgumentKind::Text:
      return std::string(argument.text);
    case LogArgumentKind::Object:
      break;
  }
  return argument.describeObject(argument.object);
}

}  // namespace

std::string renderLogFormat(std::string_view format, const LogArgument* arguments) {
  std::string text;
  while (!format.empty()) {
    const std::size_t percent = format.find('%');
    text += format.substr(0, percent);
    if (percent == std::string_view::npos) break;
    format.remove_prefix(percent);
    const std::string_view directive = log_detail::directiveAt(format);
    format.remove_prefix(directive.size());
    text += directive == "%%" ? "%" : argumentText(*arguments);
    if (directive != "%%") ++arguments;
  }
  return text;
}

}  // namespace appsync
