// The result of a sync, for scripts and for people.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "host/console.h"
#include "host/json_forward.h"
#include "platform/property_list.h"

namespace appsync {

struct SyncReport {
  struct Entry {
    std::optional<std::string> identifier;  // absent where it is no string
    std::optional<std::string> operation;
    std::optional<std::string> error;
  };
  struct Skipped {
    std::optional<std::string> identifier;
    std::string reason;
  };

  bool reconciled = false;
  bool todoUnusable = false;  // there was a todo list, but it could not be used
  bool refused = false;       // an install could not be prepared
  int interruptedWith = 0;    // the exit status of an interrupted run; 0: it went to its end
  std::vector<std::string> deleted;
  PropertyList metrics = PropertyList::dictionary();
  std::vector<std::string> requested;
  std::vector<std::string> transferred;
  std::vector<Skipped> skipped;
  std::vector<Entry> applications;
  std::vector<Entry> removals;  // without operations
  std::vector<std::string> uninstalled;
  double seconds = 0;

  // The exit status that this amounts to.
  int status() const;
};

// Prints it as the console's options say.
void printSyncReport(const SyncReport& report, Console& console);

}  // namespace appsync
