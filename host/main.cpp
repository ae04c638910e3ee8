// The program: one command, carried out and reported.
#include <fcntl.h>
#include <unistd.h>

#include <csignal>
#include <exception>
#include <optional>
#include <string>
#include <system_error>

#include "host/command_line.h"
#include "host/console.h"

namespace {

using appsync::Console;
using appsync::Failure;
using appsync::FailureCode;
using appsync::Invocation;

// A file opened later must not become a standard stream that the program was started without.
bool openStandardStreams() {
  for (int file = 0; file <= 2; ++file) {
    if (::fcntl(file, F_GETFD) < 0 && ::open("/dev/null", file == 0 ? O_RDONLY : O_WRONLY) != file) return false;
  }
  return true;
}

int carryOut(const Invocation& invocation, Console& console) {
  if (invocation.failure) return console.fail(*invocation.failure);
  if (!invocation.run) {
    console.raw(invocation.text);
    return appsync::kStatusDone;
  }
  try {
    return invocation.run(console);
  } catch (const std::bad_alloc&) {
    return console.fail({FailureCode::Internal, "there is not enough memory", "free some, or use smaller input"});
  } catch (const std::system_error& error) {
    return console.fail({FailureCode::Internal, std::string("the system refused: ") + error.what(),
                         "raise the limits of processes and open files"});
  } catch (const std::exception& exception) {
    return console.fail({FailureCode::Internal,
                         std::string("something went wrong that should not: ") + exception.what(), "please report it"});
  }
}

}  // namespace

int main(int argumentCount, char** arguments) {
  std::signal(SIGPIPE, SIG_IGN);  // these two are errors of writing, and reported as such
  std::signal(SIGXFSZ, SIG_IGN);
  if (!openStandardStreams()) return appsync::kStatusUnusable;
  const Invocation invocation = appsync::parseCommandLine(argumentCount, arguments);
  Console console(invocation.json, invocation.quiet);
  const int status = carryOut(invocation, console);
  if (const std::optional<Failure> failure = console.outputFailure(); failure && status <= 1) {
    console.problem(failure->message + "; " + failure->hint);
    return appsync::kStatusUnusable;
  }
  return status;
}
