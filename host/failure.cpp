#include "host/failure.h"

#include <array>

namespace appsync {

namespace {

constexpr std::array kKinds{
    FailureKind{FailureCode::CommandLine, "command-line", kStatusCommandLine},
    FailureKind{FailureCode::UnknownFault, "unknown-fault", kStatusCommandLine},
    FailureKind{FailureCode::UnknownSetting, "unknown-setting", kStatusCommandLine},
    FailureKind{FailureCode::BadValue, "bad-value", kStatusCommandLine},
    FailureKind{FailureCode::HostUnusable, "host-unusable", kStatusUnusable},
    FailureKind{FailureCode::InputUnusable, "input-unusable", kStatusUnusable},
    FailureKind{FailureCode::OutputUnwritable, "output-unwritable", kStatusUnusable},
    FailureKind{FailureCode::DeviceMissing, "device-missing", kStatusUnusable},
    FailureKind{FailureCode::DeviceInUse, "device-in-use", kStatusUnusable},
    FailureKind{FailureCode::DeviceUnusable, "device-unusable", kStatusUnusable},
    FailureKind{FailureCode::SeedRefused, "seed-refused", kStatusUnusable},
    FailureKind{FailureCode::ScriptRefused, "script-refused", kStatusUnusable},
    FailureKind{FailureCode::PluginUnusable, "plugin-unusable", kStatusUnusable},
    FailureKind{FailureCode::PluginABI, "plugin-abi", kStatusUnusable},
    FailureKind{FailureCode::Internal, "internal", kStatusUnusable},
};

std::string ownText(const Error& error) {
  return error.text().empty() ? error.domain() + " " + std::to_string(error.code()) : error.text();
}

}  // namespace

std::span<const FailureKind> failureKinds() {
  return kKinds;
}

const FailureKind& failureKind(FailureCode code) {
  for (const FailureKind& kind : kKinds) {
    if (kind.code == code) return kind;
  }
  return kKinds.back();
}

Failure failureFrom(FailureCode code, const Error& error, const std::string& otherHint) {
  Failure failure{code, "", ""};
  for (std::optional<Error> one = error; one; one = one->underlyingError()) {
    const std::string text = ownText(*one);
    const std::size_t end = text.rfind("; ");
    failure.message += (failure.message.empty() ? "" : ": ") + text.substr(0, end);
    if (end != std::string::npos && failure.hint.empty()) failure.hint = text.substr(end + 2);
  }
  if (failure.hint.empty()) failure.hint = otherHint;
  return failure;
}

std::string reasonText(const Error& error) {
  std::string text;
  for (std::optional<Error> one = error; one; one = one->underlyingError()) {
    text += (text.empty() ? "" : ": ") + ownText(*one);
  }
  return text;
}

}  // namespace appsync
