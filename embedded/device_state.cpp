// What is on a device, told and put there.
#include <algorithm>
#include <functional>
#include <utility>

#include "embedded/coordination.h"
#include "embedded/device.h"
#include "embedded/device_directory.h"
#include "embedded/file_manager.h"
#include "embedded/home_screen.h"
#include "embedded/installer.h"
#include "embedded/notifications.h"
#include "embedded/registry.h"
#include "embedded/settings.h"
#include "embedded/state_store.h"

namespace appsync {

namespace {

constexpr char kRestoreState[] = "/var/mobile/Library/ApplicationSync/RestoreState.plist";
constexpr char kLastSyncList[] = "/var/mobile/Library/ApplicationSync/LastSyncAppState.plist";

// --- telling --------------------------------------------------------------------------------------------------------

std::optional<PropertyList> readPropertyList(EmbeddedFileManager& files, const char* path) {
  const std::optional<Bytes> bytes = files.readFile(path, nullptr);
  return bytes ? parsePropertyList(*bytes, nullptr) : std::nullopt;
}

// The host writes this file: an entry shows of what is asked for whatever it has.
PropertyList todoStatus(EmbeddedFileManager& files) {
  PropertyList shown = PropertyList::array();
  const std::optional<PropertyList> todo = readPropertyList(files, kTodoList);
  if (!todo) return shown;
  for (const PropertyList& entry : todo->elements()) {
    PropertyList fields = PropertyList::dictionary();
    for (const char* key : {"identifier", "operation"}) {
      const PropertyList* value = entry.find(key);
      if (value != nullptr && value->isString()) fields.set(key, *value);
    }
    shown.append(std::move(fields));
  }
  return shown;
}

PropertyList stringsOf(const PropertyList& list) {
  PropertyList strings = PropertyList::array();
  for (const PropertyList& element : list.elements()) {
    if (element.isString()) strings.append(element);
  }
  return strings;
}

bool isSyncing(const StateStore& store) {
  const PropertyList states = notificationsStatus(store);
  const PropertyList* state = states.find(kSyncStateNotification);
  return state != nullptr && state->unsignedInteger().value_or(0) != 0;
}

}  // namespace

std::optional<PropertyList> Device::status(const std::string& directory, ErrorOut error) {
  Disk disk;
  const std::optional<DeviceDirectory> found = lookAtDeviceDirectory(directory, disk, error);
  if (!found) return std::nullopt;
  if (found == DeviceDirectory::Missing || found == DeviceDirectory::Empty) {
    setError(error, deviceError(kDeviceMissing, "There is no device in \"" + directory +
                                                    "\"; name the directory of a device, or make one with a sync"));
    return std::nullopt;
  }
  if (found == DeviceDirectory::SomethingElse) {
    setError(error, notADeviceError(directory));
    return std::nullopt;
  }
  EmbeddedFileManager files(directory, disk);
  std::optional<Error> reason;
  if (!canListStateRecords(files, &reason)) {
    setError(error, unreadableRecordsError(directory, *reason));
    return std::nullopt;
  }
  const std::unique_ptr<StateStore> store = makeFileStateStore(files);
  PropertyList status = PropertyList::dictionary();
  status.set("installed", registryInstalledStatus(*store));
  status.set("placeholders", registryPlaceholdersStatus(*store));
  status.set("coordinators", coordinationStatus(*store));
  status.set("todo", todoStatus(files));
  status.set("homeScreen", homeScreenStatus(*store));
  status.set("uninstalled", uninstalledStatus(*store));
  status.set("syncing", isSyncing(*store));
  status.set("settings", settingsStatus(*store));
  const std::optional<PropertyList> restoreState = readPropertyList(files, kRestoreState);
  if (restoreState && restoreState->isDictionary()) status.set("restoreState", *restoreState);
  const std::optional<PropertyList> lastSync = readPropertyList(files, kLastSyncList);
  if (lastSync && lastSync->isArray()) status.set("lastSync", stringsOf(*lastSync));
  return status;
}

// --- putting there --------------------------------------------------------------------------------------------------

namespace {

bool isBadSeed(const std::string& text, ErrorOut error) {
  setError(error, deviceError(kDeviceBadSeed, text));
  return false;
}

bool checkSyncing(const PropertyList& syncing, ErrorOut error) {
  return syncing.boolean() || isBadSeed("it must be true or false", error);
}

// A file that is written as it is given: whatever a host can send is to be put there too.
bool checkFile(const PropertyList& value, PropertyListFormat format, ErrorOut error) {
  return serializePropertyList(value, format, error).has_value();
}

bool checkTodo(const PropertyList& todo, ErrorOut error) {
  if (!todo.isArray()) return isBadSeed("it must be an array of entries", error);
  const auto entries = todo.elements();
  for (std::size_t i = 0; i < entries.size(); ++i) {
    const std::string entry = "entry " + std::to_string(i + 1) + " ";
    if (!entries[i].isDictionary()) {
      return isBadSeed(entry + R"(must be a dictionary with "identifier" and "operation")", error);
    }
    const PropertyList* operation = entries[i].find("operation");
    if (operation != nullptr && !operation->isString()) {
      return isBadSeed("the \"operation\" of " + entry + "must be a string, such as \"install\"", error);
    }
  }
  return checkFile(todo, PropertyListFormat::Binary, error);
}

bool checkRestoreState(const PropertyList& state, ErrorOut error) {
  const auto isBad = [&](const std::string& where) {
    return isBadSeed(where + " must be a dictionary: identifiers, each with versions, each with properties", error);
  };
  if (!state.isDictionary()) return isBad("it");
  for (const auto& application : state.members()) {
    const std::string where = "what stands under \"" + std::string(application.key) + "\"";
    if (!application.value.isDictionary()) return isBad(where);
    for (const auto& version : application.value.members()) {
      if (!version.value.isDictionary()) return isBad(where + " and \"" + std::string(version.key) + "\"");
    }
  }
  return checkFile(state, PropertyListFormat::XML, error);
}

bool checkLastSync(const PropertyList& list, ErrorOut error) {
  if (!list.isArray() || stringsOf(list).count() != list.count()) {
    return isBadSeed("it must be an array of identifiers", error);
  }
  return checkFile(list, PropertyListFormat::XML, error);
}

bool writePropertyList(EmbeddedFileManager& files, const std::string& path, const PropertyList& value,
                       PropertyListFormat format, ErrorOut error) {
  const std::optional<Bytes> bytes = serializePropertyList(value, format, error);
  return bytes && files.createDirectory(path.substr(0, path.rfind('/')), true, {}, error) &&
         files.writeFile(path, *bytes, error);
}

// One key of a seed. The order of the table is that of putting things there: coordinators come after the placeholders
// and applications that they are about, the layout after what it orders.
struct SeedPart {
  const char* key;
  bool (*check)(const PropertyList&, ErrorOut);
  bool (*put)(Device&, const PropertyList&, ErrorOut);
};

constexpr SeedPart kSeedParts[] = {
    {"settings", checkSettingsSeed,
     [](Device& device, const PropertyList& value, ErrorOut error) {
       return device.settings().setValues(value, error);
     }},
    {"installed", checkInstalledSeed,
     [](Device& device, const PropertyList& value, ErrorOut error) {
       return seedInstalled(device.registry(), device.files(), value, error);
     }},
    {"placeholders", checkPlaceholdersSeed,
     [](Device& device, const PropertyList& value, ErrorOut error) {
       return seedPlaceholders(device.registry(), value, error);
     }},
    {"coordinators", checkCoordinationSeed,
     [](Device& device, const PropertyList& value, ErrorOut error) {
       return seedCoordination(device.coordination(), value, error);
     }},
    {"uninstalled", checkUninstalledSeed,
     [](Device& device, const PropertyList& value, ErrorOut error) {
       return seedUninstalled(device.installer(), value, error);
     }},
    {"homeScreen", checkHomeScreenSeed,
     [](Device& device, const PropertyList& value, ErrorOut error) {
       return seedHomeScreen(device.homeScreen(), value, error);
     }},
    {"todo", checkTodo,
     [](Device& device, const PropertyList& value, ErrorOut error) {
       return writePropertyList(device.files(), kTodoList, value, PropertyListFormat::Binary, error);
     }},
    {"syncing", checkSyncing,
     [](Device& device, const PropertyList& value, ErrorOut error) {
       return device.notifications().setState(kSyncStateNotification, value.boolean().value_or(false) ? 1 : 0, error);
     }},
    {"restoreState", checkRestoreState,
     [](Device& device, const PropertyList& value, ErrorOut error) {
       return writePropertyList(device.files(), kRestoreState, value, PropertyListFormat::XML, error);
     }},
    {"lastSync", checkLastSync,
     [](Device& device, const PropertyList& value, ErrorOut error) {
       return writePropertyList(device.files(), kLastSyncList, value, PropertyListFormat::XML, error);
     }},
};

bool checkKeys(const PropertyList& seed, ErrorOut error) {
  if (!seed.isDictionary()) return isBadSeed("What is to be put on a device must be a dictionary", error);
  std::string known;
  for (const SeedPart& part : kSeedParts) known += (known.empty() ? "" : ", ") + std::string(part.key);
  for (const auto& member : seed.members()) {
    const bool isKnown = std::any_of(std::begin(kSeedParts), std::end(kSeedParts),
                                     [&](const SeedPart& part) { return part.key == member.key; });
    if (!isKnown && member.key != "schema" && member.key != "ok") {
      return isBadSeed("\"" + std::string(member.key) + "\" is nothing that a device has; there are " + known, error);
    }
  }
  return true;
}

bool wrap(const SeedPart& part, std::int64_t code, const std::string& what, const std::optional<Error>& reason,
          ErrorOut error) {
  setError(error, deviceError(code, "\"" + std::string(part.key) + "\" " + what, reason));
  return false;
}

}  // namespace

bool Device::seed(const PropertyList& state, ErrorOut error) {
  if (!checkKeys(state, error)) return false;
  std::optional<Error> reason;
  for (const SeedPart& part : kSeedParts) {
    const PropertyList* value = state.find(part.key);
    if (value != nullptr && !part.check(*value, &reason)) {
      return wrap(part, kDeviceBadSeed, "cannot be put on a device", reason, error);
    }
  }
  for (const SeedPart& part : kSeedParts) {
    const PropertyList* value = state.find(part.key);
    if (value != nullptr && !part.put(*this, *value, &reason)) {
      return wrap(part, kDeviceUnusable, "could not be put on the device", reason, error);
    }
  }
  return true;
}

}  // namespace appsync
