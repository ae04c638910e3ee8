// Why a command could not be carried out at all.
#pragma once

#include <cstdint>
#include <span>
#include <string>
#include <string_view>

#include "platform/error.h"

namespace appsync {

// Exit statuses of the program.
inline constexpr int kStatusDone = 0;
inline constexpr int kStatusSomethingFailed = 1;
inline constexpr int kStatusCommandLine = 2;
inline constexpr int kStatusUnusable = 3;

enum class FailureCode : std::uint8_t {
  CommandLine,
  UnknownFault,
  UnknownSetting,
  BadValue,
  HostUnusable,
  InputUnusable,
  OutputUnwritable,
  DeviceMissing,
  DeviceInUse,
  DeviceUnusable,
  SeedRefused,
  ScriptRefused,
  PluginUnusable,
  PluginABI,
  Internal,
};

// One row for each code: what scripts see of it.
struct FailureKind {
  FailureCode code;
  std::string_view name;  // in the JSON; never changes
  int status;             // the exit status that goes with it
};

std::span<const FailureKind> failureKinds();
const FailureKind& failureKind(FailureCode code);

struct Failure {
  FailureCode code = FailureCode::Internal;
  std::string message;  // what is wrong, naming the file or the option
  std::string hint;     // what would mend it
};

// The failure that an error stands for. What a text says after its last "; " is what would mend it; of an error and
// those that caused it the first that says so gives the hint.
Failure failureFrom(FailureCode code, const Error& error, const std::string& otherHint);

// Why something failed, for a person: the error's text and those of the errors that caused it.
std::string reasonText(const Error& error);

}  // namespace appsync
