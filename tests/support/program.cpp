#include "tests/support/program.h"

#include <fcntl.h>
#include <poll.h>
#include <pty.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <regex>
#include <sstream>

namespace appsync::test {

namespace {

int exitStatus(int status) {
  return WIFEXITED(status) ? WEXITSTATUS(status) : 1000 + WTERMSIG(status);
}

}  // namespace

const std::string kProgram = std::string(APPSYNC_BIN_DIR) + "/dovel";

Outcome dovel(const Arguments& arguments, const std::function<void(pid_t, const std::string&)>& watch) {
  return runProgram(kProgram, arguments, watch);
}

Outcome runProgram(const std::string& program, const Arguments& arguments,
                   const std::function<void(pid_t, const std::string&)>& watch) {
  std::array<int, 2> out{};
  std::array<int, 2> err{};
  if (::pipe2(out.data(), O_CLOEXEC) != 0 || ::pipe2(err.data(), O_CLOEXEC) != 0) return {};
  posix_spawn_file_actions_t actions;
  ::posix_spawn_file_actions_init(&actions);
  ::posix_spawn_file_actions_adddup2(&actions, out[1], 1);
  ::posix_spawn_file_actions_adddup2(&actions, err[1], 2);
  std::vector<char*> list{const_cast<char*>(program.c_str())};
  for (const std::string& argument : arguments) list.push_back(const_cast<char*>(argument.c_str()));
  list.push_back(nullptr);
  pid_t process = 0;
  const int failed = ::posix_spawn(&process, program.c_str(), &actions, nullptr, list.data(), environ);
  ::posix_spawn_file_actions_destroy(&actions);
  ::close(out[1]);
  ::close(err[1]);
  Outcome run;
  std::array<pollfd, 2> open{pollfd{out[0], POLLIN, 0}, pollfd{err[0], POLLIN, 0}};
  while (failed == 0 && (open[0].fd >= 0 || open[1].fd >= 0)) {
    ::poll(open.data(), open.size(), -1);
    for (std::size_t i = 0; i < open.size(); ++i) {
      if (open[i].fd < 0 || open[i].revents == 0) continue;
      std::array<char, 4096> bytes{};
      const ssize_t count = ::read(open[i].fd, bytes.data(), bytes.size());
      if (count <= 0) open[i].fd = -1;
      if (count > 0) (i == 0 ? run.out : run.err).append(bytes.data(), static_cast<std::size_t>(count));
      if (watch && count > 0) watch(process, run.out);
    }
  }
  ::close(out[0]);
  ::close(err[0]);
  int status = 0;
  if (failed == 0) ::waitpid(process, &status, 0);
  run.status = exitStatus(status);
  return run;
}

Outcome dovelOnTerminal(const Arguments& arguments, unsigned short columns, unsigned short rows, const char* kind,
                        const std::function<void(pid_t, const std::string&)>& watch) {
  winsize size{};
  size.ws_row = rows;
  size.ws_col = columns;
  std::vector<char*> list{const_cast<char*>(kProgram.c_str())};
  for (const std::string& argument : arguments) list.push_back(const_cast<char*>(argument.c_str()));
  list.push_back(nullptr);
  int terminal = -1;
  const pid_t process = ::forkpty(&terminal, nullptr, nullptr, &size);
  if (process == 0) {
    ::setenv("TERM", kind, 1);
    ::execv(kProgram.c_str(), list.data());
    ::_exit(127);
  }
  Outcome run;
  std::array<char, 4096> bytes{};
  for (ssize_t count = 0; (count = ::read(terminal, bytes.data(), bytes.size())) > 0;) {
    run.out.append(bytes.data(), static_cast<std::size_t>(count));
    if (watch) watch(process, run.out);
  }
  int status = 0;
  ::waitpid(process, &status, 0);
  ::close(terminal);
  run.status = exitStatus(status);
  return run;
}

std::string contentOf(const fs::path& path) {
  std::ifstream file(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(file), {}};
}

void write(const fs::path& path, const std::string& content) {
  fs::create_directories(path.parent_path());
  std::ofstream(path, std::ios::binary | std::ios::trunc) << content;
}

std::string bytesOf(const PropertyList& list, PropertyListFormat format) {
  const Bytes bytes = serializePropertyList(list, format, nullptr).value();
  return {bytes.begin(), bytes.end()};
}

std::map<std::string, std::string> treeOf(const fs::path& root) {
  std::map<std::string, std::string> tree;
  for (const auto& entry : fs::recursive_directory_iterator(root)) {
    tree[entry.path().lexically_relative(root)] = entry.is_regular_file() ? contentOf(entry.path()) : "";
  }
  return tree;
}

PropertyList install(const std::string& identifier) {
  return PropertyList::dictionary({{"identifier", identifier}, {"operation", "install"}, {"version", "1"}});
}

PropertyList removal(const std::string& identifier) {
  return PropertyList::dictionary({{"identifier", identifier}, {"operation", "remove"}});
}

Texts column(const Json& entries, const char* key) {
  Texts values;
  for (const Json& entry : entries)
    values.push_back(entry[key].is_string() ? entry[key].get<std::string>() : entry[key].dump());
  return values;
}

Json entryOf(const Json& entries, const std::string& identifier) {
  for (const Json& entry : entries) {
    if (entry["identifier"] == identifier) return entry;
  }
  return {};
}

Texts messagesOf(const std::string& log) {
  Texts messages;
  std::istringstream lines(log);
  const std::regex form(R"(\d{4}-\d\d-\d\dT\d\d:\d\d:\d\d\.\d{6}Z\t(default|error)\t(8|15|0|transaction)\t[^\t]*)");
  for (std::string line; std::getline(lines, line);) {
    EXPECT_TRUE(std::regex_match(line, form)) << line;
    const std::size_t bar = line.find('|');
    if (bar != std::string::npos) messages.push_back(line.substr(bar + 1));
  }
  return messages;
}

void ProgramTest::SetUp() {
  std::string pattern = fs::temp_directory_path() / "dovel-test-XXXXXX";
  _root = ::mkdtemp(pattern.data());
}

std::string ProgramTest::sampleHost(const std::string& name, int count, int seed) {
  const Outcome made = dovel({"sample", at(name), "--apps", std::to_string(count), "--seed", std::to_string(seed)});
  EXPECT_EQ(made.status, 0) << made.err;
  return at(name);
}

Outcome ProgramTest::sync(const std::string& host, Arguments more) {
  more.insert(more.begin(), {"sync", "--device", at("device"), host});
  return dovel(more);
}

Json ProgramTest::status(const std::string& device) {
  return dovel({"status", "--device", at(device), "--json"}).json();
}

void ProgramTest::seed(const std::string& state, const std::string& device) {
  write(at("seed.json"), state);
  const Outcome run = dovel({"seed", "--device", at(device), at("seed.json")});
  ASSERT_EQ(run.status, 0) << run.err;
}

Outcome ProgramTest::play(const std::string& script, Arguments more) {
  write(at("script.json"), script);
  more.insert(more.begin(), {"play", "--device", at("device"), at("script.json")});
  return dovel(more);
}

}  // namespace appsync::test
