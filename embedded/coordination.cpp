#include "embedded/coordination.h"

#include <algorithm>
#include <cmath>
#include <utility>

#include "embedded/coordination_objects.h"
#include "embedded/registry.h"
#include "platform/ostrel_objects.h"

namespace appsync {

namespace {

constexpr std::uint64_t kLargestIcon = 8ULL << 20;
constexpr OstrelClientID kShell = 0;

bool refuseOver(ErrorOut error, const InstallCoordinator& coordinator) {
  const std::string text = "The install of \"" + coordinator.bundleID + "\" is over; ask for a new coordinator";
  setError(error, coordinator.error ? Error(std::string(kOstrelErrorDomain), kOstrelOver, text, *coordinator.error)
                                    : ostrelError(kOstrelOver, text));
  return false;
}

bool refuseAnotherKind(ErrorOut error, const InstallCoordinator& other, OstrelCoordinatorKind wanted) {
  return refuse(error, kOstrelAnotherKind,
                "\"" + other.bundleID + "\" has a coordinator that is " + std::string(nameOf(other.kind)) + ", not " +
                    std::string(nameOf(wanted)) +
                    (other.responsibleClient == OstrelClientMerc ? "; the store is responsible for it" : ""));
}

}  // namespace

EmbeddedCoordination::EmbeddedCoordination(StateStore& store, FileManager& files, EmbeddedRegistry& registry,
                                           EmbeddedInstaller& installer, Executor& executor)
    : _store(store), _files(files), _registry(registry), _installer(installer), _executor(executor) {
  MutexLock lock(_mutex);
  loadRecords();
}

EmbeddedCoordination::~EmbeddedCoordination() {
  drain();
}

// --- coordinators ---------------------------------------------------------------------------------------------------

OstrelRef EmbeddedCoordination::coordinatorForApp(OstrelCoordinatorKind kind, const std::string& bundleID,
                                                  OstrelClientID client, bool create, bool* created, ErrorOut error) {
  if (created != nullptr) *created = false;
  if (!isSinglePathComponent(bundleID)) {
    refuse(error, kOstrelBadIdentifier, "\"" + bundleID + "\" cannot be the identifier of an application");
    return {};
  }
  const bool isNew = create && kind != OstrelCoordinatorKind::Any;
  const bool canUpdate = isNew && kind == OstrelCoordinatorKind::Updating && _registry.applicationIsInstalled(bundleID);
  MutexLock lock(_mutex);
  const std::shared_ptr<InstallCoordinator> existing = current(bundleID);
  if (!isNew) return hold(lookUp(kind, bundleID, error));
  if (existing && existing->isLive()) {
    if (existing->kind == kind) return hold(existing);
    if (!existing->hasEnded()) return refuseAnotherKind(error, *existing, kind), OstrelRef{};
  }
  if (kind == OstrelCoordinatorKind::Updating && !canUpdate) {
    refuse(error, kOstrelNotInstalled, "\"" + bundleID + "\" is not installed, so it cannot be updated; install it");
    return {};
  }
  if (existing && existing->isLive()) existing->life = InstallCoordinator::Life::Finished;
  const auto coordinator = std::make_shared<InstallCoordinator>();
  coordinator->kind = kind;
  coordinator->bundleID = bundleID;
  coordinator->creator = client;
  coordinator->isUnwritten = true;
  _coordinators[bundleID] = coordinator;
  if (created != nullptr) *created = true;
  return hold(coordinator);
}

OstrelClientID EmbeddedCoordination::creatorIdentifier(OstrelRef coordinator) {
  MutexLock lock(_mutex);
  const auto found = find<InstallCoordinator>(coordinator);
  return found ? found->creator : 0;
}

std::optional<std::string> EmbeddedCoordination::bundleID(OstrelRef coordinator) {
  MutexLock lock(_mutex);
  const auto found = find<InstallCoordinator>(coordinator);
  return found ? std::optional(found->bundleID) : std::nullopt;
}

std::optional<Error> EmbeddedCoordination::error(OstrelRef coordinator) {
  MutexLock lock(_mutex);
  const auto found = find<InstallCoordinator>(coordinator);
  return found ? found->error : std::nullopt;
}

void EmbeddedCoordination::setObserver(OstrelRef coordinator, const Observer& observer) {
  MutexLock lock(_mutex);
  if (const auto found = find<InstallCoordinator>(coordinator)) found->observer = observer;
}

bool EmbeddedCoordination::hasInstallOptions(OstrelRef coordinator) {
  return has(coordinator, &InstallCoordinator::hasInstallOptions);
}

bool EmbeddedCoordination::setInstallOptions(OstrelRef coordinator, const KilnInstallOptions& options, ErrorOut error) {
  MutexLock lock(_mutex);
  const auto found = receiver(coordinator, &InstallCoordinator::hasInstallOptions, error);
  if (!found) return false;
  found->installOptions = options;
  return true;
}

bool EmbeddedCoordination::hasInitialVeylAssetPromises(OstrelRef coordinator) {
  return has(coordinator, &InstallCoordinator::hasInitialPromises);
}

bool EmbeddedCoordination::setInitialVeylAssetPromises(OstrelRef coordinator, const std::vector<OstrelRef>& promises,
                                                       ErrorOut error) {
  MutexLock lock(_mutex);
  for (const OstrelRef promise : promises) {
    if (!gift(promise, error)) return false;
  }
  const auto found = receiver(coordinator, &InstallCoordinator::hasInitialPromises, error);
  if (!found) return false;
  for (const OstrelRef promise : promises) find<CoordinationPromise>(promise)->isGiven = true;
  found->hasInitialAssetPromises = true;
  return true;
}

bool EmbeddedCoordination::hasAppAssetPromise(OstrelRef coordinator) {
  return has(coordinator, &InstallCoordinator::hasPackagePromise);
}

bool EmbeddedCoordination::setAppAssetPromise(OstrelRef coordinator, OstrelRef promise, ErrorOut error) {
  return givePromise(coordinator, promise, &InstallCoordinator::hasPackagePromise, &InstallCoordinator::package, error);
}

OstrelRef EmbeddedCoordination::appAssetPromise(OstrelRef coordinator, ErrorOut error) {
  MutexLock lock(_mutex);
  const auto found = find<InstallCoordinator>(coordinator);
  if (found && found->package) return hold(found->package);
  if (found) refuse(error, kOstrelNotFitting, "No package has been promised for \"" + found->bundleID + "\"");
  if (!found) refuse(error, kOstrelUnknownObject, "There is no such coordinator");
  return {};
}

bool EmbeddedCoordination::hasPlaceholderPromise(OstrelRef coordinator) {
  return has(coordinator, &InstallCoordinator::hasPlaceholder);
}

bool EmbeddedCoordination::setPlaceholderPromise(OstrelRef coordinator, OstrelRef placeholder, ErrorOut error) {
  std::optional<Bytes> icon = iconOf(placeholder);
  MutexLock lock(_mutex);
  const auto given = find<CoordinationPlaceholder>(placeholder);
  if (!given) return refuse(error, kOstrelUnknownObject, "There is no such placeholder");
  if (given->isCancelled || given->isGiven) {
    return refuse(error, given->isGiven ? kOstrelGivenAlready : kOstrelOver,
                  "The placeholder of \"" + given->description.bundleID + "\" has been " +
                      (given->isGiven ? "handed over already" : "cancelled"));
  }
  const auto found = find<InstallCoordinator>(coordinator);
  if (found && found->bundleID != given->description.bundleID) {
    return refuse(error, kOstrelNotFitting,
                  "A placeholder of \"" + given->description.bundleID + "\" is none of \"" + found->bundleID + "\"");
  }
  if (!receiver(coordinator, &InstallCoordinator::hasPlaceholder, error)) return false;
  given->isGiven = true;
  found->placeholder = given->description;
  found->placeholder->icon = std::move(icon);
  return true;
}

bool EmbeddedCoordination::hasUserDataPromise(OstrelRef coordinator) {
  return has(coordinator, &InstallCoordinator::hasUserDataPromise);
}

bool EmbeddedCoordination::setUserDataPromise(OstrelRef coordinator, OstrelRef promise, ErrorOut error) {
  return givePromise(coordinator, promise, &InstallCoordinator::hasUserDataPromise, &InstallCoordinator::userData,
                     error);
}

OstrelClientID EmbeddedCoordination::appAssetPromiseResponsibleClient(OstrelRef coordinator, ErrorOut error) {
  MutexLock lock(_mutex);
  const auto found = find<InstallCoordinator>(coordinator);
  if (found && found->kind == OstrelCoordinatorKind::Restoring) return found->responsibleClient;
  refuse(error, found ? kOstrelNotFitting : kOstrelUnknownObject, "There is no such restoring coordinator");
  return 0;
}

bool EmbeddedCoordination::setAppAssetPromiseResponsibleClient(OstrelRef coordinator, OstrelClientID client,
                                                               ErrorOut error) {
  MutexLock lock(_mutex);
  const auto restoring = find<InstallCoordinator>(coordinator);
  if (!restoring || restoring->kind != OstrelCoordinatorKind::Restoring) {
    return refuse(error, restoring ? kOstrelNotFitting : kOstrelUnknownObject,
                  "There is no such restoring coordinator");
  }
  if (!restoring->isLive()) return refuseOver(error, *restoring);
  restoring->responsibleClient = client;
  restoring->isUnwritten = true;
  return true;
}

// --- placeholders ---------------------------------------------------------------------------------------------------

OstrelRef EmbeddedCoordination::makePlaceholder(const std::string& bundleName, const std::string& bundleID,
                                                std::uint64_t installType, OstrelClientID /*client*/) {
  if (!isSinglePathComponent(bundleID)) return {};
  const auto placeholder = std::make_shared<CoordinationPlaceholder>();
  placeholder->description.bundleID = bundleID;
  placeholder->description.name = bundleName;
  placeholder->description.installType = installType;
  MutexLock lock(_mutex);
  return hold(placeholder);
}

bool EmbeddedCoordination::setIconPromise(OstrelRef placeholder, OstrelRef promise, ErrorOut error) {
  MutexLock lock(_mutex);
  const auto icon = gift(promise, error);
  const auto open = icon ? draft(placeholder, error) : nullptr;
  if (!open) return false;
  if (open->icon) return refuse(error, kOstrelGivenAlready, "The placeholder has an icon already");
  icon->isGiven = true;
  open->icon = icon;
  return true;
}

bool EmbeddedCoordination::setPlaceholderAttributes(OstrelRef placeholder,
                                                    const OstrelPlaceholderAttributes& attributes, ErrorOut error) {
  MutexLock lock(_mutex);
  const auto open = draft(placeholder, error);
  if (!open) return false;
  open->description.infoPlist = attributes.infoPlist();
  open->description.bundleVersion = attributes.bundleVersion();
  open->description.launchProhibited = attributes.launchProhibited();
  return true;
}

bool EmbeddedCoordination::setMetadata(OstrelRef placeholder, const std::optional<KilnStoreMetadata>& metadata,
                                       ErrorOut error) {
  MutexLock lock(_mutex);
  const auto open = draft(placeholder, error);
  if (!open) return false;
  open->description.metadata = metadata ? std::optional(metadata->dictionary()) : std::nullopt;
  return true;
}

bool EmbeddedCoordination::setConfigurationComplete(OstrelRef placeholder, ErrorOut error) {
  MutexLock lock(_mutex);
  const auto open = draft(placeholder, error);
  if (open) open->isConfigured = true;
  return open != nullptr;
}

// --- promises -------------------------------------------------------------------------------------------------------

OstrelRef EmbeddedCoordination::makePromise(OstrelPromiseKind kind, const std::string& name, OstrelClientID /*client*/,
                                            const std::optional<FileURL>& transferPath,
                                            std::uint64_t /*diskSpaceNeeded*/) {
  const auto promise = std::make_shared<CoordinationPromise>();
  promise->kind = kind;
  promise->name = name;
  if (transferPath) promise->path = transferPath->path();
  MutexLock lock(_mutex);
  return hold(promise);
}

void EmbeddedCoordination::setTransferPath(OstrelRef promise, const std::optional<FileURL>& path) {
  changePromise(
      promise, [&](CoordinationPromise& changed) { changed.path = path ? std::optional(path->path()) : std::nullopt; });
}

void EmbeddedCoordination::setPercentComplete(OstrelRef promise, double fraction) {
  changePromise(promise, [&](CoordinationPromise& changed) {
    changed.fraction = std::isnan(fraction) ? 0.0 : std::clamp(fraction, 0.0, 1.0);
  });
}

void EmbeddedCoordination::setComplete(OstrelRef promise, bool complete) {
  changePromise(promise, [&](CoordinationPromise& changed) { changed.isComplete = complete; });
}

bool EmbeddedCoordination::isComplete(OstrelRef promise) {
  MutexLock lock(_mutex);
  const auto found = find<CoordinationPromise>(promise);
  return found && found->isComplete;
}

// --- all of them ----------------------------------------------------------------------------------------------------

bool EmbeddedCoordination::cancel(OstrelRef object, const Error& reason, OstrelClientID client, ErrorOut error) {
  MutexLock lock(_mutex);
  if (const auto coordinator = find<InstallCoordinator>(object)) {
    if (cancelCoordinator(coordinator, reason, client)) return true;
    return coordinator->isCommitting
               ? refuse(error, kOstrelOver, "\"" + coordinator->bundleID + "\" is being put in place just now")
               : refuseOver(error, *coordinator);
  }
  if (const auto placeholder = find<CoordinationPlaceholder>(object)) {
    if (placeholder->isCancelled) return refuse(error, kOstrelOver, "The placeholder has been cancelled already");
    if (placeholder->isGiven)
      return refuse(error, kOstrelGivenAlready, "Its coordinator has the placeholder; cancel that");
    return placeholder->isCancelled = true;
  }
  const auto promise = find<CoordinationPromise>(object);
  if (!promise) return refuse(error, kOstrelUnknownObject, "There is nothing to cancel");
  if (promise->isCancelled) return refuse(error, kOstrelOver, "\"" + promise->name + "\" has been cancelled already");
  if (const auto owner = promise->owner.lock(); owner && !cancelCoordinator(owner, reason, client)) {
    return refuseOver(error, *owner);
  }
  return promise->isCancelled = true;
}

std::string EmbeddedCoordination::description(OstrelRef object) {
  MutexLock lock(_mutex);
  if (const auto coordinator = find<InstallCoordinator>(object)) {
    return "<" + std::string(nameOf(coordinator->kind)) + " coordinator of " + coordinator->bundleID + ">";
  }
  if (const auto placeholder = find<CoordinationPlaceholder>(object)) {
    return "<placeholder of " + placeholder->description.bundleID + ">";
  }
  if (const auto promise = find<CoordinationPromise>(object)) return "<promise " + promise->name + ">";
  if (const auto observer = find<InstallObserverRegistration>(object))
    return "<install observer " + observer->name + ">";
  return "(null)";
}

void EmbeddedCoordination::release(OstrelRef object) {
  MutexLock lock(_mutex);
  const auto found = find<CoordinationObject>(object);
  if (!found || --found->holds > 0) return;
  _held.erase(object.value);
  if (const auto coordinator = std::dynamic_pointer_cast<InstallCoordinator>(found)) return consider(coordinator);
  const auto observer = std::dynamic_pointer_cast<InstallObserverRegistration>(found);
  if (!observer) return;
  _registrations.erase(observer);
  const auto own = observer->running.count(std::this_thread::get_id());
  _changed.wait(lock.native(), [&] { return observer->running.size() == own; });
}

// --- the service itself ---------------------------------------------------------------------------------------------

OstrelRef EmbeddedCoordination::addInstallObserver(const std::string& machServiceName,
                                                   const std::set<OstrelClientID>& clients, const Observer& observer) {
  if (!observer) return {};
  const auto registration = std::make_shared<InstallObserverRegistration>();
  registration->name = machServiceName;
  registration->clients = clients;
  registration->observer = observer;
  MutexLock lock(_mutex);
  _registrations.insert(registration);
  return hold(registration);
}

void EmbeddedCoordination::uninstallApp(const std::string& bundleID, bool requestUserConfirmation,
                                        Completion completion) {
  std::optional<Error> refusal;
  if (!isSinglePathComponent(bundleID)) {
    refusal = ostrelError(kOstrelBadIdentifier, "\"" + bundleID + "\" cannot be the identifier of an application");
  } else if (requestUserConfirmation) {
    refusal = ostrelError(kOstrelNobodyToAsk,
                          "Nobody is there who could confirm the removal of \"" + bundleID + "\"; ask for none");
  }
  MutexLock lock(_mutex);
  if (!refusal && _drained) refusal = ostrelError(kOstrelOver, "The service has been shut down");
  if (refusal) {
    return post(bundleID, [refusal, completion] {
      if (completion) completion(refusal);
    });
  }
  if (const auto coordinator = current(bundleID)) {
    cancelCoordinator(coordinator, ostrelError(kOstrelRemoved, "\"" + bundleID + "\" is being removed"), kShell);
  }
  post(bundleID, [this, bundleID, completion] { remove(bundleID, completion); });
}

Error EmbeddedCoordination::createUserPresentableError(std::int64_t code, std::int32_t /*flag*/,
                                                       const Error& underlying) {
  return {std::string(kOstrelErrorDomain), code, "The application could not be installed; try again", underlying};
}

// --- for the device's host ------------------------------------------------------------------------------------------

void EmbeddedCoordination::personCancels(const std::string& bundleID, const Error& reason) {
  MutexLock lock(_mutex);
  if (const auto coordinator = current(bundleID)) cancelCoordinator(coordinator, reason, kShell);
}

void EmbeddedCoordination::placeholderUninstalled(const std::string& bundleID) {
  MutexLock lock(_mutex);
  const auto coordinator = current(bundleID);
  if (!coordinator || coordinator->isCommitting) return;
  if (cancelCoordinator(coordinator, ostrelError(kOstrelRemoved, "The placeholder of \"" + bundleID + "\" was removed"),
                        kShell)) {
    return;
  }
  _coordinators.erase(bundleID);
  post(bundleID, [this, bundleID] { forgetRecord(bundleID); });
}

std::vector<std::string> EmbeddedCoordination::packagePathsInUse() {
  MutexLock lock(_mutex);
  std::vector<std::string> paths;
  for (const auto& [bundleID, coordinator] : _coordinators) {
    if (coordinator->isLive() && coordinator->hasPackage()) paths.push_back(*coordinator->package->path);
  }
  return paths;
}

void EmbeddedCoordination::setEventListener(std::function<void(const CoordinatorEvent&)> listener) {
  MutexLock lock(_mutex);
  _eventListener = std::move(listener);
}

void EmbeddedCoordination::setInstallGate(std::function<std::optional<Error>(const std::string&)> gate) {
  MutexLock lock(_mutex);
  _installGate = std::move(gate);
}

// --- objects and their holds ----------------------------------------------------------------------------------------

template <typename Object>
std::shared_ptr<Object> EmbeddedCoordination::find(OstrelRef ref) {
  const auto found = _held.find(ref.value);
  return found == _held.end() ? nullptr : std::dynamic_pointer_cast<Object>(found->second);
}

OstrelRef EmbeddedCoordination::hold(const std::shared_ptr<CoordinationObject>& object) {
  if (!object) return {};
  if (object->ref == 0) object->ref = ++_lastRef;
  ++object->holds;
  _held.emplace(object->ref, object);
  return {object->ref};
}

std::shared_ptr<InstallCoordinator> EmbeddedCoordination::current(const std::string& bundleID) const {
  const auto found = _coordinators.find(bundleID);
  return found == _coordinators.end() ? nullptr : found->second;
}

std::shared_ptr<InstallCoordinator> EmbeddedCoordination::lookUp(OstrelCoordinatorKind kind,
                                                                 const std::string& bundleID, ErrorOut error) {
  auto existing = current(bundleID);
  if (!existing) {
    refuse(error, kOstrelNoCoordinator, "There is no coordinator for \"" + bundleID + "\"");
  } else if (kind != OstrelCoordinatorKind::Any && existing->kind != kind) {
    refuseAnotherKind(error, *existing, kind);
    return nullptr;
  }
  return existing;
}

bool EmbeddedCoordination::has(OstrelRef coordinator, Possession possession) {
  MutexLock lock(_mutex);
  const auto found = find<InstallCoordinator>(coordinator);
  return found && (found.get()->*possession)();
}

std::shared_ptr<InstallCoordinator> EmbeddedCoordination::receiver(OstrelRef coordinator, Possession possession,
                                                                   ErrorOut error) {
  auto found = find<InstallCoordinator>(coordinator);
  if (!found) {
    refuse(error, kOstrelUnknownObject, "There is no such coordinator");
    return nullptr;
  }
  if (!found->isLive()) {
    refuseOver(error, *found);
    return nullptr;
  }
  if ((found.get()->*possession)()) {
    refuse(error, kOstrelGivenAlready, "The coordinator of \"" + found->bundleID + "\" has been given that already");
    return nullptr;
  }
  found->isUnwritten = true;
  return found;
}

std::shared_ptr<CoordinationPromise> EmbeddedCoordination::gift(OstrelRef promise, ErrorOut error) {
  auto found = find<CoordinationPromise>(promise);
  if (!found) {
    refuse(error, kOstrelUnknownObject, "There is no such promise");
  } else if (found->isCancelled || found->isGiven) {
    refuse(error, found->isGiven ? kOstrelGivenAlready : kOstrelOver,
           "\"" + found->name + "\" has been " + (found->isGiven ? "given already" : "cancelled"));
    return nullptr;
  }
  return found;
}

std::shared_ptr<CoordinationPlaceholder> EmbeddedCoordination::draft(OstrelRef placeholder, ErrorOut error) {
  auto found = find<CoordinationPlaceholder>(placeholder);
  if (!found) {
    refuse(error, kOstrelUnknownObject, "There is no such placeholder");
  } else if (found->isConfigured || found->isGiven || found->isCancelled) {
    refuse(error, kOstrelOver, "The placeholder of \"" + found->description.bundleID + "\" cannot be changed any more");
    return nullptr;
  }
  return found;
}

bool EmbeddedCoordination::givePromise(OstrelRef coordinator, OstrelRef promise, Possession possession,
                                       std::shared_ptr<CoordinationPromise> InstallCoordinator::*place,
                                       ErrorOut error) {
  MutexLock lock(_mutex);
  const auto given = gift(promise, error);
  const auto found = given ? receiver(coordinator, possession, error) : nullptr;
  if (!found) return false;
  given->isGiven = true;
  given->owner = found;
  (found.get()->*place) = given;
  return true;
}

// What has been cancelled stays as it is, and so does a package from the moment when it is used.
void EmbeddedCoordination::changePromise(OstrelRef promise, const std::function<void(CoordinationPromise&)>& change) {
  MutexLock lock(_mutex);
  const auto found = find<CoordinationPromise>(promise);
  if (!found || found->isCancelled) return;
  const auto owner = found->owner.lock();
  if (owner && (!owner->isLive() || owner->isInstalling)) return;
  const bool wasComplete = found->isComplete;
  const auto oldPath = found->path;
  change(*found);
  if (!owner) return;
  if (found->isComplete != wasComplete || found->path != oldPath) owner->isUnwritten = true;
  consider(owner);
}

// The icon's file is the caller's to write anew as soon as the placeholder has been handed over, so it is read now. One
// that cannot be read is left out: the placeholder does without.
std::optional<Bytes> EmbeddedCoordination::iconOf(OstrelRef placeholder) {
  std::string path;
  {
    MutexLock lock(_mutex);
    const auto found = find<CoordinationPlaceholder>(placeholder);
    if (!found || found->isGiven || !found->icon || !found->icon->isComplete || !found->icon->path) return std::nullopt;
    path = *found->icon->path;
  }
  const auto attributes = _files.attributesOfItem(path, nullptr);
  if (!attributes || attributes->isDirectory || attributes->size > kLargestIcon) return std::nullopt;
  return _files.readFile(path, nullptr);
}

bool EmbeddedCoordination::cancelCoordinator(const std::shared_ptr<InstallCoordinator>& coordinator,
                                             const Error& reason, OstrelClientID client) {
  if (!coordinator->isLive() || coordinator->isCommitting) return false;
  coordinator->life = InstallCoordinator::Life::Dead;
  coordinator->error = reason;
  coordinator->ending = InstallCoordinator::Ending{true, client};
  coordinator->isUnwritten = true;
  consider(coordinator);
  return true;
}

}  // namespace appsync
