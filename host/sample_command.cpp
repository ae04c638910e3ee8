// `dovel sample`: write a host directory, or a backup, with sample applications, the same bytes for the same seed.
#include <fcntl.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <filesystem>
#include <vector>

#include "embedded/disk.h"
#include "embedded/file_manager.h"
#include "embedded/icons.h"
#include "host/backup_directory.h"
#include "host/commands.h"
#include "host/package_writer.h"
#include "host/sample_icon.h"
#include "host/text.h"

namespace appsync {

namespace {

namespace fs = std::filesystem;

struct Theme {
  const char* word;  // of the identifier
  const char* name;  // for people
};

constexpr std::array kThemes{
    Theme{"notes", "Notes"},      Theme{"maps", "Karten & Wege"}, Theme{"camera", "カメラ"},
    Theme{"chess", "Шахматы"},    Theme{"reader", "ספרים"},       Theme{"weather", "Wetter ☀️"},
    Theme{"music", "Música"},     Theme{"garden", "花园 🌱"},      Theme{"radio", "راديو"},
    Theme{"ledger", "Λογιστικό"}, Theme{"tides", "Tides <3"},     Theme{"recipes", "Crème brûlée"},
};

// A generator of our own: the standard library's distributions may differ from one machine to the next.
class Dice {
 public:
  explicit Dice(std::uint64_t seed) : _state(seed) {}

  std::uint64_t next() {
    _state += 0x9E3779B97F4A7C15U;
    std::uint64_t mixed = _state;
    mixed = (mixed ^ (mixed >> 30U)) * 0xBF58476D1CE4E5B9U;
    mixed = (mixed ^ (mixed >> 27U)) * 0x94D049BB133111EBU;
    return mixed ^ (mixed >> 31U);
  }
  std::uint64_t below(std::uint64_t limit) { return next() % limit; }

 private:
  std::uint64_t _state;
};

struct SampleApplication {
  std::string identifier;
  std::string name;
  std::string version;
  std::string executable;  // file name
  std::uint64_t look = 0;  // chooses the icon
  std::uint64_t content = 0;
  std::int64_t itemID = 0;
};

// Which applications there are depends on their number alone; the seed chooses versions, content and looks.
std::vector<SampleApplication> makeApplications(std::uint32_t count, std::uint64_t seed) {
  Dice dice(seed);
  std::vector<SampleApplication> applications;
  for (std::uint32_t i = 0; i < count; ++i) {
    const Theme& theme = kThemes[i % kThemes.size()];
    const std::uint32_t round = i / static_cast<std::uint32_t>(kThemes.size());
    SampleApplication made;
    made.executable = theme.word;
    made.identifier = std::string("org.sample.") + theme.word;
    made.name = theme.name;
    if (round > 0) {
      made.identifier += std::to_string(round + 1);
      made.name += " " + std::to_string(round + 1);
    }
    made.version = std::to_string(1 + dice.below(9)) + "." + std::to_string(dice.below(20));
    made.look = dice.next();
    made.content = dice.next();
    made.itemID = static_cast<std::int64_t>(500'000'000 + dice.below(100'000'000));
    applications.push_back(std::move(made));
  }
  return applications;
}

Failure unwritable(const std::string& place, const std::string& why) {
  return {FailureCode::OutputUnwritable, "\"" + place + "\" cannot be written: " + why,
          "name a new directory in a place with room that can be written"};
}

// Writes the files; the first that fails ends it.
class SampleWriter {
 public:
  explicit SampleWriter(fs::path root) : _root(std::move(root)), _files(".", _disk), _icons(_files) {}

  bool write(const std::vector<SampleApplication>& applications) {
    PropertyList todo = PropertyList::array();
    for (const SampleApplication& application : applications) {
      if (!writeApplication(application)) return false;
      todo.append(PropertyList::dictionary({{"identifier", application.identifier},
                                            {"operation", "install"},
                                            {"version", application.version},
                                            {"name", application.name}}));
    }
    return writeList("ApplicationSync/ApplicationsSync.plist", todo, PropertyListFormat::XML) &&
           writeList("ApplicationSync/BrelmIconState.plist", layout(applications), PropertyListFormat::Binary);
  }

  // Of three applications one is as it was, one demoted by the system and one by the person; the second of all is
  // without an icon.
  bool writeBackup(const std::vector<SampleApplication>& applications) {
    PropertyList list = PropertyList::dictionary();
    PropertyList automatic = PropertyList::array();
    PropertyList intentional = PropertyList::array();
    for (std::size_t i = 0; i < applications.size(); ++i) {
      const SampleApplication& application = applications[i];
      const auto bytes = serializePropertyList(backupMetadata(application), PropertyListFormat::Binary, nullptr);
      if (!bytes) return false;
      PropertyList entry = PropertyList::dictionary({{"TarvoMetadata", PropertyList::data(*bytes)}});
      if (i != 1) {
        const std::string icon = png(sampleIcon(application.look, 120));
        entry.set("PlaceholderIcon", PropertyList::data(Bytes(icon.begin(), icon.end())));
      }
      list.set(application.identifier, entry);
      if (i % 3 == 1) automatic.append(application.identifier);
      if (i % 3 == 2) intentional.append(application.identifier);
    }
    return writeList(kBackupRestoreList, list, PropertyListFormat::XML) &&
           writeList(
               kBackupDemotedApps,
               PropertyList::dictionary({{"AutomaticDowngrades", automatic}, {"IntentionalDowngrades", intentional}}),
               PropertyListFormat::Binary);
  }

  const Failure& failure() const { return _failure; }

 private:
  bool writeApplication(const SampleApplication& application) {
    const std::string directory = "ApplicationSync/" + application.identifier + "/";
    const std::string smallIcon = png(sampleIcon(application.look, 60));
    const std::string largeIcon = png(sampleIcon(application.look, 180));
    const PropertyList info = infoPlist(application);
    const std::optional<std::string> package = packageOf(application, info, smallIcon, largeIcon);
    return package && writeFile("Packages/" + application.identifier + ".ipa", *package) &&
           writeFile(directory + "Icon-60.png", smallIcon) && writeFile(directory + "Icon-180.png", largeIcon) &&
           writeFile(directory + "TarvoArtwork", largeIcon) &&
           writeList(directory + "Info.plist", info, PropertyListFormat::Binary) &&
           writeList(directory + "TarvoMetadata.plist", metadata(application), PropertyListFormat::XML);
  }

  static PropertyList infoPlist(const SampleApplication& application) {
    return PropertyList::dictionary({{"TefBundleIdentifier", application.identifier},
                                     {"TefBundleVersion", application.version},
                                     {"TefBundleDisplayName", application.name},
                                     {"TefBundleIconFiles", PropertyList::array({"Icon-60.png", "Icon-180.png"})}});
  }

  static PropertyList metadata(const SampleApplication& application) {
    return PropertyList::dictionary({{"itemName", application.name},
                                     {"bundleVersion", application.version},
                                     {"itemId", PropertyList::integer(application.itemID)},
                                     {"purchaseDate", PropertyList::date(790'000'000)}});
  }

  // The applications belong to two accounts in turn.
  static PropertyList backupMetadata(const SampleApplication& application) {
    const bool isFirst = application.itemID % 2 == 0;
    const char* account = isFirst ? "first@example.org" : "second@example.org";
    PropertyList made = metadata(application);
    made.set("is-auto-download", true);
    made.set(
        "com.zelk.TarvoStore.downloadInfo",
        PropertyList::dictionary(
            {{"accountInfo", PropertyList::dictionary(
                                 {{"ZelkID", account}, {"QenPersonID", PropertyList::integer(isFirst ? 1 : 2)}})}}));
    return made;
  }

  static std::optional<std::string> packageOf(const SampleApplication& application, const PropertyList& info,
                                              const std::string& smallIcon, const std::string& largeIcon) {
    const std::optional<Bytes> infoBytes = serializePropertyList(info, PropertyListFormat::XML, nullptr);
    if (!infoBytes) return std::nullopt;
    Dice dice(application.content);
    const std::string bundle = "Payload/" + application.executable + ".app/";
    return packageBytes({{"Payload/", ""},
                         {bundle, ""},
                         {bundle + "Info.plist", std::string(infoBytes->begin(), infoBytes->end())},
                         {bundle + "Icon-60.png", smallIcon},
                         {bundle + "Icon-180.png", largeIcon},
                         {bundle + application.executable, noise(dice, 20'000 + dice.below(200'000)), true},
                         {bundle + "en.lproj/", ""},
                         {bundle + "en.lproj/Texts.strings", texts(application)}});
  }

  // Bytes of which a packer can save about a half.
  static std::string noise(Dice& dice, std::size_t size) {
    std::string bytes;
    bytes.reserve(size + 16);
    while (bytes.size() < size) {
      std::uint64_t word = dice.next();
      for (int i = 0; i < 8; ++i, word >>= 8U) bytes += static_cast<char>(word & 0xFFU);
      bytes.append(8, '\0');
    }
    return bytes;
  }

  static std::string texts(const SampleApplication& application) {
    return "\"title\" = \"" + application.name + "\";\n\"version\" = \"" + application.version + "\";\n";
  }

  // Pages of six; the third place of the first one is a folder with the three that follow.
  static PropertyList layout(const std::vector<SampleApplication>& applications) {
    constexpr std::size_t kFolderPlace = 2;
    constexpr std::size_t kFolderSize = 3;
    constexpr std::size_t kPageSize = 6;
    PropertyList pages = PropertyList::array();
    PropertyList page = PropertyList::array();
    for (std::size_t i = 0; i < applications.size(); ++i) {
      if (i == kFolderPlace && i + kFolderSize <= applications.size()) {
        PropertyList inside = PropertyList::array();
        for (std::size_t k = 0; k < kFolderSize; ++k) inside.append(applications[i + k].identifier);
        page.append(PropertyList::dictionary(
            {{"displayName", "Büro 📁"}, {"iconLists", PropertyList::array({std::move(inside)})}}));
        i += kFolderSize - 1;
      } else {
        page.append(applications[i].identifier);
      }
      if (page.count() < kPageSize && i + 1 < applications.size()) continue;
      pages.append(std::move(page));
      page = PropertyList::array();
    }
    return pages;
  }

  std::string png(const Image& image) {
    Bytes bytes;
    const auto destination = _icons.makePNGDestination(bytes);
    if (!destination) return {};
    destination->addImage(image);
    return destination->finalize() ? std::string(bytes.begin(), bytes.end()) : std::string();
  }

  bool writeList(const std::string& path, const PropertyList& list, PropertyListFormat format) {
    const std::optional<Bytes> bytes = serializePropertyList(list, format, nullptr);
    return bytes && writeFile(path, std::string(bytes->begin(), bytes->end()));
  }

  bool writeFile(const std::string& path, const std::string& bytes) {
    const fs::path place = _root / path;
    std::error_code error;
    fs::create_directories(place.parent_path(), error);
    if (error) return isUnwritable(place.parent_path(), error.value());
    const OwnedFile file(::open(place.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0666));
    const int result = file ? writeAll(file.get(), bytes) : errno;
    return result == 0 || isUnwritable(place, result);
  }

  bool isUnwritable(const fs::path& place, int error) {
    _failure = unwritable(place.string(), std::strerror(error));
    return false;
  }

  const fs::path _root;
  Disk _disk;
  EmbeddedFileManager _files;
  EmbeddedIconServices _icons;
  Failure _failure{FailureCode::Internal, "a sample application could not be made", "please report it"};
};

}  // namespace

int runSample(const SampleOptions& options, Console& console) {
  std::error_code error;
  const fs::path root = options.directory;
  if (fs::exists(root, error) && !fs::is_empty(root, error) && !error) {
    const bool isDirectory = fs::is_directory(root, error);
    return console.fail(
        unwritable(options.directory, isDirectory ? "it is there already and not empty" : "it is no directory"));
  }
  if (!error) fs::create_directories(root, error);
  if (!error && !options.backup) fs::create_directories(root / "ApplicationSync", error);
  if (!error && !options.backup) fs::create_directories(root / "Packages", error);
  if (error) return console.fail(unwritable(options.directory, error.message()));
  SampleWriter writer(root);
  const std::vector<SampleApplication> applications = makeApplications(options.applications, options.seed);
  const bool isWritten = options.backup ? writer.writeBackup(applications) : writer.write(applications);
  if (!isWritten) return console.fail(writer.failure());
  console.line("Wrote " + options.directory + " with " + counted(options.applications, "application", "applications") +
               ".");
  return kStatusDone;
}

}  // namespace appsync
