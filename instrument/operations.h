// The one table of the platform's operations: what they are called, and how each can fail.
//
// An operation is named by the first piece of its full name, whatever the C++ function is called. The wrappers, the
// recorder's lines and the list of possible faults are all made from this table; a wrapper that uses a name which is
// not in it does not compile.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <span>
#include <string_view>

namespace appsync {

enum class InstrumentedService : std::uint8_t {
  Log,
  TransactionLog,
  Files,
  Waiting,
  Workspace,
  Coordination,
  Holds,  // of the coordination service's objects: only their release
  Installer,
  Backup,
  Policy,
  Shell,
  Icons,
  Notifications,
  NotificationCenter,
  DeviceService,
  Host,  // no operation of the platform: what the host itself can be made to do
};

struct OperationInfo {
  std::string_view name;
  InstrumentedService service;
  std::string_view wayOfFailing;     // for people; empty for an operation that cannot fail
  bool concernsApplication = false;  // whether a fault can be made for one application alone

  constexpr bool canFail() const { return !wayOfFailing.empty(); }
};

// Those that can fail come first.
inline constexpr auto kOperations = [] {
  using enum InstrumentedService;
  constexpr bool kByApplication = true;
  return std::to_array<OperationInfo>({
      {"readFile", Files, "the file cannot be read", kByApplication},
      {"writeFile", Files, "the file is not replaced, the old one stays", kByApplication},
      {"createFile", Files, "the file is not made", kByApplication},
      {"createDirectory", Files, "the directory is not made", kByApplication},
      {"removeItem", Files, "the item stays", kByApplication},
      {"moveItem", Files, "the item stays where it is", kByApplication},
      {"copyItem", Files, "nothing is copied", kByApplication},
      {"attributesOfItem", Files, "the attributes cannot be read", kByApplication},
      {"utimes", Files, "the times stay, with an error number", kByApplication},

      {"reportInstalls", Workspace, "the registry's first report of installs never comes"},
      {"uninstallApplication", Workspace, "the registry removes nothing", kByApplication},

      {"coordinatorForAppWithBundleID", Coordination, "no coordinator, with an error", kByApplication},
      {"setInstallOptions", Coordination, "refused with an error", kByApplication},
      {"setInitialVeylAssetPromises", Coordination, "refused with an error", kByApplication},
      {"setAppAssetPromise", Coordination, "refused with an error", kByApplication},
      {"appAssetPromiseWithError", Coordination, "no promise, with an error", kByApplication},
      {"setPlaceholderPromise", Coordination, "refused with an error", kByApplication},
      {"setUserDataPromise", Coordination, "refused with an error", kByApplication},
      {"appAssetPromiseResponsibleClientWithError", Coordination, "nobody, with an error", kByApplication},
      {"setAppAssetPromiseResponsibleClient", Coordination, "refused with an error", kByApplication},
      {"initAppPlaceholderWithBundleName", Coordination, "no placeholder is made", kByApplication},
      {"setIconPromise", Coordination, "refused with an error", kByApplication},
      {"setPlaceholderAttributes", Coordination, "refused with an error", kByApplication},
      {"setMetadata", Coordination, "refused with an error", kByApplication},
      {"setConfigurationCompleteWithError", Coordination, "refused with an error", kByApplication},
      {"initWithName", Coordination, "no promise is made", kByApplication},
      {"cancelForReason", Coordination, "nothing is cancelled, with an error", kByApplication},
      {"uninstallAppWithBundleID", Coordination, "nothing is removed, and the completion brings an error",
       kByApplication},

      {"KilnLookupUninstalled", Installer, "no list"},
      {"KilnClearUninstalled", Installer, "nothing is forgotten, with a status", kByApplication},
      {"dovelShouldCreateAppPlaceholdersWithError", Backup, "no, with an error"},
      {"BrelmSetIconState", Shell, "the old layout stays, with a status"},
      {"BrelmGetFlattenedIconState", Shell, "no layout"},
      {"bundleWithURL", Icons, "no bundle", kByApplication},
      {"GlintCreateDeviceAppropriateHomeScreenIconImageFromBundle", Icons, "no image", kByApplication},
      {"makePNGDestination", Icons, "no encoder"},
      {"finalize", Icons, "the image is not encoded"},
      {"registerCheck", Notifications, "no token, with a status"},
      {"prioritizeAsset", DeviceService, "nothing is moved ahead, and the completion brings an error", kByApplication},

      {"install", Host, "the unpacking of the package fails, and so the install", kByApplication},
      {"transfer", Host, "the transfer breaks off half way with an error", kByApplication},
      {"stall", Host, "the transfer starts and never ends", kByApplication},

      {"temporaryDirectory", Files, ""},
      {"fileExists", Files, ""},
      {"wait", Waiting, ""},
      {"addObserver", Workspace, ""},
      {"removeObserver", Workspace, ""},
      {"applicationIsInstalled", Workspace, ""},
      {"applicationProxyForIdentifier", Workspace, ""},
      {"enumerateBundlesOfType", Workspace, ""},
      {"creatorIdentifier", Coordination, ""},
      {"bundleID", Coordination, ""},
      {"error", Coordination, ""},
      {"setObserver", Coordination, ""},
      {"hasInstallOptions", Coordination, ""},
      {"hasInitialVeylAssetPromises", Coordination, ""},
      {"hasAppAssetPromise", Coordination, ""},
      {"hasPlaceholderPromise", Coordination, ""},
      {"hasUserDataPromise", Coordination, ""},
      {"setTransferPath", Coordination, ""},
      {"setPercentComplete", Coordination, ""},
      {"setComplete", Coordination, ""},
      {"isComplete", Coordination, ""},
      {"initWithMachServiceName", Coordination, ""},
      {"OstrelCreateUserPresentableError", Coordination, ""},
      {"release", Holds, ""},
      {"makeVaultryManager", Backup, ""},
      {"effectiveBoolValueForSetting", Policy, ""},
      {"BrelmBlockableServerPort", Shell, ""},
      {"addImage", Icons, ""},
      {"setState", Notifications, ""},
      {"post", Notifications, ""},
      {"addNotificationObserver", NotificationCenter, ""},
      {"removeNotificationObserver", NotificationCenter, ""},
      {"offers", DeviceService, ""},
      {"cancelAssetTransferForFailedAsset", DeviceService, ""},
  });
}();

// The operations that a fault can be made for.
constexpr std::span<const OperationInfo> faultableOperations() {
  std::size_t count = 0;
  while (count < kOperations.size() && kOperations[count].canFail()) ++count;
  return std::span(kOperations).first(count);
}

// One of the table's operations; a name that is not in it is a compile error.
class Operation {
 public:
  // NOLINTNEXTLINE(google-explicit-constructor): a literal is to become an operation where it stands
  consteval Operation(const char* name) : _index(indexOf(name)) {}

  constexpr const OperationInfo& info() const { return kOperations[_index]; }
  constexpr std::string_view name() const { return info().name; }

 private:
  static void nameIsNotInTheTable();  // never defined: reaching it is the compile error

  static consteval std::size_t indexOf(std::string_view name) {
    for (std::size_t index = 0; index < kOperations.size(); ++index) {
      if (kOperations[index].name == name) return index;
    }
    nameIsNotInTheTable();
    return 0;
  }

  std::size_t _index;
};

}  // namespace appsync
