// `dovel seed`: put the device into a state.
#include "host/commands.h"
#include "host/files.h"
#include "host/json.h"
#include "host/session.h"

namespace appsync {

int runSeed(const SeedOptions& options, Console& console) {
  Failure failure;
  const std::optional<PropertyList> state = readPropertyListOrJson(options.file, failure);
  if (!state) return console.fail(failure);
  const auto session = Session::open({.common = options.common, .loadsPlugin = false}, console, failure);
  if (!session) return console.fail(failure);
  std::optional<Error> error;
  if (!session->device().seed(*state, &error)) {
    failure = deviceFailure(options.common.device, *error);
    if (failure.code == FailureCode::SeedRefused) failure.message = "\"" + options.file + "\": " + failure.message;
    return console.fail(failure);
  }
  const int status = session->exitStatus(kStatusDone);
  if (!session->close(failure)) return console.fail(failure);
  console.document({{"ok", status == kStatusDone}});
  console.line("The device is as " + options.file + " says.");
  return status;
}

}  // namespace appsync
