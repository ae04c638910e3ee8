#include "tests/support/world.h"

#include <algorithm>
#include <cstdlib>
#include <fstream>
#include <nlohmann/json.hpp>
#include <regex>
#include <sstream>
#include <thread>

#include "embedded/waiting.h"

namespace appsync::test {

namespace {

constexpr char kWorkArea[] = "/var/mobile/Library/ApplicationSync/TarvoStuff";
constexpr char kTodoList[] = "/var/mobile/Library/ApplicationSync/TarvoStuff/ApplicationsSync.plist";

PropertyList fromJSON(const nlohmann::ordered_json& json) {
  if (json.is_boolean()) return PropertyList(json.get<bool>());
  if (json.is_number_float()) return PropertyList::real(json.get<double>());
  if (json.is_number()) return PropertyList::integer(json.get<std::int64_t>());
  if (json.is_string()) return PropertyList(json.get<std::string>());
  if (json.is_array()) {
    PropertyList array = PropertyList::array();
    for (const auto& element : json) array.append(fromJSON(element));
    return array;
  }
  PropertyList dictionary = PropertyList::dictionary();
  for (const auto& [key, value] : json.items()) dictionary.set(key, fromJSON(value));
  return dictionary;
}

// The numbers of containers depend on which worker came first.
std::string withoutNumbers(const std::string& text) {
  return std::regex_replace(text, std::regex("/Containers/Placeholders/[0-9]+"), "/Containers/Placeholders/N");
}

std::string environment(const char* name) {
  const char* value = std::getenv(name);  // NOLINT(concurrency-mt-unsafe)
  return value != nullptr ? value : "";
}

}  // namespace

PropertyList plist(const std::string& json) {
  return fromJSON(nlohmann::ordered_json::parse(json));
}

TemporaryDirectory::TemporaryDirectory() {
  std::string pattern = (std::filesystem::temp_directory_path() / "appsync-test-XXXXXX").string();
  if (mkdtemp(pattern.data()) == nullptr) throw std::runtime_error("no temporary directory: " + pattern);
  _path = pattern;
}

TemporaryDirectory::~TemporaryDirectory() {
  std::filesystem::remove_all(_path);
}

World::World(const std::string& host) {
  std::optional<Error> error;
  DeviceOptions options;
  options.directory = (_directory.path() / "device").string();
  options.mainBundleIdentifier = host;
  options.timeRunsFast = true;
  options.executor = [this] {
    auto executor = makeThreadExecutor(2);
    _executor = executor.get();
    return executor;
  };
  _device = Device::open(options, &error);
  if (!_device) throw std::runtime_error(error->description());
  InstrumentOptions instrumentOptions;
  instrumentOptions.recording = true;
  instrumentOptions.reachedTextsFile = environment("APPSYNC_REACHED_TEXTS");
  _instruments = std::make_unique<Instruments>(_device->platform(), instrumentOptions);
  _client = std::make_unique<AppsClient>(_instruments->platform());
  _device->startWork();
  _device->coordination().setInstallGate(
      [query = _instruments->faultQuery()](const std::string& bundleID) { return query("install", bundleID); });
}

World::~World() {
  _client.reset();
  _device->drain();
  _instruments.reset();
}

void World::seed(const std::string& json) {
  std::optional<Error> error;
  ASSERT_TRUE(_device->seed(plist(json), &error)) << describe(error);
}

void World::fault(const std::string& spec) {
  std::optional<Error> error;
  ASSERT_TRUE(_instruments->addFault(spec, &error)) << describe(error);
}

void World::put(const std::string& devicePath, const PropertyList& value) {
  const auto bytes = serializePropertyList(value, PropertyListFormat::XML, nullptr);
  putText(devicePath, std::string(bytes->begin(), bytes->end()));
}

void World::putText(const std::string& devicePath, const std::string& text) {
  const std::string directory = devicePath.substr(0, devicePath.rfind('/'));
  ASSERT_TRUE(_device->files().createDirectory(directory, true, {}, nullptr));
  ASSERT_TRUE(_device->files().writeFile(devicePath, Bytes(text.begin(), text.end()), nullptr));
}

std::optional<PropertyList> World::get(const std::string& devicePath) {
  const auto bytes = _device->files().readFile(devicePath, nullptr);
  return bytes ? parsePropertyList(*bytes, nullptr) : std::nullopt;
}

void World::putTodo(const std::string& json) {
  put(kTodoList, plist(json));
}

std::string World::todo() {
  std::string text;
  const auto list = get(kTodoList);
  if (!list) return "(none)";
  for (const PropertyList& entry : list->elements()) {
    const auto field = [&](const char* key) {
      return entry.find(key) != nullptr ? entry.find(key)->description() : "?";
    };
    text += (text.empty() ? "" : " ") + field("identifier") + "=" + field("operation");
  }
  return text;
}

void World::putApp(const std::string& id, const std::string& infoJson, bool icon) {
  const std::string directory = std::string(kWorkArea) + "/" + id;
  PropertyList info = plist(infoJson);
  if (icon && info.isDictionary()) {
    info.set("TefBundleIconFiles", PropertyList::array({"Icon.png"}));
    Bytes png;
    const auto destination = _device->platform().icons->makePNGDestination(png);
    destination->addImage({.width = 8, .height = 8, .pixels = Bytes(256, 200)});
    ASSERT_TRUE(destination->finalize());
    putText(directory + "/Icon.png", std::string(png.begin(), png.end()));
  }
  put(directory + "/Info.plist", info);
  put(directory + "/TarvoMetadata.plist", plist(R"({"title": "Shop name"})"));
}

void World::settle() {
  EXPECT_TRUE(_device->coordination().waitUntilSettled(_device->waiting(), std::chrono::seconds(30)));
  _executor->drain();
}

std::string World::transcript(const std::function<void()>& work) {
  _instruments->recorder().clear();
  work();
  Recorder::Selection selection;
  selection.thread = std::this_thread::get_id();
  using enum InstrumentedService;
  selection.services = {Log,    TransactionLog, Files, Waiting, Workspace,     Coordination,       Installer,
                        Backup, Policy,         Shell, Icons,   Notifications, NotificationCenter, DeviceService};
  return withoutNumbers(_instruments->recorder().transcript(selection));
}

std::string World::logLines(const std::function<void()>& work, bool everyThread) {
  _instruments->recorder().clear();
  work();
  Recorder::Selection selection;
  selection.services = {InstrumentedService::Log, InstrumentedService::TransactionLog};
  std::vector<std::string> all = _instruments->recorder().lines(selection);
  selection.thread = std::this_thread::get_id();
  std::string text;
  for (const std::string& line : _instruments->recorder().lines(selection)) {
    text += line + "\n";
    all.erase(std::ranges::find(all, line));
  }
  for (const std::string& line : all) text += everyThread ? line + "\n" : "";
  return withoutNumbers(text);
}

DovelAssetRef World::asset(const std::string& id, const std::string& path) {
  auto asset = DovelAsset::downloadAssetWithIdentifier(id, "Application", std::nullopt);
  if (!path.empty()) asset->setPath(path);
  return asset;
}

void expectTranscript(const std::string& name, const std::string& transcript) {
  const std::string path = std::string(APPSYNC_TEST_DIR) + "/transcripts/" + name + ".txt";
  if (!environment("APPSYNC_UPDATE_TRANSCRIPTS").empty()) {
    std::ofstream(path) << transcript;
    return;
  }
  std::ifstream file(path);
  std::stringstream expected;
  expected << file.rdbuf();
  EXPECT_EQ(expected.str(), transcript) << "differs from " << path;
}

}  // namespace appsync::test
