// Packages, good and bad, and what installing them leaves behind: on a disk that is full, after a crash, and otherwise.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <string>
#include <tuple>
#include <utility>
#include <vector>

#include "tests/support/registry_device.h"

namespace appsync {
namespace {

using test::RegistryDevice;

// --- archives, byte by byte -----------------------------------------------------------------------------------------

struct Entry {
  std::string name;
  std::string content;
  unsigned mode = S_IFREG | 0644;
  unsigned method = 0;
  unsigned flags = 0x800;
  std::optional<std::string> ownName = {};      // in the entry's own header
  std::optional<std::uint64_t> announced = {};  // unpacked size
  std::uint32_t wrongChecksum = 0;
};

// Numbers, the lowest byte first, each with its width.
void put(std::string& out, std::initializer_list<std::pair<int, std::uint64_t>> numbers) {
  for (const auto& [width, value] : numbers) {
    for (int at = 0; at < width; ++at) out += static_cast<char>(value >> (8 * at) & 0xFF);
  }
}

std::uint32_t checksum(const std::string& text) {
  std::uint32_t crc = 0xFFFFFFFF;
  for (const char byte : text) {
    crc ^= static_cast<unsigned char>(byte);
    for (int bit = 0; bit < 8; ++bit) crc = crc >> 1 ^ (0xEDB88320 & (0U - (crc & 1)));
  }
  return ~crc;
}

// What an entry's own header and the archive's directory have in common. Content packed by method 8 is one block that
// is stored as it is, with five bytes before it.
void putHeader(std::string& out, const Entry& entry, std::size_t nameLength) {
  const std::uint64_t size = entry.content.size();
  put(out, {{2, entry.flags}, {2, entry.method}, {4, 0x5C3F6000}, {4, checksum(entry.content) ^ entry.wrongChecksum}});
  put(out, {{4, size + (entry.method == 8 ? 5 : 0)}, {4, entry.announced.value_or(size)}, {2, nameLength}, {2, 0}});
}

Bytes archive(const std::vector<Entry>& entries, const std::string& comment = "") {
  std::string out;
  std::string directory;
  for (const Entry& entry : entries) {
    put(directory, {{4, 0x02014B50}, {2, 0x031E}, {2, 20}});
    putHeader(directory, entry, entry.name.size());
    put(directory, {{6, 0}, {4, std::uint64_t{entry.mode} << 16}, {4, out.size()}});
    directory += entry.name;
    const std::string ownName = entry.ownName.value_or(entry.name);
    put(out, {{4, 0x04034B50}, {2, 20}});
    putHeader(out, entry, ownName.size());
    out += ownName;
    if (entry.method == 8) put(out, {{1, 1}, {2, entry.content.size()}, {2, ~entry.content.size()}});
    out += entry.content;
  }
  const std::size_t start = out.size();
  out += directory;
  put(out, {{4, 0x06054B50}, {4, 0}, {2, entries.size()}, {2, entries.size()}, {4, directory.size()}, {4, start}});
  put(out, {{2, comment.size()}});
  out += comment;
  return {out.begin(), out.end()};
}

// Which numbers of an archive stand in its extra fields and its second end, and what is wrong with them there.
struct Large {
  bool unpacked = false;
  bool packed = false;
  bool offset = false;
  std::string before = {};        // other extra fields
  std::uint64_t fieldLength = 0;  // other than the right one
  std::pair<std::size_t, std::uint64_t> change = {
      0, 0};  // of the 76 bytes of the second end and its locator: place, value
};

// One that could hold more than 4 GiB, with a directory and two ends.
Bytes largeArchive(const std::vector<Entry>& entries, const Large& large) {
  constexpr std::uint64_t kElsewhere = 0xFFFFFFFF;
  std::string out;
  std::string directory;
  for (const Entry& entry : entries) {
    const std::uint64_t size = entry.content.size();
    std::string extra;
    if (large.unpacked) put(extra, {{8, size}});
    if (large.packed) put(extra, {{8, size}});
    if (large.offset) put(extra, {{8, out.size()}});
    std::string fields = large.before;
    if (!extra.empty()) put(fields, {{2, 1}, {2, large.fieldLength != 0 ? large.fieldLength : extra.size()}});
    fields += extra;
    put(directory, {{4, 0x02014B50}, {2, 0x031E}, {2, 45}, {2, 0x800}, {2, 0}, {4, 0}, {4, checksum(entry.content)}});
    put(directory, {{4, large.packed ? kElsewhere : size}, {4, large.unpacked ? kElsewhere : size}});
    put(directory, {{2, entry.name.size()}, {2, fields.size()}, {6, 0}, {4, std::uint64_t{entry.mode} << 16}});
    put(directory, {{4, large.offset ? kElsewhere : out.size()}});
    directory += entry.name + fields;
    put(out, {{4, 0x04034B50}, {2, 45}, {2, 0x800}, {2, 0}, {4, 0}, {4, checksum(entry.content)}, {4, size}});
    put(out, {{4, size}, {2, entry.name.size()}, {2, 0}});
    out += entry.name + entry.content;
  }
  const std::size_t start = out.size();
  const std::size_t end = start + directory.size();
  std::string ends;
  put(ends, {{4, 0x06064B50}, {8, 44}, {2, 45}, {2, 45}, {4, 0}, {4, 0}, {8, entries.size()}, {8, entries.size()}});
  put(ends, {{8, directory.size()}, {8, start}, {4, 0x07064B50}, {4, 0}, {8, end}, {4, 1}});
  if (large.change.first != 0) ends[large.change.first] = static_cast<char>(large.change.second);
  out += directory + ends;
  put(out, {{4, 0x06054B50}, {4, 0}, {2, 0xFFFF}, {2, 0xFFFF}, {4, kElsewhere}, {4, kElsewhere}, {2, 0}});
  return {out.begin(), out.end()};
}

std::string infoPlist(const std::string& bundleID, const std::string& version) {
  return "<plist><dict><key>TefBundleIdentifier</key><string>" + bundleID +
         "</string><key>TefBundleVersion</key><string>" + version +
         "</string><key>TefBundleDisplayName</key><string>Ä pp</string></dict></plist>";
}

// The package of "org.a", with what else it is to hold.
std::vector<Entry> entriesOf(const std::string& version, std::vector<Entry> more = {}) {
  std::vector<Entry> entries{{"Payload/", "", S_IFDIR | 0755},
                             {"Payload/A.app/", "", S_IFDIR | 0755},
                             {"Payload/A.app/Info.plist", infoPlist("org.a", version)}};
  entries.insert(entries.end(), more.begin(), more.end());
  return entries;
}

Bytes package(const std::string& version, std::vector<Entry> more = {}) {
  return archive(entriesOf(version, std::move(more)));
}

constexpr unsigned kLink = S_IFLNK | 0777;

// --- good ones ------------------------------------------------------------------------------------------------------

TEST(Package, installs) {
  RegistryDevice device;
  device.options.setTarvoMetadata(KilnStoreMetadata::initWithDictionary(PropertyList::dictionary({{"title", "A"}})));
  const Bytes bytes = package("1", {{"Extra.plist", "beside the bundle"},
                                    {"Payload/A.app/run", std::string(40000, 'x'), S_IFREG | 06755, 8},
                                    {"Payload/A.app/カ/ü/deep.txt", "deep"},
                                    {"Payload/A.app/カ/", "", S_IFDIR | 0700},
                                    {"Payload/A.app/カ/up", "../run", kLink},
                                    {"Payload/A.app/to", "カ/ü", kLink}});
  device.files->writeFile("/var/mobile/Media/p.ipa", bytes, nullptr);
  std::vector<double> progress;
  std::optional<Error> error;
  ASSERT_TRUE(device.installer->install(
      "org.a", "/var/mobile/Media/p.ipa", device.options, [&](double fraction) { progress.push_back(fraction); }, {},
      &error))
      << error->description();

  const auto record = device.registry->applicationProxyForIdentifier("org.a", false);
  ASSERT_TRUE(record);
  EXPECT_EQ(record->localizedName, "Ä pp");
  EXPECT_EQ(record->bundleVersion, "1");
  const std::string bundle = record->bundleURL->path();
  EXPECT_EQ(bundle, record->bundleContainerURL->path() + "/A.app");
  EXPECT_EQ(device.text(bundle + "/カ/ü/deep.txt"), "deep");
  EXPECT_EQ(std::filesystem::read_symlink(device.files->hostPath(bundle + "/カ/up")), "../run");
  EXPECT_EQ(record->diskUsage.staticUsage, device.files->treeSize(record->bundleContainerURL->path()));
  EXPECT_TRUE(device.files->fileExists(record->bundleContainerURL->path() + "/TarvoMetadata.plist"));
  struct stat status {};
  ASSERT_EQ(::stat(device.files->hostPath(bundle + "/run").c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0755U);
  EXPECT_EQ(status.st_size, 40000);
  EXPECT_TRUE(std::is_sorted(progress.begin(), progress.end()));
  EXPECT_EQ(progress.back(), 1.0);
  EXPECT_TRUE(device.files->fileExists("/var/mobile/Media/p.ipa"));
}

// --- bad ones -------------------------------------------------------------------------------------------------------

struct BadPackage {
  const char* name;
  std::int64_t code;
  Bytes bytes;
};

Bytes joined(std::string before, const Bytes& bytes, const std::string& after = "") {
  before.append(bytes.begin(), bytes.end());
  before += after;
  return {before.begin(), before.end()};
}

Bytes changed(Bytes bytes, std::size_t fromEnd, std::uint8_t value) {
  bytes[bytes.size() - fromEnd] = value;
  return bytes;
}

std::vector<BadPackage> badPackages() {
  const std::string app = "Payload/A.app/";
  const std::string x = app + "x";
  const std::string info = app + "Info.plist";
  const std::string good = infoPlist("org.a", "2");
  const auto plus = [](std::vector<Entry> more) { return package("2", std::move(more)); };
  const auto packed = [&](std::size_t size, std::uint64_t announced) {
    return Entry{
        .name = x + std::to_string(size), .content = std::string(size, 'x'), .method = 8, .announced = announced};
  };
  std::vector<BadPackage> all{
      {"empty file", kInstallerNotAPackage, {}},
      {"no archive", kInstallerNotAPackage, Bytes(1000, 'x')},
      {"junk before the archive", kInstallerNotAPackage, joined("#!/bin/sh\n", plus({}))},
      {"bytes behind the archive", kInstallerDamaged, joined("", plus({}), "more")},
      {"an end in the comment", kInstallerDamaged, archive(entriesOf("2"), "PK\5\6" + std::string(25, '0'))},
      {"archive without entries", kInstallerNotAPackage, archive({})},
      {"one entry more announced", kInstallerDamaged, changed(changed(plus({}), 12, 4), 14, 4)},
      {"one entry less announced", kInstallerDamaged, changed(changed(plus({}), 12, 2), 14, 2)},
      {"no bundle", kInstallerNotAPackage, archive({{"Payload/x.txt", "x"}})},
      {"bundle with no name", kInstallerNotAPackage, archive({{"Payload/.app/Info.plist", good}})},
      {"bundle that is a file", kInstallerRefused, archive({{"Payload/A.app", "x"}})},
      {"two bundles", kInstallerNotAPackage, plus({{"Payload/B.app/Info.plist", good}})},
      {"no Info.plist", kInstallerNotAPackage, archive({{x, "x"}})},
      {"Info.plist further down", kInstallerNotAPackage, archive({{app + "B/Info.plist", good}})},
      {"Info.plist that is a link", kInstallerNotAPackage, archive({{app + "I", good}, {info, "I", kLink}})},
      {"Info.plist that is none", kInstallerNotAPackage, archive({{info, "<plist>"}})},
      {"Info.plist of another kind", kInstallerNotAPackage, archive({{info, "<plist><array/></plist>"}})},
      {"no identifier", kInstallerWrongApplication, archive({{info, "<plist><dict/></plist>"}})},
      {"another application", kInstallerWrongApplication, archive({{info, infoPlist("org.b", "2")}})},
      {"wrong checksum", kInstallerDamaged, plus({{.name = x, .content = "x", .wrongChecksum = 1}})},
      {"larger than announced", kInstallerDamaged, plus({packed(1000, 10)})},
      {"smaller than announced", kInstallerDamaged, plus({packed(3, 10)})},
      {"unknown method", kInstallerRefused, plus({{.name = x, .content = "x", .method = 14}})},
      {"encrypted", kInstallerEncrypted, plus({{.name = x, .content = "x", .flags = 0x801}})},
      {"two names for one entry", kInstallerDamaged, plus({{.name = x, .content = "x", .ownName = app + "y"}})},
      {"too large in total", kInstallerTooLarge, plus(std::vector<Entry>(5, packed(1, 0xFFFFFFF0)))},
      {"suspicious ratio", kInstallerTooLarge, plus({packed(1, 65U << 20)})},
      {"same name twice", kInstallerRefused, plus({{x, "1"}, {x, "2"}})},
      {"same directory twice", kInstallerRefused, plus({{app, "", S_IFDIR | 0755}})},
      {"file in place of a directory", kInstallerRefused, plus({{x + "/y", "1"}, {x, "2"}})},
      {"directory below a file", kInstallerRefused, plus({{x, "1"}, {x + "/y", "2"}})},
      {"written through a link", kInstallerRefused, plus({{app + "d/y", ""}, {x, "d", kLink}, {x + "/z", "2"}})},
      {"device file", kInstallerRefused, plus({{x, "", S_IFCHR | 0666}})},
      {"link two up", kInstallerRefused, plus({{app + "d/l", "../../x", kLink}})},
      {"link out of another one", kInstallerRefused,
       plus({{app + "d/e", "..", kLink}, {app + "d/l", "e/../x", kLink}})},
  };
  std::string deep = app;
  for (int level = 0; level < 70; ++level) deep += "d/";
  for (const std::string& name : {std::string("../x"), std::string("/x"), app + "../../x", app + "./x", app + "/x",
                                  app + std::string("z\0z", 3), app + "\xFF", app + std::string(256, 'n'), deep}) {
    all.push_back({"name out of order", kInstallerRefused, plus({{name, "x"}})});
  }
  for (const char* target : {"/etc/passwd", "..", "../x", "d/../x", "d/../../x", "", "./../x"}) {
    all.push_back({"link that leads out", kInstallerRefused, plus({{x, target, kLink}})});
  }
  return all;
}

// Fails if the install of `bytes` is not refused, or leaves anything behind.
void expectRefused(RegistryDevice& device, const Bytes& bytes, std::int64_t code) {
  const std::vector<std::string> before = device.containers();
  std::optional<Error> error;
  EXPECT_FALSE(device.install("org.a", bytes, &error));
  ASSERT_TRUE(error);
  EXPECT_EQ(error->domain(), kInstallerErrorDomain);
  EXPECT_EQ(error->code(), code) << error->description();
  EXPECT_NE(error->text().find("/var/mobile/Media/p.ipa"), std::string::npos) << error->text();
  EXPECT_EQ(device.containers(), before);
  EXPECT_EQ(device.version("org.a"), "1");
  EXPECT_FALSE(std::filesystem::exists(device.root / "x"));
}

TEST(Package, badOnesChangeNothing) {
  RegistryDevice device;
  ASSERT_TRUE(device.install("org.a", package("1")));
  for (const BadPackage& bad : badPackages()) {
    SCOPED_TRACE(bad.name);
    expectRefused(device, bad.bytes, bad.code);
  }
  std::optional<Error> error;
  EXPECT_FALSE(device.install("../org.a", package("2"), &error));
  EXPECT_EQ(error->code(), kInstallerBadIdentifier);
  EXPECT_FALSE(device.installer->install("org.a", "/var/mobile/Media/none.ipa", {}, {}, {}, &error));
  EXPECT_EQ(error->code(), kInstallerNoPackage);

  for (const auto& [limit, value] : std::vector<std::pair<std::uint64_t PackageLimits::*, std::uint64_t>>{
           {&PackageLimits::entries, 3}, {&PackageLimits::directorySize, 200}, {&PackageLimits::unpackedSize, 100}}) {
    device.limits = {};
    device.limits.*limit = value;
    device.restart();
    expectRefused(device, package("2", {{"Payload/A.app/x", "x"}}), kInstallerTooLarge);
  }
}

TEST(Package, cutOffAnywhereIsRefused) {
  RegistryDevice device;
  ASSERT_TRUE(device.install("org.a", package("1")));
  const Bytes whole = package("2", {{"Payload/A.app/x", std::string(300, 'x'), S_IFREG | 0644, 8}});
  for (std::size_t size = 0; size < whole.size(); size += 3) {
    SCOPED_TRACE(size);
    const Bytes cut(whole.begin(), whole.begin() + static_cast<std::ptrdiff_t>(size));
    expectRefused(device, cut, size < 4 ? kInstallerNotAPackage : kInstallerDamaged);
  }
  EXPECT_TRUE(device.install("org.a", whole));
}

TEST(Package, cancellingLeavesTheOldVersion) {
  RegistryDevice device;
  const Bytes bytes = package("2", {{"Payload/A.app/x", std::string(1 << 20, 'x')}});
  ASSERT_TRUE(device.install("org.a", package("1")));
  device.files->writeFile("/var/mobile/Media/p.ipa", bytes, nullptr);
  int asked = 0;
  for (int answers = 0; answers < 100; ++answers) {
    asked = 0;
    std::optional<Error> error;
    const auto cancelled = [&] { return ++asked > answers; };
    if (device.installer->install("org.a", "/var/mobile/Media/p.ipa", {}, {}, cancelled, &error)) break;
    EXPECT_EQ(error->code(), kInstallerCancelled);
    EXPECT_EQ(device.version("org.a"), "1");
    EXPECT_EQ(device.containers().size(), 1U);
  }
  EXPECT_EQ(device.version("org.a"), "2");
  EXPECT_GT(asked, 4);
}

TEST(Package, largeNumbersAreReadWhereTheyStand) {
  const std::string other("\x55\x54\5\0\1abcd", 9);
  const std::tuple<const char*, Large, bool> cases[] = {
      {"plain", {}, true},
      {"unpacked", {.unpacked = true}, true},
      {"packed", {.packed = true}, true},
      {"offset", {.offset = true}, true},
      {"all", {.unpacked = true, .packed = true, .offset = true}, true},
      {"behind another field", {.unpacked = true, .offset = true, .before = other}, true},
      {"another field alone", {.before = other}, true},
      {"another field that is cut off", {.before = other.substr(0, 7)}, false},
      {"too short for the offset", {.unpacked = true, .offset = true, .fieldLength = 8}, false},
      {"too short for the size", {.packed = true, .fieldLength = 4}, false},
      {"too long", {.unpacked = true, .fieldLength = 9}, false},
      {"another mark", {.change = {1, 'x'}}, false},
      {"another disk", {.change = {16, 1}}, false},
      {"the directory on another disk", {.change = {20, 1}}, false},
      {"fewer entries on this disk", {.change = {24, 1}}, false},
      {"fewer entries", {.change = {32, 1}}, false},
      {"a smaller directory", {.change = {40, 1}}, false},
      {"another start", {.change = {48, 1}}, false},
      {"the end on another disk", {.change = {56 + 4, 1}}, false},
      {"the end behind the file", {.change = {56 + 12, 1}}, false},
      {"two disks", {.change = {56 + 16, 2}}, false}};
  for (const auto& [title, large, isGood] : cases) {
    SCOPED_TRACE(title);
    RegistryDevice device;
    ASSERT_TRUE(device.install("org.a", package("1")));
    std::optional<Error> error;
    const Bytes bytes = largeArchive(entriesOf("2", {{"Payload/A.app/x", "content"}}), large);
    EXPECT_EQ(device.install("org.a", bytes, &error), isGood) << (error ? error->description() : "");
    EXPECT_EQ(device.version("org.a"), isGood ? "2" : "1");
    if (!isGood) {
      EXPECT_EQ(error.value_or(Error("", 0)).code(), kInstallerDamaged) << error->description();
    } else {
      const auto bundle = device.registry->applicationProxyForIdentifier("org.a", false)->bundleURL->path();
      EXPECT_EQ(device.text(bundle + "/x"), "content");
    }
  }
}

// What decides at the very end still decides: all has been unpacked by then, and nothing is in place.
TEST(Package, aCancellationAfterTheLastByteCounts) {
  RegistryDevice device;
  ASSERT_TRUE(device.install("org.a", package("1")));
  device.files->writeFile("/var/mobile/Media/p.ipa", package("2", {{"Payload/A.app/x", "x"}}), nullptr);
  std::ptrdiff_t ends = 0;
  const auto install = [&](std::ptrdiff_t patience, ErrorOut error) {
    ends = 0;
    return device.installer->install(
        "org.a", "/var/mobile/Media/p.ipa", {}, [&](double fraction) { ends += fraction == 1.0 ? 1 : 0; },
        [&] { return ends >= patience; }, error);
  };
  ASSERT_TRUE(install(100, nullptr));
  ASSERT_TRUE(device.install("org.a", package("1")));
  device.files->writeFile("/var/mobile/Media/p.ipa", package("2", {{"Payload/A.app/x", "x"}}), nullptr);
  std::optional<Error> error;
  const std::ptrdiff_t last = ends;
  EXPECT_FALSE(install(last, &error));
  EXPECT_EQ(ends, last);
  EXPECT_EQ(error.value_or(Error("", 0)).code(), kInstallerCancelled);
  EXPECT_EQ(device.version("org.a"), "1");
  EXPECT_EQ(device.containers().size(), 1U);
}

TEST(Package, whatIsNotExecutableOrBesideTheBundleIsNotMadeSo) {
  RegistryDevice device;
  ASSERT_TRUE(device.install("org.a", package("1", {{"Payload/A.app/plain", "x", S_IFREG | 0666},
                                                    {"Payload/note.txt", "beside"},
                                                    {"Payload/.app/x", "no bundle"},
                                                    {"Payload/A.app/empty", ""}})));
  const auto bundle = device.registry->applicationProxyForIdentifier("org.a", false)->bundleURL->path();
  struct stat status {};
  ASSERT_EQ(::stat(device.files->hostPath(bundle + "/plain").c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0644U);
  EXPECT_EQ(device.text(bundle + "/empty"), "");
  EXPECT_EQ(device.files->contentsOfDirectory(bundle, nullptr)->size(), 3U);
}

// --- the disk -------------------------------------------------------------------------------------------------------

// Old or new, whole, with the placeholder exactly beside the old one, and nothing else.
void expectOldOrNew(RegistryDevice& device, bool installed) {
  const std::string version = device.version("org.a").value_or("(none)");
  EXPECT_TRUE(!installed || version == "2");
  const auto record = device.registry->applicationProxyForIdentifier("org.a", false);
  ASSERT_TRUE(record);
  EXPECT_EQ(device.text(record->bundleURL->path() + "/x"), version == "1" ? "old" : "new");
  const auto placeholder = device.registry->applicationProxyForIdentifier("org.a", true);
  EXPECT_EQ(placeholder.has_value(), version == "1");
  EXPECT_TRUE(!placeholder || device.files->fileExists(placeholder->bundleURL->path() + "/Info.plist"));
  EXPECT_EQ(device.containers().size(), version == "1" ? 2U : 1U);
}

TEST(Package, everyFailureOfTheDiskLeavesOldOrNewWhole) {
  int failures = 0;
  for (const bool isCrash : {false, true}) {
    bool reachedTheEnd = false;
    for (int call = 1; !reachedTheEnd; ++call) {
      SCOPED_TRACE((isCrash ? "crash at " : "failure at ") + std::to_string(call));
      RegistryDevice device;
      ASSERT_TRUE(device.install("org.a", package("1", {{"Payload/A.app/x", "old"}})));
      PlaceholderDescription placeholder;
      placeholder.bundleID = "org.a";
      ASSERT_TRUE(device.registry->installPlaceholder(placeholder, nullptr));
      device.files->writeFile("/var/mobile/Media/p.ipa", package("2", {{"Payload/A.app/x", "new"}}), nullptr);

      device.disk.failingCall = call;
      device.disk.forGood = isCrash;
      std::optional<Error> error;
      const bool installed =
          device.installer->install("org.a", "/var/mobile/Media/p.ipa", device.options, {}, {}, &error);
      reachedTheEnd = device.disk.failingCall > 1 || (device.disk.failingCall == 1 && !isCrash);
      ASSERT_NE(installed, error.has_value());
      EXPECT_TRUE(!error || error->description().find("No space left") != std::string::npos);
      EXPECT_TRUE(installed || isCrash || device.containers().size() == 2);
      failures += installed ? 0 : 1;
      device.restart();
      expectOldOrNew(device, installed);
    }
  }
  EXPECT_GT(failures, 20);
}

// --- what was uninstalled -------------------------------------------------------------------------------------------

TEST(Installer, remembersWhatWasUninstalled) {
  RegistryDevice device;
  ASSERT_TRUE(device.install("org.a", package("1")));
  EXPECT_TRUE(device.installer->uninstall("org.none", nullptr));
  EXPECT_TRUE(device.installer->uninstall("org.a", nullptr));
  EXPECT_FALSE(device.registry->applicationIsInstalled("org.a"));
  EXPECT_TRUE(device.containers().empty());
  device.restart();
  EXPECT_EQ(device.installer->KilnLookupUninstalled()->count(), 1U);
  EXPECT_EQ(uninstalledStatus(*device.store), PropertyList::array({"org.a"}));

  ASSERT_TRUE(device.install("org.a", package("1")));
  EXPECT_EQ(device.installer->KilnLookupUninstalled()->count(), 0U);
  EXPECT_TRUE(device.installer->remember({"org.a", "org.b", "org.c"}, nullptr));
  EXPECT_EQ(device.installer->KilnLookupUninstalled()->count(), 2U);  // what is installed is not uninstalled
  EXPECT_EQ(device.installer->KilnClearUninstalled({"org.b", "org.none"}), 0);
  EXPECT_EQ(uninstalledStatus(*device.store), PropertyList::array({"org.c"}));
  device.disk.failingCall = 1;
  EXPECT_NE(device.installer->KilnClearUninstalled({"org.c"}), 0);
  EXPECT_EQ(device.installer->KilnLookupUninstalled()->count(), 1U);
}

TEST(Installer, anUpdateKeepsTheTypeAndFillsAPlaceholdersPlace) {
  for (const bool hasPlaceholder : {true, false}) {
    RegistryDevice device;
    if (hasPlaceholder) {
      PlaceholderDescription placeholder;
      placeholder.bundleID = "org.a";
      placeholder.applicationType = "System";
      ASSERT_TRUE(device.registry->installPlaceholder(placeholder, nullptr));
    }
    for (const char* version : {"1", "2"}) {
      ASSERT_TRUE(device.install("org.a", package(version)));
      EXPECT_EQ(device.registry->applicationProxyForIdentifier("org.a", false)->applicationType,
                hasPlaceholder ? "System" : "User");
    }
  }
}

TEST(Installer, whatIsInstalledAgainIsNotRememberedAnyMore) {
  RegistryDevice device;
  ASSERT_TRUE(device.install("org.a", package("1")) && device.installer->uninstall("org.a", nullptr));
  ASSERT_TRUE(device.install("org.a", package("1")) && device.registry->removeApplication("org.a", nullptr));
  EXPECT_EQ(device.installer->KilnLookupUninstalled()->count(), 0U) << "it went by another way";
  device.disk.failingCall = 1;
  EXPECT_EQ(device.installer->KilnClearUninstalled({"org.a", "org.b"}), 0) << "nothing to forget, nothing to write";
  EXPECT_EQ(device.disk.failingCall, 1);
}

// Either it is remembered and gone, or it is there and not remembered, but for a flush that came to nothing.
TEST(Installer, aRemovalThatFailsHasNotHappened) {
  int failures = 0;
  std::size_t remembered = 0;
  bool isOver = false;
  for (int call = 1; !isOver; ++call) {
    ASSERT_LT(call, 100);
    SCOPED_TRACE(call);
    RegistryDevice device;
    ASSERT_TRUE(device.install("org.a", package("1")));
    device.disk.failingCall = call;
    std::optional<Error> error;
    const bool isRemoved = device.installer->uninstall("org.a", &error);
    isOver = device.disk.failingCall > 0;
    EXPECT_EQ(isRemoved, !error);
    EXPECT_NE(device.registry->applicationIsInstalled("org.a"), isRemoved);
    EXPECT_EQ(device.installer->KilnLookupUninstalled()->count(), isRemoved ? 1U : 0U);
    if (isRemoved) continue;
    ++failures;
    ASSERT_TRUE(device.registry->removeApplication("org.a", nullptr));
    remembered += uninstalledStatus(*device.store).count();
  }
  EXPECT_GT(failures, 4);
  EXPECT_EQ(remembered, 1U);
}

TEST(Installer, aListThatCannotBeReadIsNoEmptyList) {
  RegistryDevice device;
  ASSERT_TRUE(device.install("org.a", package("1")));
  device.files->ownFiles().createDirectory("/state/uninstalled.plist/x", true, {}, nullptr);
  EXPECT_FALSE(device.installer->KilnLookupUninstalled());
  EXPECT_NE(device.installer->KilnClearUninstalled({"org.b"}), 0);
  std::optional<Error> error;
  EXPECT_FALSE(device.installer->uninstall("org.a", &error));
  EXPECT_TRUE(error && device.registry->applicationIsInstalled("org.a"));
  EXPECT_EQ(uninstalledStatus(*device.store).count(), 0U);
  device.files->ownFiles().removeItem("/state/uninstalled.plist", nullptr);
  device.store->save("uninstalled", "no dictionary", nullptr);
  EXPECT_EQ(device.installer->KilnLookupUninstalled()->count(), 0U);

  const PropertyList good = PropertyList::array({"org.a", "org.b"});
  EXPECT_TRUE(checkUninstalledSeed(good, nullptr));
  for (const auto& [list, said] :
       {std::pair(PropertyList::array({"org.a", "a/b"}), "entry 2 must be a bundle identifier"),
        std::pair(PropertyList::array({true}), "entry 1 must be a bundle identifier"),
        std::pair(PropertyList("org.a"), "must be an array")}) {
    error.reset();
    EXPECT_FALSE(checkUninstalledSeed(list, &error));
    EXPECT_NE(error.value_or(Error("", 0)).text().find(said), std::string::npos) << error->text();
  }
}

}  // namespace
}  // namespace appsync
