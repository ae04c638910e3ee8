#include <unordered_map>

#include "client/apps_client.h"
#include "client/paths.h"
#include "platform/kiln.h"

namespace appsync {

namespace {

// What the todo list says of an application that is not on the device.
struct TodoState {
  bool found = false;
  bool failed = false;
  bool pi = false;  // installed once, and gone since
};

using TodoStates = std::unordered_map<std::string_view, TodoState>;

// By identifier, the first entry of each; valid as long as the list.
TodoStates todoStates(const std::optional<PropertyList>& todoList) {
  TodoStates states;
  if (!todoList) return states;
  for (const PropertyList& entry : todoList->elements()) {
    const PropertyList* identifier = entry.find("identifier");
    if (identifier == nullptr || !identifier->isString()) continue;
    TodoState state{.found = true};
    if (const PropertyList* operation = entry.find("operation")) {
      state.failed = operation->stringView() == std::string_view(kTodoFailed);
      state.pi = !state.failed && operation->stringView() == std::string_view(kTodoInstalled);
    }
    states.try_emplace(*identifier->stringView(), state);
  }
  return states;
}

}  // namespace

PropertyList AppsClient::installedAssets() {
  _log("getting installed assets");
  const std::optional<PropertyList> toDoList = _loadPlist(*_platform.files, _log, kTodoListPath, nullptr);
  const std::optional<PropertyList> lastSyncedApps = _loadPlist(*_platform.files, _log, kLastSyncListPath, nullptr);

  std::set<std::string> candidates;
  std::optional<std::vector<std::string>> uninstalledApps;
  if (const std::optional<PropertyList> uninstalled = _platform.installer->KilnLookupUninstalled()) {
    uninstalledApps.emplace();
    for (const auto& [bundleID, value] : uninstalled->members()) uninstalledApps->emplace_back(bundleID);
    candidates.insert(uninstalledApps->begin(), uninstalledApps->end());
    const MutexLock lock(_memberLock);
    _uninstalledApps = uninstalledApps;
  } else {
    _log.error("KilnLookupUninstalled returned NULL");
    const MutexLock lock(_memberLock);
    uninstalledApps = _uninstalledApps;
  }
  if (lastSyncedApps) {
    for (const PropertyList& app : lastSyncedApps->elements()) {
      const std::optional<std::string> bundleID = app.string();
      if (bundleID && !_platform.defaultWorkspace->applicationIsInstalled(*bundleID)) candidates.insert(*bundleID);
    }
  }

  PropertyList deleted = PropertyList::array();
  const TodoStates states = todoStates(toDoList);
  for (const std::string& candidate : candidates) {
    const auto state = states.find(candidate);
    const TodoState todo = state != states.end() ? state->second : TodoState{};
    if (todo.failed || todo.pi || !todo.found) {
      _log("%{public}@ not installed, and no todo (found=%d pi=%d failed=%d) Marking as deleted", candidate, todo.found,
           todo.pi, todo.failed);
      deleted.append(PropertyList::dictionary({{kBundleIdentifierKey, candidate}}));
    } else {
      _log("%{public}@ not installed, but is in our todo list. Not marking deleted", candidate);
    }
  }
  _log.summary(
      "finished getting installed assets toDoList:%{public}@, uninstalled apps %{public}@, last synced apps%{public}@",
      toDoList, uninstalledApps, lastSyncedApps);
  return PropertyList::dictionary({{"_Deleted", deleted}});
}

PropertyList AppsClient::installedAssetMetrics() {
  std::uint64_t count = 0;
  std::uint64_t size = 0;
  _platform.defaultWorkspace->enumerateBundlesOfType(kPellumBundleTypeApplication,
                                                     [&](const PellumApplicationProxy& app, bool& /*stop*/) {
                                                       if (app.applicationType != "User") return;
                                                       size += app.diskUsage.staticUsage;
                                                       ++count;
                                                     });
  _log("found %ld apps using %lld bytes (%lld purgeable)", static_cast<std::int64_t>(count),
       static_cast<std::int64_t>(size), std::int64_t{0});
  return PropertyList::dictionary({{"_Count", PropertyList::unsignedInteger(count)},
                                   {"_PhysicalSize", PropertyList::unsignedInteger(size)},
                                   {"_PurgeableSize", PropertyList::unsignedInteger(0)}});
}

}  // namespace appsync
