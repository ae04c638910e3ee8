// The install coordination service: it owns every install on the device.
//
// A client configures a coordinator (what is installed), a placeholder (what the home screen shows meanwhile) and
// promises (what the client delivers later); the service does the rest on its own threads. `OstrelService` is the whole
// service over one flat interface that speaks in references; the handles in "platform/ostrel_objects.h" carry the
// service's classes and are what a client writes against.
//
// Threads: every operation on any thread. The service calls observers back on its own threads at any moment, also
// before the call that caused it has returned; events can come early, late, twice or never. It is never to be called
// under a lock that a callback takes.
//
// Errors are of the domain "OstrelError". Every boolean operation with an error out-parameter sets it when it answers
// false and leaves it alone when it answers true.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "platform/error.h"
#include "platform/file_url.h"
#include "platform/kiln.h"
#include "platform/property_list.h"

namespace appsync {

inline constexpr std::string_view kOstrelErrorDomain = "OstrelError";

// Who is who at the service.
using OstrelClientID = std::uint64_t;
inline constexpr OstrelClientID OstrelClientMerc = 1;   // the application store
inline constexpr OstrelClientID OstrelClientDovel = 3;  // this client

enum class OstrelCoordinatorKind : std::uint8_t {
  Any,  // a look-up of whatever there is; nothing can be created with it
  Initiating,
  Updating,
  Restoring,
  RestoringDemoted,
};

enum class OstrelPromiseKind : std::uint8_t { TransferToPath, OutOfBandTransfer };

// Names one object of the service for as long as it is held: whoever gets one from the service calls `release` once for
// it. The same object may be given out more than once under the same reference; each counts.
struct OstrelRef {
  std::uint64_t value = 0;  // 0: none

  explicit operator bool() const { return value != 0; }
  friend auto operator<=>(const OstrelRef&, const OstrelRef&) = default;  // NOLINT(modernize-use-nullptr)
};

// What the home screen needs to know of an application that is not there yet.
class OstrelPlaceholderAttributes {
 public:
  OstrelPlaceholderAttributes() = default;
  // From an application's Info.plist; an absent one, or one that is no dictionary, gives attributes without it.
  static OstrelPlaceholderAttributes initWithInfoPlistDictionary(const std::optional<PropertyList>& info) {
    OstrelPlaceholderAttributes attributes;
    if (info && info->isDictionary()) attributes._infoPlist = info;
    return attributes;
  }

  void setLaunchProhibited(bool prohibited) { _launchProhibited = prohibited; }
  void setBundleVersion(std::optional<std::string> version) { _bundleVersion = std::move(version); }

  const std::optional<PropertyList>& infoPlist() const { return _infoPlist; }
  bool launchProhibited() const { return _launchProhibited; }
  const std::optional<std::string>& bundleVersion() const { return _bundleVersion; }

  std::string description() const {
    return "<attributes version=" + _bundleVersion.value_or("(null)") +
           " launchProhibited=" + (_launchProhibited ? "1>" : "0>");
  }

 private:
  std::optional<PropertyList> _infoPlist;
  std::optional<std::string> _bundleVersion;
  bool _launchProhibited = false;
};

class OstrelAppInstallObserverDelegate;

class OstrelService {
 public:
  using Observer = std::shared_ptr<OstrelAppInstallObserverDelegate>;
  using Completion = std::function<void(const std::optional<Error>& error)>;

  virtual ~OstrelService() = default;

  // --- coordinators -------------------------------------------------------------------------------------------------

  // The coordinator of that kind for the application. A look-up (`create` false) may find a dead one, whose `error` is
  // set; with `create` a dead one is replaced. None, with an error, when there is none and none may be made, when one
  // of another kind lives, when the identifier is no single path component, or when an updating coordinator is asked
  // for an application that is not installed. With `create`, a demoted restore whose placeholder is installed has ended
  // and gives way to any other kind; one for which the store is responsible refuses. `created`, when given, is always
  // set.
  //
  // A coordinator does nothing while the caller that configures it holds it.
  virtual OstrelRef coordinatorForApp(OstrelCoordinatorKind kind, const std::string& bundleID, OstrelClientID client,
                                      bool create, bool* created, ErrorOut error) = 0;

  virtual OstrelClientID creatorIdentifier(OstrelRef coordinator) = 0;
  virtual std::optional<std::string> bundleID(OstrelRef coordinator) = 0;

  // Why it failed or was cancelled; none while it lives, and after it has succeeded.
  virtual std::optional<Error> error(OstrelRef coordinator) = 0;

  // Who hears of this coordinator, in place of its creator's registered observers. Not kept beyond the process.
  virtual void setObserver(OstrelRef coordinator, const Observer& observer) = 0;

  // What the coordinator has been given. A setter is refused when the coordinator is dead or has been given it already.
  virtual bool hasInstallOptions(OstrelRef coordinator) = 0;
  virtual bool setInstallOptions(OstrelRef coordinator, const KilnInstallOptions& options, ErrorOut error) = 0;
  virtual bool hasInitialVeylAssetPromises(OstrelRef coordinator) = 0;
  virtual bool setInitialVeylAssetPromises(OstrelRef coordinator, const std::vector<OstrelRef>& promises,
                                           ErrorOut error) = 0;
  virtual bool hasAppAssetPromise(OstrelRef coordinator) = 0;
  virtual bool setAppAssetPromise(OstrelRef coordinator, OstrelRef promise, ErrorOut error) = 0;
  // The package promise, held once more; none, with an error, when it has not been set.
  virtual OstrelRef appAssetPromise(OstrelRef coordinator, ErrorOut error) = 0;
  virtual bool hasPlaceholderPromise(OstrelRef coordinator) = 0;
  // No placeholder (a reference of 0) is refused.
  virtual bool setPlaceholderPromise(OstrelRef coordinator, OstrelRef placeholder, ErrorOut error) = 0;
  virtual bool hasUserDataPromise(OstrelRef coordinator) = 0;
  virtual bool setUserDataPromise(OstrelRef coordinator, OstrelRef promise, ErrorOut error) = 0;
  // Who delivers the package; 0 when nobody has been named. Restoring coordinators only: others answer 0 and refuse. May
  // be named anew while the coordinator lives.
  virtual OstrelClientID appAssetPromiseResponsibleClient(OstrelRef coordinator, ErrorOut error) = 0;
  virtual bool setAppAssetPromiseResponsibleClient(OstrelRef coordinator, OstrelClientID client, ErrorOut error) = 0;

  // --- placeholders -------------------------------------------------------------------------------------------------

  // None for an identifier that is no single path component.
  virtual OstrelRef makePlaceholder(const std::string& bundleName, const std::string& bundleID,
                                    std::uint64_t installType, OstrelClientID client) = 0;
  virtual bool setIconPromise(OstrelRef placeholder, OstrelRef promise, ErrorOut error) = 0;
  virtual bool setPlaceholderAttributes(OstrelRef placeholder, const OstrelPlaceholderAttributes& attributes,
                                        ErrorOut error) = 0;
  virtual bool setMetadata(OstrelRef placeholder, const std::optional<KilnStoreMetadata>& metadata, ErrorOut error) = 0;
  virtual bool setConfigurationComplete(OstrelRef placeholder, ErrorOut error) = 0;

  // --- promises -----------------------------------------------------------------------------------------------------

  // `transferPath` is absent for data whose place is named later, or that travels out of band.
  virtual OstrelRef makePromise(OstrelPromiseKind kind, const std::string& name, OstrelClientID client,
                                const std::optional<FileURL>& transferPath, std::uint64_t diskSpaceNeeded) = 0;
  virtual void setTransferPath(OstrelRef promise, const std::optional<FileURL>& path) = 0;
  virtual void setPercentComplete(OstrelRef promise, double fraction) = 0;  // 0.0 to 1.0; others are brought in range
  virtual void setComplete(OstrelRef promise, bool complete) = 0;
  virtual bool isComplete(OstrelRef promise) = 0;

  // --- all of them --------------------------------------------------------------------------------------------------

  // Cancels a coordinator, placeholder or promise. A coordinator's cancellation is reported to its observers with the
  // client named here, also when that client did it itself. False, with an error, for what is dead or done already.
  virtual bool cancel(OstrelRef object, const Error& reason, OstrelClientID client, ErrorOut error) = 0;

  // For a log line: what it is and which application it belongs to.
  virtual std::string description(OstrelRef object) = 0;

  // One hold less. When the last is gone the service may act on the object: a coordinator that has a placeholder
  // begins its work. Never fails; a reference of 0 is ignored.
  virtual void release(OstrelRef object) = 0;

  // --- the service itself -------------------------------------------------------------------------------------------

  // Registers for the events of coordinators that one of `clients` created and that have no observer of their own,
  // until the reference is released; release returns when no callback runs any more, except one that it is called from.
  virtual OstrelRef addInstallObserver(const std::string& machServiceName, const std::set<OstrelClientID>& clients,
                                       const Observer& observer) = 0;

  // Removes the application, whatever stands under the identifier, and returns at once. `completion` runs once, on a
  // thread of the service. Removing what is not there succeeds, since it is already so.
  virtual void uninstallApp(const std::string& bundleID, bool requestUserConfirmation, Completion completion) = 0;

  // An error fit to be shown to a person, which carries `code` and the underlying error.
  virtual Error createUserPresentableError(std::int64_t code, std::int32_t flag, const Error& underlying) = 0;
};

}  // namespace appsync
