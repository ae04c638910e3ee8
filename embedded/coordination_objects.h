// What the coordination service keeps in memory, and how a coordinator becomes a record and comes back. Private to it.
//
// All members are guarded by the service's mutex, but for those that are constant.
#pragma once

#include <array>
#include <cstdint>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <thread>

#include "embedded/registry.h"
#include "platform/ostrel.h"
#include "platform/ostrel_objects.h"

namespace appsync {

struct CoordinationObject {
  virtual ~CoordinationObject() = default;

  std::uint64_t ref = 0;  // given when it is first held
  std::uint64_t holds = 0;
};

struct CoordinationPromise : CoordinationObject {
  OstrelPromiseKind kind = OstrelPromiseKind::TransferToPath;
  std::string name;
  std::optional<std::string> path;
  double fraction = 0;
  bool isComplete = false;
  bool isCancelled = false;
  bool isGiven = false;
  std::weak_ptr<InstallCoordinator> owner;  // whose package or user data it is
};

struct CoordinationPlaceholder : CoordinationObject {
  PlaceholderDescription description;  // without the icon
  std::shared_ptr<CoordinationPromise> icon;
  bool isConfigured = false;
  bool isCancelled = false;
  bool isGiven = false;
};

struct InstallCoordinator : CoordinationObject {
  enum class Life : std::uint8_t { Live, Dead, Finished };
  enum class Shown : std::uint8_t { Nothing, Waiting, Loading, Installing };
  struct Ending {
    bool isCancellation = false;
    OstrelClientID client = 0;  // who cancelled
  };

  OstrelCoordinatorKind kind = OstrelCoordinatorKind::Initiating;
  std::string bundleID;
  OstrelClientID creator = 0;
  OstrelClientID responsibleClient = 0;
  std::optional<Error> error;  // when dead
  std::optional<KilnInstallOptions> installOptions;
  bool hasInitialAssetPromises = false;
  std::shared_ptr<CoordinationPromise> package;
  std::shared_ptr<CoordinationPromise> userData;
  std::optional<PlaceholderDescription> placeholder;
  bool isPlaceholderInstalled = false;
  bool isSeeded = false;

  // Beyond here nothing outlives the process.
  Life life = Life::Live;
  OstrelService::Observer observer;
  bool isScheduled = false;   // its worker has a job
  bool isUnwritten = false;   // the record is not what is here
  bool isCommitting = false;  // the application is being put in place
  bool isInstalling = false;
  bool isTidy = false;           // dead, and nothing of it is left elsewhere
  std::optional<Ending> ending;  // of which the observers have not heard
  std::set<std::uint64_t> begunPromises;
  Shown shown = Shown::Nothing;

  bool hasInstallOptions() const { return installOptions.has_value(); }
  bool hasInitialPromises() const { return hasInitialAssetPromises; }
  bool hasPackagePromise() const { return package != nullptr; }
  bool hasUserDataPromise() const { return userData != nullptr; }
  bool hasPlaceholder() const { return placeholder.has_value(); }

  bool isLive() const { return life == Life::Live; }
  // A demoted application has what it gets once its placeholder is there.
  bool hasEnded() const { return kind == OstrelCoordinatorKind::RestoringDemoted && isPlaceholderInstalled; }
  // A package that can be installed.
  bool hasPackage() const { return package && package->isComplete && package->path; }
};

struct InstallObserverRegistration : CoordinationObject {
  std::string name;
  std::set<OstrelClientID> clients;
  OstrelService::Observer observer;
  std::multiset<std::thread::id> running;  // the threads of its callbacks
};

inline Error ostrelError(std::int64_t code, std::string text) {
  return {std::string(kOstrelErrorDomain), code, std::move(text)};
}

// Sets the error and answers false.
inline bool refuse(ErrorOut error, std::int64_t code, std::string text) {
  setError(error, ostrelError(code, std::move(text)));
  return false;
}

// "initiating", "updating", "restoring", "restoring-demoted".
std::string_view nameOf(OstrelCoordinatorKind kind);

// The state store's record of a coordinator.
std::string coordinatorRecordName(const std::string& bundleID);
PropertyList coordinatorRecord(const InstallCoordinator& coordinator);
// Null when the record is no coordinator's.
std::shared_ptr<InstallCoordinator> coordinatorFromRecord(const std::string& bundleID, const PropertyList& record);

}  // namespace appsync
