// Standard output and standard error of the program.
#pragma once

#include <atomic>
#include <optional>
#include <string>
#include <string_view>

#include "host/failure.h"
#include "host/json_forward.h"

namespace appsync {

// Any thread may write. A line goes out in one write, unless the system takes it in parts: then another thread's line
// may come between. A reader that has gone away is no reason to stop.
class Console {
 public:
  Console(bool json, bool quiet) : _json(json), _quiet(quiet) {}

  bool isJSON() const { return _json; }
  bool isQuiet() const { return _quiet; }
  // Whether a person looks at standard output, and text is to be written there.
  bool isTerminal() const;
  // Columns and rows of that terminal.
  std::size_t columns() const;
  std::size_t rows() const;

  // A line of text for a person: left out with JSON and when it is to be quiet. Made printable.
  void line(std::string_view text);
  // The same, but said when it is to be quiet too, as it tells of a failure.
  void failureLine(std::string_view text);
  // Bytes that draw on the terminal.
  void picture(std::string_view bytes);
  // Bytes as they are, whatever the options say.
  void raw(std::string_view bytes);
  // From now on there are no lines and no pictures: the run is to fail as a whole.
  void mute() { _isMute = true; }
  // The one document of a command, with JSON only. "schema" is put in front.
  void document(const Json& fields);
  // A line on standard error, after the program's name. Made printable.
  void problem(std::string_view text);

  // Says why the command could not be carried out, and answers the exit status for it.
  int fail(const Failure& failure);

  // Why standard output could not be written, other than that nobody reads it any more.
  std::optional<Failure> outputFailure() const;

 private:
  const bool _json;
  const bool _quiet;
  std::atomic<bool> _isMute = false;
  std::atomic<int> _outputError = 0;
};

// Writes all bytes; 0 or the system's error number.
int writeAll(int file, std::string_view bytes);

}  // namespace appsync
