#include "embedded/home_screen.h"

#include <map>
#include <string_view>
#include <unordered_set>
#include <utility>

#include "embedded/device.h"
#include "embedded/registry.h"

namespace appsync {

namespace {

constexpr char kLayoutRecord[] = "homescreen";
constexpr int kLayoutRefused = 1;

// Appends the identifiers of a page, a folder or the whole layout, each that is not there yet.
void flatten(const PropertyList& part, std::unordered_set<std::string>& seen, std::vector<std::string>& identifiers) {
  if (const auto identifier = part.string(); identifier && !identifier->empty() && seen.insert(*identifier).second) {
    identifiers.push_back(*identifier);
  }
  for (const PropertyList& element : part.elements()) flatten(element, seen, identifiers);
  if (const PropertyList* pages = part.find("iconLists"); pages != nullptr && pages->isArray()) {
    flatten(*pages, seen, identifiers);
  }
}

std::vector<std::string> flattenedLayout(const PropertyList& layout) {
  std::unordered_set<std::string> seen;
  std::vector<std::string> identifiers;
  flatten(layout, seen, identifiers);
  return identifiers;
}

// The layout, then what else is on the device.
std::vector<std::string> joined(std::vector<std::string> layout, const std::vector<std::string>& onDevice) {
  std::unordered_set<std::string> seen(layout.begin(), layout.end());
  for (const std::string& bundleID : onDevice) {
    if (seen.insert(bundleID).second) layout.push_back(bundleID);
  }
  return layout;
}

PropertyList arrayOf(const std::vector<std::string>& identifiers) {
  return PropertyList::array(std::vector<PropertyList>(identifiers.begin(), identifiers.end()));
}

}  // namespace

EmbeddedHomeScreen::EmbeddedHomeScreen(StateStore& store, EmbeddedRegistry& registry)
    : _store(store), _registry(registry) {
  const std::optional<PropertyList> layout = store.load(kLayoutRecord, nullptr);
  const MutexLock lock(_mutex);
  if (layout) _layout = flattenedLayout(*layout);
}

BrelmPort EmbeddedHomeScreen::BrelmBlockableServerPort() {
  return BrelmPort{1};
}

int EmbeddedHomeScreen::BrelmSetIconState(BrelmPort /*port*/, const std::uint8_t* bytes, std::size_t length) {
  const std::optional<PropertyList> layout = parsePropertyList(bytes, length, nullptr);
  return layout && setLayout(*layout, nullptr) ? 0 : kLayoutRefused;
}

std::optional<Bytes> EmbeddedHomeScreen::BrelmGetFlattenedIconState(BrelmPort /*port*/, std::uint32_t format) {
  if (format != kBrelmIconStateFlattened) return std::nullopt;
  return serializePropertyList(arrayOf(flattened()), PropertyListFormat::Binary, nullptr);
}

bool EmbeddedHomeScreen::setLayout(const PropertyList& layout, ErrorOut error) {
  if (!checkHomeScreenSeed(layout, error)) return false;
  std::vector<std::string> identifiers = flattenedLayout(layout);
  const MutexLock lock(_mutex);
  if (!_store.save(kLayoutRecord, layout, error)) return false;
  _layout = std::move(identifiers);
  return true;
}

std::vector<std::string> EmbeddedHomeScreen::flattened() {
  std::vector<std::string> layout;
  {
    const MutexLock lock(_mutex);
    layout = _layout;
  }
  return joined(std::move(layout), _registry.identifiersByArrival());
}

PropertyList homeScreenStatus(const StateStore& store) {
  const std::optional<PropertyList> layout = store.load(kLayoutRecord, nullptr);
  return arrayOf(
      joined(layout ? flattenedLayout(*layout) : std::vector<std::string>(),
             identifiersByArrival(loadApplicationRecords(store, nullptr), loadPlaceholderRecords(store, nullptr))));
}

bool checkHomeScreenSeed(const PropertyList& layout, ErrorOut error) {
  if (layout.isArray()) return true;
  setError(error, Error(std::string(kDeviceErrorDomain), kDeviceBadSeed,
                        "homeScreen must be an array of identifiers, or of pages of identifiers and folders"));
  return false;
}

bool seedHomeScreen(EmbeddedHomeScreen& homeScreen, const PropertyList& layout, ErrorOut error) {
  return homeScreen.setLayout(layout, error);
}

}  // namespace appsync
