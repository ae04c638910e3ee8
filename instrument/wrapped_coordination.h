// The install coordination service: coordinators, placeholders, promises, observers.
#pragma once

#include "instrument/probe.h"
#include "instrument/references.h"
#include "platform/ostrel_objects.h"

namespace appsync {

class WrappedCoordination : public OstrelService {
 public:
  WrappedCoordination(OstrelService& bare, Probe& probe) : _bare(bare), _probe(probe) {}

  OstrelAppInstallCoordinator makePhantom(std::optional<std::string> bundleID, std::optional<Error> error) {
    return {*this, _references.givePhantom(std::move(bundleID), std::move(error))};
  }

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
  class ObserverOfCoordinators;

  // A call on an object. On a made-up one it never reaches the service: it is refused.
  template <class Forward, class... Shown>
  std::invoke_result_t<Forward, ErrorOut> on(OstrelRef object, Operation operation, ErrorOut error,
                                             const Forward& forward, const Shown&... shown);
  // A question that the script may answer, about an object.
  template <class Value, class Question, class... Arguments>
  Value ask(OstrelRef object, Operation operation, const std::function<std::optional<Value>(Arguments...)>& answer,
            const Question& question, const std::type_identity_t<Arguments>&... arguments);
  bool has(OstrelRef coordinator, Operation operation, bool (OstrelService::*question)(OstrelRef));
  template <class Forward, class... Shown>
  void tell(OstrelRef object, Operation operation, const Forward& forward, const Shown&... shown);

  NamedRef named(OstrelRef object) const { return _references.named(object); }

  OstrelService& _bare;
  Probe& _probe;
  References _references;
};

}  // namespace appsync
