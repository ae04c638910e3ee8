// The daemon's protocol for a client that looks after one class of data, and the daemon's own services for it.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "platform/dovel_asset.h"
#include "platform/error.h"
#include "platform/ostrel_objects.h"
#include "platform/property_list.h"

namespace appsync {

// Told how far an operation has come, 0.0 to 1.0. May be empty.
using ProgressCallback = std::function<void(double fraction)>;

// A store account, as the daemon tells it to the host.
class DovelMutableAccountInfo {
 public:
  void setZelkID(std::optional<std::string> id) { _zelkID = std::move(id); }
  void setQenID(std::optional<PropertyList> number) { _qenID = std::move(number); }
  void setAltQenID(std::optional<std::string> id) { _altQenID = std::move(id); }

  const std::optional<std::string>& zelkID() const { return _zelkID; }
  const std::optional<PropertyList>& qenID() const { return _qenID; }  // an integer or a real
  const std::optional<std::string>& altQenID() const { return _altQenID; }

  std::string description() const { return "<account " + _zelkID.value_or("(null)") + ">"; }

 private:
  std::optional<std::string> _zelkID;
  std::optional<PropertyList> _qenID;
  std::optional<std::string> _altQenID;
};

// The daemon calls a client's operations one at a time, in the order of a sync:
//   prepareForSyncWithHostAnchor, installedAssets, installedAssetMetrics, reconcileSync, outstandingAssetTransfers, for
//   each package assetTransferUpdatedProgress and assetTransferSucceeded, assetTransferEndedWithSuccess,
//   syncEndedWithSuccess.
// Operations run on the caller's thread and may block it as each says. The daemon makes no call under a lock that a
// service's callback takes. The operations with a body are optional: this is what an absent one answers.
class DovelClient {
 public:
  virtual ~DovelClient() = default;

  virtual std::vector<std::string> supportedDataclasses() = 0;
  virtual std::string currentSyncAnchor() = 0;

  // Whether the sync may go on.
  virtual bool prepareForSyncWithHostAnchor(const std::string& hostAnchor, const ProgressCallback& progressCallback,
                                            ErrorOut error) = 0;

  // A dictionary: "_Deleted" holds what has gone from the device, and must be shown to the host as deleted.
  virtual PropertyList installedAssets() = 0;
  // A dictionary: "_Count", "_PhysicalSize" and "_PurgeableSize" (bytes), unsigned 64-bit integers.
  virtual PropertyList installedAssetMetrics() = 0;

  // Takes over what the host has staged. False, with an error, when that failed; true can leave an error behind too,
  // for a todo list that could not be read.
  virtual bool reconcileSync(std::uint32_t type, const std::string& newAnchor, const ProgressCallback& progressCallback,
                             ErrorOut error) = 0;
  // After a restore from a backup: brings its applications back as placeholders and waits for these, for a bounded time.
  // True; `error` is always overwritten, with the reason why placeholders were not to be made, or none.
  virtual bool reconcileRestoreOfType(std::int32_t /*type*/, ErrorOut /*error*/) { return true; }
  virtual void syncEndedWithSuccess(bool success) = 0;

  // The packages to request from the host, in the order in which they are wanted.
  virtual std::vector<DovelAssetRef> outstandingAssetTransfers() = 0;
  virtual void assetTransferSucceeded(const DovelAssetRef& asset, bool succeeded,
                                      const std::optional<Error>& error) = 0;
  virtual void assetTransferUpdatedProgress(const DovelAssetRef& asset, double progress) = 0;
  virtual void assetInstallSucceeded(const DovelAssetRef& asset) = 0;
  virtual void assetInstallFailed(const DovelAssetRef& asset, const std::optional<Error>& error) = 0;
  virtual void assetTransferEndedWithSuccess(bool success) = 0;

  // Forgets everything about syncs.
  virtual void clearSyncData() = 0;

  // The ids of the store accounts that the device's applications belong to, and a record for each account.
  virtual std::set<std::string> zelkIDsForAssets() { return {}; }
  virtual std::vector<DovelMutableAccountInfo> accountsForAssets() { return {}; }
  // Tidies the applications' store metadata. What cannot be read or written is left as it is.
  virtual void prepareForBackup() {}
  // The asset types that must not be synced; none when nothing is disabled.
  virtual std::optional<std::set<std::string>> disabledAssetTypes() { return std::nullopt; }

  // Where the client hears the install coordination service, for a host that relays the service's events by itself.
  // Never null; closed, and so silent, once the client is destroyed.
  virtual std::shared_ptr<OstrelAppInstallObserverDelegate> installObserverDelegate() = 0;
};

// The daemon's transfers, as a client may steer them. Any thread; calls back on threads of the daemon, at any moment.
class DovelDeviceService {
 public:
  using Completion = std::function<void(const std::optional<Error>& error)>;
  enum class Operation : std::uint8_t { PrioritizeAsset, CancelAssetTransferForFailedAsset };

  virtual ~DovelDeviceService() = default;

  // Whether the service has the operation; one that it lacks must not be called.
  virtual bool offers(Operation operation) = 0;

  // Moves the asset's transfer ahead of the others. `completion` runs once, with an error when there is no such
  // transfer.
  virtual void prioritizeAsset(const DovelAssetRef& asset, Completion completion) = 0;

  // Stops and drops the asset's transfer. One that is not known is left alone.
  virtual void cancelAssetTransferForFailedAsset(const DovelAssetRef& asset) = 0;
};

}  // namespace appsync
