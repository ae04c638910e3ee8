// The device's settings, and the services that answer from them: what profiles allow, and whether the backup service
// agrees to placeholders.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "embedded/state_store.h"
#include "platform/device_policy.h"
#include "platform/error.h"
#include "platform/property_list.h"
#include "platform/thread_annotations.h"
#include "platform/vaultry.h"

namespace appsync {

inline constexpr std::string_view kSettingsErrorDomain = "SettingsError";
inline constexpr std::int64_t kSettingsUnknownKey = 1;
inline constexpr std::int64_t kSettingsBadValue = 2;
inline constexpr std::int64_t kSettingsNoPlaceholders = 3;  // the backup service's NO

inline constexpr char kSettingCreateAppPlaceholders[] = "CreateAppPlaceholders";

// Any thread. Changes are seen at once, and by the next process. `store` must outlive this.
class EmbeddedSettings : public TessaProfileConnection, public VaultryService {
 public:
  explicit EmbeddedSettings(StateStore& store) : _store(store) {}

  TessaBoolean effectiveBoolValueForSetting(const std::string& feature) override;
  std::unique_ptr<VaultryManager> makeVaultryManager() override;

  // The names of all settings, in the order in which they are shown.
  static std::vector<std::string> keys();

  // All settings: "AppInstallationAllowed" and "AppRemovalAllowed" as integers (0 not set, 1 yes, 2 no),
  // "CreateAppPlaceholders" as a boolean.
  PropertyList all() const;
  // None, with an error, for a key that nobody knows.
  std::optional<PropertyList> value(const std::string& key, ErrorOut error) const;
  // False, with an error that says what the key takes, when it does not take this, or it cannot be kept.
  bool setValue(const std::string& key, const PropertyList& value, ErrorOut error);
  // Several at once, in one step: a dictionary; all or none.
  bool setValues(const PropertyList& values, ErrorOut error);
  // What a person writes for a value: 0, 1, 2, or yes, no.
  static std::optional<PropertyList> valueFromText(const std::string& key, const std::string& text, ErrorOut error);

 private:
  StateStore& _store;
  mutable Mutex _mutex;  // around reading, changing and writing the record
};

// Part of the device's status: all settings, as `all` answers them.
PropertyList settingsStatus(const StateStore& store);
// Whether `setValues` takes this; false, with an error that says what it does not take.
bool checkSettingsSeed(const PropertyList& settings, ErrorOut error);

}  // namespace appsync
