// The registry, the home screen and icons: what observers and walks see, and what a later process finds.
#include <gtest/gtest.h>

#include <future>
#include <mutex>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "embedded/icons.h"
#include "tests/support/registry_device.h"

namespace appsync {
namespace {

using test::RegistryDevice;

PropertyList parsed(const std::string& xml) {
  std::optional<Error> error;
  const std::string document = "<plist>" + xml + "</plist>";
  const auto value = parsePropertyList(Bytes(document.begin(), document.end()), &error);
  EXPECT_TRUE(value) << error->description();
  return value.value_or(PropertyList::array());
}

// An entry of a seed, its fields as XML.
PropertyList entry(const std::string& bundleID, const std::string& fields = "") {
  return parsed("<dict><key>identifier</key><string>" + bundleID + "</string>" + fields + "</dict>");
}
std::string number(const std::string& key, int value) {
  return "<key>" + key + "</key><integer>" + std::to_string(value) + "</integer>";
}
std::string flag(const std::string& key, bool value) {
  return "<key>" + key + "</key>" + (value ? "<true/>" : "<false/>");
}
std::string text(const std::string& key, const std::string& value) {
  return "<key>" + key + "</key><string>" + value + "</string>";
}

void seed(RegistryDevice& device, const std::vector<PropertyList>& installed,
          const std::vector<PropertyList>& placeholders) {
  std::optional<Error> error;
  const PropertyList applications = PropertyList::array(installed);
  const PropertyList others = PropertyList::array(placeholders);
  ASSERT_TRUE(checkInstalledSeed(applications, &error)) << error->text();
  ASSERT_TRUE(checkPlaceholdersSeed(others, &error)) << error->text();
  ASSERT_TRUE(seedInstalled(*device.registry, *device.files, applications, &error)) << error->description();
  ASSERT_TRUE(seedPlaceholders(*device.registry, others, &error)) << error->description();
}

std::string described(const PellumApplicationProxies& records) {
  std::string all;
  for (const auto& record : records) {
    all += (all.empty() ? "" : " ") + record.bundleIdentifier + (record.isPlaceholder() ? "*" : "");
    if (!record.isPlaceholder()) continue;
    const auto& progress = record.installProgressSync;
    all += progress ? std::to_string(progress->installState) + std::to_string(progress->installPhase) : "-";
  }
  return all;
}

class Observer : public PellumApplicationWorkspaceObserver {
 public:
  void applicationInstallsArePrioritized(const PellumApplicationProxies& prioritized,
                                         const PellumApplicationProxies& paused) override {
    hear(described(prioritized) + " | " + described(paused));
  }
  void applicationInstallsDidCancel(const PellumApplicationProxies& applications) override {
    hear("cancelled " + described(applications));
  }

  std::vector<std::string> heard() {
    const std::unique_lock lock(_mutex);
    return _heard;
  }
  std::function<void()> during;  // every callback; set before the observer is added

 private:
  void hear(std::string text) {
    {
      const std::unique_lock lock(_mutex);
      _heard.push_back(std::move(text));
    }
    if (during) during();
  }

  std::mutex _mutex;
  std::vector<std::string> _heard;
};

// --- walks and look-ups ---------------------------------------------------------------------------------------------

TEST(Registry, walksBySortedClassOnASnapshot) {
  RegistryDevice device;
  seed(device, {entry("org.c"), entry("org.a", text("type", "System"))},
       {entry("org.c", text("version", "2")), entry("org.b", text("type", "System"))});
  device.restart();
  const std::vector<std::pair<std::uint64_t, std::string>> walks{
      {0, "org.a org.b*00 org.c org.c*00"}, {1, "org.a org.c"}, {7, "org.a org.b*00"}, {2, ""}};
  for (const auto& [type, expected] : walks) {
    PellumApplicationProxies records;
    device.registry->enumerateBundlesOfType(type, [&](const auto& record, bool&) { records.push_back(record); });
    EXPECT_EQ(described(records), expected);
  }
  PellumApplicationProxies records;
  device.registry->enumerateBundlesOfType(kPellumBundleTypeAll, [&](const auto& record, bool& stop) {
    records.push_back(record);
    EXPECT_TRUE(device.registry->uninstallApplication("org.b", nullptr) || records.size() > 1);
    stop = records.size() == 2;
  });
  EXPECT_EQ(described(records), "org.a org.b*00");
  EXPECT_FALSE(device.registry->applicationIsInstalled("org.b"));
  EXPECT_FALSE(device.registry->applicationProxyForIdentifier("org.c", false)->bundleVersion);
  EXPECT_EQ(device.registry->applicationProxyForIdentifier("org.c", true)->bundleVersion, "2");
}

TEST(Registry, aPlaceholderIsAnInputOfTheNextSync) {
  RegistryDevice device;
  PlaceholderDescription description;
  description.bundleID = "org.a";
  description.name = "Näme";
  description.installType = kPellumInstallTypeSync;
  description.launchProhibited = true;
  description.infoPlist = parsed("<dict>" + text("Other", "kept") + text("TefBundleVersion", "9") +
                                 "<key>TefBundleIconFiles</key><array><string>Gone.png</string></array></dict>");
  for (const bool hasIcon : {false, true}) {
    if (hasIcon) {
      description.icon = Bytes{1, 2, 3};
      description.bundleVersion = "7";
      description.metadata = parsed("<dict>" + text("title", "t") + "</dict>");
    }
    ASSERT_TRUE(device.registry->installPlaceholder(description, nullptr));
    const auto record = device.registry->applicationProxyForIdentifier("org.a", true);
    const auto info =
        parsePropertyList(*device.files->readFile(record->bundleURL->path() + "/Info.plist", nullptr), nullptr);
    const std::string version = hasIcon ? text("TefBundleVersion", "7") : "";
    const std::string icons = hasIcon ? "<key>TefBundleIconFiles</key><array><string>Icon.png</string></array>" : "";
    EXPECT_EQ(info, parsed("<dict>" + text("Other", "kept") + text("TefBundleIdentifier", "org.a") +
                           text("TefBundleDisplayName", "Näme") + version + icons +
                           flag("PellumApplicationLaunchProhibited", true) + "</dict>"));
    EXPECT_EQ(device.text(record->bundleURL->path() + "/Icon.png"), hasIcon ? "\1\2\3" : "(none)");
    EXPECT_EQ(device.files->fileExists(record->bundleContainerURL->path() + "/TarvoMetadata.plist"), hasIcon);
    EXPECT_EQ(device.containers().size(), 1U);
    device.restart();
  }
  description.bundleID = "a/b";
  EXPECT_FALSE(device.registry->installPlaceholder(description, nullptr));
}

TEST(Registry, uninstallingTakesThePlaceholderFirst) {
  RegistryDevice device;
  std::vector<std::string> hooked;
  device.registry->placeholderUninstalled = [&](const std::string& bundleID) { hooked.push_back(bundleID); };
  seed(device, {entry("org.a")}, {entry("org.a")});
  EXPECT_TRUE(device.registry->uninstallApplication("org.a", nullptr));
  EXPECT_TRUE(device.registry->applicationIsInstalled("org.a"));
  EXPECT_EQ(hooked, std::vector<std::string>{"org.a"});
  EXPECT_TRUE(device.registry->uninstallApplication("org.a", nullptr));
  EXPECT_TRUE(device.containers().empty());
  std::optional<Error> error;
  EXPECT_FALSE(device.registry->uninstallApplication("org.a", &error));
  EXPECT_EQ(error->code(), kRegistryUnknown);
  EXPECT_EQ(hooked.size(), 1U);
  EXPECT_TRUE(device.registry->removePlaceholder("org.a", nullptr));
  EXPECT_TRUE(device.registry->removeApplication("org.a", nullptr));
}

TEST(Registry, sweepsOnlyWhatNoRecordNames) {
  RegistryDevice device;
  seed(device, {entry("org.a")}, {entry("org.b")});
  const auto known = device.containers();
  device.files->createDirectory(std::string(kContainersDirectory) + "/.incoming-77/x", true, {}, nullptr);
  device.files->createDirectory(std::string(kPlaceholdersDirectory) + "/78/x", true, {}, nullptr);
  device.restart();
  EXPECT_EQ(device.containers(), known);
  // Of a record that means nothing no one can say which container was its.
  device.store->save("applications/org.a", PropertyList::dictionary(), nullptr);
  device.restart();
  EXPECT_EQ(device.containers(), known);
  EXPECT_FALSE(device.registry->applicationIsInstalled("org.a"));
}

// Whatever a record or a directory's name says, numbering goes on, and to a name that is free.
TEST(Registry, numberingSurvivesTheLargestNumbers) {
  constexpr std::uint64_t kLargestCounted = UINT64_MAX / 2 - 1;
  for (const std::uint64_t arrival : {UINT64_MAX, kLargestCounted}) {
    RegistryDevice device;
    seed(device, {entry("org.a")}, {});
    PropertyList record = *device.store->load("applications/org.a", nullptr);
    record.set("arrival", PropertyList::unsignedInteger(arrival));
    ASSERT_TRUE(device.store->save("applications/org.a", record, nullptr));
    for (const char* parent : {kContainersDirectory, kPlaceholdersDirectory}) {
      device.files->createDirectory(std::string(parent) + "/" + std::to_string(kLargestCounted + 1), true, {}, nullptr);
    }
    ASSERT_TRUE(device.store->save("placeholders/org.meaningless", PropertyList::dictionary(), nullptr));  // no sweep
    device.restart();
    seed(device, {entry("org.b"), entry("org.c")}, {entry("org.d")});
    const std::vector<std::string> last = {"org.b", "org.c", "org.d"};
    auto order = device.registry->identifiersByArrival();
    std::erase(order, "org.a");
    EXPECT_EQ(order, last);
  }
}

// --- observers ------------------------------------------------------------------------------------------------------

TEST(Registry, everyLiveInstallIsInExactlyOneList) {
  RegistryDevice device;
  seed(device, {entry("org.installed", flag("prioritized", true)), entry("org.quiet")},
       {entry("org.a"), entry("org.b", number("installState", 1)), entry("org.c", number("installState", 2)),
        entry("org.d", flag("prioritized", false)), entry("org.e", flag("progress", false)),
        entry("org.f", number("installPhase", 1) + number("installState", 2) + flag("prioritized", true))});
  device.restart();
  const auto observer = std::make_shared<Observer>();
  device.registry->addObserver(observer);
  device.executor->drain();
  EXPECT_EQ(observer->heard().at(0), "org.b*10 org.e*- org.installed | org.c*20 org.d*00 org.f*21");
}

TEST(Registry, reportsWhenAnInstallBeginsPausesGoesOnAndEnds) {
  RegistryDevice device;
  seed(device, {}, {entry("org.a")});
  const auto observer = std::make_shared<Observer>();
  const auto show = [&](const std::string& bundleID, std::optional<InstallDisplay> display) {
    device.registry->setInstallDisplay(bundleID, display);
    device.executor->drain();
  };
  device.registry->addObserver(observer);
  device.registry->addObserver(observer);
  device.executor->drain();  // a first report that meets the first change would say it, and the next say it again
  show("org.a", InstallDisplay{{1, 0}});
  show("org.a", InstallDisplay{{1, 1}});  // the same install in the same list
  show("org.a", InstallDisplay{{2, 1}});
  show("org.a", InstallDisplay{{1, 1}, false});
  show("org.none", InstallDisplay{});
  device.registry->installsDidCancel("org.a");
  show("org.a", std::nullopt);
  show("org.a", InstallDisplay{{1, 1}});
  device.registry->removePlaceholder("org.a", nullptr);
  device.executor->drain();
  seed(device, {}, {entry("org.a")});
  device.executor->drain();
  EXPECT_EQ(observer->heard(), (std::vector<std::string>{" | ", "org.a*10 | ", " | org.a*21", " | org.a*11",
                                                         "cancelled org.a*11", " | ", "org.a*11 | ", " | "}));
  show("org.a", InstallDisplay{{1, 1}});
  device.restart();
  EXPECT_EQ(described({*device.registry->applicationProxyForIdentifier("org.a", true)}), "org.a*00");
}

TEST(Registry, firstReportComesOnAnotherThreadAndRemovalWaitsForIt) {
  RegistryDevice device;
  std::promise<void> entered;
  std::promise<void> leave;
  std::atomic<bool> isOver = false;
  std::thread::id reporter;
  const auto observer = std::make_shared<Observer>();
  observer->during = [&] {
    reporter = std::this_thread::get_id();
    entered.set_value();
    leave.get_future().wait();
    isOver = true;
  };
  device.registry->addObserver(observer);
  entered.get_future().wait();
  EXPECT_NE(reporter, std::this_thread::get_id());
  std::thread releasing([&] { leave.set_value(); });
  device.registry->removeObserver(observer);
  EXPECT_TRUE(isOver);
  releasing.join();
  device.registry->installsDidCancel("org.a");
  device.executor->drain();
  EXPECT_EQ(observer->heard().size(), 1U);
  device.registry->removeObserver(observer);
}

TEST(Registry, anObserverCanRemoveItselfInACallback) {
  RegistryDevice device;
  auto observer = std::make_shared<Observer>();
  const std::weak_ptr<Observer> watched = observer;
  observer->during = [&] { device.registry->removeObserver(watched.lock()); };
  device.registry->addObserver(observer);
  device.executor->drain();
  device.registry->installsDidCancel("org.a");
  device.executor->drain();
  EXPECT_EQ(observer->heard().size(), 1U);
  observer.reset();
  EXPECT_TRUE(watched.expired());
}

TEST(Registry, observersComeAndGoWhileInstallsChange) {
  RegistryDevice device;
  seed(device, {}, {entry("org.a"), entry("org.b")});
  std::vector<std::thread> threads;
  for (const std::string bundleID : {"org.a", "org.b"}) {
    threads.emplace_back([&device, bundleID] {
      for (int round = 0; round < 200; ++round) {
        device.registry->setInstallDisplay(bundleID, InstallDisplay{{1, 1}, round % 2 == 0});
      }
    });
    threads.emplace_back([&device] {
      for (int round = 0; round < 50; ++round) {
        const auto observer = std::make_shared<Observer>();
        device.registry->addObserver(observer);
        while (round % 2 == 0 && observer->heard().empty()) std::this_thread::yield();
        device.registry->removeObserver(observer);
        const auto heard = observer->heard();
        device.registry->enumerateBundlesOfType(kPellumBundleTypeAll, [](const auto&, bool&) {});
        EXPECT_EQ(observer->heard(), heard);
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
}

// --- status and seed ------------------------------------------------------------------------------------------------

TEST(RegistrySeed, whatOneDeviceShowsSeedsAnother) {
  RegistryDevice first;
  seed(first,
       {entry("org.a",
              text("version", "1.2") + text("name", "A") + number("size", 5'000'000) + flag("prioritized", false)),
        entry("org.b", text("type", "System") + "<key>files</key><dict>" + number("d/e/x", 10) + number("y", 20) +
                           "</dict><key>storeMetadata</key><dict>" + text("zelkId", "z") + "</dict>")},
       {entry("org.a", text("name", "P") + number("installType", 8) + flag("launchProhibited", true) +
                           number("installState", 1) + number("installPhase", 1) + flag("progress", false)),
        entry("org.p")});
  const auto record = first.registry->applicationProxyForIdentifier("org.a", false);
  EXPECT_EQ(record->diskUsage.staticUsage, 5'000'000U);
  EXPECT_EQ(first.files->treeSize(record->bundleContainerURL->path()), 5'000'000U);
  EXPECT_FALSE(record->installProgressSync);
  const auto other = first.registry->applicationProxyForIdentifier("org.b", false);
  EXPECT_EQ(first.files->attributesOfItem(other->bundleURL->path() + "/d/e/x", nullptr)->size, 10U);
  EXPECT_TRUE(first.files->fileExists(other->bundleContainerURL->path() + "/TarvoMetadata.plist"));

  const PropertyList installed = registryInstalledStatus(*first.store);
  EXPECT_EQ(*installed.elements()[0].find("container"), "var/mobile/Containers/1");
  EXPECT_EQ(installed.elements()[0].find("installState"), nullptr);
  EXPECT_EQ(*installed.elements()[1].find("name"), "org.b");
  RegistryDevice second;
  const auto entries = installed.elements();
  seed(second, std::vector<PropertyList>(entries.begin(), entries.end()), {});
  const PropertyList placeholders = registryPlaceholdersStatus(*first.store);
  ASSERT_TRUE(seedPlaceholders(*second.registry, placeholders, nullptr));
  EXPECT_EQ(registryPlaceholdersStatus(*second.store), placeholders);
  EXPECT_EQ(placeholders.count(), 2U);
  PropertyList again = registryInstalledStatus(*second.store);
  for (std::size_t index = 0; index < again.count(); ++index) {
    PropertyList shown = again.elements()[index];
    shown.set("container", *installed.elements()[index].find("container"));
    EXPECT_EQ(shown, installed.elements()[index]);
  }
}

TEST(RegistrySeed, badEntriesAreNamed) {
  const auto files = [](const std::string& sizes) { return "<key>files</key><dict>" + sizes + "</dict>"; };
  const std::vector<std::pair<std::string, std::string>> bad{
      {text("size", "big"), "(org.a): \"size\""},
      {"<key>size</key><integer>9999999999999999</integer>", "1 TiB"},
      {text("type", "Other"), "\"type\" must be"},
      {number("prioritized", 1), "\"prioritized\""},
      {"<key>storeMetadata</key><array/>", "\"storeMetadata\""},
      {files(number("../x", 1)), "\"files\""},
      {files(number("x", 1) + number("x/y", 1)), "\"files\""},
      {files(number("Info.plist", 1)), "\"files\""},
      {number("sise", 1), "entry 2 (org.a): \"sise\" is nothing that an entry has; there are identifier, version"},
      {number("installType", 1), "\"installType\" is nothing"},
      {text("identifier", "../b"), "entry 2 must"},
      {text("identifier", ""), "entry 2 must"}};
  std::optional<Error> error;
  for (const auto& [fields, expected] : bad) {
    EXPECT_FALSE(checkInstalledSeed(PropertyList::array({entry("org.z"), entry("org.a", fields)}), &error));
    EXPECT_NE(error->text().find(expected), std::string::npos) << error->text();
  }
  EXPECT_FALSE(checkInstalledSeed("x", &error));
  EXPECT_FALSE(checkInstalledSeed(PropertyList::array({"x"}), &error));
}

// --- the home screen ------------------------------------------------------------------------------------------------

std::string shown(RegistryDevice& device) {
  std::string all;
  const auto bytes = device.homeScreen->BrelmGetFlattenedIconState({}, kBrelmIconStateFlattened);
  const auto layout = parsePropertyList(*bytes, nullptr);
  EXPECT_EQ(layout, homeScreenStatus(*device.store));
  for (const PropertyList& bundleID : layout->elements()) all.append(*bundleID.string()).append(" ");
  return all.substr(0, all.rfind(' '));
}

int push(RegistryDevice& device, const std::string& xml) {
  const std::string document = "<plist>" + xml + "</plist>";
  const Bytes bytes(document.begin(), document.end());
  return device.homeScreen->BrelmSetIconState({}, bytes.data(), bytes.size());
}

TEST(HomeScreen, showsTheLayoutThenWhatCame) {
  RegistryDevice device;
  seed(device, {entry("org.z"), entry("org.a")}, {entry("org.m"), entry("org.a")});
  EXPECT_EQ(shown(device), "org.z org.a org.m");
  const std::string page = "<array><string>org.m</string><dict>" + text("displayName", "F") +
                           "<key>iconLists</key><array><array><string>org.x</string><string>org.m</string></array>"
                           "</array></dict><integer>3</integer></array>";
  EXPECT_EQ(push(device, "<array>" + page + "<array><string>org.a</string></array></array>"), 0);
  for (const char* bad : {"<dict/>", "<string>org.a</string>", "<arr"}) {
    EXPECT_NE(push(device, bad), 0);
    EXPECT_EQ(shown(device), "org.m org.x org.a org.z");
  }
  EXPECT_FALSE(device.homeScreen->BrelmGetFlattenedIconState({}, 2));
  device.registry->removeApplication("org.z", nullptr);  // came by itself
  device.registry->removeApplication("org.m", nullptr);  // has its place in the layout
  seed(device, {entry("org.b")}, {});
  device.restart();
  EXPECT_EQ(shown(device), "org.m org.x org.a org.b");
  EXPECT_EQ(push(device, "<array><string>org.b</string></array>"), 0);
  EXPECT_EQ(shown(device), "org.b org.a");
  device.disk.failingCall = 1;
  EXPECT_NE(push(device, "<array/>"), 0);
  EXPECT_EQ(shown(device), "org.b org.a");
}

// --- icons ----------------------------------------------------------------------------------------------------------

Image plain(std::uint32_t width, std::uint32_t height, std::uint8_t red) {
  Image image{width, height, {}};
  for (std::uint32_t pixel = 0; pixel < width * height; ++pixel) {
    image.pixels.insert(image.pixels.end(), {red, 40, 200, 255});
  }
  return image;
}

Bytes encoded(const Image& image) {
  Bytes buffer;
  test::RegistryDevice device;
  EmbeddedIconServices icons(*device.files);
  const auto destination = icons.makePNGDestination(buffer);
  EXPECT_FALSE(destination->finalize());
  destination->addImage(image);
  EXPECT_TRUE(destination->finalize());
  return buffer;
}

std::vector<int> pixel(const Image& image, std::size_t x, std::size_t y) {
  const std::uint8_t* at = &image.pixels[(y * image.width + x) * 4];
  return {at[0], at[1], at[2], at[3]};
}

TEST(Icons, haveTheDevicesSizeAndShape) {
  for (const auto& [width, height] : std::vector<std::pair<std::uint32_t, std::uint32_t>>{
           {1, 1}, {2, 3}, {48, 48}, {120, 120}, {512, 512}, {1000, 1}, {301, 777}}) {
    const Image icon = homeScreenIcon(plain(width, height, 255));
    ASSERT_EQ(icon.width, kHomeScreenIconSize);
    ASSERT_EQ(icon.pixels.size(), 4U * kHomeScreenIconSize * kHomeScreenIconSize);
    for (const std::size_t corner : {0U, 119U}) EXPECT_EQ(pixel(icon, corner, 119 - corner)[3], 0);
    for (const auto& [x, y] : {std::pair(60U, 60U), std::pair(60U, 0U), std::pair(0U, 60U), std::pair(119U, 59U)}) {
      EXPECT_EQ(pixel(icon, x, y), (std::vector<int>{255, 40, 200, 255})) << width << "x" << height;
    }
  }
}

TEST(Icons, scaleByAreaInThePicturesOwnOrientation) {
  // The upper right is a fine checkerboard of two reds; on the left every other square is transparent, and very red.
  Image picture = plain(480, 480, 0);
  for (std::uint32_t y = 0; y < 480; ++y) {
    for (std::uint32_t x = 0; x < 480; ++x) {
      std::uint8_t* at = &picture.pixels[(y * 480 + x) * 4];
      const bool isLight = (x / 2 + y / 2) % 2 == 0;
      if (x >= 240 && y < 240) at[0] = isLight ? 200 : 100;
      if (x < 240 && !isLight) at[0] = 255, at[3] = 0;
    }
  }
  const Image icon = homeScreenIcon(picture);
  EXPECT_EQ(pixel(icon, 90, 30), (std::vector<int>{150, 40, 200, 255}));
  EXPECT_EQ(pixel(icon, 90, 90), (std::vector<int>{0, 40, 200, 255}));
  EXPECT_EQ(pixel(icon, 30, 60), (std::vector<int>{0, 40, 200, 128}));
}

TEST(Icons, takeTheLargestPictureThatCanBeRead) {
  RegistryDevice device;
  EmbeddedIconServices icons(*device.files);
  const FileURL url = *FileURL::fileURLWithPath("/var/mobile/Media/a", true);
  EXPECT_FALSE(icons.bundleWithURL(url));
  device.files->createDirectory("/var/mobile/Media/a", false, {}, nullptr);
  EXPECT_EQ(icons.bundleWithURL(url)->infoDictionary, PropertyList::dictionary());
  const auto put = [&](const std::string& name, const Bytes& bytes) {
    device.files->writeFile("/var/mobile/Media/a/" + name, bytes, nullptr);
  };
  const std::string info =
      "<plist><dict><key>TefBundleIconFiles</key><array><string>small.png</string><string>../a/small.png</string>"
      "<integer>1</integer><string/><string>cut.png</string><string>none.png</string><string>mid.png</string>"
      "<string>Info.plist</string><string>wide.png</string></array></dict></plist>";
  put("Info.plist", Bytes(info.begin(), info.end()));
  const Bundle bundle = *icons.bundleWithURL(url);
  const auto red = [&]() -> int {
    const auto icon = icons.GlintCreateDeviceAppropriateHomeScreenIconImageFromBundle(bundle);
    return icon ? icon->pixels[(60 * 120 + 60) * 4] : -1;
  };
  EXPECT_EQ(red(), -1);
  put("small.png", encoded(plain(8, 8, 10)));
  EXPECT_EQ(red(), 10);
  put("mid.png", encoded(plain(30, 30, 20)));
  EXPECT_EQ(red(), 20);
  Bytes cut = encoded(plain(300, 300, 30));
  cut.resize(cut.size() / 2);
  put("cut.png", cut);
  put("wide.png", encoded(plain(4097, 1, 40)));
  EXPECT_EQ(red(), 20);
}

}  // namespace
}  // namespace appsync
