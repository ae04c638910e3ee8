// `dovel clear`: forget all sync state.
#include <algorithm>
#include <atomic>
#include <set>

#include "embedded/file_manager.h"
#include "embedded/registry.h"
#include "host/commands.h"
#include "host/json.h"
#include "host/session.h"

namespace appsync {

namespace {

constexpr char kStateRoot[] = "/var/mobile/Library/ApplicationSync";

// Hears what the client says when something could not be cleared; what is said before it has begun to clear is no
// business of it.
class ClearListener : public LogSink {
 public:
  void begin() { _hasBegun = true; }
  bool hasFailed() const { return _hasFailed; }

  void line(const LogLine& line) override {
    if (_hasBegun && line.level == LogLevel::Error) _hasFailed = true;
  }
  void transaction(const TransactionRecord&) override {}

 private:
  std::atomic<bool> _hasBegun = false;
  std::atomic<bool> _hasFailed = false;
};

std::set<std::string> placeholders(Device& device) {
  std::set<std::string> found;
  device.registry().enumerateBundlesOfType(kPellumBundleTypeAll, [&](const PellumApplicationProxy& record, bool&) {
    if (record.isPlaceholder()) found.insert(record.bundleIdentifier);
  });
  return found;
}

}  // namespace

int runClear(const ClearOptions& options, Console& console) {
  Failure failure;
  ClearListener listener;
  const auto session = Session::open({.common = options.common, .listeners = {&listener}}, console, failure);
  if (!session || !session->makeClient(failure)) return console.fail(failure);

  Device& device = session->device();
  const std::set<std::string> before = placeholders(device);
  listener.begin();
  session->client().clearSyncData();
  const std::set<std::string> after = placeholders(device);
  const bool isCleared = after.empty() && !device.files().fileExists(kStateRoot);
  const int status = session->exitStatus(isCleared && !listener.hasFailed() ? kStatusDone : kStatusSomethingFailed);
  if (!session->close(failure)) return console.fail(failure);

  Json gone = Json::array();
  for (const std::string& identifier : before) {
    if (!after.contains(identifier)) gone.push_back(identifier);
  }
  console.document({{"ok", status == kStatusDone}, {"uninstalled", gone}});
  for (const Json& identifier : gone) console.line("The placeholder of " + identifier.get<std::string>() + " is gone.");
  for (const std::string& identifier : after)
    console.failureLine("The placeholder of " + identifier + " could not be removed.");
  if (status == kStatusDone) {
    console.line("All sync state is forgotten.");
  } else if (status == kStatusSomethingFailed) {
    console.problem("not all sync state could be cleared; --log FILE tells what failed, then clear again");
  }
  return status;
}

}  // namespace appsync
