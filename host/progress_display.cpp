#include "host/progress_display.h"

#include <algorithm>
#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <string_view>

#include "host/text.h"

namespace appsync {

namespace {

constexpr auto kBetweenPictures = std::chrono::milliseconds(100);
constexpr double kTransferShare = 0.9;  // of a bar; it is full only when the application is installed
constexpr std::size_t kStateWidth = 17;

}  // namespace

bool canDrawInPlace(const DeviceOptionsGiven& options, const Console& console) {
  const char* terminal = std::getenv("TERM");
  return console.isTerminal() && options.log != "-" && terminal != nullptr && std::string_view(terminal) != "dumb";
}

ProgressDisplay::ProgressDisplay(Console& console, bool drawsInPlace)
    : _console(console), _drawsInPlace(drawsInPlace) {}

ProgressDisplay::~ProgressDisplay() {
  end();
}

void ProgressDisplay::begin(const std::vector<std::pair<std::string, std::string>>& applications) {
  MutexLock lock(_mutex);
  for (const auto& [identifier, name] : applications) {
    _places.emplace(identifier, _rows.size());
    _rows.push_back({identifier, printable(name), State::Waiting, 0, {}});
    _nameWidth = std::max(_nameWidth, displayWidth(_rows.back().name));
  }
  if (!_drawsInPlace || _rows.empty()) return;
  _isStale = true;
  _drawer = std::thread([this] { drawRepeatedly(); });
}

void ProgressDisplay::transferring(const std::string& identifier, double fraction) {
  change(identifier, State::Transferring, fraction, {});
}

void ProgressDisplay::installing(const std::string& identifier) {
  change(identifier, State::Installing, 1, {});
}

void ProgressDisplay::installed(const std::string& identifier) {
  change(identifier, State::Installed, 1, {});
}

void ProgressDisplay::failed(const std::string& identifier, const std::string& why) {
  change(identifier, State::Failed, 0, why);
}

void ProgressDisplay::end() {
  {
    MutexLock lock(_mutex);
    _hasEnded = true;
    _isStale = true;  // the picture before may have left rows out
    _changed.notify_all();
  }
  if (_drawer.joinable()) _drawer.join();
}

void ProgressDisplay::change(const std::string& identifier, State state, double fraction, const std::string& why) {
  MutexLock lock(_mutex);
  const auto place = _places.find(identifier);
  if (place == _places.end() || _hasEnded) return;
  Row& row = _rows[place->second];
  if (row.state == State::Failed || row.state == State::Installed) return;
  if (row.state == State::Installing && state == State::Transferring) return;
  const bool isNews = row.state != state;
  row.state = state;
  if (state != State::Failed) row.fraction = fraction;
  row.why = printable(why);
  if (!_drawsInPlace) {
    if (isNews) tell(row);
    return;
  }
  _isStale = true;
  _changed.notify_all();
}

void ProgressDisplay::tell(const Row& row) {
  switch (row.state) {
    case State::Transferring:
      return _console.line(row.identifier + ": transferring");
    case State::Installing:
      return _console.line(row.identifier + ": installing");
    case State::Installed:
      return _console.line(row.identifier + ": installed");
    case State::Failed:
      return _console.line(row.identifier + ": failed: " + row.why);
    case State::Waiting:
      return;
  }
}

// The first picture of a change comes at once, the next one not before its time; the last change is always drawn.
void ProgressDisplay::drawRepeatedly() {
  MutexLock lock(_mutex);
  while (true) {
    _changed.wait(lock.native(), [this]() APPSYNC_NO_THREAD_ANALYSIS { return _isStale || _hasEnded; });
    if (_isStale) draw();
    if (_hasEnded) return;
    _changed.wait_for(lock.native(), kBetweenPictures, [this]() APPSYNC_NO_THREAD_ANALYSIS { return _hasEnded; });
  }
}

void ProgressDisplay::draw() {
  _isStale = false;
  const std::size_t columns = _console.columns() - 1;  // the last column would wrap on some terminals
  const std::vector<const Row*> rows = rowsToDraw(_hasEnded ? _rows.size() : _console.rows() - 2);
  std::string picture;
  if (_drawnLines > 0) picture += "\x1b[" + std::to_string(_drawnLines) + "A";
  for (const Row* row : rows) picture += "\r\x1b[K" + rowText(*row, columns) + "\n";
  if (rows.size() < _rows.size()) {
    const auto done =
        std::count_if(_rows.begin(), _rows.end(), [](const Row& row) { return row.state > State::Installing; });
    picture +=
        "\r\x1b[K" + fitted(std::to_string(done) + " of " + std::to_string(_rows.size()) + " done", columns) + "\n";
  }
  picture += "\x1b[J";
  _drawnLines = rows.size() + (rows.size() < _rows.size() ? 1 : 0);
  _console.picture(picture);
}

// All rows when there is room; otherwise those that move come first, then those that wait.
std::vector<const ProgressDisplay::Row*> ProgressDisplay::rowsToDraw(std::size_t room) const {
  std::vector<const Row*> rows;
  for (const Row& row : _rows) rows.push_back(&row);
  if (rows.size() <= room) return rows;
  const auto rank = [](const Row* row) {
    if (row->state == State::Transferring || row->state == State::Installing) return 0;
    return row->state == State::Waiting ? 1 : 2;
  };
  std::stable_sort(rows.begin(), rows.end(), [&](const Row* a, const Row* b) { return rank(a) < rank(b); });
  rows.resize(room - 1);
  return rows;
}

std::string ProgressDisplay::rowText(const Row& row, std::size_t columns) const {
  const std::size_t nameWidth = std::min(_nameWidth, columns / 3);
  std::string state;
  double fraction = row.fraction * kTransferShare;
  switch (row.state) {
    case State::Waiting:
      state = "waiting";
      break;
    case State::Transferring:
      state = "transferring " + std::to_string(std::lround(100 * std::clamp(row.fraction, 0.0, 1.0))) + " %";
      break;
    case State::Installing:
      state = "installing";
      fraction = 0.95;
      break;
    case State::Installed:
      state = "installed";
      fraction = 1;
      break;
    case State::Failed:
      state = "failed: " + row.why;
  }
  if (columns < nameWidth + kStateWidth + 14)
    return fitted(row.name, nameWidth) + " " + fitted(state, columns - nameWidth - 1);
  const std::size_t barWidth = std::min<std::size_t>(columns - nameWidth - kStateWidth - 4, 40);
  auto full = static_cast<std::size_t>(std::lround(std::clamp(fraction, 0.0, 1.0) * static_cast<double>(barWidth)));
  if (row.state != State::Installed) full = std::min(full, barWidth - 1);
  const std::string bar = std::string(full, '#') + std::string(barWidth - full, '.');
  return fitted(row.name, nameWidth) + " [" + bar + "] " + fitted(state, columns - nameWidth - barWidth - 4);
}

}  // namespace appsync
