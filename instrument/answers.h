// Answers that a script gives in a service's place, where a failure is not enough, and what becomes of events.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <utility>

#include "platform/brelm.h"
#include "platform/device_policy.h"
#include "platform/error.h"
#include "platform/ostrel.h"
#include "platform/pellum.h"
#include "platform/property_list.h"

namespace appsync {

// What becomes of an event that a service has for its observer.
enum class EventFate : std::uint8_t {
  Deliver,
  Lose,    // it never comes
  Double,  // it comes twice
  Hold,    // it waits for `Instruments::releaseHeldEvents`
};

// Each member stands for one operation and is asked at each call of it; an empty one, and one that answers none, lets
// the service answer. They run on the thread of the call, with no lock of the instruments held, several at once also. A
// fault goes first. Where an answer may itself be absent there are two levels: the outer one says whether to answer.
struct ScriptedAnswers {
  template <class Value>
  using Answer = std::optional<Value>;
  using ID = const std::string&;

  // Files.
  std::function<Answer<bool>(const std::string& path)> fileExists;
  std::function<Answer<std::optional<Bytes>>(const std::string& path)> readFile;

  // Registry. `records` changes what a walk of this type, or a report of installs (none), shows.
  std::function<Answer<bool>(ID bundleID)> applicationIsInstalled;
  std::function<Answer<std::optional<PellumApplicationProxy>>(ID bundleID, bool placeholder)>
      applicationProxyForIdentifier;
  std::function<void(std::uint64_t type, PellumApplicationProxies& records)> enumerateBundlesOfType;
  std::function<void(PellumApplicationProxies& prioritized, PellumApplicationProxies& paused)>
      applicationInstallsArePrioritized;

  // Coordination, by the coordinator's application.
  std::function<Answer<OstrelClientID>(ID bundleID)> creatorIdentifier;
  std::function<Answer<std::optional<std::string>>(ID bundleID)> bundleID;
  std::function<Answer<std::optional<Error>>(ID bundleID)> error;
  std::function<Answer<bool>(const std::string& operation, ID bundleID)> has;  // "hasInstallOptions" and its like
  std::function<Answer<OstrelClientID>(ID bundleID)> appAssetPromiseResponsibleClient;
  std::function<Answer<bool>(const std::string& promiseName)> isComplete;

  // The rest of the device.
  std::function<Answer<std::optional<PropertyList>>()> KilnLookupUninstalled;
  std::function<Answer<std::pair<bool, std::optional<Error>>>()> dovelShouldCreateAppPlaceholders;
  std::function<Answer<TessaBoolean>(const std::string& feature)> effectiveBoolValueForSetting;
  std::function<Answer<std::optional<Bytes>>()> BrelmGetFlattenedIconState;
  std::function<Answer<std::optional<Bundle>>(const std::string& path)> bundleWithURL;
  std::function<Answer<std::optional<Image>>(const Bundle& bundle)> iconImage;

  // What becomes of an event: a callback of an observer, or a completion by the name of its operation.
  std::function<EventFate(const std::string& event, ID bundleID)> event;

  // Run on the caller's thread just before a service is asked and just after it has answered, so that something (an
  // early event, a change behind the client's back) can happen exactly there. `subject` is the application concerned,
  // or the path of a file operation; empty when there is neither. A leaf service may be called under a lock of the
  // client.
  std::function<void(const std::string& operation, const std::string& subject)> beforeCall;
  std::function<void(const std::string& operation, const std::string& subject)> afterCall;
};

}  // namespace appsync
