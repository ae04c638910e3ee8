#include "instrument/recorder.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>

namespace appsync {

namespace {

std::string onOneLine(const std::string& text) {
  if (text.find('\n') == std::string::npos) return text;
  std::string line;
  for (const char character : text) line += character == '\n' ? std::string("\\n") : std::string(1, character);
  return line;
}

// In one piece, so that programs which share the file do not tear each other's lines.
void appendToFile(const std::string& path, const std::string& line) {
  const int file = ::open(path.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
  if (file < 0) return;
  [[maybe_unused]] const ssize_t written = ::write(file, line.data(), line.size());
  ::close(file);
}

}  // namespace

Recorder::Recorder(bool recording, std::string reachedTextsFile)
    : _recording(recording), _reachedTextsFile(std::move(reachedTextsFile)) {}

void Recorder::add(InstrumentedService service, const std::string& text) {
  if (!isRecording()) return;
  MutexLock lock(_mutex);
  _lines.push_back({service, std::this_thread::get_id(), onOneLine(text)});
}

void Recorder::addFormat(Format format) {
  const std::string line =
      format.category + (format.level == LogLevel::Error ? "\terror\t" : "\tdefault\t") + onOneLine(format.text) + "\n";
  {
    MutexLock lock(_mutex);
    if (!_formats.insert(std::move(format)).second) return;
  }
  if (!_reachedTextsFile.empty()) appendToFile(_reachedTextsFile, line);
}

std::vector<std::string> Recorder::lines(const Selection& selection) const {
  MutexLock lock(_mutex);
  std::vector<std::string> chosen;
  for (const Line& line : _lines) {
    if (!selection.services.empty() && !selection.services.contains(line.service)) continue;
    if (selection.thread && *selection.thread != line.thread) continue;
    if (!selection.callbacks && line.text.starts_with("<- ")) continue;
    chosen.push_back(line.text);
  }
  return chosen;
}

std::string Recorder::transcript(const Selection& selection) const {
  std::string text;
  for (const std::string& line : lines(selection)) text += line + "\n";
  return text;
}

void Recorder::clear() {
  MutexLock lock(_mutex);
  _lines.clear();
}

std::set<Recorder::Format> Recorder::setOfFormats() const {
  MutexLock lock(_mutex);
  return _formats;
}

}  // namespace appsync
