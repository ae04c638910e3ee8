// The install coordination service's classes, as small value handles over `OstrelService`.
//
// A handle is empty (an absent object: `if (handle)` is false) or holds its object until the last copy of it is gone.
// An empty handle may be described and passed where the service accepts none; `setPercentComplete` and `setComplete` on
// an empty promise do nothing. Handles may be copied and used on any thread; the service must outlive them.
#pragma once

#include <memory>
#include <optional>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "platform/ostrel.h"

namespace appsync {

class OstrelObject {
 public:
  OstrelObject() = default;
  OstrelObject(OstrelService& service, OstrelRef ref) {
    if (ref) _held = std::make_shared<const Held>(service, ref);
  }

  explicit operator bool() const { return _held != nullptr; }
  OstrelRef ref() const { return _held ? _held->ref : OstrelRef{}; }
  std::string description() const { return _held ? _held->service.description(_held->ref) : "(null)"; }

  // The object must be there.
  bool cancelForReason(const Error& reason, OstrelClientID client, ErrorOut error) const {
    return service().cancel(ref(), reason, client, error);
  }

 protected:
  OstrelService& service() const { return _held->service; }

 private:
  struct Held {
    Held(OstrelService& owner, OstrelRef object) : service(owner), ref(object) {}
    ~Held() { service.release(ref); }
    Held(const Held&) = delete;
    Held& operator=(const Held&) = delete;

    OstrelService& service;
    const OstrelRef ref;
  };

  std::shared_ptr<const Held> _held;
};

class OstrelPromise : public OstrelObject {
 public:
  using OstrelObject::OstrelObject;

  void setTransferPath(const std::optional<FileURL>& path) const {
    if (*this) service().setTransferPath(ref(), path);
  }
  void setPercentComplete(double fraction) const {
    if (*this) service().setPercentComplete(ref(), fraction);
  }
  void setComplete(bool complete) const {
    if (*this) service().setComplete(ref(), complete);
  }
  bool isComplete() const { return *this ? service().isComplete(ref()) : false; }
};

class OstrelPromisedTransferToPath : public OstrelPromise {
 public:
  using OstrelPromise::OstrelPromise;

  static OstrelPromisedTransferToPath initWithName(OstrelService& service, const std::string& name,
                                                   OstrelClientID client, const std::optional<FileURL>& transferPath,
                                                   std::uint64_t diskSpaceNeeded) {
    return {service,
            service.makePromise(OstrelPromiseKind::TransferToPath, name, client, transferPath, diskSpaceNeeded)};
  }
};

class OstrelPromisedOutOfBandTransfer : public OstrelPromise {
 public:
  using OstrelPromise::OstrelPromise;

  static OstrelPromisedOutOfBandTransfer initWithName(OstrelService& service, const std::string& name,
                                                      OstrelClientID client, std::uint64_t diskSpaceNeeded) {
    return {service,
            service.makePromise(OstrelPromiseKind::OutOfBandTransfer, name, client, std::nullopt, diskSpaceNeeded)};
  }
};

class OstrelPlaceholder : public OstrelObject {
 public:
  using OstrelObject::OstrelObject;

  static OstrelPlaceholder initAppPlaceholderWithBundleName(OstrelService& service, const std::string& bundleName,
                                                            const std::string& bundleID, std::uint64_t installType,
                                                            OstrelClientID client) {
    return {service, service.makePlaceholder(bundleName, bundleID, installType, client)};
  }

  bool setIconPromise(const OstrelPromise& promise, ErrorOut error) const {
    return service().setIconPromise(ref(), promise.ref(), error);
  }
  bool setPlaceholderAttributes(const OstrelPlaceholderAttributes& attributes, ErrorOut error) const {
    return service().setPlaceholderAttributes(ref(), attributes, error);
  }
  bool setMetadata(const std::optional<KilnStoreMetadata>& metadata, ErrorOut error) const {
    return service().setMetadata(ref(), metadata, error);
  }
  bool setConfigurationCompleteWithError(ErrorOut error) const {
    return service().setConfigurationComplete(ref(), error);
  }
};

// The base class: a look-up on it answers whatever coordinator there is.
class OstrelAppInstallCoordinator : public OstrelObject {
 public:
  using OstrelObject::OstrelObject;

  static OstrelAppInstallCoordinator coordinatorForAppWithBundleID(OstrelService& service, const std::string& bundleID,
                                                                   OstrelClientID client, bool createIfNotExisting,
                                                                   bool* created, ErrorOut error) {
    return {service, service.coordinatorForApp(OstrelCoordinatorKind::Any, bundleID, client, createIfNotExisting,
                                               created, error)};
  }
  static void uninstallAppWithBundleID(OstrelService& service, const std::string& bundleID,
                                       bool requestUserConfirmation, OstrelService::Completion completion) {
    service.uninstallApp(bundleID, requestUserConfirmation, std::move(completion));
  }

  OstrelClientID creatorIdentifier() const { return service().creatorIdentifier(ref()); }
  std::optional<std::string> bundleID() const { return *this ? service().bundleID(ref()) : std::nullopt; }
  std::optional<Error> error() const { return *this ? service().error(ref()) : std::nullopt; }
  void setObserver(const OstrelService::Observer& observer) const { service().setObserver(ref(), observer); }

  bool hasInstallOptions() const { return service().hasInstallOptions(ref()); }
  bool setInstallOptions(const KilnInstallOptions& options, ErrorOut error) const {
    return service().setInstallOptions(ref(), options, error);
  }
  bool hasInitialVeylAssetPromises() const { return service().hasInitialVeylAssetPromises(ref()); }
  bool setInitialVeylAssetPromises(const std::vector<OstrelPromise>& promises, ErrorOut error) const {
    std::vector<OstrelRef> refs;
    refs.reserve(promises.size());
    for (const OstrelPromise& promise : promises) refs.push_back(promise.ref());
    return service().setInitialVeylAssetPromises(ref(), refs, error);
  }
  bool hasAppAssetPromise() const { return service().hasAppAssetPromise(ref()); }
  bool setAppAssetPromise(const OstrelPromise& promise, ErrorOut error) const {
    return service().setAppAssetPromise(ref(), promise.ref(), error);
  }
  OstrelPromisedTransferToPath appAssetPromiseWithError(ErrorOut error) const {
    return {service(), service().appAssetPromise(ref(), error)};
  }
  bool hasPlaceholderPromise() const { return service().hasPlaceholderPromise(ref()); }
  bool setPlaceholderPromise(const OstrelPlaceholder& placeholder, ErrorOut error) const {
    return service().setPlaceholderPromise(ref(), placeholder.ref(), error);
  }
  bool hasUserDataPromise() const { return service().hasUserDataPromise(ref()); }
  bool setUserDataPromise(const OstrelPromise& promise, ErrorOut error) const {
    return service().setUserDataPromise(ref(), promise.ref(), error);
  }
};

class OstrelInitiatingAppInstallCoordinator : public OstrelAppInstallCoordinator {
 public:
  static OstrelAppInstallCoordinator coordinatorForAppWithBundleID(OstrelService& service, const std::string& bundleID,
                                                                   OstrelClientID client, bool createIfNotExisting,
                                                                   bool* created, ErrorOut error) {
    return {service, service.coordinatorForApp(OstrelCoordinatorKind::Initiating, bundleID, client, createIfNotExisting,
                                               created, error)};
  }
};

class OstrelUpdatingAppInstallCoordinator : public OstrelAppInstallCoordinator {
 public:
  static OstrelAppInstallCoordinator coordinatorForAppWithBundleID(OstrelService& service, const std::string& bundleID,
                                                                   OstrelClientID client, bool createIfNotExisting,
                                                                   bool* created, ErrorOut error) {
    return {service, service.coordinatorForApp(OstrelCoordinatorKind::Updating, bundleID, client, createIfNotExisting,
                                               created, error)};
  }
};

class OstrelRestoringAppInstallCoordinator : public OstrelAppInstallCoordinator {
 public:
  using OstrelAppInstallCoordinator::OstrelAppInstallCoordinator;

  static OstrelRestoringAppInstallCoordinator coordinatorForAppWithBundleID(OstrelService& service,
                                                                            const std::string& bundleID,
                                                                            OstrelClientID client,
                                                                            bool createIfNotExisting, bool* created,
                                                                            ErrorOut error) {
    return {service, service.coordinatorForApp(OstrelCoordinatorKind::Restoring, bundleID, client, createIfNotExisting,
                                               created, error)};
  }

  OstrelClientID appAssetPromiseResponsibleClientWithError(ErrorOut error) const {
    return service().appAssetPromiseResponsibleClient(ref(), error);
  }
  bool setAppAssetPromiseResponsibleClient(OstrelClientID client, ErrorOut error) const {
    return service().setAppAssetPromiseResponsibleClient(ref(), client, error);
  }
};

class OstrelRestoringDemotedAppInstallCoordinator : public OstrelAppInstallCoordinator {
 public:
  static OstrelAppInstallCoordinator coordinatorForAppWithBundleID(OstrelService& service, const std::string& bundleID,
                                                                   OstrelClientID client, bool createIfNotExisting,
                                                                   bool* created, ErrorOut error) {
    return {service, service.coordinatorForApp(OstrelCoordinatorKind::RestoringDemoted, bundleID, client,
                                               createIfNotExisting, created, error)};
  }
};

// A registration for install events; it ends when the last handle is gone.
class OstrelAppInstallObserver : public OstrelObject {
 public:
  using OstrelObject::OstrelObject;

  static OstrelAppInstallObserver initWithMachServiceName(OstrelService& service, const std::string& machServiceName,
                                                          const std::set<OstrelClientID>& clients,
                                                          const OstrelService::Observer& delegate) {
    return {service, service.addInstallObserver(machServiceName, clients, delegate)};
  }
};

// What an observer may hear of coordinators. Callbacks come on threads of the service, several at once also; the handle
// is valid beyond the call. What an observer does not override is ignored.
class OstrelAppInstallObserverDelegate {
 public:
  virtual ~OstrelAppInstallObserverDelegate() = default;

  virtual void coordinatorShouldPrioritize(const OstrelAppInstallCoordinator& /*coordinator*/) {}
  virtual void coordinatorDidInstallPlaceholder(const OstrelAppInstallCoordinator& /*coordinator*/) {}
  // The install is over; the coordinator's `error` is set first when it has failed.
  virtual void coordinatorDidCompleteSuccessfully(const OstrelAppInstallCoordinator& /*coordinator*/) {}
  // Whoever cancelled it, `client` names it.
  virtual void coordinatorCanceledWithReason(const OstrelAppInstallCoordinator& /*coordinator*/,
                                             const Error& /*reason*/, OstrelClientID /*client*/) {}
  // A promise of the coordinator has begun to be fulfilled: 1 package, 2 placeholder, 3 user data.
  virtual void promiseDidBeginFulfillmentWithIdentifier(std::uint64_t /*identifier*/) {}
};

inline Error OstrelCreateUserPresentableError(OstrelService& service, std::int64_t code, std::int32_t flag,
                                              const Error& underlying) {
  return service.createUserPresentableError(code, flag, underlying);
}

}  // namespace appsync
