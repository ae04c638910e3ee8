// The system log and the install transaction log of the embedded device: both write to its host's sink.
#pragma once

#include <memory>
#include <string>

#include "embedded/log_sink.h"
#include "platform/install_transaction_log.h"
#include "platform/system_log.h"
#include "platform/thread_annotations.h"

namespace appsync {

// The way to the sink, one call at a time. Any thread.
class SinkAccess {
 public:
  // Null: nobody listens. The sink must outlive this.
  explicit SinkAccess(LogSink* sink) : _sink(sink) {}

  bool isListening();
  void line(LogLevel level, const std::string& category, std::string_view format, std::string message);
  void transaction(TransactionRecord record);

 private:
  Mutex _mutex;
  LogSink* const _sink;
};

// Handles may outlive the log, not the sink.
class EmbeddedLog : public SystemLog {
 public:
  explicit EmbeddedLog(std::shared_ptr<SinkAccess> access) : _access(std::move(access)) {}

  std::shared_ptr<LogHandle> DovelGetLogCategory(std::uint32_t category) override;
  std::shared_ptr<LogHandle> makeLogHandle(const std::string& subsystem, const std::string& category) override;

 private:
  const std::shared_ptr<SinkAccess> _access;
};

// Records are kept by the sink as records; the handle that a client names ends in the same sink, and so gets none.
class EmbeddedTransactionLog : public InstallTransactionLog {
 public:
  explicit EmbeddedTransactionLog(std::shared_ptr<SinkAccess> access) : _access(std::move(access)) {}

  void initializeWithLog(std::shared_ptr<LogHandle> log) override;
  void logStep(std::int32_t step, std::int32_t party, std::int32_t phase, bool success,
               const std::optional<std::string>& bundleID, const std::string& description) override;
  void logScenario(const std::string& scenario, std::int32_t step, bool success,
                   const std::optional<std::string>& bundleID, const std::string& description) override;

 private:
  const std::shared_ptr<SinkAccess> _access;
};

}  // namespace appsync
