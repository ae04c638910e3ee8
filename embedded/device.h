// A whole device in a directory.
//
// DIR/var/mobile/… are the device's own absolute paths; DIR/state holds the services' records, DIR/lock keeps other
// processes out. What one process leaves behind is what the next one finds.
#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "embedded/disk.h"
#include "embedded/executor.h"
#include "embedded/log_sink.h"
#include "platform/error.h"
#include "platform/platform.h"
#include "platform/property_list.h"

namespace appsync {

class EmbeddedCoordination;
class EmbeddedDeviceService;
class EmbeddedFileManager;
class EmbeddedHomeScreen;
class EmbeddedInstaller;
class EmbeddedNotificationCenter;
class EmbeddedNotificationService;
class EmbeddedRegistry;
class EmbeddedSettings;
class EmbeddedWaiting;

// The domain of errors that keep a device from being opened: codes below.
inline constexpr std::string_view kDeviceErrorDomain = "DeviceError";
inline constexpr std::int64_t kDeviceInUse = 1;     // another process works on it
inline constexpr std::int64_t kDeviceUnusable = 2;  // cannot be made, read or written, or is damaged beyond repair
inline constexpr std::int64_t kDeviceMissing = 3;   // only where it must not be made: nothing is there
inline constexpr std::int64_t kDeviceBadSeed = 4;   // what is to be put on it is not in order

// Where the client keeps the todo list of the last sync.
inline constexpr char kTodoList[] = "/var/mobile/Library/ApplicationSync/TarvoStuff/ApplicationsSync.plist";

struct DeviceOptions {
  std::string directory;                                // made with everything a device has when it is not there
  std::string mainBundleIdentifier = "com.zelk.dovel";  // of the process that hosts the client
  LogSink* sink = nullptr;                              // must outlive the device; null: nobody listens
  Disk* disk = nullptr;                                 // must outlive the device; null: the real one
  std::function<std::unique_ptr<Executor>()> executor;  // empty: threads
  bool timeRunsFast = false;  // waits jump to their deadline once no job of a service can make them ready
};

class Device {
 public:
  // Opens the directory for this process alone, makes what a device has, repairs what a crash left (temporary files,
  // containers that no record names, records that cannot be read) and starts the services; no worker runs before
  // `startWork`. A directory that holds something else than a device is left alone. Null, with an error.
  static std::unique_ptr<Device> open(const DeviceOptions& options, ErrorOut error);

  // Drains and destroys the services. Every client of them has been destroyed before.
  ~Device();

  // The bare services. Valid as long as the device.
  Platform platform();

  // Lets the coordinators that an earlier process left go on with their work.
  void startWork();

  // No callback of a service runs any more when this returns, and none is to come. For the end, after the client's.
  void drain();

  // What opening the device has mended that a person should know of, one line each: records that could not be read and
  // were moved aside. The same lines went to the log sink.
  const std::vector<std::string>& repairs() const;

  // What is on the device: a dictionary with the keys "installed", "placeholders", "coordinators", "todo",
  // "homeScreen", "uninstalled", "syncing", "settings", and, where there are such files, "restoreState" and "lastSync".
  // Reads only, takes no lock, makes nothing: may be asked while another process works on the device.
  static std::optional<PropertyList> status(const std::string& directory, ErrorOut error);

  // Puts the device into a state: the keys of `status` in any selection ("schema" and "ok" of its JSON document are
  // passed over); what is named is added or replaced. Checks everything before it changes anything; false, with an
  // error that names the entry and what would mend it.
  bool seed(const PropertyList& state, ErrorOut error);

  EmbeddedCoordination& coordination();
  EmbeddedDeviceService& deviceService();
  EmbeddedFileManager& files();
  EmbeddedHomeScreen& homeScreen();
  EmbeddedInstaller& installer();
  EmbeddedNotificationCenter& notificationCenter();
  EmbeddedNotificationService& notifications();
  EmbeddedRegistry& registry();
  EmbeddedSettings& settings();
  EmbeddedWaiting& waiting();

 private:
  struct Parts;
  explicit Device(std::unique_ptr<Parts> parts);
  std::unique_ptr<Parts> _parts;
};

}  // namespace appsync
