// A client on an embedded device behind the instruments, in a directory of its own: what most tests run in.
#pragma once

#include <gtest/gtest.h>

#include <filesystem>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "client/apps_client.h"
#include "embedded/coordination.h"
#include "embedded/device.h"
#include "embedded/file_manager.h"
#include "instrument/instruments.h"
#include "platform/property_list.h"

namespace appsync::test {

// A property list from JSON: objects, arrays, strings, booleans and numbers. A text that is no JSON fails the test.
PropertyList plist(const std::string& json);

class TemporaryDirectory {
 public:
  TemporaryDirectory();
  ~TemporaryDirectory();
  const std::filesystem::path& path() const { return _path; }

 private:
  std::filesystem::path _path;
};

class World {
 public:
  // `host` is the process that hosts the client; time runs fast, so no wait takes longer than the work it waits for.
  explicit World(const std::string& host = "com.zelk.dovel");
  ~World();

  Device& device() { return *_device; }
  Instruments& instruments() { return *_instruments; }
  AppsClient& client() { return *_client; }
  void destroyClient() { _client.reset(); }

  void seed(const std::string& json);
  void fault(const std::string& spec);
  void put(const std::string& devicePath, const PropertyList& value);
  void putText(const std::string& devicePath, const std::string& text);
  bool exists(const std::string& devicePath) { return _device->files().fileExists(devicePath); }
  std::optional<PropertyList> get(const std::string& devicePath);

  // Puts a todo list (JSON) into the work area, and reads it back as "id=OPERATION …".
  void putTodo(const std::string& json);
  std::string todo();
  // Stages a directory for an application in the work area: Info.plist, store metadata and, if wanted, an icon.
  void putApp(const std::string& id, const std::string& infoJson, bool icon = true);

  // Waits until no worker has anything to do.
  void settle();
  // What this thread did while `work` ran: calls, log lines and transaction records, in order.
  std::string transcript(const std::function<void()>& work);
  // The log lines and transaction records alone: this thread's, and behind them, if wanted, the others'.
  std::string logLines(const std::function<void()>& work, bool everyThread = false);

  DovelAssetRef asset(const std::string& id, const std::string& path = "");

 private:
  TemporaryDirectory _directory;
  Executor* _executor = nullptr;  // the device's
  std::unique_ptr<Device> _device;
  std::unique_ptr<Instruments> _instruments;
  std::unique_ptr<AppsClient> _client;
};

// Compares with tests/transcripts/NAME.txt; with APPSYNC_UPDATE_TRANSCRIPTS in the environment writes it instead, for
// a person to read.
void expectTranscript(const std::string& name, const std::string& transcript);

}  // namespace appsync::test
