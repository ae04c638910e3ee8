// The fixed places and names that the client works with.
#pragma once

#include "platform/file_manager.h"

namespace appsync {

inline constexpr char kDataclass[] = "Application";

inline constexpr char kSyncDaemonBundleIdentifier[] = "com.zelk.dovel";
inline constexpr char kStartupCompleteNotification[] = "com.zelk.dovel.DovelStartupCompleteNotification";
inline constexpr char kInstallObserverServiceName[] = "com.zelk.dovel.relay.ostrelappobserverdelegate";

// What the host pushes before a sync.
inline constexpr char kStagingRoot[] = "/var/mobile/Media/PublicStaging";
inline constexpr char kStagingDirectory[] = "/var/mobile/Media/PublicStaging/ApplicationSync";

// The client's own state.
inline constexpr char kStateRoot[] = "/var/mobile/Library/ApplicationSync";
inline constexpr char kWorkArea[] = "/var/mobile/Library/ApplicationSync/TarvoStuff";
inline constexpr char kTodoListPath[] = "/var/mobile/Library/ApplicationSync/TarvoStuff/ApplicationsSync.plist";
inline constexpr char kTodoListDebugPath[] =
    "/var/mobile/Library/ApplicationSync/TarvoStuff/ApplicationsSync.plist-debug.plist";
inline constexpr char kLastSyncListPath[] = "/var/mobile/Library/ApplicationSync/LastSyncAppState.plist";
inline constexpr char kIconScratchDirectory[] = "/var/mobile/Library/ApplicationSync/Icons";
inline constexpr char kAssetSortOrderPath[] = "/var/mobile/Library/ApplicationSync/AssetSortOrder.plist";
inline constexpr char kRestoreStatePath[] = "/var/mobile/Library/ApplicationSync/RestoreState.plist";

// The account that owns what is made for placeholders.
inline FileAttributes mobileAttributes() {
  return {.ownerAccountName = "mobile", .groupOwnerAccountName = "mobile"};
}

// Keys of Info.plist files, and of the tables that are made from them.
inline constexpr char kBundleIdentifierKey[] = "TefBundleIdentifier";
inline constexpr char kBundleVersionKey[] = "TefBundleVersion";
inline constexpr char kBundleDisplayNameKey[] = "TefBundleDisplayName";
inline constexpr char kLaunchProhibitedKey[] = "PellumApplicationLaunchProhibited";

// Values of "operation" in the todo list.
inline constexpr char kTodoInstall[] = "install";
inline constexpr char kTodoRemove[] = "remove";
inline constexpr char kTodoSent[] = "SENT";
inline constexpr char kTodoDownloaded[] = "DOWNLOADED";
inline constexpr char kTodoInstalled[] = "INSTALLED";
inline constexpr char kTodoFailed[] = "FAILED";

}  // namespace appsync
