#include "transfer/install_names.h"

#include "platform/log_format.h"

namespace appsync {

std::string installTypeName(std::uint64_t type) {
  switch (type) {
    case 0:
      return "PellumInstallTypeNone";
    case 1:
      return "PellumInstallTypeStoreDownload";
    case 2:
      return "PellumInstallTypeRestore";
    case 3:
      return "PellumInstallTypeAutomaticDownload";
    case 4:
      return "PellumInstallTypeSync";
    case 5:
      return "PellumInstallTypeAutomaticUpdate";
    case 6:
      return "PellumInstallTypeMigration";
    case 7:
      return "PellumInstallTypeDowngrade";
    default:
      return makeText("Unknown Install Type: %lu", type);
  }
}

std::string installStateName(std::uint64_t state) {
  switch (state) {
    case 0:
      return "PellumInstallStateWaiting";
    case 1:
      return "PellumInstallStateActive";
    case 2:
      return "PellumInstallStatePaused";
    case 3:
      return "PellumInstallStateCanceled";
    case 4:
      return "PellumInstallStateFailed";
    case 5:
      return "PellumInstallStateFinished";
    default:
      return makeText("Unknown Install State: %lu", state);
  }
}

std::string installPhaseName(std::uint64_t phase) {
  switch (phase) {
    case 0:
      return "PellumInstallPhaseLoading";
    case 1:
      return "PellumInstallPhaseInstalling";
    case 2:
      return "PellumInstallPhaseRestoringData";
    case 3:
      return "PellumInstallPhaseInstallingPlaceholder";
    default:
      return makeText("Unknown Install Phase: %lu", phase);
  }
}

}  // namespace appsync
