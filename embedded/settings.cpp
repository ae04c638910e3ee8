#include "embedded/settings.h"

#include <algorithm>

namespace appsync {

namespace {

constexpr char kSettingsRecord[] = "settings";

// What a setting takes, in the order in which settings are shown.
struct Setting {
  const char* key;
  bool isBoolean;  // otherwise an integer from 0 to 2
};

constexpr Setting kSettings[] = {
    {TessaFeatureAppInstallationAllowed, false},
    {TessaFeatureAppRemovalAllowed, false},
    {kSettingCreateAppPlaceholders, true},
};

const Setting* settingForKey(const std::string& key, ErrorOut error) {
  const auto* const found = std::find_if(std::begin(kSettings), std::end(kSettings),
                                         [&](const Setting& setting) { return setting.key == key; });
  if (found != std::end(kSettings)) return found;
  std::string known;
  for (const Setting& setting : kSettings) known += (known.empty() ? "" : ", ") + std::string(setting.key);
  setError(error, Error(std::string(kSettingsErrorDomain), kSettingsUnknownKey,
                        "There is no setting \"" + key + "\"; there are " + known));
  return nullptr;
}

bool takes(const Setting& setting, const PropertyList& value) {
  if (setting.isBoolean) return value.boolean().has_value();
  const std::optional<std::int64_t> number = value.integer();
  return number && *number >= 0 && *number <= 2;
}

PropertyList defaultValue(const Setting& setting) {
  return setting.isBoolean ? PropertyList(true) : PropertyList::integer(0);
}

Error badValue(const Setting& setting, const std::string& value) {
  return Error(std::string(kSettingsErrorDomain), kSettingsBadValue,
               "The setting " + std::string(setting.key) + " cannot be \"" + value + "\"; it takes " +
                   (setting.isBoolean ? "yes or no" : "0 (not set), 1 (yes) or 2 (no)"));
}

// What the record says of a setting, or what holds without one.
PropertyList valueIn(const std::optional<PropertyList>& record, const Setting& setting) {
  const PropertyList* kept = record ? record->find(setting.key) : nullptr;
  return kept != nullptr && takes(setting, *kept) ? *kept : defaultValue(setting);
}

class EmbeddedVaultryManager : public VaultryManager {
 public:
  explicit EmbeddedVaultryManager(EmbeddedSettings& settings) : _settings(settings) {}

  bool dovelShouldCreateAppPlaceholdersWithError(ErrorOut error) override {
    const std::optional<PropertyList> value = _settings.value(kSettingCreateAppPlaceholders, error);
    if (value && value->boolean().value_or(false)) return true;
    setError(error, Error(std::string(kSettingsErrorDomain), kSettingsNoPlaceholders,
                          "The setting CreateAppPlaceholders is no, which forbids placeholders for restored "
                          "applications; set it to yes to allow them"));
    return false;
  }

 private:
  EmbeddedSettings& _settings;
};

}  // namespace

TessaBoolean EmbeddedSettings::effectiveBoolValueForSetting(const std::string& feature) {
  const std::optional<PropertyList> kept = value(feature, nullptr);
  const std::optional<std::int64_t> number = kept ? kept->integer() : std::nullopt;
  return number ? static_cast<TessaBoolean>(*number) : TessaBoolean::NotSet;
}

std::unique_ptr<VaultryManager> EmbeddedSettings::makeVaultryManager() {
  return std::make_unique<EmbeddedVaultryManager>(*this);
}

std::vector<std::string> EmbeddedSettings::keys() {
  std::vector<std::string> keys;
  for (const Setting& setting : kSettings) keys.emplace_back(setting.key);
  return keys;
}

PropertyList EmbeddedSettings::all() const {
  return settingsStatus(_store);
}

std::optional<PropertyList> EmbeddedSettings::value(const std::string& key, ErrorOut error) const {
  const Setting* setting = settingForKey(key, error);
  if (setting == nullptr) return std::nullopt;
  return valueIn(_store.load(kSettingsRecord, nullptr), *setting);
}

bool EmbeddedSettings::setValue(const std::string& key, const PropertyList& value, ErrorOut error) {
  return setValues(PropertyList::dictionary({{key, value}}), error);
}

bool EmbeddedSettings::setValues(const PropertyList& values, ErrorOut error) {
  if (!checkSettingsSeed(values, error)) return false;
  const MutexLock lock(_mutex);
  PropertyList record = settingsStatus(_store);
  for (const PropertyList::Member& member : values.members()) record.set(member.key, member.value);
  return _store.save(kSettingsRecord, record, error);
}

std::optional<PropertyList> EmbeddedSettings::valueFromText(const std::string& key, const std::string& text,
                                                            ErrorOut error) {
  const Setting* setting = settingForKey(key, error);
  if (setting == nullptr) return std::nullopt;
  if (setting->isBoolean && (text == "yes" || text == "no")) return PropertyList(text == "yes");
  if (!setting->isBoolean && (text == "0" || text == "1" || text == "2")) return PropertyList::integer(text[0] - '0');
  setError(error, badValue(*setting, text));
  return std::nullopt;
}

PropertyList settingsStatus(const StateStore& store) {
  const std::optional<PropertyList> record = store.load(kSettingsRecord, nullptr);
  PropertyList all = PropertyList::dictionary();
  for (const Setting& setting : kSettings) all.set(setting.key, valueIn(record, setting));
  return all;
}

bool checkSettingsSeed(const PropertyList& settings, ErrorOut error) {
  if (!settings.isDictionary()) {
    setError(error, Error(std::string(kSettingsErrorDomain), kSettingsBadValue,
                          "The settings must be a dictionary of settings and their values"));
    return false;
  }
  return std::ranges::all_of(settings.members(), [&](const PropertyList::Member& member) {
    const Setting* setting = settingForKey(std::string(member.key), error);
    if (setting == nullptr) return false;
    if (!takes(*setting, member.value)) setError(error, badValue(*setting, member.value.description()));
    return takes(*setting, member.value);
  });
}

}  // namespace appsync
