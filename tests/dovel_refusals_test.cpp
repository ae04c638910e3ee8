// Whole runs of the program that have to be refused, or to tell of a failure, and what they must leave as it was.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/file.h>
#include <sys/resource.h>

#include <cstdlib>
#include <filesystem>

#include "embedded/disk.h"
#include "tests/support/program.h"

namespace appsync::test {
namespace {

class RefusalsTest : public ProgramTest {};

// From how few files on that it may open the program is tried; a sanitizer cannot do with that few itself.
#if defined(__has_feature)
constexpr int kFewestFiles = __has_feature(address_sanitizer) || __has_feature(thread_sanitizer) ? 13 : 5;
#else
constexpr int kFewestFiles = 5;
#endif

// Runs the program with a limit on how large its files may grow, which it inherits.
Outcome dovelWithLimit(rlim_t largestFile, const Arguments& arguments) {
  rlimit before{};
  ::getrlimit(RLIMIT_FSIZE, &before);
  const rlimit limit{largestFile, before.rlim_max};
  ::setrlimit(RLIMIT_FSIZE, &limit);
  const Outcome run = dovel(arguments);
  ::setrlimit(RLIMIT_FSIZE, &before);
  return run;
}

TEST_F(RefusalsTest, AHostAndADeviceWithinEachOtherAreRefusedAndKept) {
  const std::string host = sampleHost("host", 1, 1);
  ASSERT_EQ(sync(host).status, 0);
  const std::string staging = at("device/var/mobile/Media/PublicStaging");
  fs::copy(host, staging, fs::copy_options::recursive);
  fs::create_directory_symlink(staging, at("link"));
  write(at("script.json"), Json{{"steps", {{{"do", "stage"}, {"host", staging}}}}}.dump());
  const auto before = treeOf(_root);
  const std::vector<Arguments> cases{
      {"sync", "--device", at("device"), staging},
      {"sync", "--device", at("device"), at("link")},
      {"sync", "--device", at("device"), at("device")},
      {"sync", "--device", host + "/ApplicationSync/new/device", host},
      {"restore", "--device", at("device"), staging},
  };
  for (const Arguments& arguments : cases) {
    SCOPED_TRACE(testing::PrintToString(arguments));
    Arguments asked = arguments;
    asked.push_back("--json");
    const Outcome run = dovel(asked);
    EXPECT_EQ(run.status, 3);
    EXPECT_EQ(run.json()["error"]["code"], "host-unusable") << run.out;
    EXPECT_EQ(treeOf(_root), before);
  }
  EXPECT_EQ(dovel({"play", "--device", at("device"), at("script.json")}).status, 3);
  EXPECT_EQ(treeOf(staging).count("ApplicationSync/ApplicationsSync.plist"), 1U);
  for (const std::string& apart : {at("host.device"), host + "/device"}) {
    EXPECT_EQ(dovel({"sync", "--device", apart, host}).status, 0) << apart;
    EXPECT_EQ(dovel({"restore", "--device", apart, host}).status, 0) << apart;
  }
}

TEST_F(RefusalsTest, ARefusedRunChangesNothing) {
  const std::string host = sampleHost("host", 1, 1);
  ASSERT_EQ(sync(host).status, 0);
  ASSERT_EQ(dovel({"settings", "--device", at("busy")}).status, 0);
  const OwnedFile lock(::open(at("busy/lock").c_str(), O_RDWR | O_CLOEXEC));
  ASSERT_EQ(::flock(lock.get(), LOCK_EX), 0);
  write(at("old"), "old");
  write(at("empty.json"), "{}");
  fs::create_symlink(at("old"), at("other name"));
  const std::string device = at("device");
  struct Case {
    Arguments arguments;
    int status;
    std::string code;
  };
  const std::vector<Case> cases{
      {{"status", "--device", device, "--fault", "nonsense"}, 2, "unknown-fault"},
      {{"status", "--device", device, "--log", at("none/log")}, 3, "output-unwritable"},
      {{"settings", "--log=", "--device", device}, 3, "output-unwritable"},
      {{"settings", "--device="}, 2, "command-line"},
      {{"status", "--device", device, "--plugin", at("none.so")}, 3, "plugin-unusable"},
      {{"status", "--device", at("none"), "--log", at("old"), "--trace", at("old2")}, 3, "device-missing"},
      {{"settings", "--device", device, "--plugin", at("none.so")}, 3, "plugin-unusable"},
      {{"settings", "--device", device, "--plugin", ""}, 2, "command-line"},
      {{"settings", "--device", at("none"), "Nonsense"}, 2, "unknown-setting"},
      {{"settings", "--device", device, "--log", at("new"), "--trace", at("./new")}, 2, "command-line"},
      {{"settings", "--device", device, "--log", at("old"), "--trace", at("other name")}, 2, "command-line"},
      {{"settings", "--device", at("busy"), "--log", at("old")}, 3, "device-in-use"},
      {{"settings", "--device", at("busy"), "--trace", at("old")}, 3, "device-in-use"},
      {{"seed", "--device", host, at("empty.json"), "--log", at("old")}, 3, "device-unusable"},
  };
  for (const Case& one : cases) {
    SCOPED_TRACE(testing::PrintToString(one.arguments));
    Arguments arguments = one.arguments;
    arguments.push_back("--json");
    const Outcome run = dovel(arguments);
    EXPECT_EQ(run.status, one.status);
    EXPECT_EQ(run.json()["error"]["code"], one.code) << run.out;
    EXPECT_EQ(contentOf(at("old")), "old");
    EXPECT_FALSE(fs::exists(at("none")) || fs::exists(at("new")));
  }
  EXPECT_EQ(dovel({"status", "--device", device, "--quiet", "--log", at("old"), "--trace", at("trace")}).status, 0);
  EXPECT_EQ(contentOf(at("old")), "");
  EXPECT_EQ(Json::parse(contentOf(at("trace")))["traceEvents"].size(), 1U);
  // A sample is written into a directory that its name says, and numbers are decimal.
  EXPECT_EQ(dovel({"sample", "", "--apps", "1"}).status, 2);
  EXPECT_NE(dovel({"sample", at("old/x")}).err.find("Not a directory"), std::string::npos);
  ASSERT_EQ(dovel({"sample", at("ten"), "--apps", "010"}).status, 0);
  EXPECT_EQ(std::distance(fs::directory_iterator(at("ten/Packages")), {}), 10);
}

TEST_F(RefusalsTest, AFailureOnTheWayIsSaidWithItsCureAndNothingElse) {
  const std::string host = sampleHost("host", 1, 1);
  const std::string backup = at("backup");
  ASSERT_EQ(dovel({"sample", "--backup", backup, "--apps", "2"}).status, 0);
  const Outcome played = play(R"({"steps": [{"do": "supportedDataclasses"}, {"do": "stage", "host": "none"}]})", {});
  EXPECT_EQ(played.status, 3);
  EXPECT_EQ(played.out, "") << "a step before the one that failed was shown";
  EXPECT_EQ(play(R"({"steps": [{"do": "currentSyncAnchor"}]})", {}).out.substr(0, 19), "currentSyncAnchor: ");

  write(at("file"), "");
  const Json error = dovel({"settings", "--device", at("file"), "--json"}).json()["error"];
  EXPECT_EQ(error["hint"], "name another one") << "the cure of the outer error, not what caused it";
  EXPECT_NE(error["message"].dump().find("Not a directory"), std::string::npos);

  ASSERT_EQ(dovel({"settings", "--device", at("device"), "--trace", at("trace")}).status, 0);
  const Outcome cut =
      dovelWithLimit(fs::file_size(at("trace")) - 1, {"settings", "--device", at("device"), "--trace", at("cut")});
  EXPECT_EQ(cut.status, 3) << "only the end of the trace was missing";
  EXPECT_EQ(cut.out, "");

  // A backup that does not fit leaves the lists of the one before.
  ASSERT_EQ(dovel({"restore", "--device", at("device"), "--type", "1", backup}).status, 0);
  const auto lists = treeOf(at("device/var/mobile/Media/TarvoRestore"));
  const Outcome full = dovelWithLimit(1024, {"restore", "--device", at("device"), backup});
  EXPECT_EQ(full.status, 3);
  EXPECT_NE(full.err.find("File too large"), std::string::npos) << full.err;
  EXPECT_EQ(lists.size(), 1U);
  EXPECT_EQ(treeOf(at("device/var/mobile/Media/TarvoRestore")), lists);

  // An output that fails at once lets nothing be shown of the run.
  for (const Arguments& command : std::vector<Arguments>{{"sync", host}, {"restore", backup}}) {
    for (const char* output : {"--log", "--trace"}) {
      Arguments arguments = command;
      arguments.insert(arguments.end(), {"--device", at("device"), output, "/dev/full"});
      const Outcome run = dovel(arguments);
      EXPECT_EQ(run.status, 3) << output;
      EXPECT_EQ(run.out, "") << output;
      EXPECT_NE(run.err.find("\"/dev/full\" cannot be written"), std::string::npos) << run.err;
    }
  }

  for (int files = kFewestFiles; files <= 12; ++files) {
    const std::string line = "(ulimit -n " + std::to_string(files) + "; exec " + kProgram + " sync --quiet --device " +
                             at("device") + " " + host + ") 2>" + at("said");
    const int status = std::system(line.c_str());
    EXPECT_EQ(WIFEXITED(status) ? WEXITSTATUS(status) : -1, 3) << files << " open files";
    EXPECT_NE(contentOf(at("said")).find("Too many open files"), std::string::npos);
  }
}

TEST_F(RefusalsTest, WhatADeviceRepairsIsSaidByEveryCommandAndFailsNone) {
  write(at("empty.json"), "{}");
  write(at("script.json"), R"({"steps": []})");
  fs::create_directories(at("host"));
  ASSERT_EQ(sync(at("host")).status, 0);
  const std::vector<Arguments> commands{
      {"sync", at("host")},       {"restore", at("host")},    {"backup"}, {"clear"}, {"settings"},
      {"seed", at("empty.json")}, {"play", at("script.json")}};
  for (const Arguments& command : commands) {
    SCOPED_TRACE(command.front());
    write(at("device/state/uninstalled.plist"), "junk");
    Arguments arguments = command;
    arguments.insert(arguments.end(), {"--device", at("device"), "--json", "--log", at("log")});
    const Outcome run = dovel(arguments);
    EXPECT_EQ(run.status, 0) << run.err;
    EXPECT_EQ(run.json()["ok"], true);
    EXPECT_NE(run.err.find("uninstalled.plist.damaged"), std::string::npos) << run.err;
    EXPECT_NE(contentOf(at("log")).find("uninstalled.plist.damaged"), std::string::npos) << "said before the beginning";
  }
}

}  // namespace
}  // namespace appsync::test
