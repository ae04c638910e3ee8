#include "host/sync_log.h"

#include <algorithm>
#include <array>

namespace appsync {

namespace {

constexpr std::int32_t kUninstallStep = 7;

// A line that says of its first argument that it is left out. What a line names by a list has an entry of its own
// below.
struct Rule {
  std::string_view format;
  std::string_view reason;
};

constexpr std::array kRules{
    Rule{"skipping %{public}@ - its not a restore and app installation is disabled", "policy"},
    Rule{"%{public}@ is currenlty marked to be restored and will be handled by mercd - skipping", "restore"},
    Rule{"%{public}@ is auto demoted: %d, manual demoted: %d, system app:%d - skipping", "system"},
    Rule{"%{public}@ is system app placeholder - skipping", "system-placeholder"},
    Rule{"%{public}@ is currenlty demoted (manual:%d, auto:%d) - skipping", "demoted"},
    Rule{"Not requesting app asset for %{public}@", "refused"},
};
constexpr std::string_view kInProgress = "Assets already in progress (not returning these): %{public}@";
constexpr std::string_view kRemovalsForbidden = "Not processing deletes because app removal is restricted";
constexpr std::string_view kRemoved =
    "Uninstall of %{public}@ with install coordinator succeeded wiht error %{public}@.";
constexpr std::string_view kPrepared =
    "processing app install for bundle %{public}@ finished with status %d error %{public}@";

// The elements of a list as a line shows it: "[a, b]", its end cut off with "…" when it is long.
std::vector<std::string> listElements(std::string_view text) {
  std::vector<std::string> elements;
  if (!text.starts_with('[') || !text.ends_with(']')) return elements;
  text = text.substr(1, text.size() - 2);
  while (!text.empty()) {
    const std::size_t end = std::min(text.find(", "), text.size());
    if (text.substr(0, end) != "…") elements.emplace_back(text.substr(0, end));
    text.remove_prefix(std::min(end + 2, text.size()));
  }
  return elements;
}

}  // namespace

void SyncLog::line(const LogLine& line) {
  const auto firstArgument = [&] {
    const auto arguments = argumentsOfLine(line.format, withoutPrefix(line.message));
    return arguments && !arguments->empty() ? arguments->front() : std::string();
  };
  MutexLock lock(_mutex);
  const auto skip = [this](const std::string& identifier, std::string_view reason) APPSYNC_NO_THREAD_ANALYSIS {
    if (_skippedIdentifiers.insert(identifier).second) _skipped.push_back({identifier, reason});
  };
  for (const Rule& rule : kRules) {
    if (line.format == rule.format) skip(firstArgument(), rule.reason);
  }
  if (line.format == kInProgress) {
    for (const std::string& identifier : listElements(firstArgument())) skip(identifier, "in-progress");
  } else if (line.format == kRemovalsForbidden) {
    _removalsWereForbidden = true;
  } else if (line.format == kRemoved) {
    _removalLines.emplace_back(withoutPrefix(line.message));
  } else if (line.format == kPrepared) {
    const auto arguments = argumentsOfLine(line.format, withoutPrefix(line.message));
    if (arguments && arguments->at(1) == "0") _preparationErrors[arguments->at(0)] = arguments->at(2);
  }
}

void SyncLog::transaction(const TransactionRecord& record) {
  if (record.scenario || record.step != kUninstallStep || !record.bundleID) return;
  MutexLock lock(_mutex);
  if (record.phase == 2) {
    _removalEnds[*record.bundleID] = record.success;
  } else if (std::find(_removals.begin(), _removals.end(), *record.bundleID) == _removals.end()) {
    _removals.push_back(*record.bundleID);
  }
}

std::vector<SyncLog::Skipped> SyncLog::skipped() const {
  MutexLock lock(_mutex);
  return _skipped;
}

bool SyncLog::removalsWereForbidden() const {
  MutexLock lock(_mutex);
  return _removalsWereForbidden;
}

std::vector<std::string> SyncLog::removals() const {
  MutexLock lock(_mutex);
  return _removals;
}

std::optional<std::string> SyncLog::removalError(const std::string& identifier) const {
  MutexLock lock(_mutex);
  const auto end = _removalEnds.find(identifier);
  if (end == _removalEnds.end()) return "the removal has not ended";
  if (end->second) return std::nullopt;
  // The application is known, so the line that ends with the reason is the one that begins like this.
  const std::string begin = "Uninstall of " + identifier + " with install coordinator succeeded wiht error ";
  for (const std::string& line : _removalLines) {
    if (line.starts_with(begin) && line.ends_with('.'))
      return line.substr(begin.size(), line.size() - begin.size() - 1);
  }
  return "it could not be removed";
}

std::optional<std::string> SyncLog::preparationError(const std::string& identifier) const {
  MutexLock lock(_mutex);
  const auto found = _preparationErrors.find(identifier);
  if (found == _preparationErrors.end() || found->second == "(null)") return std::nullopt;
  return found->second;
}

std::string_view withoutPrefix(std::string_view message) {
  const std::size_t bar = message.find('|');
  return bar == std::string_view::npos ? message : message.substr(bar + 1);
}

std::optional<std::vector<std::string>> argumentsOfLine(std::string_view format, std::string_view message) {
  constexpr std::array<std::string_view, 4> kDirectives{"%{public}@", "%lld", "%d", "%c"};
  std::vector<std::string> arguments;
  bool isOpen = false;  // an argument has begun and goes up to the next literal
  while (true) {
    const std::size_t at = std::min(format.find('%'), format.size());
    const std::string_view literal = format.substr(0, at);
    const bool isLast = at == format.size();
    // The last literal ends the message; one before that is taken where it first appears.
    const std::size_t found = !isOpen ? 0
                              : isLast
                                  ? (message.ends_with(literal) ? message.size() - literal.size() : std::string::npos)
                                  : message.find(literal);
    if (found == std::string::npos || message.substr(found, literal.size()) != literal) return std::nullopt;
    if (isOpen) arguments.emplace_back(message.substr(0, found));
    message.remove_prefix(found + literal.size());
    if (isLast) return message.empty() ? std::optional(std::move(arguments)) : std::nullopt;
    format.remove_prefix(at);
    const auto* const directive = std::find_if(kDirectives.begin(), kDirectives.end(),
                                               [&](std::string_view one) { return format.starts_with(one); });
    if (directive == kDirectives.end()) return std::nullopt;
    format.remove_prefix(directive->size());
    isOpen = true;
  }
}

}  // namespace appsync
