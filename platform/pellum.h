// The application registry: which applications and placeholders are on the device, and which installs are under way.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/error.h"
#include "platform/file_url.h"

namespace appsync {

// Install types, states and phases, as the registry numbers them.
inline constexpr std::uint64_t kPellumInstallTypeStoreDownload = 1;
inline constexpr std::uint64_t kPellumInstallTypeRestore = 2;
inline constexpr std::uint64_t kPellumInstallTypeSync = 4;
inline constexpr std::uint64_t kPellumInstallTypeDowngrade = 7;             // demoted by the system
inline constexpr std::uint64_t kPellumInstallTypeIntentionalDowngrade = 8;  // demoted by the person
inline constexpr std::uint64_t kPellumInstallStateWaiting = 0;
inline constexpr std::uint64_t kPellumInstallStateActive = 1;
inline constexpr std::uint64_t kPellumInstallStatePaused = 2;
inline constexpr std::uint64_t kPellumInstallPhaseLoading = 0;
inline constexpr std::uint64_t kPellumInstallPhaseInstalling = 1;

// Classes of registry records to walk.
inline constexpr std::uint64_t kPellumBundleTypeAll = 0;  // every application and placeholder
// What a person would call an application of the device: what is installed, and what a restore has brought back and
// still stands there as a placeholder alone. One record for each identifier.
inline constexpr std::uint64_t kPellumBundleTypeApplication = 1;
inline constexpr std::uint64_t kPellumBundleTypeSystem = 7;  // records of application type "System"

// The progress of an install, as it was when the record was read.
struct PellumInstallProgress {
  std::uint64_t installState = 0;
  std::uint64_t installPhase = 0;
};

// One record of the registry: a snapshot, which never changes afterwards. An application that is being updated has two
// records under one identifier, the installed version's and a placeholder's.
struct PellumApplicationProxy {
  struct State {
    bool isInstalled = false;
    bool isPlaceholder = false;
  };
  struct DiskUsage {
    std::uint64_t staticUsage = 0;  // bytes of the files in the container
  };

  std::string applicationIdentifier;
  std::string bundleIdentifier;               // the same text
  std::optional<std::string> bundleVersion;   // absent when the bundle names none
  std::optional<std::string> localizedName;   // absent when the bundle names none
  std::string applicationType;                // "User" or "System"
  std::optional<FileURL> bundleURL;           // the bundle's directory; absent when the record has none
  std::optional<FileURL> bundleContainerURL;  // the directory that holds it; absent when the record has none
  State appState;
  std::uint64_t installType = 0;
  std::optional<PellumInstallProgress> installProgressSync;  // absent when no install is known for the record
  DiskUsage diskUsage;

  bool isInstalled() const { return appState.isInstalled; }
  bool isPlaceholder() const { return appState.isPlaceholder; }

  // The identifier, and whether this is a placeholder.
  std::string description() const {
    return isPlaceholder() ? applicationIdentifier + " (placeholder)" : applicationIdentifier;
  }
};

using PellumApplicationProxies = std::vector<PellumApplicationProxy>;

// What an observer of the registry may hear. Callbacks come on threads of the registry, at any moment between
// `addObserver` and the return of `removeObserver`, several at once also.
class PellumApplicationWorkspaceObserverProtocol {
 public:
  virtual ~PellumApplicationWorkspaceObserverProtocol() = default;

  // The installs that are under way: every live one is in exactly one of the two lists. Called once soon after an
  // observer has been added, and again whenever an install begins, pauses, goes on or ends.
  virtual void applicationInstallsArePrioritized(const PellumApplicationProxies& /*prioritized*/,
                                                 const PellumApplicationProxies& /*arePaused*/) {}

  virtual void applicationInstallsDidCancel(const PellumApplicationProxies& /*applications*/) {}
};

// Base of observers that are made for observing alone.
class PellumApplicationWorkspaceObserver : public PellumApplicationWorkspaceObserverProtocol {};

// Any thread. Calls observers back at any moment, also before the call that caused it has returned: never to be called
// under a lock that a callback takes.
class PellumApplicationWorkspace {
 public:
  using Observer = std::shared_ptr<PellumApplicationWorkspaceObserverProtocol>;
  // Called with a record; setting `stop` ends the walk.
  using Block = std::function<void(const PellumApplicationProxy& record, bool& stop)>;

  virtual ~PellumApplicationWorkspace() = default;

  // Registers an observer, once. Its first report of installs comes after this has returned, on another thread.
  virtual void addObserver(const Observer& observer) = 0;

  // Returns when no callback of this observer runs any more, except one that this is called from. An observer that is
  // not registered is no failure.
  virtual void removeObserver(const Observer& observer) = 0;

  // NO for a placeholder, and for an identifier that the registry does not know.
  virtual bool applicationIsInstalled(const std::string& bundleID) = 0;

  // The placeholder's record (`placeholder` true) or the installed application's; none when there is none.
  virtual std::optional<PellumApplicationProxy> applicationProxyForIdentifier(const std::string& bundleID,
                                                                              bool placeholder) = 0;

  // Calls `block` once for each record of the class, on the caller's thread, before it returns. The walk runs on a
  // snapshot with no lock held, so the block may call the registry. The order is that of the identifiers.
  virtual void enumerateBundlesOfType(std::uint64_t type, const Block& block) = 0;

  // Removes what stands under the identifier, and returns when it is gone. When a placeholder stands there, only that
  // goes, with its install, and an installed version stays; otherwise the application goes. False, with an error, when
  // nothing stands there or it cannot be removed.
  virtual bool uninstallApplication(const std::string& bundleID, ErrorOut error) = 0;
};

}  // namespace appsync
