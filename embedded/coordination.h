// The install coordination service of the embedded device.
//
// It keeps a coordinator for each application that is being installed, updated or restored, and a worker does the
// coordinator's work on the executor, on a strand of the application's own: installs and removals of one application
// are done one after the other. Every step follows from the coordinator's state alone, so a later process goes on where
// an earlier one ended.
//
// Beyond the contract of `OstrelService`:
// - Events, completions and all work of one application run on its strand, never under a lock, and in order.
// - A cancelled package or user-data promise takes its live coordinator with it, with the same reason and client. A
//   placeholder that has been handed over cannot be cancelled any more, its coordinator can; nor can a coordinator
//   whose application is being put in place.
// - The client that answers for the package may be named anew while the coordinator lives.
// - What a coordinator has been given is written down when the last hold is released.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "embedded/executor.h"
#include "embedded/state_store.h"
#include "platform/file_manager.h"
#include "platform/ostrel.h"
#include "platform/property_list.h"
#include "platform/thread_annotations.h"
#include "platform/waiting.h"

namespace appsync {

class EmbeddedInstaller;
class EmbeddedRegistry;
class OstrelAppInstallCoordinator;
struct CoordinationObject;
struct CoordinationPlaceholder;
struct CoordinationPromise;
struct InstallCoordinator;
struct InstallObserverRegistration;

// The codes of the domain "OstrelError" that this service gives.
inline constexpr std::int64_t kOstrelUnknownObject = 2;       // nothing is held under that reference, or something else
inline constexpr std::int64_t kOstrelBadIdentifier = 3;       // no single path component
inline constexpr std::int64_t kOstrelNoCoordinator = 4;       // there is none, and none was to be made
inline constexpr std::int64_t kOstrelAnotherKind = 5;         // a coordinator of another kind lives
inline constexpr std::int64_t kOstrelNotInstalled = 6;        // there is nothing to update
inline constexpr std::int64_t kOstrelOver = 7;                // dead, finished or cancelled
inline constexpr std::int64_t kOstrelGivenAlready = 8;        // a second time, or to two coordinators
inline constexpr std::int64_t kOstrelNotFitting = 9;          // not for this object
inline constexpr std::int64_t kOstrelPlaceholderFailed = 10;  // the placeholder could not be installed
inline constexpr std::int64_t kOstrelInstallFailed = 11;      // the package could not be installed
inline constexpr std::int64_t kOstrelRemoved = 12;            // the application or its placeholder was removed
inline constexpr std::int64_t kOstrelNobodyToAsk = 13;        // a person was to confirm
inline constexpr std::int64_t kOstrelSeeded = 14;             // dead from the start

// What the service did with a coordinator, for the device's host.
struct CoordinatorEvent {
  enum class Kind : std::uint8_t { PlaceholderInstalled, Completed, Cancelled };

  std::string bundleID;
  Kind kind = Kind::Completed;
  std::optional<Error> error;  // why it failed or was cancelled
};

class EmbeddedCoordination : public OstrelService {
 public:
  // Takes over the coordinators that an earlier process left; none works before `startWork`. All services must outlive
  // this one.
  EmbeddedCoordination(StateStore& store, FileManager& files, EmbeddedRegistry& registry, EmbeddedInstaller& installer,
                       Executor& executor);
  ~EmbeddedCoordination() override;  // drains

  // --- for the device's host; any thread ----------------------------------------------------------------------------

  // Lets the coordinators work, those of an earlier process too.
  void startWork();

  // Begins no further placeholder or install: what is being done is finished, the rest is a later process's.
  void stopWork();

  // Whether a later process will know of a coordinator of this application.
  bool isRecorded(const std::string& bundleID) const;

  // Finishes the work that is queued, writes down what is not yet written and begins nothing more: no callback runs
  // when this returns, and none is to come. Not to be called from a callback.
  void drain();

  // Waits for the installs and removals that are under way. True when no coordinator that could go on has a fulfilled
  // package promise and no removal is pending; false when nothing moved for as long as `patience`, or on an interrupt.
  bool waitUntilSettled(Waiting& waiting, std::chrono::milliseconds patience);

  // The person at the device cancels the install (as client 0), or asks for it first. Without a live coordinator of
  // that application nothing happens.
  void personCancels(const std::string& bundleID, const Error& reason);
  void personPrioritizes(const std::string& bundleID);

  // For the registry's hook: the placeholder has been taken away. Cancels a live coordinator (as client 0) and forgets
  // a dead one.
  void placeholderUninstalled(const std::string& bundleID);

  // The device paths of packages that are promised complete and not installed or given up yet.
  std::vector<std::string> packagePathsInUse();

  // Called on the application's strand after the observers have heard the same, so for different applications at the
  // same time. Null: nobody listens.
  void setEventListener(std::function<void(const CoordinatorEvent&)> listener);

  // Asked before a package is unpacked; an error it answers fails the install. Null: nobody is asked.
  void setInstallGate(std::function<std::optional<Error>(const std::string& bundleID)> gate);

  // Puts coordinators there, in place of those of the same applications: see `seedCoordination`.
  bool seed(const PropertyList& coordinators, ErrorOut error);

  // --- OstrelService ------------------------------------------------------------------------------------------------
  OstrelRef coordinatorForApp(OstrelCoordinatorKind kind, const std::string& bundleID, OstrelClientID client,
                              bool create, bool* created, ErrorOut error) override;
  OstrelClientID creatorIdentifier(OstrelRef coordinator) override;
  std::optional<std::string> bundleID(OstrelRef coordinator) override;
  std::optional<Error> error(OstrelRef coordinator) override;
  void setObserver(OstrelRef coordinator, const Observer& observer) override;

  bool hasInstallOptions(OstrelRef coordinator) override;
  bool setInstallOptions(OstrelRef coordinator, const KilnInstallOptions& options, ErrorOut error) override;
  bool hasInitialVeylAssetPromises(OstrelRef coordinator) override;
  bool setInitialVeylAssetPromises(OstrelRef coordinator, const std::vector<OstrelRef>& promises,
                                   ErrorOut error) override;
  bool hasAppAssetPromise(OstrelRef coordinator) override;
  bool setAppAssetPromise(OstrelRef coordinator, OstrelRef promise, ErrorOut error) override;
  OstrelRef appAssetPromise(OstrelRef coordinator, ErrorOut error) override;
  bool hasPlaceholderPromise(OstrelRef coordinator) override;
  bool setPlaceholderPromise(OstrelRef coordinator, OstrelRef placeholder, ErrorOut error) override;
  bool hasUserDataPromise(OstrelRef coordinator) override;
  bool setUserDataPromise(OstrelRef coordinator, OstrelRef promise, ErrorOut error) override;
  OstrelClientID appAssetPromiseResponsibleClient(OstrelRef coordinator, ErrorOut error) override;
  bool setAppAssetPromiseResponsibleClient(OstrelRef coordinator, OstrelClientID client, ErrorOut error) override;

  OstrelRef makePlaceholder(const std::string& bundleName, const std::string& bundleID, std::uint64_t installType,
                            OstrelClientID client) override;
  bool setIconPromise(OstrelRef placeholder, OstrelRef promise, ErrorOut error) override;
  bool setPlaceholderAttributes(OstrelRef placeholder, const OstrelPlaceholderAttributes& attributes,
                                ErrorOut error) override;
  bool setMetadata(OstrelRef placeholder, const std::optional<KilnStoreMetadata>& metadata, ErrorOut error) override;
  bool setConfigurationComplete(OstrelRef placeholder, ErrorOut error) override;

  OstrelRef makePromise(OstrelPromiseKind kind, const std::string& name, OstrelClientID client,
                        const std::optional<FileURL>& transferPath, std::uint64_t diskSpaceNeeded) override;
  void setTransferPath(OstrelRef promise, const std::optional<FileURL>& path) override;
  void setPercentComplete(OstrelRef promise, double fraction) override;
  void setComplete(OstrelRef promise, bool complete) override;
  bool isComplete(OstrelRef promise) override;

  bool cancel(OstrelRef object, const Error& reason, OstrelClientID client, ErrorOut error) override;
  std::string description(OstrelRef object) override;
  void release(OstrelRef object) override;

  OstrelRef addInstallObserver(const std::string& machServiceName, const std::set<OstrelClientID>& clients,
                               const Observer& observer) override;
  void uninstallApp(const std::string& bundleID, bool requestUserConfirmation, Completion completion) override;
  Error createUserPresentableError(std::int64_t code, std::int32_t flag, const Error& underlying) override;

 private:
  enum class Step : std::uint8_t;
  using Event = std::function<void(OstrelAppInstallObserverDelegate&, const OstrelAppInstallCoordinator&)>;

  // Objects and their holds. Where an error is set the answer is null.
  using Possession = bool (InstallCoordinator::*)() const;
  template <typename Object>
  std::shared_ptr<Object> find(OstrelRef ref) APPSYNC_REQUIRES(_mutex);
  OstrelRef hold(const std::shared_ptr<CoordinationObject>& object) APPSYNC_REQUIRES(_mutex);
  std::shared_ptr<InstallCoordinator> current(const std::string& bundleID) const APPSYNC_REQUIRES(_mutex);
  std::shared_ptr<InstallCoordinator> lookUp(OstrelCoordinatorKind kind, const std::string& bundleID, ErrorOut error)
      APPSYNC_REQUIRES(_mutex);
  bool has(OstrelRef coordinator, Possession possession);
  std::shared_ptr<InstallCoordinator> receiver(OstrelRef coordinator, Possession possession, ErrorOut error)
      APPSYNC_REQUIRES(_mutex);
  std::shared_ptr<CoordinationPromise> gift(OstrelRef promise, ErrorOut error) APPSYNC_REQUIRES(_mutex);
  std::shared_ptr<CoordinationPlaceholder> draft(OstrelRef placeholder, ErrorOut error) APPSYNC_REQUIRES(_mutex);
  bool givePromise(OstrelRef coordinator, OstrelRef promise, Possession possession,
                   std::shared_ptr<CoordinationPromise> InstallCoordinator::*place, ErrorOut error);
  void changePromise(OstrelRef promise, const std::function<void(CoordinationPromise&)>& change);
  std::optional<Bytes> iconOf(OstrelRef placeholder);
  bool cancelCoordinator(const std::shared_ptr<InstallCoordinator>& coordinator, const Error& reason,
                         OstrelClientID client) APPSYNC_REQUIRES(_mutex);

  // The worker (coordination_worker.cpp).
  void post(const std::string& strand, Executor::Job job) APPSYNC_REQUIRES(_mutex);
  void consider(const std::shared_ptr<InstallCoordinator>& coordinator) APPSYNC_REQUIRES(_mutex);
  Step nextStep(const InstallCoordinator& coordinator) const APPSYNC_REQUIRES(_mutex);
  void work(const std::shared_ptr<InstallCoordinator>& coordinator);
  void save(const std::shared_ptr<InstallCoordinator>& coordinator);
  void installPlaceholder(const std::shared_ptr<InstallCoordinator>& coordinator);
  void install(const std::shared_ptr<InstallCoordinator>& coordinator);
  bool unpack(const std::shared_ptr<InstallCoordinator>& coordinator, ErrorOut error);
  void finish(const std::shared_ptr<InstallCoordinator>& coordinator);
  void fail(const std::shared_ptr<InstallCoordinator>& coordinator, std::int64_t code, const std::string& text,
            const std::optional<Error>& cause);
  void show(const std::shared_ptr<InstallCoordinator>& coordinator);
  void tidyUp(const std::shared_ptr<InstallCoordinator>& coordinator);
  void deletePackage(const std::shared_ptr<InstallCoordinator>& coordinator);
  void beginFulfillment(const std::shared_ptr<InstallCoordinator>& coordinator, std::uint64_t promise);
  void tellEnding(const std::shared_ptr<InstallCoordinator>& coordinator);
  void tell(const std::shared_ptr<InstallCoordinator>& coordinator, const Event& event);
  void tellHost(const CoordinatorEvent& event);
  void remove(const std::string& bundleID, const Completion& completion);
  void forgetRecord(const std::string& bundleID);
  bool isSettled() const APPSYNC_REQUIRES(_mutex);

  // Records (coordination_records.cpp).
  void loadRecords() APPSYNC_REQUIRES(_mutex);

  StateStore& _store;
  FileManager& _files;
  EmbeddedRegistry& _registry;
  EmbeddedInstaller& _installer;
  Executor& _executor;

  Mutex _mutex;
  std::condition_variable _changed;  // a job has ended, an install has moved on, a callback has returned
  std::map<std::string, std::shared_ptr<InstallCoordinator>> _coordinators APPSYNC_GUARDED_BY(_mutex);
  std::map<std::uint64_t, std::shared_ptr<CoordinationObject>> _held APPSYNC_GUARDED_BY(_mutex);
  std::set<std::shared_ptr<InstallObserverRegistration>> _registrations APPSYNC_GUARDED_BY(_mutex);
  std::uint64_t _lastRef APPSYNC_GUARDED_BY(_mutex) = 0;
  std::uint64_t _jobs APPSYNC_GUARDED_BY(_mutex) = 0;   // queued or running
  std::uint64_t _moves APPSYNC_GUARDED_BY(_mutex) = 0;  // grows with everything that gets done
  bool _working APPSYNC_GUARDED_BY(_mutex) = false;
  bool _drained APPSYNC_GUARDED_BY(_mutex) = false;
  std::function<void(const CoordinatorEvent&)> _eventListener APPSYNC_GUARDED_BY(_mutex);
  std::function<std::optional<Error>(const std::string& bundleID)> _installGate APPSYNC_GUARDED_BY(_mutex);
};

// Whether a record of the state store that is to be a coordinator's can be read as one; every other record can.
bool isCoordinatorRecord(const std::string& name, const PropertyList& record);

// What `Device::status` shows under "coordinators": an array with a dictionary for each, "identifier", "kind"
// ("initiating", "updating", "restoring", "restoring-demoted"), "creator", "error" (a text; absent while it lives),
// "responsibleClient" (absent when nobody has been named), "installOptions", "initialAssetPromises",
// "placeholderPromise", "userDataPromise" (booleans) and "assetPromise" ("open" or "complete"; absent when there is
// none). Only reads; a record that is damaged or vanishes meanwhile is left out.
PropertyList coordinationStatus(const StateStore& store);

// Whether this is an array of such dictionaries: "identifier" and "kind" have to be there, the "creator" is this client
// when it is not. False, with an error that names the entry and what would mend it.
bool checkCoordinationSeed(const PropertyList& coordinators, ErrorOut error);

// Puts them there, after the placeholders of the same seed. A coordinator with an "error" is dead. A package that is
// "complete" lies nowhere, so it is never installed; a placeholder promise is one with the identifier as its name, and
// counts as installed when the registry has a placeholder of the application. Changes nothing if the check fails.
bool seedCoordination(EmbeddedCoordination& coordination, const PropertyList& coordinators, ErrorOut error);

}  // namespace appsync
