// The plug-in's one exported symbol, and the boundary that no exception crosses.
#include "platform/plugin.h"

#include <memory>
#include <utility>

#include "client/apps_client.h"

namespace appsync {

namespace {

// Only running out of memory, or of other means of the process, can bring an exception here. The call then ends with
// the answer that the daemon takes for a failure, as far as its operation has one.
template <class Call, class Answer>
auto guarded(const Call& call, Answer onFailure) noexcept -> decltype(call()) {
  try {
    return call();
  } catch (...) {
    return onFailure;
  }
}

template <class Call>
void guarded(const Call& call) noexcept {
  try {
    call();
  } catch (...) {
  }
}

class ClientBoundary final : public DovelClient {
 public:
  explicit ClientBoundary(const Platform& platform) : _client(platform) {}

  std::vector<std::string> supportedDataclasses() override {
    return guarded([&] { return _client.supportedDataclasses(); }, std::vector<std::string>{});
  }
  std::string currentSyncAnchor() override {
    return guarded([&] { return _client.currentSyncAnchor(); }, std::string{});
  }
  bool prepareForSyncWithHostAnchor(const std::string& hostAnchor, const ProgressCallback& progressCallback,
                                    ErrorOut error) override {
    return guarded([&] { return _client.prepareForSyncWithHostAnchor(hostAnchor, progressCallback, error); }, false);
  }
  PropertyList installedAssets() override {
    return guarded([&] { return _client.installedAssets(); }, PropertyList::dictionary());
  }
  PropertyList installedAssetMetrics() override {
    return guarded([&] { return _client.installedAssetMetrics(); }, PropertyList::dictionary());
  }
  bool reconcileSync(std::uint32_t type, const std::string& newAnchor, const ProgressCallback& progressCallback,
                     ErrorOut error) override {
    return guarded([&] { return _client.reconcileSync(type, newAnchor, progressCallback, error); }, false);
  }
  bool reconcileRestoreOfType(std::int32_t type, ErrorOut error) override {
    return guarded([&] { return _client.reconcileRestoreOfType(type, error); }, false);
  }
  void syncEndedWithSuccess(bool success) override {
    guarded([&] { _client.syncEndedWithSuccess(success); });
  }
  std::vector<DovelAssetRef> outstandingAssetTransfers() override {
    return guarded([&] { return _client.outstandingAssetTransfers(); }, std::vector<DovelAssetRef>{});
  }
  void assetTransferSucceeded(const DovelAssetRef& asset, bool succeeded, const std::optional<Error>& error) override {
    guarded([&] { _client.assetTransferSucceeded(asset, succeeded, error); });
  }
  void assetTransferUpdatedProgress(const DovelAssetRef& asset, double progress) override {
    guarded([&] { _client.assetTransferUpdatedProgress(asset, progress); });
  }
  void assetInstallSucceeded(const DovelAssetRef& asset) override {
    guarded([&] { _client.assetInstallSucceeded(asset); });
  }
  void assetInstallFailed(const DovelAssetRef& asset, const std::optional<Error>& error) override {
    guarded([&] { _client.assetInstallFailed(asset, error); });
  }
  void assetTransferEndedWithSuccess(bool success) override {
    guarded([&] { _client.assetTransferEndedWithSuccess(success); });
  }
  void clearSyncData() override {
    guarded([&] { _client.clearSyncData(); });
  }
  std::set<std::string> zelkIDsForAssets() override {
    return guarded([&] { return _client.zelkIDsForAssets(); }, std::set<std::string>{});
  }
  std::vector<DovelMutableAccountInfo> accountsForAssets() override {
    return guarded([&] { return _client.accountsForAssets(); }, std::vector<DovelMutableAccountInfo>{});
  }
  void prepareForBackup() override {
    guarded([&] { _client.prepareForBackup(); });
  }
  std::optional<std::set<std::string>> disabledAssetTypes() override {
    return guarded([&] { return _client.disabledAssetTypes(); }, std::optional<std::set<std::string>>{});
  }
  std::shared_ptr<OstrelAppInstallObserverDelegate> installObserverDelegate() override {
    return _client.installObserverDelegate();
  }

 private:
  AppsClient _client;
};

DovelClient* makeClient(const Platform& platform) noexcept {
  return guarded([&]() -> DovelClient* { return std::make_unique<ClientBoundary>(platform).release(); }, nullptr);
}

}  // namespace

}  // namespace appsync

extern "C" __attribute__((visibility("default"))) const appsync::DovelPluginDescriptor DovelClientPlugin = {
    .size = sizeof(appsync::DovelPluginDescriptor),
    .abi = appsync::kDovelPluginABI,
    .bundleIdentifier = appsync::kPluginBundleIdentifier.data(),
    .version = APPSYNC_VERSION,
    .makeClient = appsync::makeClient,
};
