#include "instrument/wrapped_coordination.h"

#include "instrument/instruments.h"

namespace appsync {

namespace {

std::string applicationOfPromise(std::string_view name) {
  for (const std::string_view suffix : {"-Asset", "-Icon", "-UserData"}) {
    if (name.ends_with(suffix)) return std::string(name.substr(0, name.size() - suffix.size()));
  }
  return std::string(name);
}

Error phantomRefuses(std::string_view operation) {
  return Error(std::string(kFaultErrorDomain), kFaultPhantom,
               std::string(operation) + " is refused by a coordinator that is made up");
}

}  // namespace

// --- calls on objects -----------------------------------------------------------------------------------------------

template <class Forward, class... Shown>
std::invoke_result_t<Forward, ErrorOut> WrappedCoordination::on(OstrelRef object, Operation operation, ErrorOut error,
                                                                const Forward& forward, const Shown&... shown) {
  const std::string application = _references.bundleID(object);
  const auto refused = [&](ErrorOut out) -> std::invoke_result_t<Forward, ErrorOut> {
    if (!_references.phantom(object)) return forward(out);
    setError(out, phantomRefuses(operation.name()));
    return {};
  };
  return _probe.call(operation, Subject::application(application), error, refused, named(object), shown...);
}

template <class Value, class Question, class... Arguments>
Value WrappedCoordination::ask(OstrelRef object, Operation operation,
                               const std::function<std::optional<Value>(Arguments...)>& answer,
                               const Question& question, const std::type_identity_t<Arguments>&... arguments) {
  const std::string application = _references.bundleID(object);
  const auto forward = [&](ErrorOut) { return scripted(answer, question, arguments...); };
  return _probe.call(operation, Subject::application(application), nullptr, forward, named(object));
}

bool WrappedCoordination::has(OstrelRef coordinator, Operation operation, bool (OstrelService::*question)(OstrelRef)) {
  const auto otherwise = [&] { return !_references.phantom(coordinator) && (_bare.*question)(coordinator); };
  const auto script = _probe.script();
  return ask(coordinator, operation, script->has, otherwise, std::string(operation.name()),
             _references.bundleID(coordinator));
}

template <class Forward, class... Shown>
void WrappedCoordination::tell(OstrelRef object, Operation operation, const Forward& forward, const Shown&... shown) {
  const std::string application = _references.bundleID(object);
  const auto unlessPhantom = [&] {
    if (!_references.phantom(object)) forward();
  };
  _probe.tell(operation, Subject::application(application), unlessPhantom, named(object), shown...);
}

// --- coordinators ---------------------------------------------------------------------------------------------------

OstrelRef WrappedCoordination::coordinatorForApp(OstrelCoordinatorKind kind, const std::string& bundleID,
                                                 OstrelClientID client, bool create, bool* created, ErrorOut error) {
  if (created != nullptr) *created = false;
  const auto forward = [&](ErrorOut out) {
    const OstrelRef ref = _bare.coordinatorForApp(kind, bundleID, client, create, created, out);
    return _references.give(ref, "coordinator", bundleID, bundleID);
  };
  return _probe
      .call("coordinatorForAppWithBundleID", Subject::application(bundleID), error, forward, kind, bundleID,
            field("client", client), field("create", create))
      .ref;
}

OstrelClientID WrappedCoordination::creatorIdentifier(OstrelRef coordinator) {
  const auto otherwise = [&] {
    return _references.phantom(coordinator) ? OstrelClientDovel : _bare.creatorIdentifier(coordinator);
  };
  const auto script = _probe.script();
  return ask(coordinator, "creatorIdentifier", script->creatorIdentifier, otherwise, _references.bundleID(coordinator));
}

std::optional<std::string> WrappedCoordination::bundleID(OstrelRef coordinator) {
  const auto otherwise = [&] {
    const auto phantom = _references.phantom(coordinator);
    return phantom ? phantom->bundleID : _bare.bundleID(coordinator);
  };
  const auto script = _probe.script();
  return ask(coordinator, "bundleID", script->bundleID, otherwise, _references.bundleID(coordinator));
}

std::optional<Error> WrappedCoordination::error(OstrelRef coordinator) {
  const auto otherwise = [&] {
    const auto phantom = _references.phantom(coordinator);
    return phantom ? phantom->error : _bare.error(coordinator);
  };
  const auto script = _probe.script();
  return ask(coordinator, "error", script->error, otherwise, _references.bundleID(coordinator));
}

bool WrappedCoordination::hasInstallOptions(OstrelRef coordinator) {
  return has(coordinator, "hasInstallOptions", &OstrelService::hasInstallOptions);
}

bool WrappedCoordination::setInstallOptions(OstrelRef coordinator, const KilnInstallOptions& options, ErrorOut error) {
  const auto forward = [&](ErrorOut out) { return _bare.setInstallOptions(coordinator, options, out); };
  return on(coordinator, "setInstallOptions", error, forward, options);
}

bool WrappedCoordination::hasInitialVeylAssetPromises(OstrelRef coordinator) {
  return has(coordinator, "hasInitialVeylAssetPromises", &OstrelService::hasInitialVeylAssetPromises);
}

bool WrappedCoordination::setInitialVeylAssetPromises(OstrelRef coordinator, const std::vector<OstrelRef>& promises,
                                                      ErrorOut error) {
  const auto forward = [&](ErrorOut out) { return _bare.setInitialVeylAssetPromises(coordinator, promises, out); };
  return on(coordinator, "setInitialVeylAssetPromises", error, forward, field("count", promises.size()));
}

bool WrappedCoordination::hasAppAssetPromise(OstrelRef coordinator) {
  return has(coordinator, "hasAppAssetPromise", &OstrelService::hasAppAssetPromise);
}

bool WrappedCoordination::setAppAssetPromise(OstrelRef coordinator, OstrelRef promise, ErrorOut error) {
  const auto forward = [&](ErrorOut out) { return _bare.setAppAssetPromise(coordinator, promise, out); };
  return on(coordinator, "setAppAssetPromise", error, forward, named(promise));
}

OstrelRef WrappedCoordination::appAssetPromise(OstrelRef coordinator, ErrorOut error) {
  const auto forward = [&](ErrorOut out) {
    const std::string application = _references.bundleID(coordinator);
    return _references.give(_bare.appAssetPromise(coordinator, out), "promise", application + "-Asset", application);
  };
  return on(coordinator, "appAssetPromiseWithError", error, forward).ref;
}

bool WrappedCoordination::hasPlaceholderPromise(OstrelRef coordinator) {
  return has(coordinator, "hasPlaceholderPromise", &OstrelService::hasPlaceholderPromise);
}

bool WrappedCoordination::setPlaceholderPromise(OstrelRef coordinator, OstrelRef placeholder, ErrorOut error) {
  const auto forward = [&](ErrorOut out) { return _bare.setPlaceholderPromise(coordinator, placeholder, out); };
  return on(coordinator, "setPlaceholderPromise", error, forward, named(placeholder));
}

bool WrappedCoordination::hasUserDataPromise(OstrelRef coordinator) {
  return has(coordinator, "hasUserDataPromise", &OstrelService::hasUserDataPromise);
}

bool WrappedCoordination::setUserDataPromise(OstrelRef coordinator, OstrelRef promise, ErrorOut error) {
  const auto forward = [&](ErrorOut out) { return _bare.setUserDataPromise(coordinator, promise, out); };
  return on(coordinator, "setUserDataPromise", error, forward, named(promise));
}

OstrelClientID WrappedCoordination::appAssetPromiseResponsibleClient(OstrelRef coordinator, ErrorOut error) {
  const auto script = _probe.script();
  const auto forward = [&](ErrorOut out) {
    return scripted(
        script->appAssetPromiseResponsibleClient,
        [&] { return _bare.appAssetPromiseResponsibleClient(coordinator, out); }, _references.bundleID(coordinator));
  };
  return on(coordinator, "appAssetPromiseResponsibleClientWithError", error, forward);
}

bool WrappedCoordination::setAppAssetPromiseResponsibleClient(OstrelRef coordinator, OstrelClientID client,
                                                              ErrorOut error) {
  const auto forward = [&](ErrorOut out) {
    return _bare.setAppAssetPromiseResponsibleClient(coordinator, client, out);
  };
  return on(coordinator, "setAppAssetPromiseResponsibleClient", error, forward, field("client", client));
}

// --- placeholders ---------------------------------------------------------------------------------------------------

OstrelRef WrappedCoordination::makePlaceholder(const std::string& bundleName, const std::string& bundleID,
                                               std::uint64_t installType, OstrelClientID client) {
  const auto forward = [&](ErrorOut) {
    return _references.give(_bare.makePlaceholder(bundleName, bundleID, installType, client), "placeholder", bundleID,
                            bundleID);
  };
  return _probe
      .call("initAppPlaceholderWithBundleName", Subject::application(bundleID), nullptr, forward, bundleName, bundleID,
            field("installType", installType), field("client", client))
      .ref;
}

bool WrappedCoordination::setIconPromise(OstrelRef placeholder, OstrelRef promise, ErrorOut error) {
  const auto forward = [&](ErrorOut out) { return _bare.setIconPromise(placeholder, promise, out); };
  return on(placeholder, "setIconPromise", error, forward, named(promise));
}

bool WrappedCoordination::setPlaceholderAttributes(OstrelRef placeholder, const OstrelPlaceholderAttributes& attributes,
                                                   ErrorOut error) {
  const auto forward = [&](ErrorOut out) { return _bare.setPlaceholderAttributes(placeholder, attributes, out); };
  return on(placeholder, "setPlaceholderAttributes", error, forward, attributes);
}

bool WrappedCoordination::setMetadata(OstrelRef placeholder, const std::optional<KilnStoreMetadata>& metadata,
                                      ErrorOut error) {
  const auto forward = [&](ErrorOut out) { return _bare.setMetadata(placeholder, metadata, out); };
  return on(placeholder, "setMetadata", error, forward, metadata);
}

bool WrappedCoordination::setConfigurationComplete(OstrelRef placeholder, ErrorOut error) {
  const auto forward = [&](ErrorOut out) { return _bare.setConfigurationComplete(placeholder, out); };
  return on(placeholder, "setConfigurationCompleteWithError", error, forward);
}

// --- promises -------------------------------------------------------------------------------------------------------

OstrelRef WrappedCoordination::makePromise(OstrelPromiseKind kind, const std::string& name, OstrelClientID client,
                                           const std::optional<FileURL>& transferPath, std::uint64_t diskSpaceNeeded) {
  const std::string application = applicationOfPromise(name);
  const auto forward = [&](ErrorOut) {
    return _references.give(_bare.makePromise(kind, name, client, transferPath, diskSpaceNeeded), "promise", name,
                            application);
  };
  return _probe
      .call("initWithName", Subject::application(application), nullptr, forward, kind, name, field("client", client),
            field("path", transferPath), field("space", diskSpaceNeeded))
      .ref;
}

void WrappedCoordination::setTransferPath(OstrelRef promise, const std::optional<FileURL>& path) {
  tell(
      promise, "setTransferPath", [&] { _bare.setTransferPath(promise, path); }, path);
}

void WrappedCoordination::setPercentComplete(OstrelRef promise, double fraction) {
  tell(
      promise, "setPercentComplete", [&] { _bare.setPercentComplete(promise, fraction); }, fraction);
}

void WrappedCoordination::setComplete(OstrelRef promise, bool complete) {
  tell(
      promise, "setComplete", [&] { _bare.setComplete(promise, complete); }, complete);
}

bool WrappedCoordination::isComplete(OstrelRef promise) {
  const auto script = _probe.script();
  const std::string name = named(promise).name;  // "promise(NAME)"
  const std::size_t open = name.find('(') + 1;
  return ask(
      promise, "isComplete", script->isComplete, [&] { return _bare.isComplete(promise); },
      name.substr(open, name.size() - open - 1));
}

// --- all of them, and the service itself ----------------------------------------------------------------------------

bool WrappedCoordination::cancel(OstrelRef object, const Error& reason, OstrelClientID client, ErrorOut error) {
  const auto forward = [&](ErrorOut out) { return _bare.cancel(object, reason, client, out); };
  return on(object, "cancelForReason", error, forward, field("client", client), reason);
}

std::string WrappedCoordination::description(OstrelRef object) {
  return _references.phantom(object) ? named(object).name : _bare.description(object);
}

void WrappedCoordination::release(OstrelRef object) {
  if (!object) return;
  const std::string application = _references.bundleID(object);
  const auto forward = [&] {
    const void* const owner = _references.owner(object);
    if (!_references.release(object)) _bare.release(object);
    if (owner != nullptr) _probe.forget(owner);
  };
  _probe.tell("release", Subject::application(application), forward, named(object));
}

void WrappedCoordination::uninstallApp(const std::string& bundleID, bool requestUserConfirmation,
                                       Completion completion) {
  const auto forward = [&](const Completion& recorded) {
    _bare.uninstallApp(bundleID, requestUserConfirmation, recorded);
  };
  _probe.start("uninstallAppWithBundleID", bundleID, completion, forward, bundleID,
               field("confirm", requestUserConfirmation));
}

Error WrappedCoordination::createUserPresentableError(std::int64_t code, std::int32_t flag, const Error& underlying) {
  const auto forward = [&](ErrorOut) {
    return std::optional(_bare.createUserPresentableError(code, flag, underlying));
  };
  return *_probe.call("OstrelCreateUserPresentableError", Subject::none(), nullptr, forward, field("code", code),
                      field("flag", flag), underlying);
}

// --- observers ------------------------------------------------------------------------------------------------------

// Stands between the service and one observer. The handles that it passes on are the wrapper's, so that calls on them
// go the same way as all others.
class WrappedCoordination::ObserverOfCoordinators : public OstrelAppInstallObserverDelegate {
 public:
  ObserverOfCoordinators(Observer observer, WrappedCoordination& owner)
      : _observer(std::move(observer)), _owner(owner) {}

  void coordinatorShouldPrioritize(const OstrelAppInstallCoordinator& bare) override {
    pass("coordinatorShouldPrioritize", bare, "",
         [](auto& observer, const auto& coordinator) { observer.coordinatorShouldPrioritize(coordinator); });
  }
  void coordinatorDidInstallPlaceholder(const OstrelAppInstallCoordinator& bare) override {
    pass("coordinatorDidInstallPlaceholder", bare, "",
         [](auto& observer, const auto& coordinator) { observer.coordinatorDidInstallPlaceholder(coordinator); });
  }
  void coordinatorDidCompleteSuccessfully(const OstrelAppInstallCoordinator& bare) override {
    pass("coordinatorDidCompleteSuccessfully", bare, "",
         [](auto& observer, const auto& coordinator) { observer.coordinatorDidCompleteSuccessfully(coordinator); });
  }
  void coordinatorCanceledWithReason(const OstrelAppInstallCoordinator& bare, const Error& reason,
                                     OstrelClientID client) override {
    pass("coordinatorCanceledWithReason", bare, " " + field("client", client) + " " + shown(reason),
         [reason, client](auto& observer, const auto& coordinator) {
           observer.coordinatorCanceledWithReason(coordinator, reason, client);
         });
  }
  void promiseDidBeginFulfillmentWithIdentifier(std::uint64_t identifier) override {
    _owner._probe.deliver(
        InstrumentedService::Coordination, "promiseDidBeginFulfillmentWithIdentifier", "", this, shown(identifier),
        [observer = _observer, identifier] { observer->promiseDidBeginFulfillmentWithIdentifier(identifier); });
  }

 private:
  template <class Event>
  void pass(std::string_view name, const OstrelAppInstallCoordinator& bare, const std::string& details,
            const Event& event) {
    OstrelAppInstallCoordinator coordinator;
    std::string bundleID;
    if (bare) {
      bundleID = bare.bundleID().value_or("");
      _owner._references.lend(bare, bundleID);
      coordinator = OstrelAppInstallCoordinator(_owner, bare.ref());
    }
    _owner._probe.deliver(InstrumentedService::Coordination, name, bundleID, this,
                          shown(_owner.named(bare.ref())) + details,
                          [observer = _observer, coordinator, event] { event(*observer, coordinator); });
  }

  const Observer _observer;
  WrappedCoordination& _owner;
};

void WrappedCoordination::setObserver(OstrelRef coordinator, const Observer& observer) {
  Observer between;
  if (observer) between = std::make_shared<ObserverOfCoordinators>(observer, *this);
  tell(coordinator, "setObserver", [&] { _bare.setObserver(coordinator, between); });
}

OstrelRef WrappedCoordination::addInstallObserver(const std::string& machServiceName,
                                                  const std::set<OstrelClientID>& clients, const Observer& observer) {
  const auto forward = [&](ErrorOut) {
    Observer between;
    if (observer) between = std::make_shared<ObserverOfCoordinators>(observer, *this);
    const OstrelRef registration = _bare.addInstallObserver(machServiceName, clients, between);
    NamedRef given = _references.give(registration, "observer", machServiceName, "");
    _references.setOwner(registration, between.get());
    return given;
  };
  return _probe
      .call("initWithMachServiceName", Subject::none(), nullptr, forward, machServiceName, field("clients", clients))
      .ref;
}

}  // namespace appsync
