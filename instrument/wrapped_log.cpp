// The system log, the install transaction log, and waiting: the services that are called everywhere.

#include "instrument/wrappers.h"

namespace appsync {

namespace {

class WrappedLogHandle : public LogHandle {
 public:
  WrappedLogHandle(std::shared_ptr<LogHandle> bare, std::string category, Probe& probe)
      : _bare(std::move(bare)), _category(std::move(category)), _probe(probe) {}

  const std::shared_ptr<LogHandle>& bare() const { return _bare; }

  bool isEnabled(LogLevel level) override { return _probe.recorder.wantsFormats() || _bare->isEnabled(level); }
  void write(LogLevel level, std::string_view format, std::string message) override {
    if (_probe.recorder.wantsFormats()) {
      _probe.recorder.add(InstrumentedService::Log,
                          "log " + _category + (level == LogLevel::Error ? " error: " : ": ") + message);
      _probe.recorder.addFormat({_category, level, std::string(format)});
    }
    if (_bare->isEnabled(level)) _bare->write(level, format, std::move(message));
  }

 private:
  const std::shared_ptr<LogHandle> _bare;
  const std::string _category;
  Probe& _probe;
};

class WrappedSystemLog : public SystemLog {
 public:
  WrappedSystemLog(SystemLog& bare, Probe& probe) : _bare(bare), _probe(probe) {}

  std::shared_ptr<LogHandle> DovelGetLogCategory(std::uint32_t category) override {
    return std::make_shared<WrappedLogHandle>(_bare.DovelGetLogCategory(category), std::to_string(category), _probe);
  }
  std::shared_ptr<LogHandle> makeLogHandle(const std::string& subsystem, const std::string& category) override {
    return std::make_shared<WrappedLogHandle>(_bare.makeLogHandle(subsystem, category), subsystem + ":" + category,
                                              _probe);
  }

 private:
  SystemLog& _bare;
  Probe& _probe;
};

class WrappedTransactionLog : public InstallTransactionLog {
 public:
  WrappedTransactionLog(InstallTransactionLog& bare, Probe& probe) : _bare(bare), _probe(probe) {}

  // The bare handle, so that a record is not written down a second time as a line.
  void initializeWithLog(std::shared_ptr<LogHandle> log) override {
    const auto* wrapped = dynamic_cast<const WrappedLogHandle*>(log.get());
    _bare.initializeWithLog(wrapped != nullptr ? wrapped->bare() : log);
  }
  void logStep(std::int32_t step, std::int32_t party, std::int32_t phase, bool success,
               const std::optional<std::string>& bundleID, const std::string& description) override {
    if (_probe.recorder.isRecording()) {
      record(field("step", step) + " " + field("party", party) + " " + field("phase", phase), success, bundleID,
             description);
    }
    _bare.logStep(step, party, phase, success, bundleID, description);
  }
  void logScenario(const std::string& scenario, std::int32_t step, bool success,
                   const std::optional<std::string>& bundleID, const std::string& description) override {
    if (_probe.recorder.isRecording()) {
      record(field("scenario", scenario) + " " + field("step", step), success, bundleID, description);
    }
    _bare.logScenario(scenario, step, success, bundleID, description);
  }

 private:
  void record(const std::string& beginning, bool success, const std::optional<std::string>& bundleID,
              const std::string& description) {
    _probe.recorder.add(InstrumentedService::TransactionLog,
                        "transaction " + beginning + " " + field("success", success) +
                            " bundle=" + bundleID.value_or("(null)") + " description=" + description);
  }

  InstallTransactionLog& _bare;
  Probe& _probe;
};

class WrappedWaiting : public Waiting {
 public:
  WrappedWaiting(Waiting& bare, Probe& probe) : _bare(bare), _probe(probe) {}

  Time now() override { return _bare.now(); }
  bool wait(std::unique_lock<std::mutex>& lock, std::condition_variable& condition, Time deadline,
            const std::function<bool()>& ready) override {
    return _probe.call("wait", Subject::none(), nullptr,
                       [&](ErrorOut) { return _bare.wait(lock, condition, deadline, ready); });
  }

 private:
  Waiting& _bare;
  Probe& _probe;
};

}  // namespace

std::unique_ptr<SystemLog> wrap(SystemLog& bare, Probe& probe) {
  return std::make_unique<WrappedSystemLog>(bare, probe);
}

std::unique_ptr<InstallTransactionLog> wrap(InstallTransactionLog& bare, Probe& probe) {
  return std::make_unique<WrappedTransactionLog>(bare, probe);
}

std::unique_ptr<Waiting> wrap(Waiting& bare, Probe& probe) {
  return std::make_unique<WrappedWaiting>(bare, probe);
}

}  // namespace appsync
