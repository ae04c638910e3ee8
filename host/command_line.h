// The command line: commands, their options and their help.
#pragma once

#include <functional>
#include <string>

#include "host/console.h"
#include "host/failure.h"

namespace appsync {

// What is to be done, or what is wrong with the command line.
struct Invocation {
  bool json = false;
  bool quiet = false;
  std::function<int(Console&)> run;  // empty: only `text` is to be printed, or there is a failure
  std::string text;                  // help or version
  std::optional<Failure> failure;
};

Invocation parseCommandLine(int argumentCount, const char* const* arguments);

}  // namespace appsync
