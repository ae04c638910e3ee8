// `dovel clear`: forget all sync state.
#include <algorithm>
#include <set>

#include "embedded/file_manager.h"
#include "embedded/registry.h"
#include "host/commands.h"
#include "host/json.h"
#include "host/session.h"

namespace appsync {

namespace {

constexpr char kStateRoot[] = "/var/mobile/Library/ApplicationSync";

// Hears what the client says when something could not be cleared.
class ClearListener : public LogSink {
 public:
  void line(const LogLine& line) override {
    if (line.level == LogLevel::Error) failed = true;
  }
  void transaction(const TransactionRecord&) override {}

  bool failed = false;
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
  const auto session = Session::open({.common = options.common, .listeners = {&listener}}, failure);
  if (!session || !session->makeClient(failure)) return console.fail(failure);

  Device& device = session->device();
  const std::set<std::string> before = placeholders(device);
  session->client().clearSyncData();
  const std::set<std::string> after = placeholders(device);
  const bool isCleared = after.empty() && !device.files().fileExists(kStateRoot);
  if (!session->close(failure)) return console.fail(failure);

  const bool ok = isCleared && !listener.failed;
  Json gone = Json::array();
  for (const std::string& identifier : before) {
    if (!after.contains(identifier)) gone.push_back(identifier);
  }
  console.document({{"ok", ok}, {"uninstalled", gone}});
  for (const Json& identifier : gone) console.line("The placeholder of " + identifier.get<std::string>() + " is gone.");
  for (const std::string& identifier : after)
    console.failureLine("The placeholder of " + identifier + " could not be removed.");
  if (ok) {
    console.line("All sync state is forgotten.");
  } else {
    console.problem("not all sync state could be cleared; --log FILE tells what failed, then clear again");
  }
  return ok ? kStatusDone : kStatusSomethingFailed;
}

}  // namespace appsync
