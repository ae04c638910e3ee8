// `dovel status`: what is on the device.
#include <algorithm>
#include <array>
#include <vector>

#include "embedded/device.h"
#include "host/commands.h"
#include "host/json.h"
#include "host/session.h"
#include "host/text.h"

namespace appsync {

namespace {

// What the entries of the document show first, in this order; null where the device says nothing. What else the device
// shows of an entry follows.
struct Listing {
  const char* key;
  std::vector<const char*> fields;
};

const std::array<Listing, 4>& listings() {
  static const auto* all = new std::array<Listing, 4>{
      Listing{"installed", {"identifier", "version", "name", "type", "size", "container"}},
      Listing{"placeholders", {"identifier", "name", "installType", "version", "launchProhibited", "type"}},
      Listing{"coordinators", {"identifier", "kind", "creator", "error", "responsibleClient"}},
      Listing{"todo", {"identifier", "operation"}},
  };
  return *all;
}

Json entryDocument(const PropertyList& entry, const Listing& listing) {
  Json shown = Json::object();
  for (const char* field : listing.fields) {
    const PropertyList* value = entry.find(field);
    shown[field] = value == nullptr ? Json(nullptr) : jsonFromPropertyList(*value);
  }
  if (!shown["identifier"].is_string()) shown["identifier"] = nullptr;
  for (const auto member : entry.members()) {
    const std::string key(member.key);
    if (!shown.contains(key)) shown[key] = jsonFromPropertyList(member.value);
  }
  return shown;
}

Json statusDocument(const PropertyList& status, bool ok) {
  Json document = {{"ok", ok}};
  for (const Listing& listing : listings()) {
    Json& entries = document[listing.key] = Json::array();
    const PropertyList* found = status.find(listing.key);
    if (found == nullptr) continue;
    for (const PropertyList& entry : found->elements()) entries.push_back(entryDocument(entry, listing));
  }
  for (const auto member : status.members()) {
    const std::string key(member.key);
    if (!document.contains(key)) document[key] = jsonFromPropertyList(member.value);
  }
  return document;
}

std::string cell(const Json& value) {
  if (value.is_null()) return "-";
  return printable(value.is_string() ? value.get<std::string>() : jsonLine(value));
}

std::string cell(const Json& entry, const char* field) {
  const Json& value = entry[field];
  return std::string_view(field) == "installType" && value.is_number_integer()
             ? installTypeText(value.get<std::uint64_t>())
             : cell(value);
}

// A table with a headline; its columns are as wide as their widest cell.
void printTable(const Json& document, const Listing& listing, Console& console) {
  const Json& entries = document[listing.key];
  console.line(std::string(listing.key) + " (" + std::to_string(entries.size()) + ")");
  std::vector<std::size_t> widths;
  for (const char* field : listing.fields) {
    std::size_t width = std::string_view(field).size();
    for (const Json& entry : entries)
      width = std::max(width, std::min<std::size_t>(displayWidth(cell(entry, field)), 48));
    widths.push_back(width);
  }
  const auto printRow = [&](const auto& cellOf) {
    std::string row = " ";
    for (std::size_t i = 0; i < widths.size(); ++i) row += " " + fitted(cellOf(listing.fields[i]), widths[i]);
    row.erase(row.find_last_not_of(' ') + 1);
    console.line(row);
  };
  if (!entries.empty()) printRow([](const char* field) { return std::string(field); });
  for (const Json& entry : entries) {
    printRow([&](const char* field) { return cell(entry, field); });
  }
}

void printIdentifiers(const Json& document, const char* key, Console& console) {
  if (!document.contains(key)) return;
  console.line(std::string(key) + " (" + std::to_string(document[key].size()) + ")");
  for (const Json& identifier : document[key]) console.line("  " + cell(identifier));
}

}  // namespace

int runStatus(const StatusOptions& options, Console& console) {
  Failure failure;
  const auto session =
      Session::open({.common = options.common, .loadsPlugin = false, .opensDevice = false}, console, failure);
  if (!session) return console.fail(failure);
  std::optional<Error> error;
  const std::optional<PropertyList> status = Device::status(options.common.device, &error);
  if (!status) return console.fail(deviceFailure(options.common.device, *error));
  session->beginOutputs();
  const int exitStatus = session->exitStatus(kStatusDone);
  if (!session->close(failure)) return console.fail(failure);

  const Json document = statusDocument(*status, exitStatus == kStatusDone);
  console.document(document);
  if (console.isJSON() || console.isQuiet()) return exitStatus;
  for (const Listing& listing : listings()) printTable(document, listing, console);
  printIdentifiers(document, "homeScreen", console);
  printIdentifiers(document, "uninstalled", console);
  console.line(std::string("syncing: ") + (document.value("syncing", false) ? "yes" : "no"));
  if (document.contains("settings")) {
    console.line("settings");
    for (const auto& [key, value] : document["settings"].items()) console.line("  " + key + " " + cell(value));
  }
  return exitStatus;
}

}  // namespace appsync
