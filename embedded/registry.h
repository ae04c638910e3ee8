// The application registry of the embedded device: a record for each installed application and each placeholder.
//
// A record is a file of its own ("applications/ID", "placeholders/ID" in the state store) that names the container
// directory below /var/mobile/Containers; writing it is the moment at which an application or placeholder begins to
// exist. A container that no record names is what a crash left, and is swept away at the next start.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "embedded/executor.h"
#include "embedded/install_observers.h"
#include "embedded/registry_records.h"
#include "embedded/state_store.h"
#include "platform/pellum.h"
#include "platform/property_list.h"
#include "platform/thread_annotations.h"

namespace appsync {

class EmbeddedFileManager;

// The domain of the registry's errors; a failure of the disk is the underlying error.
inline constexpr std::string_view kRegistryErrorDomain = "RegistryError";
inline constexpr std::int64_t kRegistryBadIdentifier = 1;  // no single path component
inline constexpr std::int64_t kRegistryUnknown = 2;        // nothing stands under the identifier
inline constexpr std::int64_t kRegistryDisk = 3;           // a record or container could not be written

// What a placeholder is made from.
struct PlaceholderDescription {
  std::string bundleID;
  std::string name;
  std::uint64_t installType = 0;
  std::string applicationType = "User";
  std::optional<std::string> bundleVersion;
  bool launchProhibited = false;
  std::optional<PropertyList> infoPlist;  // what the placeholder's Info.plist holds besides; a dictionary
  std::optional<PropertyList> metadata;   // written as its TarvoMetadata.plist; a dictionary
  std::optional<Bytes> icon;              // copied to its Icon.png
  std::optional<SeededInstall> seeded;    // for a seeded device only
};

// How the registry shows a running install.
struct InstallDisplay {
  PellumInstallProgress progress;
  bool prioritized = true;  // in which list it is reported; a paused install is reported as paused in any case
};

// An install is live, and so reported to observers in exactly one of the two lists, when its placeholder stands in the
// registry and something is known of it: a display, or what a seed said. A placeholder of which nothing is known shows
// the progress "waiting, loading" and is in no list.
//
// Any thread. Observers and hooks are called with no lock held; each observer's callbacks come one at a time, on a
// thread of the executor, and a report says what is true when it is made: changes that follow each other quickly can
// come as one report.
class EmbeddedRegistry : public PellumApplicationWorkspace {
 public:
  // Loads the records, finishes an install whose last step a crash prevented, and sweeps away containers that no record
  // names. A record that cannot be read is left out, and then only unfinished ones are. The executor must be drained
  // when this is destroyed.
  EmbeddedRegistry(StateStore& store, EmbeddedFileManager& files, Executor& executor);

  // Called when a placeholder has gone through `uninstallApplication`, on the caller's thread. Set before the first
  // call of anything else, and not changed afterwards. May be empty.
  std::function<void(const std::string& bundleID)> placeholderUninstalled;

  void addObserver(const Observer& observer) override;
  void removeObserver(const Observer& observer) override;
  bool applicationIsInstalled(const std::string& bundleID) override;
  std::optional<PellumApplicationProxy> applicationProxyForIdentifier(const std::string& bundleID,
                                                                      bool placeholder) override;
  void enumerateBundlesOfType(std::uint64_t type, const Block& block) override;
  bool uninstallApplication(const std::string& bundleID, ErrorOut error) override;

  // Makes the placeholder with its container; one that stands under the identifier already is replaced. False leaves
  // that one as it was.
  bool installPlaceholder(const PlaceholderDescription& description, ErrorOut error);

  // No placeholder is success. An install's display goes with the placeholder.
  bool removePlaceholder(const std::string& bundleID, ErrorOut error);

  // The new version takes the place of the old one and of the placeholder in one step; their containers go. False
  // leaves everything as it was, and the new container to the caller.
  bool commitInstall(const InstalledApplication& application, ErrorOut error);

  // The same for a seeded application, which comes beside a placeholder that stands there.
  bool seedApplication(const InstalledApplication& application, ErrorOut error);

  // Removes the application and its placeholder. Nothing there is success.
  bool removeApplication(const std::string& bundleID, ErrorOut error);

  // How the install of this application is to be shown; none: no install is under way. In memory only, so that no
  // install counts as active after a crash.
  void setInstallDisplay(const std::string& bundleID, std::optional<InstallDisplay> display);

  // Tells every observer that the install of this application has been cancelled.
  void installsDidCancel(const std::string& bundleID);

  // The name for a new container: a number that no container has had in this process and none has now.
  std::string newContainerName();

  // Every identifier that is on the device, installed or as a placeholder, in the order in which they came.
  std::vector<std::string> identifiersByArrival();

 private:
  // A record that is in place but could not be flushed counts: it is what every process reads from now on. Only after a
  // loss of power the old one may come back, so what that one names stays until the next start.
  enum class Saved : std::uint8_t { No, NotFlushed, Durably };

  Saved save(const std::string& name, const PropertyList& record, const std::string& bundleID, ErrorOut error);
  bool putApplication(const InstalledApplication& application, bool endsPlaceholder, ErrorOut error);
  bool makePlaceholderContainer(const PlaceholderDescription& description, std::string& path, ErrorOut error);
  bool dropPlaceholder(const std::string& bundleID, std::string& container, ErrorOut error) APPSYNC_REQUIRES(_changes);
  bool dropApplication(const std::string& bundleID, std::string& container, ErrorOut error) APPSYNC_REQUIRES(_changes);
  std::uint64_t arrivalOf(const std::string& bundleID);

  void finishInterruptedInstalls();
  void sweepContainers(bool keepWhole);
  void sweepDirectory(const std::string& directory, const std::set<std::string>& named, bool keepWhole);
  void removeContainer(const std::string& path);

  // How an install is reported; an install that is not live is in no list.
  struct LiveInstall {
    bool isLive = false;
    bool isPaused = false;
    std::uint64_t state = 0;

    friend bool operator==(const LiveInstall&, const LiveInstall&) = default;
  };
  PellumApplicationProxy proxy(const PlaceholderRecord& placeholder) const APPSYNC_REQUIRES(_mutex);
  LiveInstall liveInstall(const PlaceholderRecord& placeholder) const APPSYNC_REQUIRES(_mutex);
  LiveInstall liveInstall(const std::string& bundleID) const APPSYNC_REQUIRES(_mutex);
  InstallObservers::Installs installs();
  // Makes a change in memory and, when it changes how an install is reported, tells the observers.
  void change(const std::string& bundleID, const std::function<void()>& apply) APPSYNC_EXCLUDES(_mutex);

  StateStore& _store;
  EmbeddedFileManager& _files;
  InstallObservers _observers;
  std::atomic<std::uint64_t> _nextSerial{1};

  // Held by whoever changes records, from the first look at them until disk and memory agree again; a reader takes
  // `_mutex` alone, which is never held while the disk works.
  Mutex _changes;

  Mutex _mutex;
  std::map<std::string, ApplicationRecord> _applications APPSYNC_GUARDED_BY(_mutex);
  std::map<std::string, PlaceholderRecord> _placeholders APPSYNC_GUARDED_BY(_mutex);
  std::map<std::string, InstallDisplay> _displays APPSYNC_GUARDED_BY(_mutex);
};

// --- status and seed ------------------------------------------------------------------------------------------------

// "installed" of a device's status: an array of {"identifier", "version", "name", "type", "size", "container" (relative
// to the device's directory), and what a seed said of an install}, sorted by identifier; a version that is absent has
// no key. Needs no registry and takes no lock; a record that goes meanwhile is left out.
PropertyList registryInstalledStatus(const StateStore& store);

// "placeholders" of a device's status: {"identifier", "name", "installType", "version", "launchProhibited", "type", and
// what a seed said of its install: "installState", "installPhase", "prioritized", "progress"}.
PropertyList registryPlaceholdersStatus(const StateStore& store);

// Whether these entries can be seeded. False, with an error that names the entry and what would mend it.
bool checkInstalledSeed(const PropertyList& entries, ErrorOut error);
bool checkPlaceholdersSeed(const PropertyList& entries, ErrorOut error);

// Adds or replaces what the (checked) entries name. An application gets a real container: its bundle with an Info.plist
// and files of the given sizes (or one of the given total size, which takes no room), and its TarvoMetadata.plist.
bool seedInstalled(EmbeddedRegistry& registry, EmbeddedFileManager& files, const PropertyList& entries, ErrorOut error);
bool seedPlaceholders(EmbeddedRegistry& registry, const PropertyList& entries, ErrorOut error);

}  // namespace appsync
