// One device with everything around it: outputs, interrupts, services, wrappers, plug-in and client, each made in its
// turn and taken down in the opposite one.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "embedded/device.h"
#include "host/console.h"
#include "host/failure.h"
#include "host/interrupt.h"
#include "host/log_file.h"
#include "host/options.h"
#include "host/plugin_loader.h"
#include "host/trace_file.h"
#include "instrument/instruments.h"

namespace appsync {

struct SessionOptions {
  DeviceOptionsGiven common;
  std::string mainBundleIdentifier = "com.zelk.dovel";
  std::vector<LogSink*> listeners = {};  // hear the log too; must outlive the session
  bool wrapsServices = false;            // the instruments are needed even without a fault
  bool loadsPlugin = true;               // a plug-in that the options name is loaded, and so checked, in any case
  bool opensDevice = true;
};

class Session {
 public:
  // Checks what can be checked, then opens the device and tells on the console what that has repaired. Null, with the
  // failure said: log and trace files are as they were then, made empty where they were not there; of a device that
  // could not be made there may be a part.
  static std::unique_ptr<Session> open(const SessionOptions& options, Console& console, Failure& failure);
  ~Session();
  Session(const Session&) = delete;
  Session& operator=(const Session&) = delete;

  // Makes the client, once. False, with the failure said, when there is none to be had.
  bool makeClient(Failure& failure);
  // The same on a platform that differs from `platform()`.
  bool makeClient(const Platform& platform, Failure& failure);

  // From here on the log and trace files are this run's. Done by `open` when it has opened the device.
  void beginOutputs();

  // Ends the client and then the device's work; after this the outputs are complete. Called again it does nothing.
  // False, with the failure said, when a log or trace file could not be written to its end.
  bool close(Failure& failure);

  // Announces that the daemon's start-up is complete, and returns when all who listen have heard.
  void announceStartup();

  Device& device() { return *_device; }
  DovelClient& client() { return *_client; }
  Interrupt& interrupt() { return _interrupt; }
  // The exit status of a run that amounts to `status` unless it has been interrupted.
  int exitStatus(int status) const { return _interrupt.signal() == 0 ? status : _interrupt.exitStatus(); }
  Instruments* instruments() { return _instruments.get(); }  // null when nothing needs them
  TraceFile* trace() { return _trace.get(); }                // null when none is wanted
  Platform platform();                                       // the one for the client
  // Blocks until no service has work queued or running.
  void drainExecutor();

  // Whether an operation of the host itself is to fail this time.
  std::optional<Error> fault(const std::string& operation, const std::string& identifier);

 private:
  class FanOut;

  Session();
  bool openOutputs(const SessionOptions& options, Console& console, Failure& failure);
  std::optional<Failure> outputFailure() const;  // why the log or the trace cannot be written, if so
  bool openDevice(const SessionOptions& options, Failure& failure);

  Interrupt _interrupt;
  std::unique_ptr<LogFile> _log;
  std::unique_ptr<TraceFile> _trace;
  std::unique_ptr<FanOut> _sink;
  std::optional<Plugin> _plugin;
  std::unique_ptr<Device> _device;
  Executor* _executor = nullptr;  // the device's
  std::unique_ptr<Instruments> _instruments;
  std::unique_ptr<DovelClient> _client;
};

// The failure that an error of the device's domain stands for.
Failure deviceFailure(const std::string& directory, const Error& error);

}  // namespace appsync
