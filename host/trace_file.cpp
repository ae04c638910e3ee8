#include "host/trace_file.h"

#include <unistd.h>

#include <cerrno>

#include "host/console.h"
#include "host/files.h"
#include "host/json.h"
#include "host/text.h"

namespace appsync {

namespace {

constexpr int kProcess = 1;

std::int64_t microseconds(TraceFile::Time time) {
  return std::chrono::duration_cast<std::chrono::microseconds>(time.time_since_epoch()).count();
}

Json detailsOf(const TransactionRecord& record) {
  return {{"step", record.step}, {"party", record.party}, {"success", record.success}};
}

}  // namespace

std::unique_ptr<TraceFile> TraceFile::open(const std::string& path, Failure& failure) {
  const int file = openOutput(path, failure);
  if (file < 0) return nullptr;
  return std::unique_ptr<TraceFile>(new TraceFile(path, file));
}

TraceFile::TraceFile(std::string path, int file) : _path(std::move(path)), _file(file) {
  MutexLock lock(_mutex);
  write("{\"displayTimeUnit\": \"ms\", \"traceEvents\": [");
  add({{"ph", "M"}, {"pid", kProcess}, {"name", "process_name"}, {"args", {{"name", "dovel"}}}});
}

TraceFile::~TraceFile() {
  ::close(_file);
}

void TraceFile::begin() {
  MutexLock lock(_mutex);
  _hasBegun = true;
  _error = emptyOutput(_file);
  write(std::exchange(_early, {}));
}

void TraceFile::finish() {
  MutexLock lock(_mutex);
  if (!_hasBegun || std::exchange(_isFinished, true)) return;
  try {
    const Time now = std::chrono::system_clock::now();
    for (const auto& [key, steps] : _openSteps) {
      for (const OpenStep& step : steps) {
        Json details = detailsOf(step.record);
        details["unfinished"] = true;
        addSpan(key.first, step.record.description, step.begin, now, details);
      }
    }
    write("\n]}\n");
  } catch (const std::bad_alloc&) {
    _error = ENOMEM;
  }
}

void TraceFile::transaction(const TransactionRecord& record) {
  MutexLock lock(_mutex);
  const int track = trackOf(record.bundleID);
  if (record.scenario) {
    addMoment(track, *record.scenario + ": " + record.description, record.time, detailsOf(record));
    return;
  }
  std::vector<OpenStep>& open = _openSteps[{track, record.step}];
  if (record.phase == 1) {
    open.push_back({record.time, record});
    return;
  }
  const Time begin = open.empty() ? record.time : open.back().begin;
  if (!open.empty()) open.pop_back();
  addSpan(track, record.description, begin, record.time, detailsOf(record));
}

void TraceFile::span(const std::string& identifier, const std::string& name, Time begin, const Json& details) {
  MutexLock lock(_mutex);
  addSpan(trackOf(identifier), name, begin, std::chrono::system_clock::now(), details);
}

void TraceFile::moment(const std::string& identifier, const std::string& name, const Json& details) {
  MutexLock lock(_mutex);
  addMoment(trackOf(identifier), name, std::chrono::system_clock::now(), details);
}

std::optional<Failure> TraceFile::writeFailure() const {
  MutexLock lock(_mutex);
  if (_error == 0 || _error == EPIPE) return std::nullopt;
  return outputFailure(_path, _error);
}

void TraceFile::addSpan(int track, const std::string& name, Time begin, Time end, const Json& details) {
  add({{"ph", "X"},
       {"pid", kProcess},
       {"tid", track},
       {"ts", microseconds(begin)},
       {"dur", microseconds(end) - microseconds(begin)},
       {"name", name},
       {"args", details}});
}

void TraceFile::addMoment(int track, const std::string& name, Time time, const Json& details) {
  add({{"ph", "i"},
       {"pid", kProcess},
       {"tid", track},
       {"ts", microseconds(time)},
       {"s", "t"},
       {"name", name},
       {"args", details}});
}

int TraceFile::trackOf(const std::optional<std::string>& identifier) {
  const std::string name = identifier ? printable(*identifier) : "no application";
  const auto [place, isNew] = _tracks.try_emplace(name, static_cast<int>(_tracks.size()) + 1);
  if (isNew) {
    add({{"ph", "M"}, {"pid", kProcess}, {"tid", place->second}, {"name", "thread_name"}, {"args", {{"name", name}}}});
  }
  return place->second;
}

void TraceFile::add(const Json& event) {
  write((_hasEvents ? ",\n" : "\n") + jsonLine(event));
  _hasEvents = true;
}

void TraceFile::write(const std::string& text) {
  if (!_hasBegun) {
    _early += text;
  } else if (_error == 0) {
    _error = writeAll(_file, text);
  }
}

}  // namespace appsync
