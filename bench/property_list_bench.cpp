// Property lists, read and written, beside a deep copy of the same tree: the least that building it again can cost.
//
// Times are processor time, so that a busy machine changes little. Counters: `per_entry` is the time for one entry;
// `of_copy` the time as a multiple of the deep copy's (for the same tree, in the same run); `bytes_per_byte` the memory
// of a parsed value as a multiple of its binary file.
#include <benchmark/benchmark.h>
#include <malloc.h>

#include <algorithm>
#include <ctime>
#include <map>
#include <string>

#include "platform/property_list.h"

namespace {

using appsync::Bytes;
using appsync::parsePropertyList;
using appsync::PropertyList;
using appsync::PropertyListFormat;
using appsync::serializePropertyList;

std::string identifier(std::int64_t i) {
  return "org.sample.application." + std::to_string(i);
}

PropertyList strings(std::int64_t count) {
  PropertyList list = PropertyList::array();
  for (std::int64_t i = 0; i < count; ++i) list.append(identifier(i));
  return list;
}

PropertyList todoList(std::int64_t count) {
  PropertyList list = PropertyList::array();
  for (std::int64_t i = 0; i < count; ++i) {
    list.append(PropertyList::dictionary({{"identifier", identifier(i)},
                                          {"operation", i % 3 == 0 ? "remove" : "install"},
                                          {"version", std::to_string(i % 50) + ".0"},
                                          {"name", "Application " + std::to_string(i)}}));
  }
  return list;
}

PropertyList bigDictionary(std::int64_t count) {
  PropertyList dictionary = PropertyList::dictionary();
  for (std::int64_t i = 0; i < count; ++i) dictionary.set(identifier(i), PropertyList::integer(i));
  return dictionary;
}

// The shortest file there can be for so many values: each is one byte, a reference.
PropertyList flags(std::int64_t count) {
  PropertyList list = PropertyList::array();
  for (std::int64_t i = 0; i < count; ++i) list.append(i % 2 == 0);
  return list;
}

// Shares nothing with `value`; the trees here are three levels deep.
PropertyList deepCopy(const PropertyList& value) {  // NOLINT(misc-no-recursion)
  if (value.isArray()) {
    std::vector<PropertyList> elements;
    elements.reserve(value.count());
    for (const PropertyList& element : value.elements()) elements.push_back(deepCopy(element));
    return PropertyList::array(std::move(elements));
  }
  if (value.isDictionary()) {
    PropertyList copy = PropertyList::dictionary();
    for (const auto& [key, member] : value.members()) copy.set(key, deepCopy(member));
    return copy;
  }
  if (const auto text = value.stringView()) return *text;
  return value;
}

struct Shape {
  const char* name;
  PropertyList (*make)(std::int64_t count);
};

constexpr Shape kShapes[] = {
    {"strings", strings}, {"todo_list", todoList}, {"dictionary", bigDictionary}, {"flags", flags}};

// A tree as it comes out of its file, as in a program that has read it.
struct Sample {
  Bytes binary;
  Bytes xml;
  PropertyList value;
  double copySeconds;
};

double processorSeconds() {
  timespec time{};
  clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &time);
  return static_cast<double>(time.tv_sec) + 1e-9 * static_cast<double>(time.tv_nsec);
}

double secondsOf(const auto& work) {
  double best = 1e9;
  for (int i = 0; i < 5; ++i) {
    const double start = processorSeconds();
    const auto result = work();
    benchmark::DoNotOptimize(&result);
    best = std::min(best, processorSeconds() - start);
  }
  return best;
}

// One sample at a time is kept: the largest are large.
const Sample& sampleOf(const Shape& shape, std::int64_t count) {
  static std::map<std::pair<std::string, std::int64_t>, Sample> kept;
  const std::pair<std::string, std::int64_t> key{shape.name, count};
  const auto found = kept.find(key);
  if (found != kept.end()) return found->second;
  kept.clear();
  Bytes binary = *serializePropertyList(shape.make(count), PropertyListFormat::Binary, nullptr);
  PropertyList value = *parsePropertyList(binary, nullptr);
  Bytes xml = *serializePropertyList(value, PropertyListFormat::XML, nullptr);
  const double copySeconds = secondsOf([&] { return deepCopy(value); });
  return kept.emplace(key, Sample{std::move(binary), std::move(xml), std::move(value), copySeconds}).first->second;
}

std::size_t allocatedBytes() {
  const struct mallinfo2 info = mallinfo2();
  return info.uordblks + info.hblkhd;
}

// What is made is thrown away while the clock stands still.
template <typename Work>
void measure(benchmark::State& state, const Sample& sample, std::int64_t entries, const Work& work) {
  double seconds = 0;
  for (auto _ : state) {
    const double start = processorSeconds();
    const auto result = work();
    benchmark::DoNotOptimize(&result);
    const double taken = processorSeconds() - start;
    state.SetIterationTime(taken);
    seconds += taken;
  }
  const double each = seconds / static_cast<double>(state.iterations());
  state.counters["per_entry"] = each / static_cast<double>(entries);
  state.counters["of_copy"] = each / sample.copySeconds;
}

void deepCopyOf(benchmark::State& state, const Shape& shape, std::int64_t entries) {
  const Sample& sample = sampleOf(shape, entries);
  measure(state, sample, entries, [&] { return deepCopy(sample.value); });
}

void readBinary(benchmark::State& state, const Shape& shape, std::int64_t entries) {
  const Sample& sample = sampleOf(shape, entries);
  const std::size_t before = allocatedBytes();
  const auto value = parsePropertyList(sample.binary, nullptr);
  const std::size_t taken = allocatedBytes() - before;
  state.counters["bytes_per_byte"] = static_cast<double>(taken) / static_cast<double>(sample.binary.size());
  measure(state, sample, entries, [&] { return parsePropertyList(sample.binary, nullptr); });
}

void writeBinary(benchmark::State& state, const Shape& shape, std::int64_t entries) {
  const Sample& sample = sampleOf(shape, entries);
  measure(state, sample, entries,
          [&] { return serializePropertyList(sample.value, PropertyListFormat::Binary, nullptr); });
}

void readXML(benchmark::State& state, const Shape& shape, std::int64_t entries) {
  const Sample& sample = sampleOf(shape, entries);
  const std::size_t before = allocatedBytes();
  const auto value = parsePropertyList(sample.xml, nullptr);
  const std::size_t taken = allocatedBytes() - before;
  state.counters["bytes_per_byte"] = static_cast<double>(taken) / static_cast<double>(sample.binary.size());
  measure(state, sample, entries, [&] { return parsePropertyList(sample.xml, nullptr); });
}

void writeXML(benchmark::State& state, const Shape& shape, std::int64_t entries) {
  const Sample& sample = sampleOf(shape, entries);
  measure(state, sample, entries,
          [&] { return serializePropertyList(sample.value, PropertyListFormat::XML, nullptr); });
}

[[maybe_unused]] const bool kRegistered = [] {
  constexpr std::pair<const char*, void (*)(benchmark::State&, const Shape&, std::int64_t)> operations[] = {
      {"deep_copy", deepCopyOf},
      {"read_binary", readBinary},
      {"write_binary", writeBinary},
      {"read_xml", readXML},
      {"write_xml", writeXML}};
  for (const Shape& shape : kShapes) {
    for (const std::int64_t entries : {10'000, 100'000, 1'000'000}) {
      for (const auto& [name, operation] : operations) {
        const std::string full =
            std::string("property_list/") + shape.name + '/' + std::to_string(entries) + '/' + name;
        benchmark::RegisterBenchmark(
            full.c_str(), [&shape, entries, run = operation](benchmark::State& state) { run(state, shape, entries); })
            ->UseManualTime()
            ->Unit(benchmark::kMillisecond);
      }
    }
  }
  return true;
}();

}  // namespace

BENCHMARK_MAIN();
