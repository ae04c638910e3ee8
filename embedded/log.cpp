#include "embedded/log.h"

#include <utility>

namespace appsync {

std::string TransactionRecord::message() const {
  const std::string head =
      scenario ? "scenario=" + *scenario + " step=" + std::to_string(step)
               : "step=" + std::to_string(step) + " party=" + std::to_string(party) + " phase=" + std::to_string(phase);
  return head + " success=" + (success ? "1" : "0") + " bundle=" + bundleID.value_or("(null)") +
         " description=" + description;
}

bool SinkAccess::isListening() {
  if (_sink == nullptr) return false;
  const MutexLock lock(_mutex);
  return _sink->isListening();
}

void SinkAccess::line(LogLevel level, const std::string& category, std::string_view format, std::string message) {
  if (_sink == nullptr) return;
  const MutexLock lock(_mutex);
  if (!_sink->isListening()) return;
  _sink->line({std::chrono::system_clock::now(), level, category, format, std::move(message)});
}

void SinkAccess::transaction(TransactionRecord record) {
  if (_sink == nullptr) return;
  const MutexLock lock(_mutex);
  if (!_sink->isListening()) return;
  record.time = std::chrono::system_clock::now();
  _sink->transaction(record);
}

namespace {

class SinkHandle : public LogHandle {
 public:
  SinkHandle(std::shared_ptr<SinkAccess> access, std::string category)
      : _access(std::move(access)), _category(std::move(category)) {}

  bool isEnabled(LogLevel /*level*/) override { return _access->isListening(); }
  void write(LogLevel level, std::string_view format, std::string message) override {
    _access->line(level, _category, format, std::move(message));
  }

 private:
  const std::shared_ptr<SinkAccess> _access;
  const std::string _category;
};

}  // namespace

std::shared_ptr<LogHandle> EmbeddedLog::DovelGetLogCategory(std::uint32_t category) {
  return std::make_shared<SinkHandle>(_access, std::to_string(category));
}

std::shared_ptr<LogHandle> EmbeddedLog::makeLogHandle(const std::string& subsystem, const std::string& category) {
  return std::make_shared<SinkHandle>(_access, subsystem + ":" + category);
}

void EmbeddedTransactionLog::initializeWithLog(std::shared_ptr<LogHandle> /*log*/) {}

void EmbeddedTransactionLog::logStep(std::int32_t step, std::int32_t party, std::int32_t phase, bool success,
                                     const std::optional<std::string>& bundleID, const std::string& description) {
  _access->transaction({{}, std::nullopt, step, party, phase, success, bundleID, description});
}

void EmbeddedTransactionLog::logScenario(const std::string& scenario, std::int32_t step, bool success,
                                         const std::optional<std::string>& bundleID, const std::string& description) {
  _access->transaction({{}, scenario, step, 0, 0, success, bundleID, description});
}

}  // namespace appsync
