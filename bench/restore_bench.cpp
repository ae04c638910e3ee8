// A restore of many applications with icons of 20 KiB each, on an embedded device in the temporary directory.
//
// Counters, for one application of the list: `cpu_us`, the processor time of the client's thread, the kernel's work on
// its files included, without the wait; `icon_blocks`, how many blocks of memory that could hold an icon that thread
// takes: one for the list's value, one for the service's own copy. More than two fail the benchmark.
#include <benchmark/benchmark.h>

#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <new>

#include "client/apps_client.h"
#include "embedded/coordination.h"
#include "embedded/device.h"
#include "embedded/file_manager.h"
#include "embedded/waiting.h"

namespace {

constexpr std::size_t kIconSize = 20 * 1024;
constexpr std::size_t kLargestIconBlock = kIconSize + 4096;

thread_local std::int64_t iconBlocks = 0;

}  // namespace

// Not inlined, so that the compiler goes on seeing pairs of `new` and `delete`.
[[gnu::noinline]] void* operator new(std::size_t size) {
  if (size >= kIconSize && size <= kLargestIconBlock) ++iconBlocks;
  void* memory = std::malloc(size);
  if (memory == nullptr) throw std::bad_alloc();
  return memory;
}
[[gnu::noinline]] void operator delete(void* memory) noexcept {
  std::free(memory);
}
[[gnu::noinline]] void operator delete(void* memory, std::size_t /*size*/) noexcept {
  std::free(memory);
}

namespace {

using namespace appsync;

constexpr char kRestoreList[] = "/var/mobile/Media/TarvoRestore/RestoreApplications.plist";
constexpr char kDemotedApps[] = "/var/mobile/Library/Preferences/com.zelk.Vaultry.DemotedApps.plist";

void putLists(FileManager& files, std::int64_t count) {
  const Bytes metadata =
      *serializePropertyList(PropertyList::dictionary({{"title", "Application"}, {"bundleVersion", "1.0"}}),
                             PropertyListFormat::Binary, nullptr);
  PropertyList list = PropertyList::dictionary();
  PropertyList demoted = PropertyList::array();
  for (std::int64_t i = 0; i < count; ++i) {
    const std::string bundleID = "org.sample.application" + std::to_string(i);
    list.set(bundleID,
             PropertyList::dictionary({{"TarvoMetadata", PropertyList::data(metadata)},
                                       {"PlaceholderIcon", PropertyList::data(Bytes(kIconSize, std::uint8_t(i)))}}));
    if (i % 2 == 0) demoted.append(bundleID);
  }
  files.writeFile(kRestoreList, *serializePropertyList(list, PropertyListFormat::Binary, nullptr), nullptr);
  files.writeFile(kDemotedApps,
                  *serializePropertyList(PropertyList::dictionary({{"AutomaticDowngrades", demoted}}),
                                         PropertyListFormat::Binary, nullptr),
                  nullptr);
}

double threadMicroseconds() {
  timespec time{};
  ::clock_gettime(CLOCK_THREAD_CPUTIME_ID, &time);
  return 1e6 * static_cast<double>(time.tv_sec) + 1e-3 * static_cast<double>(time.tv_nsec);
}

void restore(benchmark::State& state) {
  const std::int64_t count = state.range(0);
  double time = 0;
  std::int64_t blocks = 0;
  for (auto _ : state) {
    state.PauseTiming();
    std::string directory = (std::filesystem::temp_directory_path() / "appsync-bench-XXXXXX").string();
    if (::mkdtemp(directory.data()) == nullptr) return state.SkipWithError("no temporary directory");
    DeviceOptions options;
    options.directory = directory;
    const auto device = Device::open(options, nullptr);
    if (!device) return state.SkipWithError("no device");
    putLists(device->files(), count);
    auto client = std::make_unique<AppsClient>(device->platform());
    device->waiting().interrupt();  // only the work counts, not the wait
    iconBlocks = 0;
    const double begin = threadMicroseconds();
    state.ResumeTiming();
    const bool isRestored = client->_processTarvoRestoreInfo();
    state.PauseTiming();
    time += threadMicroseconds() - begin;
    blocks += iconBlocks;
    if (!isRestored) state.SkipWithError("an application was not restored");
    client.reset();
    device->drain();
    std::filesystem::remove_all(directory);
    state.ResumeTiming();
  }
  const auto applications = static_cast<double>(count * state.iterations());
  state.counters["cpu_us"] = time / applications;
  state.counters["icon_blocks"] = static_cast<double>(blocks) / applications;
  const bool isWasteful = static_cast<double>(blocks) > 2.1 * applications;
  if (isWasteful) state.SkipWithError("an icon is copied more often than it must");
}

BENCHMARK(restore)->Arg(250)->Arg(500)->Arg(1000)->Arg(2000)->Iterations(1)->Unit(benchmark::kMillisecond);

}  // namespace
