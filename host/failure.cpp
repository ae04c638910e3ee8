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
  const std::string text = reasonText(error);
  const std::size_t at = text.rfind("; ");
  if (at == std::string::npos) return {code, text, otherHint};
  return {code, text.substr(0, at), text.substr(at + 2)};
}

std::string reasonText(const Error& error) {
  std::string text;
  for (std::optional<Error> one = error; one; one = one->underlyingError()) {
    if (!text.empty()) text += ": ";
    text += one->text().empty() ? one->domain() + " " + std::to_string(one->code()) : one->text();
  }
  return text;
}

}  // namespace appsync
