#include "host/session.h"

#include <sys/stat.h>

#include <condition_variable>
#include <filesystem>
#include <mutex>
#include <thread>

#include "embedded/coordination.h"
#include "embedded/notifications.h"
#include "embedded/waiting.h"
#include "instrument/faults.h"

namespace appsync {

namespace {

constexpr char kStartupComplete[] = "com.zelk.dovel.DovelStartupCompleteNotification";
constexpr auto kLongestDelivery = std::chrono::seconds(10);

// Hears an announcement after everybody who has registered before.
struct LastListener {
  std::mutex mutex;
  std::condition_variable condition;
  bool heard = false;
};

// Whether two paths lead to one plain file, which may have to be made yet.
bool areOneFile(const std::string& one, const std::string& other) {
  struct stat first {};
  struct stat second {};
  const bool isThere = ::stat(one.c_str(), &first) == 0;
  if (isThere != (::stat(other.c_str(), &second) == 0)) return false;
  if (isThere) return S_ISREG(first.st_mode) && first.st_dev == second.st_dev && first.st_ino == second.st_ino;
  const auto placeOf = [](const std::string& path) {
    std::error_code unknown;
    return std::filesystem::weakly_canonical(std::filesystem::absolute(path, unknown), unknown);
  };
  return one == other || (!placeOf(one).empty() && placeOf(one) == placeOf(other));
}

}  // namespace

// Passes the log on to everybody who listens, to the files first: when one of them fails, so will the run, and nothing
// more is shown of it.
class Session::FanOut : public LogSink {
 public:
  FanOut(Session& session, std::vector<LogSink*> listeners, Console& console)
      : _session(session), _listeners(std::move(listeners)), _console(console) {}

  bool isListening() override { return !_listeners.empty() || _session._log || _session._trace; }
  void line(const LogLine& line) override {
    if (_session._log) _session._log->line(line);
    muteAfterFailure();
    for (LogSink* listener : _listeners) listener->line(line);
  }
  void transaction(const TransactionRecord& record) override {
    if (_session._log) _session._log->transaction(record);
    if (_session._trace) _session._trace->transaction(record);
    muteAfterFailure();
    for (LogSink* listener : _listeners) listener->transaction(record);
  }

 private:
  void muteAfterFailure() {
    if (_session.outputFailure()) _console.mute();
  }

  Session& _session;
  const std::vector<LogSink*> _listeners;
  Console& _console;
};

Session::Session() = default;

std::unique_ptr<Session> Session::open(const SessionOptions& options, Console& console, Failure& failure) {
  Faults trial;
  for (const std::string& spec : options.common.faults) {
    std::optional<Error> error;
    if (trial.add(spec, false, std::nullopt, &error)) continue;
    failure = failureFrom(FailureCode::UnknownFault, *error, "\"dovel faults\" lists the names");
    return nullptr;
  }
  const auto& log = options.common.log;
  const auto& trace = options.common.trace;
  if (log && trace && log != "-" && areOneFile(*log, *trace)) {
    failure = {FailureCode::CommandLine, "--log and --trace both name \"" + *log + "\"", "give each a file of its own"};
    return nullptr;
  }
  std::unique_ptr<Session> session(new Session);
  // To open a pipe that nobody reads yet takes until somebody does: a signal meanwhile ends the program itself.
  if (!session->openOutputs(options, console, failure) || !session->_interrupt.start(failure)) return nullptr;
  if (options.loadsPlugin || options.common.plugin) {
    session->_plugin = Plugin::load(options.common.plugin, failure);
    if (!session->_plugin) return nullptr;
  }
  if (!options.opensDevice) return session;
  if (!session->openDevice(options, failure)) return nullptr;
  session->beginOutputs();
  if (session->outputFailure()) console.mute();
  for (const std::string& repair : session->device().repairs()) console.problem(repair);
  return session;
}

Session::~Session() {
  Failure ignored;
  close(ignored);
}

bool Session::openOutputs(const SessionOptions& options, Console& console, Failure& failure) {
  if (options.common.log) {
    _log = LogFile::open(*options.common.log, failure);
    if (!_log) return false;
  }
  if (options.common.trace) {
    _trace = TraceFile::open(*options.common.trace, failure);
    if (!_trace) return false;
  }
  _sink = std::make_unique<FanOut>(*this, options.listeners, console);
  return true;
}

std::optional<Failure> Session::outputFailure() const {
  std::optional<Failure> failure = _log ? _log->writeFailure() : std::nullopt;
  return failure || !_trace ? failure : _trace->writeFailure();
}

bool Session::openDevice(const SessionOptions& options, Failure& failure) {
  DeviceOptions wanted;
  wanted.directory = options.common.device;
  wanted.mainBundleIdentifier = options.mainBundleIdentifier;
  wanted.sink = _sink.get();
  wanted.executor = [this] {
    auto executor = makeThreadExecutor(std::max(2U, std::min(8U, std::thread::hardware_concurrency())));
    _executor = executor.get();
    return executor;
  };
  std::optional<Error> error;
  _device = Device::open(wanted, &error);
  if (!_device) {
    failure = deviceFailure(options.common.device, *error);
    return false;
  }
  if (options.wrapsServices || !options.common.faults.empty()) {
    _instruments = std::make_unique<Instruments>(_device->platform());
    for (const std::string& spec : options.common.faults) _instruments->addFault(spec, nullptr);
    _device->coordination().setInstallGate(
        [query = _instruments->faultQuery()](const std::string& bundleID) { return query("install", bundleID); });
  }
  _interrupt.setHandler([this] { _device->waiting().interrupt(); });
  return true;
}

Platform Session::platform() {
  return _instruments ? _instruments->platform() : _device->platform();
}

bool Session::makeClient(Failure& failure) {
  return makeClient(platform(), failure);
}

bool Session::makeClient(const Platform& platform, Failure& failure) {
  _client = _plugin->makeClient(platform, failure);
  return _client != nullptr;
}

void Session::announceStartup() {
  const auto listener = std::make_shared<LastListener>();
  EmbeddedNotificationCenter& center = _device->notificationCenter();
  center.addObserver(
      listener,
      [](NotificationCenter*, void* observer, const std::string&, const void*, const void*) {
        auto* self = static_cast<LastListener*>(observer);
        const std::lock_guard<std::mutex> lock(self->mutex);
        self->heard = true;
        self->condition.notify_all();
      },
      kStartupComplete, NotificationSuspension::DeliverImmediately);
  center.post(kStartupComplete);
  Waiting& waiting = _device->waiting();
  {
    std::unique_lock<std::mutex> lock(listener->mutex);
    waiting.wait(lock, listener->condition, waiting.now() + kLongestDelivery, [&] { return listener->heard; });
  }
  center.removeObserver(listener, kStartupComplete);
}

void Session::drainExecutor() {
  _executor->drain();
}

std::optional<Error> Session::fault(const std::string& operation, const std::string& identifier) {
  return _instruments ? _instruments->faultQuery()(operation, identifier) : std::nullopt;
}

void Session::beginOutputs() {
  if (_log) _log->begin();
  if (_trace) _trace->begin();
}

bool Session::close(Failure& failure) {
  _client.reset();
  if (_device) {
    _device->coordination().setEventListener(nullptr);
    _device->drain();
  }
  _interrupt.setHandler(nullptr);
  _instruments.reset();
  _device.reset();
  if (_trace) _trace->finish();
  const std::optional<Failure> unwritten = outputFailure();
  _trace.reset();
  _log.reset();
  if (unwritten) failure = *unwritten;
  return !unwritten;
}

Failure deviceFailure(const std::string& directory, const Error& error) {
  FailureCode code = FailureCode::DeviceUnusable;
  std::string hint = "name another directory with --device, or mend this one";
  if (error.domain() == kDeviceErrorDomain) {
    if (error.code() == kDeviceInUse) {
      code = FailureCode::DeviceInUse;
      hint = "wait until the other process has ended";
    } else if (error.code() == kDeviceMissing) {
      code = FailureCode::DeviceMissing;
      hint = "name the directory of a device with --device";
    } else if (error.code() == kDeviceBadSeed) {
      code = FailureCode::SeedRefused;
      hint = "mend the entry";
    }
  }
  Failure failure = failureFrom(code, error, hint);
  if (failure.message.find(directory) == std::string::npos && code != FailureCode::SeedRefused) {
    failure.message = "the device \"" + directory + "\": " + failure.message;
  }
  return failure;
}

}  // namespace appsync
