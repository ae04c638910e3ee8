#include "host/transfers.h"

#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "embedded/coordination.h"
#include "embedded/device_service.h"
#include "embedded/file_manager.h"
#include "embedded/waiting.h"
#include "host/json.h"

namespace appsync {

namespace {

constexpr std::uint64_t kMostReports = 100;  // of one package
constexpr std::uint64_t kSmallestPiece = 64 * 1024;
constexpr auto kPatienceWithAPerson = std::chrono::seconds(2);  // until a request at the device has come through
constexpr std::uint64_t kPackagePart = 1;

Error transferError(std::int64_t code, const std::string& text) {
  return Error(std::string(kTransferErrorDomain), code, text);
}

// A package is reported at its half at the latest, and at most a hundred times.
std::uint64_t pieceSize(std::uint64_t size, std::uint64_t rate) {
  const std::uint64_t smallest = rate == 0 ? kSmallestPiece : std::clamp<std::uint64_t>(rate / 4, 1, kSmallestPiece);
  const std::uint64_t wanted = std::max(smallest, (size + kMostReports - 1) / kMostReports);
  return std::max<std::uint64_t>(std::min(wanted, (size + 1) / 2), 1);
}

}  // namespace

// A package on its way.
struct Transfers::Package {
  OwnedFile source;
  std::uint64_t size = 0;
  std::uint64_t sent = 0;
  bool wasAtHalf = false;
  std::unique_ptr<FileSink> sink;
  std::vector<char> buffer;
  Waiting::Time begin;
};

Transfers::Transfers(Session& session, const HostDirectory& host, const SyncOptions& options, ProgressDisplay& display,
                     Console& console, std::function<void()> afterEach)
    : _session(session),
      _host(host),
      _options(options),
      _display(display),
      _console(console),
      _afterEach(std::move(afterEach)),
      _client(session.client()),
      _queue(session.device().deviceService()),
      _files(session.device().files()),
      _waiting(session.device().waiting()) {}

void Transfers::run(const std::vector<DovelAssetRef>& assets) {
  std::map<std::string, DovelAssetRef> byIdentifier;
  std::vector<std::string> order;
  for (const DovelAssetRef& asset : assets) {
    byIdentifier[asset->identifier()] = asset;
    order.push_back(asset->identifier());
  }
  _queue.setQueue(order);
  askForOrder(assets);
  beginDisplay(assets);
  while (_session.interrupt().signal() == 0) {
    const auto turn = _queue.takeNext();
    if (!turn) break;
    const DovelAssetRef& asset = byIdentifier[turn->identifier];
    if (turn->dropped) {
      end(asset, transferError(kTransferCancelled, "its install was cancelled before its package came"));
    } else {
      send(asset);
    }
    _afterEach();
  }
}

std::optional<std::string> Transfers::failure(const std::string& identifier) const {
  const auto found = _failures.find(identifier);
  return found == _failures.end() ? std::nullopt : std::optional(found->second);
}

// What the person at the device asks for before anything is sent.
void Transfers::askForOrder(const std::vector<DovelAssetRef>& assets) {
  const auto isInSync = [&](const std::string& identifier, const char* option) {
    if (std::any_of(assets.begin(), assets.end(), [&](const auto& one) { return one->identifier() == identifier; })) {
      return true;
    }
    _console.problem(std::string(option) + " " + identifier + " has no effect: no package of it is asked for");
    return false;
  };
  for (const std::string& identifier : _options.cancel) isInSync(identifier, "--cancel");
  for (const std::string& identifier : _options.prioritize) {
    if (!isInSync(identifier, "--prioritize")) continue;
    _session.device().coordination().personPrioritizes(identifier);
    _queue.waitUntilPrioritized(identifier, _waiting, _waiting.now() + kPatienceWithAPerson);
  }
}

void Transfers::beginDisplay(const std::vector<DovelAssetRef>& assets) {
  std::vector<std::pair<std::string, std::string>> names;
  names.reserve(assets.size());
  for (const DovelAssetRef& asset : assets) {
    names.emplace_back(asset->identifier(), asset->prettyName().value_or(asset->identifier()));
  }
  _display.begin(names);
}

void Transfers::send(const DovelAssetRef& asset) {
  const std::string& identifier = asset->identifier();
  const auto begin = std::chrono::system_clock::now();
  std::optional<Error> error;
  Package package;
  package.source = _host.openPackage(identifier, package.size, &error);
  if (package.source && _session.fault("stall", identifier)) {
    report(asset, 0);
    _failures[identifier] = "its transfer never ended";
    _display.failed(identifier, _failures[identifier]);
    _allEnded = false;
    return;
  }
  if (package.source && sendPieces(asset, package, &error)) error.reset();
  package.sink.reset();  // a package that did not arrive whole is gone before its end is reported
  if (TraceFile* trace = _session.trace()) {
    trace->span(identifier, "transfer", begin, {{"bytes", package.sent}, {"of", package.size}, {"success", !error}});
  }
  end(asset, error);
}

bool Transfers::sendPieces(const DovelAssetRef& asset, Package& package, ErrorOut error) {
  const std::string& identifier = asset->identifier();
  if (!_files.createDirectory(kPackageDirectory, true, {}, error)) return false;
  package.sink = _files.openSink(std::string(kPackageDirectory) + "/" + identifier + ".ipa", error);
  if (!package.sink) return false;
  package.buffer.resize(kPieceSize);
  package.begin = _waiting.now();
  const std::uint64_t piece = pieceSize(package.size, _options.rate);
  do {
    if (!sendPiece(asset, package, std::min(piece, package.size - package.sent), error)) return false;
    report(asset, package.size == 0 ? 1.0 : static_cast<double>(package.sent) / static_cast<double>(package.size));
    if (!package.wasAtHalf && package.sent >= package.size - package.sent) {
      package.wasAtHalf = true;
      if (!atHalf(identifier, error)) return false;
    }
  } while (package.sent < package.size);
  return !isToStop(identifier, error) && package.sink->finish(error);
}

// One piece, in as many reads as it takes.
bool Transfers::sendPiece(const DovelAssetRef& asset, Package& package, std::uint64_t size, ErrorOut error) {
  const std::uint64_t end = package.sent + size;
  std::uint64_t most = package.buffer.size();
  if (_options.rate != 0) most = std::clamp<std::uint64_t>(_options.rate / 10, 1, most);
  while (package.sent < end) {
    if (isToStop(asset->identifier(), error)) return false;
    const ssize_t count = ::read(package.source.get(), package.buffer.data(), std::min(most, end - package.sent));
    if (count < 0 && errno == EINTR) continue;
    if (count <= 0) {
      const std::string why = count < 0 ? std::strerror(errno) : "it became shorter meanwhile";
      setError(error, transferError(kTransferBroken, "reading its package from the host failed: " + why));
      return false;
    }
    if (!package.sink->append(package.buffer.data(), static_cast<std::size_t>(count), error)) return false;
    package.sent += static_cast<std::uint64_t>(count);
    waitForRate(asset->identifier(), package);
  }
  return true;
}

bool Transfers::isToStop(const std::string& identifier, ErrorOut error) {
  if (_session.interrupt().signal() != 0) {
    setError(error, transferError(kTransferStopped, "the sync was interrupted"));
  } else if (_queue.isDropped(identifier)) {
    const bool byPerson = isWanted(_options.cancel, identifier);
    setError(error, transferError(kTransferCancelled, byPerson ? "cancelled by the person at the device"
                                                               : "its install was cancelled on the way"));
  } else {
    return false;
  }
  return true;
}

// Half of the package has been sent: what is to happen there. False, with an error, when that is its end.
bool Transfers::atHalf(const std::string& identifier, ErrorOut error) {
  if (const std::optional<Error> broken = _session.fault("transfer", identifier)) {
    setError(error, *broken);
    return false;
  }
  if (isWanted(_options.cancel, identifier)) {
    _session.device().coordination().personCancels(
        identifier, transferError(kTransferCancelled, "cancelled by the person at the device"));
    _queue.waitUntilDropped(identifier, _waiting, _waiting.now() + kPatienceWithAPerson);
  }
  return !isToStop(identifier, error);
}

// Sleeps until this much may have been sent; a transfer that is dropped meanwhile need not wait.
void Transfers::waitForRate(const std::string& identifier, const Package& package) {
  if (_options.rate == 0) return;
  const std::chrono::duration<double> due(static_cast<double>(package.sent) / static_cast<double>(_options.rate));
  constexpr std::chrono::duration<double> kLongest = std::chrono::hours(24 * 365);
  _queue.waitUntilDropped(
      identifier, _waiting,
      package.begin + std::chrono::duration_cast<Waiting::Clock::duration>(std::min(due, kLongest)));
}

void Transfers::report(const DovelAssetRef& asset, double fraction) {
  asset->setIsDownload(true);
  asset->setPath("Packages/" + asset->identifier() + ".ipa");
  asset->setDownloadProgress(static_cast<float>(fraction));
  _display.transferring(asset->identifier(), fraction);
  _client.assetTransferUpdatedProgress(asset, fraction);
}

void Transfers::end(const DovelAssetRef& asset, const std::optional<Error>& error) {
  const std::string& identifier = asset->identifier();
  asset->setIsDownload(true);
  if (error) {
    _failures[identifier] = reasonText(*error);
    _display.failed(identifier, _failures[identifier]);
  } else {
    asset->setPath("Packages/" + identifier + ".ipa");
    asset->setDownloadProgress(1);
    asset->setCompletedAssetParts(kPackagePart);
    _transferred.push_back(identifier);
    _display.installing(identifier);
  }
  _client.assetTransferSucceeded(asset, !error, error);
}

bool Transfers::isWanted(const std::vector<std::string>& list, const std::string& identifier) const {
  return std::find(list.begin(), list.end(), identifier) != list.end();
}

}  // namespace appsync
