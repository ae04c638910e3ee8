// Whole runs of the program through its command line, each in a directory of its own.
#pragma once

#include <gtest/gtest.h>
#include <sys/types.h>

#include <filesystem>
#include <functional>
#include <map>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "platform/property_list.h"

namespace appsync::test {

namespace fs = std::filesystem;
using Json = nlohmann::ordered_json;
using Arguments = std::vector<std::string>;
using Texts = std::vector<std::string>;

struct Outcome {
  int status = -1;  // 1000 and more: ended by a signal
  std::string out;
  std::string err;
  Json json() const { return Json::parse(out, nullptr, false); }
};

extern const std::string kProgram;

// Runs a program to its end; `watch` sees its output as it comes and may send it signals.
Outcome runProgram(const std::string& program, const Arguments& arguments,
                   const std::function<void(pid_t, const std::string&)>& watch = {});
// The same for this project's own.
Outcome dovel(const Arguments& arguments, const std::function<void(pid_t, const std::string&)>& watch = {});
// The same on a terminal of this many columns and rows; `out` is all that it shows.
Outcome dovelOnTerminal(const Arguments& arguments, unsigned short columns, unsigned short rows,
                        const char* kind = "xterm", const std::function<void(pid_t, const std::string&)>& watch = {});

std::string contentOf(const fs::path& path);
void write(const fs::path& path, const std::string& content);
// The files below a directory and what they hold; directories hold "".
std::map<std::string, std::string> treeOf(const fs::path& root);

std::string bytesOf(const PropertyList& list, PropertyListFormat format = PropertyListFormat::XML);
// Entries of a todo list.
PropertyList install(const std::string& identifier);
PropertyList removal(const std::string& identifier);

// The member `key` of every entry, as text ("null" for none).
Texts column(const Json& entries, const char* key);
// The entry of an application.
Json entryOf(const Json& entries, const std::string& identifier);
// The messages of a log, without the plug-in's prefix, and with the application's name in place of arguments left out.
Texts messagesOf(const std::string& log);

class ProgramTest : public testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override { fs::remove_all(_root); }

  std::string at(const std::string& name) const { return _root / name; }

  // A sample host with this many applications.
  std::string sampleHost(const std::string& name, int count, int seed);
  Outcome sync(const std::string& host, Arguments more = {"--json"});
  Json status(const std::string& device = "device");
  // Puts a device into the state that this JSON describes.
  void seed(const std::string& state, const std::string& device = "device");
  Outcome play(const std::string& script, Arguments more = {"--json"});

  fs::path _root;
};

}  // namespace appsync::test
