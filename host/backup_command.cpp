// `dovel backup`: what the daemon asks the client before a backup is taken.
#include <algorithm>

#include "embedded/file_manager.h"
#include "embedded/registry.h"
#include "host/commands.h"
#include "host/json.h"
#include "host/session.h"
#include "host/sync_log.h"
#include "host/text.h"
#include "platform/thread_annotations.h"

namespace appsync {

namespace {

constexpr char kAutoDownloadKey[] = "is-auto-download";

// Hears whose store metadata the client tidies.
class TidyListener : public LogSink {
 public:
  void line(const LogLine& line) override {
    constexpr std::string_view kClears = "clearing is-auto-download value for %{public}@";
    if (line.format != kClears) return;
    const MutexLock lock(_mutex);
    _tidied.emplace_back(withoutPrefix(line.message).substr(kClears.find('%')));
  }
  void transaction(const TransactionRecord&) override {}

  std::vector<std::string> tidied() const {
    const MutexLock lock(_mutex);
    return _tidied;
  }

 private:
  mutable Mutex _mutex;
  std::vector<std::string> _tidied APPSYNC_GUARDED_BY(_mutex);
};

// Whether the application's store metadata still has what was to go: the client does not tell when it cannot write.
bool isUntidy(Device& device, const std::string& identifier) {
  auto record = device.registry().applicationProxyForIdentifier(identifier, false);
  if (!record) record = device.registry().applicationProxyForIdentifier(identifier, true);
  if (!record || !record->bundleContainerURL) return false;
  const auto bytes = device.files().readFile(record->bundleContainerURL->path() + "/TarvoMetadata.plist", nullptr);
  const auto metadata = bytes ? parseDictionary(*bytes, nullptr) : std::nullopt;
  return metadata && metadata->find(kAutoDownloadKey) != nullptr;
}

std::string cell(const Json& value) {
  if (!value.is_string()) return value.is_null() ? "-" : jsonLine(value);
  const std::string text = printable(value.get<std::string>());
  return text.empty() ? "(empty)" : text;
}

void printAccounts(const Json& accounts, Console& console) {
  console.line("accounts (" + std::to_string(accounts.size()) + ")");
  std::size_t width = 0;
  for (const Json& account : accounts) width = std::max(width, displayWidth(cell(account["zelkID"])));
  for (const Json& account : accounts) {
    console.line("  " + fitted(cell(account["zelkID"]), width) + "  person " + cell(account["qenID"]) +
                 ", alternative id " + cell(account["altQenID"]));
  }
}

void printTexts(const char* title, const Json& texts, Console& console) {
  console.line(std::string(title) + " (" + std::to_string(texts.size()) + ")");
  for (const Json& text : texts) console.line("  " + cell(text));
}

}  // namespace

int runBackup(const BackupOptions& options, Console& console) {
  Failure failure;
  TidyListener listener;
  const auto session = Session::open({.common = options.common, .listeners = {&listener}}, console, failure);
  if (!session || !session->makeClient(failure)) return console.fail(failure);
  Device& device = session->device();

  DovelClient& client = session->client();
  client.prepareForBackup();
  const Json ids(client.zelkIDsForAssets());
  const Json accounts = accountDocuments(client.accountsForAssets());
  const auto disabled = client.disabledAssetTypes();
  Json cleared = Json::array();
  std::vector<std::string> untidy;
  for (const std::string& identifier : listener.tidied()) {
    if (isUntidy(device, identifier)) {
      untidy.push_back(identifier);
    } else {
      cleared.push_back(identifier);
    }
  }
  const int status = session->exitStatus(untidy.empty() ? kStatusDone : kStatusSomethingFailed);
  if (!session->close(failure)) return console.fail(failure);

  console.document({{"ok", status == kStatusDone},
                    {"zelkIDs", ids},
                    {"accounts", accounts},
                    {"disabledAssetTypes", orNull(disabled)},
                    {"cleared", cleared}});
  printAccounts(accounts, console);
  printTexts("account ids", ids, console);
  if (disabled) printTexts("asset types that policy keeps from being synced", Json(*disabled), console);
  printTexts("tidied", cleared, console);
  for (const std::string& identifier : untidy) {
    console.problem("the store metadata of \"" + identifier +
                    "\" could not be tidied; make the device's directory writable");
  }
  return status;
}

}  // namespace appsync
