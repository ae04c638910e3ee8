// The low-level installer of the embedded device: unpacks packages into containers, and remembers what was uninstalled.
#pragma once

#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "embedded/package_reader.h"
#include "embedded/state_store.h"
#include "platform/kiln.h"
#include "platform/thread_annotations.h"

namespace appsync {

class EmbeddedFileManager;
class EmbeddedRegistry;

// Any thread. What is uninstalled is kept in the record "uninstalled", a dictionary keyed by identifier.
class EmbeddedInstaller : public KilnInstaller {
 public:
  EmbeddedInstaller(StateStore& store, EmbeddedFileManager& files, EmbeddedRegistry& registry,
                    const PackageLimits& limits = {});

  std::optional<PropertyList> KilnLookupUninstalled() override;
  int KilnClearUninstalled(const std::vector<std::string>& bundleIDs) override;

  // Installs the package, which must be the application `bundleID`, in place of an older version and of the
  // application's placeholder. The package file stays. `progress` and `cancelled` are called on this thread, between
  // blocks, and a last time, with 1, before everything is put in place; either may be empty. False, with an error of
  // the domain "InstallerError" that names the package: nothing of it stays, and what was installed before is
  // untouched.
  bool install(const std::string& bundleID, const std::string& packagePath, const KilnInstallOptions& options,
               const std::function<void(double fraction)>& progress, const std::function<bool()>& cancelled,
               ErrorOut error);

  // Removes the application and its placeholder; nothing there is success. An application that was installed is
  // remembered until it is installed again or cleared.
  bool uninstall(const std::string& bundleID, ErrorOut error);

  // Remembers these too.
  bool remember(const std::vector<std::string>& bundleIDs, ErrorOut error);

 private:
  bool forget(const std::vector<std::string>& bundleIDs, ErrorOut error);
  std::optional<PropertyList> load(ErrorOut error) APPSYNC_REQUIRES(_mutex);

  StateStore& _store;
  EmbeddedFileManager& _files;
  EmbeddedRegistry& _registry;
  const PackageLimits _limits;

  Mutex _mutex;  // held while the record is read, changed and written
};

// "uninstalled" of a device's status: an array of identifiers. Needs no installer and takes no lock.
PropertyList uninstalledStatus(const StateStore& store);

// Whether this array of identifiers can be seeded, and seeding it: they are remembered besides those that are.
bool checkUninstalledSeed(const PropertyList& identifiers, ErrorOut error);
bool seedUninstalled(EmbeddedInstaller& installer, const PropertyList& identifiers, ErrorOut error);

}  // namespace appsync
