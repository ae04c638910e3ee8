// `dovel settings`: show all settings, show one, or change one.
#include "embedded/settings.h"
#include "host/commands.h"
#include "host/json.h"
#include "host/session.h"

namespace appsync {

namespace {

std::string shown(const PropertyList& value) {
  if (const std::optional<bool> flag = value.boolean()) return *flag ? "yes" : "no";
  return value.description();
}

Failure settingFailure(const Error& error) {
  const FailureCode code = error.code() == kSettingsUnknownKey ? FailureCode::UnknownSetting : FailureCode::BadValue;
  return failureFrom(code, error, "\"dovel settings --device DIR\" shows every setting and its value");
}

}  // namespace

int runSettings(const SettingsOptions& options, Console& console) {
  Failure failure;
  std::optional<Error> error;
  std::optional<PropertyList> newValue;
  // A wrong key or value is found before the device is touched.
  if (options.key) {
    newValue = EmbeddedSettings::valueFromText(*options.key, options.value.value_or(""), &error);
    if (!newValue && (options.value || error->code() == kSettingsUnknownKey)) {
      return console.fail(settingFailure(*error));
    }
  }
  const auto session = Session::open({.common = options.common, .loadsPlugin = false}, console, failure);
  if (!session) return console.fail(failure);
  EmbeddedSettings& settings = session->device().settings();
  if (newValue && !settings.setValue(*options.key, *newValue, &error)) {
    return console.fail(deviceFailure(options.common.device, *error));
  }
  PropertyList values = settings.all();
  if (options.key) {
    const std::optional<PropertyList> value = settings.value(*options.key, &error);
    if (!value) return console.fail(settingFailure(*error));
    values = PropertyList::dictionary();
    values.set(*options.key, *value);
  }
  const int status = session->exitStatus(kStatusDone);
  if (!session->close(failure)) return console.fail(failure);
  console.document({{"ok", status == kStatusDone}, {"settings", jsonFromPropertyList(values)}});
  for (const auto member : values.members()) console.line(std::string(member.key) + " " + shown(member.value));
  return status;
}

}  // namespace appsync
