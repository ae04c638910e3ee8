// The small services of the embedded device: what they refuse, what they keep, and what they do when the disk fails.
#include <gtest/gtest.h>

#include <cerrno>
#include <fstream>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "embedded/device.h"
#include "embedded/device_service.h"
#include "embedded/icons.h"
#include "embedded/notifications.h"
#include "embedded/settings.h"
#include "embedded/waiting.h"
#include "tests/support/registry_device.h"
#include "tests/support/world.h"

namespace appsync {
namespace {

using test::plist;
using test::RegistryDevice;

void put(RegistryDevice& device, const std::string& path, const std::string& content) {
  device.files->createDirectory(path.substr(0, path.rfind('/')), true, {}, nullptr);
  ASSERT_TRUE(device.files->writeFile(path, Bytes(content.begin(), content.end()), nullptr));
}

void seed(RegistryDevice& device, const std::string& installed, const std::string& placeholders) {
  std::optional<Error> error;
  ASSERT_TRUE(seedPlaceholders(*device.registry, plist(placeholders), &error)) << error->description();
  ASSERT_TRUE(seedInstalled(*device.registry, *device.files, plist(installed), &error)) << error->description();
}

// --- records --------------------------------------------------------------------------------------------------------

TEST(StateStore, RefusesNamesThatLeadElsewhere) {
  RegistryDevice device;
  ASSERT_TRUE(device.store->save("apps/org.a", "kept", nullptr));
  for (const std::string& name : {std::string("apps/../x"), std::string("."), std::string("a/b/c"),
                                  std::string("apps/."), std::string("a\0b", 3)}) {
    std::optional<Error> error;
    EXPECT_FALSE(device.store->load(name, &error));
    EXPECT_EQ(std::exchange(error, std::nullopt).value_or(Error("", 0)).code(), EINVAL) << name;
    EXPECT_FALSE(device.store->save(name, "text", &error));
    EXPECT_EQ(std::exchange(error, std::nullopt).value_or(Error("", 0)).code(), EINVAL) << name;
    EXPECT_FALSE(device.store->remove(name, &error));
    EXPECT_EQ(error.value_or(Error("", 0)).code(), EINVAL) << name;
    EXPECT_FALSE(isSinglePathComponent(name));
  }
  for (const char* collection : {"..", "apps/..", ""}) {
    EXPECT_TRUE(device.store->keys(collection).empty() && !device.store->hasSetAside(collection)) << collection;
  }
  EXPECT_EQ(device.store->keys("apps"), std::vector<std::string>{"org.a"});
  EXPECT_TRUE(device.store->keys("none").empty());
}

TEST(StateStore, TellsWhatIsMissingFromWhatCannotBeRead) {
  RegistryDevice device;
  std::optional<Error> error;
  EXPECT_FALSE(device.store->load("apps/none", &error) || error);
  device.files->ownFiles().createDirectory("/state/apps/dir.plist/x", true, {}, nullptr);
  EXPECT_FALSE(device.store->load("apps/dir", &error));
  EXPECT_TRUE(std::exchange(error, std::nullopt)) << "a directory in a record's place is no missing record";
  ASSERT_TRUE(device.store->save("apps/org.a", "kept", nullptr));
  device.disk.failingCall = 1;
  EXPECT_FALSE(device.store->remove("apps/org.a", &error));
  EXPECT_EQ(error->code(), ENOSPC);
  EXPECT_EQ(device.store->load("apps/org.a", nullptr), PropertyList("kept"));
}

TEST(StateStore, WhatIsDamagedAgainTakesThePlaceOfWhatWasBefore) {
  const auto isAnything = [](const std::string&, const PropertyList&) { return true; };
  RegistryDevice device;
  const auto own = device.files->ownFiles();
  for (const std::string content : {"first", "second"}) {
    put(device, "/var/mobile/x", content);
    ASSERT_TRUE(EmbeddedFileManager(own).createDirectory("/state", true, {}, nullptr));
    ASSERT_TRUE(
        EmbeddedFileManager(own).writeFile("/state/broken.plist", Bytes(content.begin(), content.end()), nullptr));
    EXPECT_FALSE(device.store->hasSetAside("."));
    std::vector<std::string> repairs;
    ASSERT_TRUE(repairStateRecords(*device.files, isAnything, repairs, nullptr)) << content;
    EXPECT_EQ(repairs.size(), 1U);
    const auto aside = EmbeddedFileManager(own).readFile("/state/broken.plist.damaged", nullptr);
    EXPECT_EQ(std::string(aside->begin(), aside->end()), content);
  }
  device.disk.failingCall = 1;
  device.disk.forGood = true;
  std::vector<std::string> repairs;
  std::optional<Error> error;
  EXPECT_TRUE(repairStateRecords(*device.files, isAnything, repairs, &error)) << "nothing to repair, nothing to write";
  device.disk.failingCall = 0;
}

// --- files ----------------------------------------------------------------------------------------------------------

// Writes down which records of accounts are asked for: not every file system can hold them.
class AccountDisk : public Disk {
 public:
  std::string recorded;
  int fsetxattr(int /*file*/, const char* name, const void* value, std::size_t size) override {
    recorded += std::string(name).substr(std::string(name).rfind('.') + 1) + "=" +
                std::string(static_cast<const char*>(value), size) + " ";
    errno = ENOTSUP;
    return -1;
  }
};

TEST(Files, DirectoriesAreMadeAsAskedAndAccountsNeverMakeItFail) {
  const test::TemporaryDirectory directory;
  AccountDisk disk;
  EmbeddedFileManager files(directory.path().string(), disk);
  ASSERT_TRUE(files.writeFile("/file", Bytes{1}, nullptr));
  const FileAttributes accounts{.ownerAccountName = "mobile", .groupOwnerAccountName = "wheel"};
  struct Case {
    const char* path;
    bool intermediate;
    int code;  // 0: it is there afterwards
    std::string recorded;
  };
  const std::string once = "owner=mobile group=wheel ";
  const Case cases[] = {{"/a", false, 0, once},
                        {"/a", false, EEXIST, ""},
                        {"/a", true, 0, ""},
                        {"/x/y", false, ENOENT, ""},
                        {"/x/y/z", true, 0, once + once + once},
                        {"/", false, EEXIST, ""},
                        {"/", true, 0, ""},
                        {"/file", true, ENOTDIR, ""},
                        {"/file/b", true, ENOTDIR, ""},
                        {"/file", false, ENOTDIR, ""}};
  for (const Case& one : cases) {
    SCOPED_TRACE(one.path);
    disk.recorded.clear();
    std::optional<Error> error;
    EXPECT_EQ(files.createDirectory(one.path, one.intermediate, accounts, &error), one.code == 0);
    EXPECT_EQ(error ? error->code() : 0, one.code) << (error ? error->description() : "");
    EXPECT_EQ(files.isDirectory(one.path), one.code == 0 || one.code == EEXIST);
    EXPECT_EQ(disk.recorded, one.recorded);
  }
  disk.recorded.clear();
  EXPECT_TRUE(files.createDirectory("/b", false, {}, nullptr) && files.createFile("/f", Bytes{1}, accounts));
  EXPECT_EQ(disk.recorded, once);
  EXPECT_FALSE(files.attributesOfItem("/f", nullptr)->attributes.ownerAccountName);
}

TEST(Files, WhatIsTheRootOrADirectoryIsNoFile) {
  const test::TemporaryDirectory directory;
  Disk disk;
  EmbeddedFileManager files(directory.path().string(), disk);
  ASSERT_TRUE(files.createDirectory("/d/e", true, {}, nullptr) && files.writeFile("/f", Bytes{1}, nullptr));
  using Operation = std::function<bool(ErrorOut)>;
  const std::pair<const char*, Operation> refused[] = {
      {"write the root", [&](auto error) { return files.writeFile("/", Bytes{2}, error); }},
      {"write a directory", [&](auto error) { return files.writeFile("/d", Bytes{2}, error); }},
      {"sink the root", [&](auto error) { return files.openSink("/", error) != nullptr; }},
      {"sink a directory", [&](auto error) { return files.openSink("/d", error) != nullptr; }},
      {"sink nowhere", [&](auto error) { return files.openSink("/none/x", error) != nullptr; }},
      {"remove the root", [&](auto error) { return files.removeItem("/", error); }},
      {"remove nothing", [&](auto error) { return files.removeItem("/none", error); }},
      {"move the root", [&](auto error) { return files.moveItem("/", "/x", error); }},
      {"move over a file", [&](auto error) { return files.moveItem("/d", "/f", error); }},
      {"move into itself", [&](auto error) { return files.moveItem("/d", "/d/e/x", error); }},
      {"copy a directory", [&](auto error) { return files.copyItem("/d", "/x", error); }},
      {"copy over a directory", [&](auto error) { return files.copyItem("/f", "/d", error); }},
      {"attributes of nothing", [&](auto error) { return files.attributesOfItem("/none", error).has_value(); }},
      {"list a file", [&](auto error) { return files.contentsOfDirectory("/f", error).has_value(); }},
      {"read a directory", [&](auto error) { return files.readFile("/d", error).has_value(); }}};
  for (const auto& [title, operation] : refused) {
    std::optional<Error> error;
    EXPECT_FALSE(operation(&error)) << title;
    ASSERT_TRUE(error) << title;
    EXPECT_EQ(error->domain(), kFileErrorDomain) << title;
    std::size_t count = 0;
    for (const auto& entry : std::filesystem::recursive_directory_iterator(directory.path())) count += entry.exists();
    EXPECT_EQ(count, 3U) << title << " left something behind";
  }
  {
    std::optional<Error> error;
    const auto sink = files.openSink("/f", &error);
    ASSERT_TRUE(sink && sink->append("abc", 3, &error));
    EXPECT_EQ(files.readFile("/f", nullptr), Bytes{1}) << "the old one stays until the new one is finished";
  }
  EXPECT_EQ(files.readFile("/f", nullptr), Bytes{1}) << "what is not finished is given up";
  EXPECT_EQ(files.contentsOfDirectory("/", nullptr)->size(), 2U);
}

TEST(Files, OnlyNamesOfTheirOwnPatternAreTemporary) {
  const std::pair<const char*, bool> cases[] = {
      {".tmp-appsync-0123456789abcdef", true},  {".tmp-appsync-0123456789abcdeg", false},
      {".tmp-appsync-0123456789abcde", false},  {".tmp-appsync-0123456789abcdef0", false},
      {"xtmp-appsync-0123456789abcdef", false}, {".tmp-appsync-0123456789ABCDEF", false},
      {"0123456789abcdef0123456789abc", false}, {"", false}};
  const test::TemporaryDirectory directory;
  Disk disk;
  EmbeddedFileManager files(directory.path().string(), disk);
  for (const auto& [name, isTemporary] : cases) EXPECT_EQ(isTemporaryName(name), isTemporary) << name;
  ASSERT_TRUE(files.createDirectory("/d/.tmp-appsync-0123456789abcdef/inside", true, {}, nullptr));
  EXPECT_EQ(files.removeLeftTemporaryFiles(), 0U) << "a directory is somebody's own";
  std::ofstream(directory.path() / "d/.tmp-appsync-1123456789abcdef") << "left by a crash";
  EXPECT_EQ(files.removeLeftTemporaryFiles(), 1U);
}

TEST(DeviceService, ANewQueueBeginsAnew) {
  RegistryDevice device;
  EmbeddedDeviceService service(*device.executor);
  EmbeddedWaiting waiting;
  const auto asset = [](const char* identifier) {
    return DovelAsset::downloadAssetWithIdentifier(identifier, "Application", std::nullopt);
  };
  service.setQueue({"a", "b"});
  EXPECT_EQ(service.takeNext()->identifier, "a");
  service.cancelAssetTransferForFailedAsset(asset("a"));
  service.prioritizeAsset(asset("b"), nullptr);
  EXPECT_TRUE(service.waitUntilDropped("a", waiting, waiting.now()));
  EXPECT_TRUE(service.waitUntilPrioritized("b", waiting, waiting.now()));
  service.setQueue({"b"});
  EXPECT_FALSE(service.waitUntilDropped("a", waiting, waiting.now()) || service.isDropped("a"));
  EXPECT_FALSE(service.waitUntilPrioritized("b", waiting, waiting.now()));
  service.cancelAssetTransferForFailedAsset(asset("a"));
  EXPECT_FALSE(service.isDropped("a")) << "it was begun in the queue before";
  std::optional<Error> answer;
  service.prioritizeAsset(asset("a"), [&](const auto& error) { answer = error; });
  device.executor->drain();
  EXPECT_EQ(answer.value_or(Error("", 0)).code(), kTransferUnknown);
}

// --- settings -------------------------------------------------------------------------------------------------------

TEST(Settings, TakeWhatFitsAndIgnoreWhatARecordShouldNotHold) {
  RegistryDevice device;
  EmbeddedSettings settings(*device.store);
  const std::pair<const char*, std::int64_t> bad[] = {{R"({"AppRemovalAllowed": 3})", kSettingsBadValue},
                                                      {R"({"AppRemovalAllowed": -1})", kSettingsBadValue},
                                                      {R"({"AppInstallationAllowed": "1"})", kSettingsBadValue},
                                                      {R"({"CreateAppPlaceholders": 1})", kSettingsBadValue},
                                                      {R"({"CreateAppPlaceholders": "no"})", kSettingsBadValue},
                                                      {R"(["AppRemovalAllowed"])", kSettingsBadValue},
                                                      {R"({"AppRemovalAllowed": 2, "Other": 1})", kSettingsUnknownKey}};
  for (const auto& [values, code] : bad) {
    std::optional<Error> error;
    EXPECT_FALSE(settings.setValues(plist(values), &error)) << values;
    ASSERT_TRUE(error) << values;
    EXPECT_EQ(error->code(), code) << values;
    EXPECT_FALSE(device.store->load("settings", nullptr)) << values;
  }
  EXPECT_FALSE(settings.value("Other", nullptr));

  ASSERT_TRUE(settings.setValues(plist(R"({"AppRemovalAllowed": 0, "AppInstallationAllowed": 2})"), nullptr));
  EXPECT_EQ(settings.effectiveBoolValueForSetting(TessaFeatureAppInstallationAllowed), TessaBoolean::No);
  device.store->save("settings", plist(R"({"AppRemovalAllowed": 3, "AppInstallationAllowed": -1,
                                          "CreateAppPlaceholders": "no", "Other": 1})"),
                     nullptr);
  EXPECT_EQ(settings.all().description(),
            "{AppInstallationAllowed = 0, AppRemovalAllowed = 0, CreateAppPlaceholders = true}");
  EXPECT_EQ(settings.effectiveBoolValueForSetting(TessaFeatureAppRemovalAllowed), TessaBoolean::NotSet);
  ASSERT_TRUE(settings.setValue("CreateAppPlaceholders", false, nullptr));
  std::optional<Error> error;
  EXPECT_FALSE(settings.makeVaultryManager()->dovelShouldCreateAppPlaceholdersWithError(&error));
  EXPECT_EQ(error.value_or(Error("", 0)).code(), kSettingsNoPlaceholders);
}

// --- notifications --------------------------------------------------------------------------------------------------

TEST(Notifications, AWordIsKeptByNameAndAPostReachesItsObserversAlone) {
  RegistryDevice device;
  EmbeddedNotificationCenter center(*device.executor);
  EmbeddedNotificationService service(*device.store, center);
  int first = -1;
  int second = -1;
  int again = -1;
  EXPECT_NE(service.registerCheck("", first), 0U);
  EXPECT_EQ(service.registerCheck("org.first", first) + service.registerCheck("org.second", second) +
                service.registerCheck("org.first", again),
            0U);
  EXPECT_EQ(first, again);
  EXPECT_NE(first, second);
  service.setState(first, 7);
  service.setState(second, ~0ULL);
  for (const int unknown : {-1, 2, 1 << 30}) service.setState(unknown, 9);
  EXPECT_EQ(notificationsStatus(*device.store).description(), "{org.first = 7, org.second = 18446744073709551615}");
  EXPECT_EQ(EmbeddedNotificationService(*device.store, center).state("org.second"), ~0ULL) << "kept from run to run";
  EXPECT_EQ(service.state("org.third"), 0U);

  std::string heard;
  const auto observe = [&](const char* name) {
    const auto observer = std::shared_ptr<void>(&heard, [](void*) {});
    center.addObserver(
        observer,
        [](NotificationCenter*, void* text, const std::string& posted, const void*, const void*) {
          *static_cast<std::string*>(text) += posted + " ";
        },
        name, NotificationSuspension::DeliverImmediately);
    return observer;
  };
  const auto posted = [&] {
    heard.clear();
    for (const char* name : {"org.first", "org.second", "org.third"}) service.post(name);
    device.executor->drain();
    return heard;
  };
  const auto one = observe("org.first");
  const auto other = std::make_shared<int>();
  center.addObserver(
      one, [](NotificationCenter*, void* text, auto&, auto*, auto*) { *static_cast<std::string*>(text) += "also "; },
      "org.second", NotificationSuspension::Drop);
  EXPECT_EQ(posted(), "org.first also ");
  center.removeObserver(other, "org.first");  // another observer
  center.removeObserver(one, "org.third");    // another name
  EXPECT_EQ(posted(), "org.first also ");
  center.removeObserver(one, "org.second");
  EXPECT_EQ(posted(), "org.first ");
}

// --- the home screen ------------------------------------------------------------------------------------------------

TEST(HomeScreen, WhatIsNoIdentifierHasNoPlace) {
  RegistryDevice device;
  std::optional<Error> error;
  ASSERT_TRUE(device.homeScreen->setLayout(
      plist(R"([["", "org.b", 5, {"iconLists": "org.x"}, {"iconLists": {"a": "org.y"}}, {"iconLists": [["org.a"]]},
                 "org.b"], true])"),
      nullptr));
  EXPECT_EQ(homeScreenStatus(*device.store).description(), "[org.b, org.a]");
  for (const char* layout : {R"({"iconLists": []})", R"("org.a")"}) {
    EXPECT_FALSE(device.homeScreen->setLayout(plist(layout), &error));
    EXPECT_EQ(error.value_or(Error("", 0)).code(), kDeviceBadSeed);
  }
}

TEST(HomeScreen, AnUpdateKeepsItsPlace) {
  RegistryDevice device;
  const char* one = R"([{"identifier": "org.z"}])";
  seed(device, one, "[]");
  seed(device, R"([{"identifier": "org.a"}])", R"([{"identifier": "org.p"}])");
  seed(device, one, one);  // again, and its placeholder
  seed(device, R"([{"identifier": "org.p"}])", "[]");
  EXPECT_EQ(homeScreenStatus(*device.store).description(), "[org.z, org.p, org.a]");
}

// --- icons ----------------------------------------------------------------------------------------------------------

TEST(Icons, OneWholePictureMakesAFile) {
  RegistryDevice device;
  EmbeddedIconServices icons(*device.files);
  const Image good{.width = 2, .height = 1, .pixels = Bytes(8, 100)};
  const std::pair<const char*, std::vector<Image>> cases[] = {
      {"none", {}},
      {"two", {good, good}},
      {"no width", {{.width = 0, .height = 1, .pixels = {}}}},
      {"no height", {{.width = 1, .height = 0, .pixels = {}}}},
      {"too few pixels", {{.width = 2, .height = 2, .pixels = Bytes(8)}}},
      {"too many pixels", {{.width = 1, .height = 1, .pixels = Bytes(8)}}},
      {"good", {good}}};
  for (const auto& [title, images] : cases) {
    Bytes buffer{1, 2, 3};
    const auto destination = icons.makePNGDestination(buffer);
    for (const Image& image : images) destination->addImage(image);
    const bool isGood = title == std::string("good");
    EXPECT_EQ(destination->finalize(), isGood) << title;
    const auto read = decodePNG(buffer);
    EXPECT_EQ(read.has_value(), isGood) << title;
    if (!isGood) {
      EXPECT_EQ(buffer, (Bytes{1, 2, 3})) << title;
    } else {
      EXPECT_EQ(read->pixels, good.pixels);
    }
  }
}

TEST(Icons, APictureOfAnyColourTypeIsRead) {
  // One pixel each: with a palette, and with colours but no opacity.
  for (const std::string hex : {"89504e470d0a1a0a0000000d494844520000000100000001080300000028cb34bb00000003504c54450908"
                                "07fe1619fe0000000a49444154789c636000000002000148afa4710000000049454e44ae426082",
                                "89504e470d0a1a0a0000000d4948445200000001000000010802000000907753de0000000c49444154789c"
                                "63e0e4600700003600196eb52a2a0000000049454e44ae426082"}) {
    Bytes file;
    for (std::size_t at = 0; at < hex.size(); at += 2) {
      file.push_back(static_cast<std::uint8_t>(std::stoi(hex.substr(at, 2), nullptr, 16)));
    }
    const auto image = decodePNG(file);
    ASSERT_TRUE(image);
    EXPECT_EQ(image->pixels, (Bytes{9, 8, 7, 255}));
  }
}

TEST(Icons, ABundleIsADirectoryAndItsInformationADictionary) {
  RegistryDevice device;
  EmbeddedIconServices icons(*device.files);
  const FileURL url = *FileURL::fileURLWithPath("/var/mobile/Media/a", true);
  put(device, "/var/mobile/Media/a", "a file");
  EXPECT_FALSE(icons.bundleWithURL(url));
  device.files->removeItem("/var/mobile/Media/a", nullptr);
  for (const char* content : {"<plist><array/></plist>", "<plist>", "<plist><string>x</string></plist>"}) {
    put(device, "/var/mobile/Media/a/Info.plist", content);
    EXPECT_EQ(icons.bundleWithURL(url)->infoDictionary, PropertyList::dictionary()) << content;
  }
  // Of more pictures than a bundle can have the first 64 are looked at, and none is higher than 4096 pixels.
  const auto picture = [&](std::uint32_t width, std::uint32_t height, std::uint8_t red) {
    Bytes buffer;
    const auto destination = icons.makePNGDestination(buffer);
    Image image{.width = width, .height = height, .pixels = Bytes(4ULL * width * height, 255)};
    for (std::size_t at = 0; at < image.pixels.size(); at += 4) image.pixels[at] = red;
    destination->addImage(image);
    EXPECT_TRUE(destination->finalize());
    return buffer;
  };
  EXPECT_TRUE(decodePNG(picture(1, 4096, 1)));
  EXPECT_FALSE(decodePNG(picture(1, 4097, 1)));
  PropertyList names = PropertyList::array();
  for (std::uint32_t i = 0; i < 66; ++i) {
    const Bytes bytes = picture(i == 0 ? 4097 : i, 1, static_cast<std::uint8_t>(i));
    put(device, "/var/mobile/Media/a/" + std::to_string(i), {bytes.begin(), bytes.end()});
    names.append(std::to_string(i));
  }
  const auto icon = icons.GlintCreateDeviceAppropriateHomeScreenIconImageFromBundle(
      {url, PropertyList::dictionary({{"TefBundleIconFiles", names}})});
  ASSERT_TRUE(icon);
  EXPECT_EQ(icon->pixels[(60 * 120 + 60) * 4], 64) << "what cannot be read is not counted";
}

// --- the registry ---------------------------------------------------------------------------------------------------

TEST(Registry, ARestoredPlaceholderThatStandsAloneIsAnApplication) {
  RegistryDevice device;
  seed(device, R"([{"identifier": "org.both"}])", R"([{"identifier": "org.both", "installType": 2},
       {"identifier": "org.0"}, {"identifier": "org.1", "installType": 1}, {"identifier": "org.2", "installType": 2},
       {"identifier": "org.4", "installType": 4}, {"identifier": "org.7", "installType": 7},
       {"identifier": "org.8", "installType": 8}])");
  std::string walked;
  device.registry->enumerateBundlesOfType(kPellumBundleTypeApplication, [&](const auto& record, bool&) {
    walked += record.bundleIdentifier + (record.isPlaceholder() ? "* " : " ");
  });
  EXPECT_EQ(walked, "org.2* org.7* org.8* org.both ");
}

TEST(Registry, RefusesIdentifiersThatNameNoFile) {
  RegistryDevice device;
  const auto before = device.containers();
  for (const char* bundleID : {"..", "a/b", ""}) {
    PlaceholderDescription placeholder;
    placeholder.bundleID = bundleID;
    InstalledApplication application;
    application.bundleID = bundleID;
    std::optional<Error> error;
    EXPECT_FALSE(device.registry->installPlaceholder(placeholder, &error));
    EXPECT_EQ(std::exchange(error, std::nullopt).value_or(Error("", 0)).code(), kRegistryBadIdentifier);
    EXPECT_FALSE(device.registry->commitInstall(application, &error));
    EXPECT_EQ(error.value_or(Error("", 0)).code(), kRegistryBadIdentifier);
  }
  EXPECT_EQ(device.containers(), before);
}

TEST(Registry, WhatIsReplacedOrRemovedIsGoneFromTheDiskAtOnce) {
  RegistryDevice device;
  const std::string one = R"([{"identifier": "org.a"}])";
  seed(device, one, one);
  const auto before = device.containers();
  seed(device, one, one);
  EXPECT_EQ(device.containers().size(), 2U);
  EXPECT_NE(device.containers(), before);
  // A seeded application comes beside the placeholder, also after a restart; an installed one takes its place.
  device.restart();
  EXPECT_TRUE(device.registry->applicationProxyForIdentifier("org.a", true));
  InstalledApplication update;
  update.bundleID = "org.a";
  update.containerPath = std::string(kContainersDirectory) + "/99";
  put(device, update.containerPath + "/A.app/x", "new");
  ASSERT_TRUE(device.registry->commitInstall(update, nullptr));
  EXPECT_EQ(device.containers(), std::vector<std::string>{"99"});
  seed(device, "[]", one);
  EXPECT_TRUE(device.registry->removePlaceholder("org.a", nullptr));
  EXPECT_EQ(device.containers(), std::vector<std::string>{"99"});
  EXPECT_TRUE(device.registry->removeApplication("org.a", nullptr));
  EXPECT_TRUE(device.containers().empty());
  seed(device, one, one);
  EXPECT_TRUE(device.registry->removeApplication("org.a", nullptr));
  EXPECT_TRUE(device.containers().empty()) << "the placeholder goes with its application";
}

// A removal whose record stays has not happened, whoever asks, and says so.
TEST(Registry, WhatCannotBeForgottenStays) {
  using Operation = std::function<bool(RegistryDevice&, std::optional<Error>*)>;
  const std::pair<const char*, Operation> operations[] = {
      {"removePlaceholder",
       [](auto& device, auto* error) { return device.registry->removePlaceholder("org.a", error); }},
      {"removeApplication",
       [](auto& device, auto* error) { return device.registry->removeApplication("org.b", error); }},
      {"uninstall placeholder",
       [](auto& device, auto* error) { return device.registry->uninstallApplication("org.a", error); }},
      {"uninstall application",
       [](auto& device, auto* error) { return device.registry->uninstallApplication("org.b", error); }},
      {"installPlaceholder", [](auto& device, auto* error) {
         PlaceholderDescription placeholder;
         placeholder.bundleID = "org.a";
         placeholder.name = "new";
         return device.registry->installPlaceholder(placeholder, error);
       }}};
  for (const auto& [title, operation] : operations) {
    SCOPED_TRACE(title);
    RegistryDevice device;
    seed(device, R"([{"identifier": "org.b"}])", R"([{"identifier": "org.a", "name": "old"}])");
    const auto before = device.containers();
    bool isDone = false;
    for (int call = 1; !isDone; ++call) {
      ASSERT_LT(call, 200);
      device.disk.failingCall = call;
      std::optional<Error> error;
      isDone = operation(device, &error);
      ASSERT_EQ(isDone, !error) << call;
      if (isDone) break;
      EXPECT_EQ(error->code(), kRegistryDisk) << call;
      EXPECT_TRUE(error->underlyingError()) << call;
      EXPECT_EQ(device.containers(), before) << call;
      EXPECT_EQ(device.registry->applicationProxyForIdentifier("org.a", true)->localizedName, "old") << call;
      EXPECT_TRUE(device.registry->applicationIsInstalled("org.b")) << call;
    }
  }
}

// What a record names is removed with it, so a record that names anything but a container is not believed.
TEST(Registry, ARecordNamesAContainerAndNothingElse) {
  const std::string containers(kContainersDirectory);
  const std::string placeholders(kPlaceholdersDirectory);
  const std::pair<std::string, std::string> cases[] = {
      {containers + "/5", placeholders + "/5"},   {containers, placeholders},
      {containers + "/", placeholders + "/"},     {containers + "x5", placeholders + "x5"},
      {containers + "/..", placeholders + "/.."}, {containers + "/5/6", placeholders + "/5/6"},
      {"/var/mobile/Media", "/var/mobile/Media"}, {"", ""}};
  for (const auto& [application, placeholder] : cases) {
    SCOPED_TRACE(application);
    RegistryDevice device;
    put(device, "/var/mobile/Media/photo", "years");
    for (const auto& [name, path] :
         {std::pair("applications/org.a", application), std::pair("placeholders/org.b", placeholder)}) {
      device.store->save(name, PropertyList::dictionary({{"container", path}, {"name", "A"}}), nullptr);
    }
    device.restart();
    const bool isGood = application.ends_with("s/5");
    EXPECT_EQ(device.registry->applicationIsInstalled("org.a"), isGood);
    EXPECT_EQ(device.registry->applicationProxyForIdentifier("org.b", true).has_value(), isGood);
    device.registry->removeApplication("org.a", nullptr);
    device.registry->uninstallApplication("org.b", nullptr);
    EXPECT_EQ(device.text("/var/mobile/Media/photo"), "years");
    EXPECT_TRUE(device.files->fileExists(placeholders));
  }
}

// With a damaged record a whole container may be that record's, and the next one must not get its name.
TEST(Registry, AContainerThatMayBeSomebodysKeepsItsName) {
  RegistryDevice device;
  put(device, std::string(kContainersDirectory) + "/500/A.app/x", "x");
  put(device, std::string(kContainersDirectory) + "/.501/A.app/x", "unfinished");
  put(device, std::string(kContainersDirectory) + "/other/A.app/x", "x");
  device.store->save("applications/org.a", "damaged", nullptr);
  device.restart();
  EXPECT_EQ(device.containers(), (std::vector<std::string>{"500", "other"}));
  EXPECT_EQ(device.registry->newContainerName(), "501");
}

TEST(Registry, ACancellationNamesItsApplicationEvenWithoutAPlaceholder) {
  struct Observer : PellumApplicationWorkspaceObserver {
    std::string heard;
    void applicationInstallsArePrioritized(const PellumApplicationProxies&, const PellumApplicationProxies&) override {}
    void applicationInstallsDidCancel(const PellumApplicationProxies& applications) override {
      for (const auto& one : applications) heard += one.applicationIdentifier + "=" + one.bundleIdentifier + " ";
    }
  };
  RegistryDevice device;
  const auto observer = std::make_shared<Observer>();
  device.registry->addObserver(observer);
  device.registry->installsDidCancel("org.gone");
  device.executor->drain();
  EXPECT_EQ(observer->heard, "org.gone=org.gone ");
}

// --- the whole device -----------------------------------------------------------------------------------------------

TEST(Device, AnEmptyDiskBecomesADeviceAndWhatIsNoNameDoesNot) {
  const test::TemporaryDirectory directory;
  const auto open = [](const std::string& name, ErrorOut error) {
    DeviceOptions options;
    options.directory = name;
    return Device::open(options, error) != nullptr;
  };
  for (const std::string& name : {std::string(), directory.path().string() + std::string("/x\0y", 4)}) {
    std::optional<Error> error;
    EXPECT_FALSE(open(name, &error));
    EXPECT_EQ(std::exchange(error, std::nullopt).value_or(Error("", 0)).code(), kDeviceUnusable);
    EXPECT_FALSE(Device::status(name, &error));
    EXPECT_EQ(error.value_or(Error("", 0)).code(), kDeviceUnusable);
  }
  EXPECT_TRUE(std::filesystem::is_empty(directory.path()));
  std::filesystem::create_directory(directory.path() / "lost+found");
  EXPECT_FALSE(Device::status(directory.path().string(), nullptr)) << "no device yet";
  EXPECT_TRUE(open(directory.path().string(), nullptr));
  EXPECT_TRUE(Device::status(directory.path().string(), nullptr));
}

TEST(RegistrySeed, EveryFieldIsShownAsItWasSeeded) {
  RegistryDevice device;
  seed(device,
       R"([{"identifier": "org.a", "version": "1.2", "name": "A", "type": "System", "size": 70000, "installState": 2,
            "installPhase": 1, "prioritized": false, "progress": false},
           {"identifier": "org.b", "files": {"d/e/x": 1000, "d/e/y": 2000, "d/z": 0}}])",
       R"([{"identifier": "org.p", "name": "P", "installType": 7, "version": "3", "launchProhibited": true,
            "type": "System", "installState": 1, "installPhase": 2, "prioritized": true, "progress": false},
           {"identifier": "org.q"}])");
  device.restart();
  const std::string installed = registryInstalledStatus(*device.store).description();
  EXPECT_EQ(installed.substr(0, installed.find(", {identifier = org.b")),
            "[{identifier = org.a, version = 1.2, name = A, type = System, size = 70000, container = "
            "var/mobile/Containers/5, installState = 2, installPhase = 1, prioritized = false, progress = false}");
  EXPECT_EQ(installed.find("version", installed.find("org.b")), std::string::npos);
  EXPECT_EQ(
      registryPlaceholdersStatus(*device.store).description(),
      "[{identifier = org.p, name = P, installType = 7, version = 3, launchProhibited = true, type = System, "
      "installState = 1, installPhase = 2, prioritized = true, progress = false}, {identifier = org.q, name = org.q, "
      "installType = 0, launchProhibited = false, type = User}]");
  const auto record = device.registry->applicationProxyForIdentifier("org.b", false);
  const std::string bundle = record->bundleURL->path();
  EXPECT_EQ(device.files->attributesOfItem(bundle + "/d/e/y", nullptr)->size, 2000U);
  EXPECT_EQ(record->diskUsage.staticUsage, device.files->treeSize(record->bundleContainerURL->path()));
  const auto info = parsePropertyList(*device.files->readFile(bundle + "/Info.plist", nullptr), nullptr);
  EXPECT_EQ(info->description(), "{TefBundleIdentifier = org.b}");
}

TEST(RegistrySeed, WhatASeedSaysOfAnInstallIsWhatTheRecordShows) {
  RegistryDevice device;
  seed(
      device,
      R"([{"identifier": "org.a"}, {"identifier": "org.b", "installState": 1}, {"identifier": "org.c", "installPhase": 2},
           {"identifier": "org.d", "prioritized": true}, {"identifier": "org.e", "installState": 1, "progress": false}])",
      "[]");
  std::string shown;
  device.registry->enumerateBundlesOfType(kPellumBundleTypeAll, [&](const auto& record, bool&) {
    const auto& progress = record.installProgressSync;
    shown += progress ? std::to_string(progress->installState) + std::to_string(progress->installPhase) + " " : "- ";
  });
  EXPECT_EQ(shown, "- 10 02 - - ");
}

TEST(RegistrySeed, WhatDoesNotFitIsRefused) {
  const std::pair<const char*, const char*> bad[] = {{R"({"files": {"x": -1}})", "files"},
                                                     {R"({"files": {"x": "1"}})", "files"},
                                                     {R"({"files": {"x": 1099511627777}})", "files"},
                                                     {R"({"files": {"Info.plist/x": 1}})", "files"},
                                                     {R"({"files": {"a/b": 1, "a": 1}})", "files"},
                                                     {R"({"files": []})", "files"},
                                                     {R"({"version": 1})", "version"},
                                                     {R"({"installState": -1})", "installState"},
                                                     {R"({"progress": "no"})", "progress"},
                                                     {R"({"name": true})", "name"}};
  for (const auto& [fields, key] : bad) {
    PropertyList entry = plist(fields);
    entry.set("identifier", "org.a");
    std::optional<Error> error;
    EXPECT_FALSE(checkInstalledSeed(PropertyList::array({entry}), &error)) << fields;
    ASSERT_TRUE(error) << fields;
    EXPECT_EQ(error->code(), kDeviceBadSeed);
    EXPECT_NE(error->text().find(std::string("(org.a): \"") + key), std::string::npos) << error->text();
  }
}

}  // namespace
}  // namespace appsync
