// Wrappers of every service of a platform: each forwards every call, records it, fails it or answers for it on request.
//
// Lifetime: the bare services are made first; then the instruments, then the client on `platform()`. The client is
// destroyed first, then the services are drained, then the instruments go (with every handle that came from them), and
// the services last. Any thread, unless an operation says otherwise. No lock is held while a service is called.
#pragma once

#include <cstddef>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>

#include "instrument/answers.h"
#include "instrument/operations.h"
#include "instrument/recorder.h"
#include "platform/dovel_client.h"
#include "platform/error.h"
#include "platform/ostrel_objects.h"
#include "platform/platform.h"

namespace appsync {

// The domain of the errors that faults make, of the refusals of phantom coordinators, and of faults that cannot be
// made.
inline constexpr std::string_view kFaultErrorDomain = "FaultError";
inline constexpr std::int64_t kFaultMade = 1;     // "NAME was made to fail"
inline constexpr std::int64_t kFaultPhantom = 2;  // the object exists in the instruments alone
inline constexpr std::int64_t kFaultUnknown = 3;  // the description of a fault is not in order

struct InstrumentOptions {
  bool recording = false;        // whether the recorder takes lines from the start; a long run's need memory
  std::string reachedTextsFile;  // see `Recorder`; empty: none
};

// Answers, for an operation and an application, whether it is to fail this time. Counts as one call of the operation.
using FaultQuery = std::function<std::optional<Error>(const std::string& operation, const std::string& bundleID)>;

class Instruments {
 public:
  Instruments(const Platform& bare, const InstrumentOptions& options = {});
  ~Instruments();
  Instruments(const Instruments&) = delete;
  Instruments& operator=(const Instruments&) = delete;

  // The wrapped services, with the bare platform's main bundle identifier. Valid as long as the instruments.
  Platform platform();

  // --- faults -------------------------------------------------------------------------------------------------------

  // What a fault can be made for, with each one's way of failing.
  static std::span<const OperationInfo> operations() { return faultableOperations(); }

  // OPERATION[=ID][@N]: from now on every call of the operation (that concerns the application ID; the Nth such call
  // alone) fails, and does not reach the service. The application is the one named by the call or by its object; for
  // promises their name less its suffix; for files the one whose identifier is a component of a path, also with ".png",
  // ".app" or ".ipa" behind it. "reportInstalls" counts observers of the registry: one that is hit gets no report at
  // all. False, with an error that says what is wrong and what would mend it.
  bool addFault(const std::string& spec, ErrorOut error);

  // The same, failing with `given` where the operation brings an error; without one it fails and brings none.
  bool addFaultWithError(const std::string& spec, const std::optional<Error>& given, ErrorOut error);

  void clearFaults();

  // For what fails where no operation of the platform passes by: "install", "transfer" and "stall". Also any other
  // operation. Valid as long as the instruments.
  FaultQuery faultQuery();

  // --- recording ----------------------------------------------------------------------------------------------------

  Recorder& recorder();

  // --- answers and events -------------------------------------------------------------------------------------------

  // Replaces the script, for calls that begin from now on.
  void setAnswers(ScriptedAnswers answers);

  // Delivers the events that the script has held back, in order, on this thread; answers how many. Those of observers
  // that have been removed since are gone; none may be in the course of its removal meanwhile. A held event of a
  // coordinator holds the coordinator too.
  std::size_t releaseHeldEvents();
  void dropHeldEvents();

  // --- objects that are not there -----------------------------------------------------------------------------------

  // A coordinator that exists here alone: it answers this identifier and this error, and refuses or lacks everything
  // else.
  OstrelAppInstallCoordinator makePhantomCoordinator(std::optional<std::string> bundleID, std::optional<Error> error);

  // Whether the daemon's service is to lack an operation.
  void setLacking(DovelDeviceService::Operation operation, bool lacking);

 private:
  struct Parts;
  std::unique_ptr<Parts> _parts;
};

}  // namespace appsync
