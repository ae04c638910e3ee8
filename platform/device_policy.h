// What the device's profiles allow.
#pragma once

#include <cstdint>
#include <string>

namespace appsync {

inline constexpr char TessaFeatureAppInstallationAllowed[] = "AppInstallationAllowed";
inline constexpr char TessaFeatureAppRemovalAllowed[] = "AppRemovalAllowed";

enum class TessaBoolean : std::uint8_t { NotSet = 0, Yes = 1, No = 2 };

// Any thread; never calls back.
class TessaProfileConnection {
 public:
  virtual ~TessaProfileConnection() = default;

  // The value in force for a feature; not set for one that nobody knows.
  virtual TessaBoolean effectiveBoolValueForSetting(const std::string& feature) = 0;
};

}  // namespace appsync
