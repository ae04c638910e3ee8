// The client's lines in the system log.
#pragma once

#include <array>
#include <memory>
#include <string>
#include <string_view>
#include <utility>

#include "platform/log_format.h"
#include "platform/system_log.h"

namespace appsync {

// The plug-in's own bundle: every line but the type warnings begins with it and a bar.
inline constexpr std::string_view kPluginBundleIdentifier = "com.zelk.kest.Dovel.AppSync";

// The characters that a flag is printed as in the system's lines.
inline char yesOrNo(bool flag) {
  return flag ? 'y' : 'n';
}

// A value: copies write to the same handles, so work that outlives a call takes a copy with it. Any thread.
class ClientLog {
 public:
  explicit ClientLog(SystemLog& log)
      : _lines(log.DovelGetLogCategory(8)),
        _summaries(log.DovelGetLogCategory(15)),
        _types(log.DovelGetLogCategory(0)) {}

  // An ordinary line.
  template <class... Arguments>
  void operator()(LogFormat<std::type_identity_t<Arguments>...> format, const Arguments&... arguments) const {
    write(*_lines, LogLevel::Default, kPluginBundleIdentifier, format.text, arguments...);
  }

  // An ordinary line at error level.
  template <class... Arguments>
  void error(LogFormat<std::type_identity_t<Arguments>...> format, const Arguments&... arguments) const {
    write(*_lines, LogLevel::Error, kPluginBundleIdentifier, format.text, arguments...);
  }

  // One of the few lines that print whole lists, in a category of their own.
  template <class... Arguments>
  void summary(LogFormat<std::type_identity_t<Arguments>...> format, const Arguments&... arguments) const {
    write(*_summaries, LogLevel::Default, kPluginBundleIdentifier, format.text, arguments...);
  }

  // A value of a type that was not expected: at error level, in category 0, without the prefix.
  template <class... Arguments>
  void typeWarning(LogFormat<std::type_identity_t<Arguments>...> format, const Arguments&... arguments) const {
    write(*_types, LogLevel::Error, {}, format.text, arguments...);
  }

 private:
  template <class... Arguments>
  static void write(LogHandle& handle, LogLevel level, std::string_view prefix, std::string_view format,
                    const Arguments&... arguments) {
    if (!handle.isEnabled(level)) return;
    std::string message(prefix);
    if (!prefix.empty()) message += '|';
    // One more than there are, since an array may not be empty.
    const std::array<LogArgument, sizeof...(Arguments) + 1> list{LogArgument(arguments)..., LogArgument(0)};
    handle.write(level, format, message + renderLogFormat(format, list.data()));
  }

  std::shared_ptr<LogHandle> _lines;
  std::shared_ptr<LogHandle> _summaries;
  std::shared_ptr<LogHandle> _types;
};

}  // namespace appsync
