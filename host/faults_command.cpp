// `dovel faults`: the names that --fault knows.
#include "host/commands.h"
#include "instrument/operations.h"

namespace appsync {

int runFaults(Console& console) {
  for (const OperationInfo& operation : faultableOperations()) console.line(operation.name);
  return kStatusDone;
}

}  // namespace appsync
