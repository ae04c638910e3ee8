#include "host/sync_report.h"

#include <algorithm>
#include <array>
#include <cstdio>

#include "host/json.h"
#include "host/text.h"

namespace appsync {

namespace {

Json metric(const SyncReport& report, const char* key) {
  const PropertyList* value = report.metrics.find(key);
  return value == nullptr ? Json(0) : jsonFromPropertyList(*value);
}

Json documentOf(const SyncReport& report) {
  Json skipped = Json::array();
  for (const auto& one : report.skipped) {
    skipped.push_back({{"identifier", orNull(one.identifier)}, {"reason", one.reason}});
  }
  Json applications = Json::array();
  for (const auto& one : report.applications) {
    applications.push_back(
        {{"identifier", orNull(one.identifier)}, {"operation", orNull(one.operation)}, {"error", orNull(one.error)}});
  }
  Json removals = Json::array();
  for (const auto& one : report.removals) {
    removals.push_back({{"identifier", orNull(one.identifier)}, {"error", orNull(one.error)}});
  }
  return {{"ok", report.status() == kStatusDone},
          {"reconciled", report.reconciled},
          {"deleted", report.deleted},
          {"metrics",
           {{"count", metric(report, "_Count")},
            {"physicalSize", metric(report, "_PhysicalSize")},
            {"purgeableSize", metric(report, "_PurgeableSize")}}},
          {"requested", report.requested},
          {"transferred", report.transferred},
          {"skipped", skipped},
          {"applications", applications},
          {"removals", removals},
          {"uninstalled", report.uninstalled},
          {"seconds", report.seconds}};
}

// One line of the closing table.
struct Row {
  std::string identifier;
  const char* state;
  std::string reason;
  bool isFailure;
};

std::vector<Row> rowsOf(const SyncReport& report) {
  std::vector<Row> rows;
  const auto name = [](const std::optional<std::string>& identifier) {
    return printable(identifier.value_or("(no identifier)"));
  };
  for (const auto& one : report.skipped) rows.push_back({name(one.identifier), "skipped", one.reason, false});
  for (const auto& one : report.applications) {
    if (one.error) rows.push_back({name(one.identifier), "failed", printable(*one.error), true});
  }
  for (const auto& one : report.removals) {
    if (one.error) rows.push_back({name(one.identifier), "not removed", printable(*one.error), true});
  }
  return rows;
}

std::string summaryOf(const SyncReport& report) {
  const auto hasFailed = [](const SyncReport::Entry& one) { return one.error.has_value(); };
  const auto notRemoved = std::count_if(report.removals.begin(), report.removals.end(), hasFailed);
  const auto failed = std::count_if(report.applications.begin(), report.applications.end(), hasFailed) + notRemoved;
  const auto installed = std::count_if(report.applications.begin(), report.applications.end(),
                                       [](const auto& one) { return one.operation == "INSTALLED"; });
  const auto removed = static_cast<std::ptrdiff_t>(report.removals.size()) - notRemoved;
  std::array<char, 32> seconds{};
  std::snprintf(seconds.data(), seconds.size(), "%.1f s", report.seconds);
  return std::to_string(installed) + " installed, " + std::to_string(removed) + " removed, " +
         std::to_string(report.skipped.size()) + " skipped, " + std::to_string(failed) + " failed in " + seconds.data();
}

}  // namespace

int SyncReport::status() const {
  if (interruptedWith != 0) return interruptedWith;
  const auto hasFailed = [](const Entry& entry) { return entry.error.has_value() || entry.operation == "FAILED"; };
  const bool good = reconciled && !todoUnusable && !refused &&
                    std::none_of(applications.begin(), applications.end(), hasFailed) &&
                    std::none_of(removals.begin(), removals.end(), hasFailed);
  return good ? kStatusDone : kStatusSomethingFailed;
}

void printSyncReport(const SyncReport& report, Console& console) {
  if (console.isJSON()) return console.document(documentOf(report));
  const std::vector<Row> rows = rowsOf(report);
  std::size_t width = 0;
  for (const Row& row : rows) width = std::max(width, std::min<std::size_t>(displayWidth(row.identifier), 40));
  if (!rows.empty()) console.line("");
  for (const Row& row : rows) {
    const std::string text = fitted(row.identifier, width) + "  " + fitted(row.state, 11) + "  " + row.reason;
    if (row.isFailure) {
      console.failureLine(text);
    } else {
      console.line(text);
    }
  }
  if (!rows.empty()) console.line("");
  console.line(summaryOf(report));
}

}  // namespace appsync
