// The transfer phase of a sync: the packages that the client asked for, sent one after the other in the order of the
// daemon's queue, each piece reported.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "host/host_directory.h"
#include "host/options.h"
#include "host/progress_display.h"
#include "host/session.h"

namespace appsync {

class EmbeddedDeviceService;
class EmbeddedFileManager;
class FileSink;

// The calls on the client are made on the thread that runs the phase.
class Transfers {
 public:
  // Everything must outlive this. `afterEach` runs between two transfers.
  Transfers(Session& session, const HostDirectory& host, const SyncOptions& options, ProgressDisplay& display,
            Console& console, std::function<void()> afterEach);

  // Sends these, unless it is interrupted.
  void run(const std::vector<DovelAssetRef>& assets);

  // Whether every transfer came to an end, a bad one included.
  bool allEnded() const { return _allEnded; }
  // Those whose package arrived, in the order of arrival.
  const std::vector<std::string>& transferred() const { return _transferred; }
  // Why a package did not arrive; none when it did.
  std::optional<std::string> failure(const std::string& identifier) const;

 private:
  struct Package;

  void askForOrder(const std::vector<DovelAssetRef>& assets);
  void beginDisplay(const std::vector<DovelAssetRef>& assets);
  void send(const DovelAssetRef& asset);
  bool sendPieces(const DovelAssetRef& asset, Package& package, ErrorOut error);
  bool sendPiece(const DovelAssetRef& asset, Package& package, std::uint64_t size, ErrorOut error);
  bool isToStop(const std::string& identifier, ErrorOut error);
  bool atHalf(const std::string& identifier, ErrorOut error);
  void waitForRate(const std::string& identifier, const Package& package);
  void report(const DovelAssetRef& asset, double fraction);
  void end(const DovelAssetRef& asset, const std::optional<Error>& error);
  bool isWanted(const std::vector<std::string>& list, const std::string& identifier) const;

  Session& _session;
  const HostDirectory& _host;
  const SyncOptions& _options;
  ProgressDisplay& _display;
  Console& _console;
  const std::function<void()> _afterEach;
  DovelClient& _client;
  EmbeddedDeviceService& _queue;
  EmbeddedFileManager& _files;
  Waiting& _waiting;

  bool _allEnded = true;
  std::vector<std::string> _transferred;
  std::map<std::string, std::string> _failures;
};

}  // namespace appsync
