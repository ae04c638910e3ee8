// The contract of the install coordination service as a test suite. It runs on the bare embedded service and through
// the instruments; whoever ports the platform instantiates it for their own (ostrel_contract.cpp holds the tests):
//
//     INSTANTIATE_TEST_SUITE_P(Mine, OstrelContract, testing::Values(MakeContractDevice(&makeMine)));
#pragma once

#include <gtest/gtest.h>

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/file_manager.h"
#include "platform/ostrel_objects.h"
#include "platform/pellum.h"
#include "platform/platform.h"
#include "platform/thread_annotations.h"

namespace appsync {

// A fresh device whose coordinators may work.
struct ContractDevice {
  virtual ~ContractDevice() = default;
  virtual Platform platform() = 0;  // of which the suite uses coordination, defaultWorkspace and files
  virtual void settle() = 0;        // returns when the services have nothing left to do by themselves
};

using MakeContractDevice = std::function<std::unique_ptr<ContractDevice>()>;

// Writes down what it hears, one line an event, and keeps the handles.
class HearingObserver : public OstrelAppInstallObserverDelegate {
 public:
  void coordinatorShouldPrioritize(const OstrelAppInstallCoordinator& coordinator) override {
    add("prioritize", coordinator);
  }
  void coordinatorDidInstallPlaceholder(const OstrelAppInstallCoordinator& coordinator) override {
    add("placeholder", coordinator);
  }
  void coordinatorDidCompleteSuccessfully(const OstrelAppInstallCoordinator& coordinator) override {
    add(coordinator.error() ? "failed" : "installed", coordinator);
  }
  void coordinatorCanceledWithReason(const OstrelAppInstallCoordinator& coordinator, const Error& reason,
                                     OstrelClientID client) override {
    add("cancelled by " + std::to_string(client) + " (" + reason.description() + ")", coordinator);
  }
  void promiseDidBeginFulfillmentWithIdentifier(std::uint64_t identifier) override {
    MutexLock lock(_mutex);
    _lines.push_back("begins " + std::to_string(identifier));
  }

  // Called with every coordinator, on the thread of its event.
  std::function<void(const OstrelAppInstallCoordinator&)> whenHeard;

  std::vector<std::string> lines() {
    MutexLock lock(_mutex);
    return _lines;
  }

 private:
  void add(const std::string& what, const OstrelAppInstallCoordinator& coordinator) {
    if (whenHeard) whenHeard(coordinator);
    MutexLock lock(_mutex);
    _lines.push_back(what + ' ' + coordinator.bundleID().value_or("(null)"));
  }

  Mutex _mutex;
  std::vector<std::string> _lines APPSYNC_GUARDED_BY(_mutex);
};

// A client of the service, as small as it gets.
class ContractClient {
 public:
  explicit ContractClient(const Platform& platform) : _platform(platform) {}

  OstrelService& service() { return *_platform.coordination; }
  PellumApplicationWorkspace& registry() { return *_platform.defaultWorkspace; }
  FileManager& files() { return *_platform.files; }

  // A package that holds this application; with another identifier in it, one that cannot be installed as `bundleID`.
  std::string putPackage(const std::string& bundleID, const std::string& version, const std::string& identifier = {});

  OstrelAppInstallCoordinator coordinator(OstrelCoordinatorKind kind, const std::string& bundleID, bool create,
                                          OstrelClientID client = OstrelClientDovel, ErrorOut error = nullptr) {
    return {service(), service().coordinatorForApp(kind, bundleID, client, create, nullptr, error)};
  }
  OstrelPromise promise(const std::string& name) {
    return OstrelPromisedTransferToPath::initWithName(service(), name, OstrelClientDovel, std::nullopt, 0);
  }
  OstrelPlaceholder placeholder(const std::string& bundleID, std::uint64_t installType = kPellumInstallTypeSync) {
    return OstrelPlaceholder::initAppPlaceholderWithBundleName(service(), "Name", bundleID, installType,
                                                               OstrelClientDovel);
  }

  // Everything that an install needs but the package; false when a part of it was refused.
  bool configure(const OstrelAppInstallCoordinator& coordinator, const std::string& bundleID);
  bool prepare(OstrelCoordinatorKind kind, const std::string& bundleID, const OstrelService::Observer& observer = {});
  // The package has arrived; false when there is no live coordinator that waits for one.
  bool deliver(const std::string& bundleID, const std::string& package);
  std::optional<std::string> installedVersion(const std::string& bundleID);
  bool hasPlaceholder(const std::string& bundleID) {
    return registry().applicationProxyForIdentifier(bundleID, true).has_value();
  }

 private:
  const Platform _platform;
};

class OstrelContract : public testing::TestWithParam<MakeContractDevice> {
 protected:
  std::unique_ptr<ContractDevice> device = GetParam()();
  ContractClient client{device->platform()};
  std::shared_ptr<HearingObserver> heard = std::make_shared<HearingObserver>();
};

}  // namespace appsync
