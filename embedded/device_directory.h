// The directory that a device lives in: telling what it is, making it, and keeping other processes out.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "embedded/disk.h"
#include "platform/error.h"

namespace appsync {

enum class DeviceDirectory : std::uint8_t { Missing, Empty, Device, SomethingElse };

// What is there. None, with an error of the domain "DeviceError", when that cannot be told or it is no directory.
std::optional<DeviceDirectory> lookAtDeviceDirectory(const std::string& directory, Disk& disk, ErrorOut error);

// Makes the directory with everything that a device has, and locks it for this process. The lock, which lasts as long
// as the handle; none, with an error of the domain "DeviceError". What holds something else than a device stays
// untouched.
OwnedFile prepareDeviceDirectory(const std::string& directory, Disk& disk, ErrorOut error);

Error deviceError(std::int64_t code, const std::string& text, const std::optional<Error>& reason = std::nullopt);
Error notADeviceError(const std::string& directory);
Error unreadableRecordsError(const std::string& directory, const Error& reason);

}  // namespace appsync
