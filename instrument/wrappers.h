// The wrappers, one for each service. Each must not outlive the bare service and the probe that it is given.
#pragma once

#include <atomic>
#include <memory>

#include "instrument/probe.h"
#include "platform/brelm.h"
#include "platform/device_policy.h"
#include "platform/dovel_client.h"
#include "platform/file_manager.h"
#include "platform/install_transaction_log.h"
#include "platform/kiln.h"
#include "platform/notifications.h"
#include "platform/pellum.h"
#include "platform/system_log.h"
#include "platform/vaultry.h"
#include "platform/waiting.h"

namespace appsync {

// Which of the daemon's operations are missing.
struct LackingOperations {
  std::atomic<bool> prioritizeAsset = false;
  std::atomic<bool> cancelAssetTransferForFailedAsset = false;

  std::atomic<bool>& of(DovelDeviceService::Operation operation) {
    return operation == DovelDeviceService::Operation::PrioritizeAsset ? prioritizeAsset
                                                                       : cancelAssetTransferForFailedAsset;
  }
};

std::unique_ptr<SystemLog> wrap(SystemLog& bare, Probe& probe);
std::unique_ptr<InstallTransactionLog> wrap(InstallTransactionLog& bare, Probe& probe);
std::unique_ptr<FileManager> wrap(FileManager& bare, Probe& probe);
std::unique_ptr<Waiting> wrap(Waiting& bare, Probe& probe);
std::unique_ptr<PellumApplicationWorkspace> wrap(PellumApplicationWorkspace& bare, Probe& probe);
std::unique_ptr<KilnInstaller> wrap(KilnInstaller& bare, Probe& probe);
std::unique_ptr<VaultryService> wrap(VaultryService& bare, Probe& probe);
std::unique_ptr<TessaProfileConnection> wrap(TessaProfileConnection& bare, Probe& probe);
std::unique_ptr<BrelmShell> wrap(BrelmShell& bare, Probe& probe);
std::unique_ptr<IconServices> wrap(IconServices& bare, Probe& probe);
std::unique_ptr<NotificationService> wrap(NotificationService& bare, Probe& probe);
std::unique_ptr<NotificationCenter> wrap(NotificationCenter& bare, Probe& probe);
std::unique_ptr<DovelDeviceService> wrap(DovelDeviceService& bare, Probe& probe, LackingOperations& lacking);

}  // namespace appsync
