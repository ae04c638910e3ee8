#include <unordered_set>

#include "client/apps_client.h"
#include "client/paths.h"

namespace appsync {

void AppsClient::_notifyBrelm(NotificationService& notifications, BrelmShell& shell, const ClientLog& log,
                              bool starting) {
  constexpr char kSyncStateNotification[] = "com.zelk.brelm.dovel.wsyncnotify";
  int token = 0;
  const std::uint32_t status = notifications.registerCheck(kSyncStateNotification, token);
  log("Notifying Brelm we are %s syncing", starting ? "starting" : "done");
  shell.BrelmBlockableServerPort();
  if (status != 0) {
    log.error("Uh Oh...can't send notification to Brelm:%d", static_cast<std::int32_t>(status));
    return;
  }
  notifications.setState(token, starting ? 1 : 0);
  notifications.post(kSyncStateNotification);
}

bool AppsClient::_makeIconFromBundlePath(IconServices& icons, FileManager& files, const ClientLog& log,
                                         const std::optional<std::string>& bundlePath, const std::string& saveTo) {
  Bytes buffer;
  if (!bundlePath) {
    log.error("missing bundlePath");
    return false;
  }
  const std::optional<FileURL> url = FileURL::fileURLWithPath(*bundlePath, true);
  if (!url) {
    log.error("couldn't create URL");
    return false;
  }
  const std::optional<Bundle> bundle = icons.bundleWithURL(*url);
  if (!bundle) {
    log.error("couldn't create bundle from URL");
    return false;
  }
  const std::optional<Image> image = icons.GlintCreateDeviceAppropriateHomeScreenIconImageFromBundle(*bundle);
  if (!image) {
    log.error("couldn't create Brelm icon from bundle");
    return false;
  }
  const std::unique_ptr<ImageDestination> destination = icons.makePNGDestination(buffer);
  if (!destination) {
    log.error("couldn't create image");
    return false;
  }
  destination->addImage(*image);
  if (!destination->finalize()) {
    log.error("Couldn't finalize image");
    return false;
  }
  if (!files.writeFile(saveTo, buffer, nullptr)) {
    log.error("Couldn't save image file to %{public}@", saveTo);
    return false;
  }
  return true;
}

std::vector<PropertyList> AppsClient::_orderTheItems(BrelmShell& shell, FileManager& files, const ClientLog& log,
                                                     PropertyList& items) {
  std::vector<PropertyList> result;
  result.reserve(items.count());
  std::optional<PropertyList> order;
  const BrelmPort port = shell.BrelmBlockableServerPort();
  if (const auto state = shell.BrelmGetFlattenedIconState(port, kBrelmIconStateFlattened)) {
    log("saved icon sort order");
    files.writeFile(kAssetSortOrderPath, *state, nullptr);
    order = parsePropertyList(*state, nullptr);
  } else {
    log("got no icon sort order from Brelm");
  }

  std::unordered_set<std::string> placed;
  if (order) {
    for (const PropertyList& element : order->elements()) {
      const std::optional<std::string> id = element.string();
      const PropertyList* item = id ? items.find(*id) : nullptr;
      if (item == nullptr || !placed.insert(*id).second) continue;
      log("prioritize %{public}@", *id);
      result.push_back(*item);
    }
  }
  PropertyList remainder = PropertyList::dictionary();
  for (const auto& [id, item] : items.members()) {
    if (placed.contains(std::string(id))) continue;
    log("lastly %{public}@", id);
    result.push_back(item);
    remainder.set(id, item);
  }
  items = std::move(remainder);
  return result;
}

}  // namespace appsync
