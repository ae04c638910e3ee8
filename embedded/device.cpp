#include "embedded/device.h"

#include <utility>

#include "embedded/coordination.h"
#include "embedded/device_directory.h"
#include "embedded/device_service.h"
#include "embedded/file_manager.h"
#include "embedded/home_screen.h"
#include "embedded/icons.h"
#include "embedded/installer.h"
#include "embedded/log.h"
#include "embedded/notifications.h"
#include "embedded/registry.h"
#include "embedded/settings.h"
#include "embedded/state_store.h"
#include "embedded/waiting.h"

namespace appsync {

namespace {

constexpr unsigned kThreads = 4;

std::string withoutTrailingSlashes(std::string path) {
  while (path.size() > 1 && path.ends_with('/')) path.pop_back();
  return path;
}

}  // namespace

// What is on the disk, before any service looks at it.
struct DeviceGround {
  std::unique_ptr<Disk> ownDisk;
  Disk& disk;
  OwnedFile lock;
  std::shared_ptr<SinkAccess> sink;
  std::vector<std::string> repairs;
};

// Each service stands below those that it uses, and so is destroyed before them.
struct Device::Parts {
  Parts(DeviceGround&& prepared, const DeviceOptions& options)
      : ground(std::move(prepared)),
        mainBundleIdentifier(options.mainBundleIdentifier),
        files(withoutTrailingSlashes(options.directory), ground.disk),
        store(makeFileStateStore(files)),
        executor(options.executor ? options.executor() : makeThreadExecutor(kThreads)) {}

  DeviceGround ground;
  const std::string mainBundleIdentifier;
  EmbeddedFileManager files;
  std::unique_ptr<StateStore> store;
  std::unique_ptr<Executor> executor;
  EmbeddedWaiting waiting;
  EmbeddedLog log{ground.sink};
  EmbeddedTransactionLog transactionLog{ground.sink};
  EmbeddedSettings settings{*store};
  EmbeddedNotificationCenter notificationCenter{*executor};
  EmbeddedNotificationService notifications{*store, notificationCenter};
  EmbeddedRegistry registry{*store, files, *executor};
  EmbeddedInstaller installer{*store, files, registry};
  EmbeddedHomeScreen homeScreen{*store, registry};
  EmbeddedIconServices icons{files};
  EmbeddedCoordination coordination{*store, files, registry, installer, *executor};
  EmbeddedDeviceService deviceService{*executor};
};

std::unique_ptr<Device> Device::open(const DeviceOptions& options, ErrorOut error) {
  const std::string directory = withoutTrailingSlashes(options.directory);
  auto ownDisk = options.disk == nullptr ? std::make_unique<Disk>() : nullptr;
  Disk& disk = options.disk == nullptr ? *ownDisk : *options.disk;
  DeviceGround ground{std::move(ownDisk),
                      disk,
                      prepareDeviceDirectory(directory, disk, error),
                      std::make_shared<SinkAccess>(options.sink),
                      {}};
  if (!ground.lock) return nullptr;

  EmbeddedFileManager files(directory, disk);
  files.removeLeftTemporaryFiles();
  std::optional<Error> reason;
  if (!repairStateRecords(files, isCoordinatorRecord, ground.repairs, &reason)) {
    setError(error, unreadableRecordsError(directory, *reason));
    return nullptr;
  }
  for (const std::string& repair : ground.repairs) ground.sink->line(LogLevel::Error, "0", "%@", repair);

  std::unique_ptr<Device> device(new Device(std::make_unique<Parts>(std::move(ground), options)));
  if (options.timeRunsFast) device->waiting().runFast(*device->_parts->executor);
  EmbeddedCoordination& coordination = device->coordination();
  device->registry().placeholderUninstalled = [&coordination](const std::string& bundleID) {
    coordination.placeholderUninstalled(bundleID);
  };
  return device;
}

Device::Device(std::unique_ptr<Parts> parts) : _parts(std::move(parts)) {}

Device::~Device() {
  drain();
}

Platform Device::platform() {
  Platform platform;
  platform.mainBundleIdentifier = _parts->mainBundleIdentifier;
  platform.log = &_parts->log;
  platform.transactionLog = &_parts->transactionLog;
  platform.files = &_parts->files;
  platform.waiting = &_parts->waiting;
  platform.defaultWorkspace = &_parts->registry;
  platform.coordination = &_parts->coordination;
  platform.installer = &_parts->installer;
  platform.backup = &_parts->settings;
  platform.sharedConnection = &_parts->settings;
  platform.shell = &_parts->homeScreen;
  platform.icons = &_parts->icons;
  platform.notifications = &_parts->notifications;
  platform.notificationCenter = &_parts->notificationCenter;
  platform.sharedInstance = &_parts->deviceService;
  return platform;
}

void Device::startWork() {
  _parts->coordination.startWork();
}

// The coordinators begin nothing more after the first; the second ends what they and all others still had to say.
void Device::drain() {
  _parts->coordination.drain();
  _parts->executor->drain();
}

const std::vector<std::string>& Device::repairs() const {
  return _parts->ground.repairs;
}

EmbeddedCoordination& Device::coordination() {
  return _parts->coordination;
}

EmbeddedDeviceService& Device::deviceService() {
  return _parts->deviceService;
}

EmbeddedFileManager& Device::files() {
  return _parts->files;
}

EmbeddedHomeScreen& Device::homeScreen() {
  return _parts->homeScreen;
}

EmbeddedInstaller& Device::installer() {
  return _parts->installer;
}

EmbeddedNotificationCenter& Device::notificationCenter() {
  return _parts->notificationCenter;
}

EmbeddedNotificationService& Device::notifications() {
  return _parts->notifications;
}

EmbeddedRegistry& Device::registry() {
  return _parts->registry;
}

EmbeddedSettings& Device::settings() {
  return _parts->settings;
}

EmbeddedWaiting& Device::waiting() {
  return _parts->waiting;
}

}  // namespace appsync
