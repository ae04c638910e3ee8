// The ground of the embedded device: files that survive crashes and never lead outside, records, settings,
// notifications, waiting, executors, and the opening, telling and seeding of a whole device.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <climits>
#include <filesystem>
#include <fstream>
#include <map>
#include <set>
#include <thread>

#include "embedded/device.h"
#include "embedded/file_manager.h"
#include "embedded/log.h"
#include "embedded/notifications.h"
#include "embedded/settings.h"
#include "embedded/state_store.h"
#include "embedded/waiting.h"
#include "platform/log_format.h"
#include "platform/queues.h"

namespace appsync {
namespace {

namespace fs = std::filesystem;

Bytes bytesOf(const std::string& text) {
  return Bytes(text.begin(), text.end());
}

class BaseTest : public testing::Test {
 protected:
  BaseTest() {
    std::string pattern = (fs::temp_directory_path() / "appsync-base-XXXXXX").string();
    top = ::mkdtemp(pattern.data());
    root = (top / "device").string();
    fs::create_directories(root + "/var");
  }
  ~BaseTest() override { fs::remove_all(top); }

  std::string read(const std::string& devicePath) {
    Disk disk;
    const auto bytes = EmbeddedFileManager(root, disk).readFile(devicePath, nullptr);
    return bytes ? std::string(bytes->begin(), bytes->end()) : "(none)";
  }
  static void put(const fs::path& path, const std::string& text) {
    fs::create_directories(path.parent_path());
    std::ofstream(path) << text;
  }
  // Everything below a directory, with the sizes of files.
  static std::map<std::string, std::uintmax_t> tree(const fs::path& directory) {
    std::map<std::string, std::uintmax_t> found;
    for (const auto& entry : fs::recursive_directory_iterator(directory)) {
      found[entry.path().string()] = entry.is_regular_file() ? entry.file_size() : 0;
    }
    return found;
  }
  std::size_t temporaryFiles() {
    std::size_t count = 0;
    for (const auto& [path, size] : tree(root)) count += isTemporaryName(fs::path(path).filename().string()) ? 1 : 0;
    return count;
  }

  fs::path top;
  std::string root;
};

// --- files and crashes ----------------------------------------------------------------------------------------------

// From one call on nothing reaches the disk any more, a write half way. What was not flushed then is lost.
class PowerCut : public Disk {
 public:
  explicit PowerCut(int at) : _left(at) {}

  bool happened() const { return _left < 0; }
  // Names that were made, moved or removed in directories that have not been flushed since.
  bool namesAreSafe() const { return _changed.empty(); }
  void loseWhatIsNotFlushed() {
    for (auto& [file, handle] : _written) EXPECT_EQ(::ftruncate(handle.get(), 0), 0);
    _written.clear();
  }

  int openat(int directory, const char* name, int flags, mode_t mode) override {
    if ((flags & O_CREAT) != 0 && !goesOn()) return -1;
    return Disk::openat(directory, name, flags, mode);
  }
  ssize_t write(int file, const void* bytes, std::size_t size) override {
    const bool whole = goesOn();
    if (!whole && _wasRunning) return Disk::write(file, bytes, size / 2);
    if (!whole) return -1;
    _written.insert_or_assign(identity(file), OwnedFile(::dup(file)));
    return Disk::write(file, bytes, size);
  }
  int fsync(int file) override {
    if (!goesOn()) return -1;
    _written.erase(identity(file));
    _changed.erase(identity(file));
    return Disk::fsync(file);
  }
  int mkdirat(int directory, const char* name, mode_t mode) override {
    return goesOn() ? change(directory, Disk::mkdirat(directory, name, mode)) : -1;
  }
  int renameat(int fromDirectory, const char* from, int toDirectory, const char* to) override {
    if (!goesOn()) return -1;
    return change(fromDirectory, change(toDirectory, Disk::renameat(fromDirectory, from, toDirectory, to)));
  }
  int renameat2(int fromDirectory, const char* from, int toDirectory, const char* to, unsigned flags) override {
    if (!goesOn()) return -1;
    return change(fromDirectory, change(toDirectory, Disk::renameat2(fromDirectory, from, toDirectory, to, flags)));
  }
  int unlinkat(int directory, const char* name, int flags) override {
    return goesOn() ? change(directory, Disk::unlinkat(directory, name, flags)) : -1;
  }

 private:
  using Identity = std::pair<dev_t, ino_t>;

  bool goesOn() {
    _wasRunning = _left >= 0;
    if (_left >= 0) --_left;
    if (_left < 0) errno = EIO;
    return _left >= 0;
  }
  static Identity identity(int file) {
    struct stat status {};
    EXPECT_EQ(::fstat(file, &status), 0);
    return {status.st_dev, status.st_ino};
  }
  int change(int directory, int result) {
    if (result == 0 && directory != AT_FDCWD) _changed.insert(identity(directory));
    return result;
  }

  int _left;
  bool _wasRunning = true;
  std::map<Identity, OwnedFile> _written;
  std::set<Identity> _changed;
};

TEST_F(BaseTest, PowerCutLeavesTheOldFileOrTheNew) {
  const std::string oldText = "the old text";
  const std::string newText(100'000, 'n');
  struct Case {
    const char* name;
    std::function<bool(EmbeddedFileManager&)> change;
    std::function<bool()> isOld;
    std::function<bool()> isNew;
  };
  const Case cases[] = {
      {"writeFile", [&](auto& files) { return files.writeFile("/var/a", bytesOf(newText), nullptr); },
       [&] { return read("/var/a") == oldText; }, [&] { return read("/var/a") == newText; }},
      {"createFile",
       [&](auto& files) {
         return files.createFile("/var/a", bytesOf(newText), {"mobile", "mobile"});
       },
       [&] { return read("/var/a") == oldText; }, [&] { return read("/var/a") == newText; }},
      {"copyItem", [&](auto& files) { return files.copyItem("/var/source", "/var/a", nullptr); },
       [&] { return read("/var/a") == oldText; }, [&] { return read("/var/a") == newText; }},
      {"moveItem", [&](auto& files) { return files.moveItem("/var/from", "/var/to", nullptr); },
       [&] { return read("/var/from/inner") == oldText && read("/var/to/inner") == "(none)"; },
       [&] { return read("/var/to/inner") == oldText && read("/var/from/inner") == "(none)"; }},
      {"FileSink",
       [&](auto& files) {
         const auto sink = files.openSink("/var/a", nullptr);
         return sink && sink->append(newText.data(), 10, nullptr) &&
                sink->append(newText.data() + 10, newText.size() - 10, nullptr) && sink->finish(nullptr);
       },
       [&] { return read("/var/a") == oldText; }, [&] { return read("/var/a") == newText; }},
      {"createDirectory", [&](auto& files) { return files.createDirectory("/var/x/y", true, {}, nullptr); },
       [&] { return !fs::exists(root + "/var/x/y"); }, [&] { return fs::is_directory(root + "/var/x/y"); }},
  };
  for (const Case& each : cases) {
    bool cutShort = true;
    for (int at = 0; cutShort; ++at) {
      SCOPED_TRACE(std::string(each.name) + ", power cut at call " + std::to_string(at));
      fs::remove_all(root + "/var");
      put(root + "/var/a", oldText);
      put(root + "/var/source", newText);
      put(root + "/var/from/inner", oldText);
      PowerCut disk(at);
      EmbeddedFileManager files(root, disk);
      const bool done = each.change(files);
      cutShort = disk.happened();
      disk.loseWhatIsNotFlushed();

      Disk real;
      EmbeddedFileManager(root, real).removeLeftTemporaryFiles();
      EXPECT_EQ(temporaryFiles(), 0U);
      EXPECT_TRUE(each.isOld() || each.isNew());
      if (done) {
        EXPECT_TRUE(each.isNew() && disk.namesAreSafe());
      }
      ASSERT_EQ(done, !cutShort);
      ASSERT_LT(at, 50);
    }
  }
}

// One kind of call fails, or does less than it was asked.
class Faulty : public Disk {
 public:
  std::size_t mostAtOnce = SIZE_MAX;
  std::size_t room = SIZE_MAX;
  int flushesThatSucceed = INT_MAX;
  bool renameFails = false;
  bool knowsNoFlags = false;
  std::string stays;
  int flushes = 0;

  ssize_t write(int file, const void* bytes, std::size_t size) override {
    size = std::min({size, mostAtOnce, room});
    if (size == 0) return fail(ENOSPC);
    room -= room == SIZE_MAX ? 0 : size;
    return Disk::write(file, bytes, size);
  }
  int fsync(int file) override {
    ++flushes;
    return flushes > flushesThatSucceed ? fail(EIO) : Disk::fsync(file);
  }
  int renameat(int fromDirectory, const char* from, int toDirectory, const char* to) override {
    return renameFails ? fail(EIO) : Disk::renameat(fromDirectory, from, toDirectory, to);
  }
  int renameat2(int fromDirectory, const char* from, int toDirectory, const char* to, unsigned flags) override {
    return knowsNoFlags ? fail(EINVAL) : Disk::renameat2(fromDirectory, from, toDirectory, to, flags);
  }
  int unlinkat(int directory, const char* name, int flags) override {
    return name == stays ? fail(EBUSY) : Disk::unlinkat(directory, name, flags);
  }

 private:
  static int fail(int errorNumber) {
    errno = errorNumber;
    return -1;
  }
};

TEST_F(BaseTest, FailedWriteLeavesTheOldFileAndNoTemporaryOne) {
  const Bytes text = bytesOf(std::string(1000, 'n'));
  struct Case {
    const char* name;
    std::function<void(Faulty&)> breakIt;
    int code;
    bool isNew;
    int flushes;  // a failed one must not be tried again
  };
  const Case cases[] = {
      {"full disk", [](Faulty& disk) { disk.room = 10; }, ENOSPC, false, 0},
      {"failed flush", [](Faulty& disk) { disk.flushesThatSucceed = 0; }, EIO, false, 1},
      {"failed rename", [](Faulty& disk) { disk.renameFails = true; }, EIO, false, 1},
      {"failed flush of the directory", [](Faulty& disk) { disk.flushesThatSucceed = 1; }, EIO, true, 2},
      {"short writes", [](Faulty& disk) { disk.mostAtOnce = 3; }, 0, true, 2},
  };
  for (const Case& each : cases) {
    SCOPED_TRACE(each.name);
    put(root + "/var/a", "old");
    Faulty disk;
    each.breakIt(disk);
    EmbeddedFileManager files(root, disk);
    std::optional<Error> error;
    EXPECT_EQ(files.writeFile("/var/a", text, &error), each.code == 0);
    EXPECT_EQ(error ? error->code() : 0, each.code);
    EXPECT_EQ(read("/var/a"), each.isNew ? std::string(1000, 'n') : "old");
    EXPECT_EQ(temporaryFiles(), 0U);
    EXPECT_EQ(disk.flushes, each.flushes);
  }
}

// --- files and paths ------------------------------------------------------------------------------------------------

TEST_F(BaseTest, NothingLeadsOutsideOrToTheDevicesOwnRecords) {
  put(top / "outside/secret", "secret");
  put(root + "/state/settings.plist", "record");
  put(root + "/lock", "");
  fs::create_directory_symlink(top / "outside", root + "/var/link");
  fs::create_symlink(top / "outside/secret", root + "/var/file");
  put(root + "/var/source", "source");
  const auto before = tree(top);

  Disk disk;
  EmbeddedFileManager files(root, disk);
  const std::string paths[] = {"/var/link/secret",
                               "/var/../../outside/secret",
                               "/../outside/secret",
                               "/state/settings.plist",
                               "//./state/x",
                               "/lock",
                               "var/source",
                               "",
                               std::string("/var/source\0x", 13)};
  for (const std::string& path : paths) {
    SCOPED_TRACE(path);
    std::optional<Error> error;
    EXPECT_FALSE(files.fileExists(path));
    EXPECT_FALSE(files.readFile(path, &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain(), kFileErrorDomain);
    EXPECT_NE(error->text().find(path), std::string::npos);
    EXPECT_FALSE(files.writeFile(path, bytesOf("x"), nullptr));
    EXPECT_FALSE(files.createFile(path, bytesOf("x"), {}));
    EXPECT_FALSE(files.createDirectory(path, true, {}, nullptr));
    EXPECT_FALSE(files.removeItem(path, nullptr));
    EXPECT_FALSE(files.moveItem(path, "/var/stolen", nullptr));
    EXPECT_FALSE(files.moveItem("/var/source", path, nullptr));
    EXPECT_FALSE(files.copyItem(path, "/var/stolen", nullptr));
    EXPECT_FALSE(files.copyItem("/var/source", path, nullptr));
    EXPECT_FALSE(files.attributesOfItem(path, nullptr));
    EXPECT_NE(files.utimes(path), 0);
    EXPECT_FALSE(files.openSink(path, nullptr));
  }
  EXPECT_FALSE(files.readFile("/var/file", nullptr)) << "a link is not followed at the end of a path either";
  EXPECT_FALSE(files.removeItem("/", nullptr));
  EXPECT_EQ(tree(top), before);

  EXPECT_TRUE(files.removeItem("/var", nullptr));
  EXPECT_FALSE(fs::exists(root + "/var"));
  EXPECT_TRUE(fs::exists(top / "outside/secret")) << "a link that is removed is not followed";
}

TEST_F(BaseTest, ReadsOnlyWhatIsAFileOfBoundedSize) {
  ASSERT_EQ(::mkfifo((root + "/var/pipe").c_str(), 0600), 0);
  put(root + "/var/large", "");
  fs::resize_file(root + "/var/large", kLargestFileRead + 1);
  Disk disk;
  EmbeddedFileManager files(root, disk);
  const std::map<std::string, int> cases = {
      {"/var/pipe", EINVAL}, {"/var/large", EFBIG}, {"/var", EISDIR}, {"/var/none", ENOENT}, {"/var/large/x", ENOTDIR}};
  for (const auto& [path, code] : cases) {
    std::optional<Error> error;
    EXPECT_FALSE(files.readFile(path, &error));
    EXPECT_EQ(error ? error->code() : 0, code) << path;
  }
  EXPECT_EQ(files.treeSize("/"), kLargestFileRead + 1);
}

TEST_F(BaseTest, RemovingTakesTreesOfAnyDepthAndKeepsWhatCannotGo) {
  Disk disk;
  EmbeddedFileManager files(root, disk);
  constexpr int kDepth = 3000;  // more than a process has file handles, and longer than the longest path
  OwnedFile directory = files.openDirectory("/var", nullptr);
  for (int i = 0; i < kDepth; ++i) {
    ASSERT_EQ(::mkdirat(directory.get(), "d", 0755), 0);
    directory = openDirectoryAt(disk, directory.get(), "d");
  }
  EXPECT_TRUE(files.removeItem("/var/d", nullptr));
  EXPECT_TRUE(fs::is_empty(root + "/var"));

  for (const char* path : {"/var/t/a/keep", "/var/t/a/gone", "/var/t/z/gone"}) put(root + path, "x");
  Faulty faulty;
  faulty.stays = "keep";
  std::optional<Error> error;
  EXPECT_FALSE(EmbeddedFileManager(root, faulty).removeItem("/var/t", &error));
  EXPECT_EQ(error ? error->code() : 0, EBUSY);
  const std::map<std::string, std::uintmax_t> left = {
      {root + "/var/t", 0}, {root + "/var/t/a", 0}, {root + "/var/t/a/keep", 1}};
  EXPECT_EQ(tree(root + "/var"), left);
}

TEST_F(BaseTest, MovingNeverReplaces) {
  for (const bool knowsNoFlags : {false, true}) {
    put(root + "/var/from/a", "from");
    put(root + "/var/to/b", "to");
    Faulty disk;
    disk.knowsNoFlags = knowsNoFlags;
    EmbeddedFileManager files(root, disk);
    std::optional<Error> error;
    EXPECT_FALSE(files.moveItem("/var/from", "/var/to", &error));
    EXPECT_EQ(error ? error->code() : 0, EEXIST);
    EXPECT_TRUE(read("/var/from/a") == "from" && read("/var/to/b") == "to");
    EXPECT_TRUE(files.moveItem("/var/from", "/var//./new/", nullptr));
    EXPECT_EQ(read("/var/new/a"), "from");
    fs::remove_all(root + "/var/new");
  }
}

// --- records --------------------------------------------------------------------------------------------------------

TEST_F(BaseTest, RecordsAreFoundByTheirNamesAlone) {
  Disk disk;
  EmbeddedFileManager files(root, disk);
  const std::unique_ptr<StateStore> store = makeFileStateStore(files);
  std::optional<Error> error;
  EXPECT_FALSE(store->load("apps/org.a", &error) || error) << "a record that is missing is no error";
  EXPECT_TRUE(store->remove("apps/org.a", nullptr));
  for (const char* key : {"org.a", "org.a.b", "org", ".tmp-appsync-0123456789abcdef"}) {
    EXPECT_TRUE(store->save(std::string("apps/") + key, "text", nullptr));
  }
  put(root + "/state/apps/org.c.plist.damaged", "x");
  files.removeLeftTemporaryFiles();
  const std::vector<std::string> keys = {".tmp-appsync-0123456789abcdef", "org", "org.a", "org.a.b"};
  EXPECT_EQ(store->keys("apps"), keys);
  for (const char* name : {"", "..", "apps/..", "apps/../x", "/x", "a/b/c", "apps/", "apps/\xff"}) {
    EXPECT_FALSE(store->save(name, "text", nullptr)) << name;
  }
  put(root + "/state/apps/org.plist", "no property list");
  EXPECT_FALSE(store->load("apps/org", &error));
  EXPECT_TRUE(error && error->text().find("org.plist") != std::string::npos);
  EXPECT_FALSE(isSinglePathComponent("\xed\xa0\x80") || isSinglePathComponent("\xc0\xaf") ||
               isSinglePathComponent(std::string(201, 'a')));
  EXPECT_TRUE(isSinglePathComponent("\xf0\x9f\x8d\x8e…ä") && isSinglePathComponent(std::string(200, 'a')));
}

TEST_F(BaseTest, SettingsAnswerForPoliciesAndPlaceholders) {
  Disk disk;
  EmbeddedFileManager files(root, disk);
  const std::unique_ptr<StateStore> store = makeFileStateStore(files);
  EmbeddedSettings settings(*store);
  std::optional<Error> error;
  EXPECT_TRUE(settings.makeVaultryManager()->dovelShouldCreateAppPlaceholdersWithError(&error));
  EXPECT_FALSE(error);
  const std::map<std::pair<std::string, std::string>, bool> texts = {
      {{"AppInstallationAllowed", "2"}, true}, {{"AppRemovalAllowed", "3"}, false},
      {{"AppRemovalAllowed", "yes"}, false},   {{"CreateAppPlaceholders", "no"}, true},
      {{"CreateAppPlaceholders", "0"}, false}, {{"Unknown", "1"}, false}};
  for (const auto& [setting, isGood] : texts) {
    const auto value = EmbeddedSettings::valueFromText(setting.first, setting.second, &error);
    EXPECT_EQ(value.has_value(), isGood) << setting.first << " " << setting.second;
    if (value) {
      EXPECT_TRUE(settings.setValue(setting.first, *value, nullptr));
    }
  }
  EmbeddedSettings later(*store);
  EXPECT_EQ(later.effectiveBoolValueForSetting(TessaFeatureAppInstallationAllowed), TessaBoolean::No);
  EXPECT_EQ(later.effectiveBoolValueForSetting(TessaFeatureAppRemovalAllowed), TessaBoolean::NotSet);
  EXPECT_EQ(later.effectiveBoolValueForSetting("CreateAppPlaceholders"), TessaBoolean::NotSet);
  EXPECT_FALSE(later.makeVaultryManager()->dovelShouldCreateAppPlaceholdersWithError(&error));
  EXPECT_TRUE(error && error->text().find("CreateAppPlaceholders") != std::string::npos);
}

// --- log ------------------------------------------------------------------------------------------------------------

TEST(EmbeddedLogTest, SinkIsCalledOneCallAtATimeAndOnlyWhenItListens) {
  struct Sink : LogSink {
    std::atomic<bool> listening{true};
    int inside = 0;  // unguarded on purpose: a second call at the same time is a race
    std::vector<std::string> messages;
    bool isListening() override { return listening; }
    void line(const LogLine& line) override { add(line.category + " " + line.message); }
    void transaction(const TransactionRecord& record) override { add(record.message()); }
    void add(std::string message) {
      EXPECT_EQ(++inside, 1);
      messages.push_back(std::move(message));
      --inside;
    }
  } sink;
  const auto access = std::make_shared<SinkAccess>(&sink);
  const auto handle = EmbeddedLog(access).DovelGetLogCategory(15);
  EmbeddedTransactionLog transactions(access);
  std::vector<std::thread> threads;
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([&] {
      for (int n = 0; n < 100; ++n) {
        handle->write(LogLevel::Default, "format", "text");
        transactions.logStep(3, 1, 2, true, "org.a", "what");
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(sink.messages.size(), 800U);
  sink.messages.clear();
  handle->write(LogLevel::Error, "format", "text");
  transactions.logStep(3, 1, 2, true, "org.a", "what");
  transactions.logScenario("Orrin restore", 0, false, std::nullopt, "what");
  const std::vector<std::string> expected = {"15 text",
                                             "step=3 party=1 phase=2 success=1 bundle=org.a description=what",
                                             "scenario=Orrin restore step=0 success=0 bundle=(null) description=what"};
  EXPECT_EQ(sink.messages, expected);
  sink.listening = false;
  EXPECT_FALSE(handle->isEnabled(LogLevel::Error));
  handle->write(LogLevel::Error, "format", "text");
  EXPECT_EQ(sink.messages.size(), 3U);
}

// --- executors and waiting ------------------------------------------------------------------------------------------

TEST(ExecutorTest, StrandsKeepTheirOrderAndASeedGivesItAgain) {
  const auto run = [](Executor& executor) {
    Mutex mutex;
    std::vector<std::string> order;
    // Posted by one job, so that nothing is taken before all is there.
    executor.post("first", [&] {
      for (int job = 0; job < 20; ++job) {
        for (const char* strand : {"a", "b", "c"}) {
          executor.post(strand, [&, strand, job] {
            const MutexLock lock(mutex);
            order.push_back(strand + std::to_string(job));
          });
        }
      }
    });
    executor.drain();
    for (const std::string strand : {"a", "b", "c"}) {
      int next = 0;
      for (const std::string& entry : order) {
        if (entry.starts_with(strand)) {
          EXPECT_EQ(entry, strand + std::to_string(next++));
        }
      }
      EXPECT_EQ(next, 20);
    }
    return order;
  };
  const auto threads = makeThreadExecutor(4);
  run(*threads);
  std::atomic<bool> ended{false};
  threads->post("a", [&] {
    threads->post("a", [&] { EXPECT_TRUE(ended) << "two jobs of one strand at the same time"; });
    for (int i = 0; i < 2000; ++i) std::this_thread::yield();
    ended = true;
  });
  threads->drain();
  const auto once = run(*makeSeededExecutor(7));
  EXPECT_EQ(once, run(*makeSeededExecutor(7)));
  EXPECT_NE(once, run(*makeSeededExecutor(8)));
}

TEST(EmbeddedWaitingTest, InterruptEndsEveryWaitAndAllLaterOnes) {
  EmbeddedWaiting waiting;
  const auto deadline = waiting.now() + std::chrono::hours(1);
  std::vector<std::thread> threads;
  std::atomic<int> begun{0};
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([&] {
      Semaphore own;  // gone as soon as its wait is over
      ++begun;
      EXPECT_FALSE(own.wait(waiting, deadline));
    });
  }
  while (begun < 4) std::this_thread::yield();
  waiting.interrupt();
  for (std::thread& thread : threads) thread.join();
  Semaphore semaphore;
  EXPECT_FALSE(semaphore.wait(waiting, deadline));
  semaphore.signal();
  EXPECT_TRUE(semaphore.wait(waiting, deadline)) << "what is ready is answered all the same";
}

TEST(EmbeddedWaitingTest, WakingForNothingEndsNoWait) {
  EmbeddedWaiting waiting;
  std::mutex mutex;
  std::condition_variable condition;
  bool waits = false;
  bool ready = false;
  std::thread waiter([&] {
    std::unique_lock<std::mutex> lock(mutex);
    waits = true;
    EXPECT_TRUE(waiting.wait(lock, condition, waiting.now() + std::chrono::hours(1), [&] { return ready; }));
  });
  const auto wake = [&](bool makeReady) {
    const std::lock_guard<std::mutex> lock(mutex);
    ready = makeReady;
    condition.notify_all();
    return waits;
  };
  while (!wake(false)) std::this_thread::yield();
  for (int i = 0; i < 100; ++i) {
    wake(false);
    std::this_thread::yield();
  }
  wake(true);
  waiter.join();
}

TEST(EmbeddedWaitingTest, FastTimeJumpsOnlyWhenNothingIsToCome) {
  const auto executor = makeThreadExecutor(1);
  EmbeddedWaiting waiting;
  waiting.runFast(*executor);
  Semaphore semaphore;
  const auto begin = waiting.now();
  EXPECT_FALSE(semaphore.wait(waiting, begin + std::chrono::hours(1)));
  EXPECT_GE(waiting.now(), begin + std::chrono::hours(1));
  for (int i = 0; i < 50; ++i) {
    executor->post("a", [&] { executor->post("b", [&] { semaphore.signal(); }); });
    EXPECT_TRUE(semaphore.wait(waiting, waiting.now() + std::chrono::hours(1)));
  }
  EXPECT_LT(waiting.now(), begin + std::chrono::hours(2));
}

// --- notifications --------------------------------------------------------------------------------------------------

TEST_F(BaseTest, NoNotificationRunsAfterItsObserverIsRemoved) {
  struct Observer {
    std::shared_ptr<void> handle{this, [](void*) {}};
    int heard = 0;  // unguarded: a callback after the removal is a race
    bool removesItself = false;
    std::atomic<bool> inside{false};
    std::atomic<bool> removed{false};
    static void hear(NotificationCenter* center, void* observer, const std::string& name, const void*, const void*) {
      auto* self = static_cast<Observer*>(observer);
      ++self->heard;
      if (self->removesItself) center->removeObserver(self->handle, name);
      self->inside = true;
      for (int i = 0; i < 2000; ++i) std::this_thread::yield();
      EXPECT_FALSE(self->removed);
    }
  };
  const auto executor = makeThreadExecutor(2);
  EmbeddedNotificationCenter center(*executor);
  std::vector<std::unique_ptr<Observer>> observers;  // kept, so that a late callback is seen
  for (int i = 0; i < 20; ++i) {
    Observer* observer = observers.emplace_back(std::make_unique<Observer>()).get();
    center.addObserver(observer->handle, Observer::hear, "name", NotificationSuspension::DeliverImmediately);
    for (int n = 0; n < 3; ++n) center.post("name");
    center.post("another name");
    if (i % 2 == 0) executor->drain();
    while (!observer->inside) std::this_thread::yield();
    center.removeObserver(observer->handle, "name");
    observer->removed = true;
    EXPECT_TRUE(i % 2 == 0 ? observer->heard == 3 : observer->heard <= 3);
  }
  Observer selfish;
  selfish.removesItself = true;
  center.addObserver(selfish.handle, Observer::hear, "name", NotificationSuspension::Drop);
  for (int n = 0; n < 3; ++n) center.post("name");
  executor->drain();
  EXPECT_EQ(selfish.heard, 1);
}

// --- the whole device -----------------------------------------------------------------------------------------------

class DeviceTest : public BaseTest {
 protected:
  DeviceTest() { fs::remove_all(root); }

  std::unique_ptr<Device> open(ErrorOut error = nullptr) {
    DeviceOptions options;
    options.directory = root;
    options.timeRunsFast = true;
    return Device::open(options, error);
  }
  void expectRefused(std::int64_t code, const std::string& saying) {
    std::optional<Error> error;
    EXPECT_EQ(open(&error), nullptr);
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain(), kDeviceErrorDomain);
    EXPECT_EQ(error->code(), code);
    EXPECT_NE(error->description().find(saying), std::string::npos) << error->description();
    EXPECT_NE(error->description().find(root), std::string::npos) << error->description();
  }
  PropertyList status() {
    std::optional<Error> error;
    auto status = Device::status(root, &error);
    EXPECT_TRUE(status) << describe(error);
    return status.value_or(PropertyList::dictionary());
  }
};

TEST_F(DeviceTest, MakesAWholeDeviceThatOneProcessAtATimeUses) {
  std::optional<Error> error;
  EXPECT_FALSE(Device::status(root, &error));
  EXPECT_EQ(error ? error->code() : 0, kDeviceMissing);
  EXPECT_FALSE(fs::exists(root)) << "asking makes nothing";

  auto device = open(&error);
  ASSERT_TRUE(device);
  for (const char* path : {"Library/Preferences", "Library/Logs/MediaServices", "Media/PublicStaging",
                           "Media/TarvoRestore", "Containers", "tmp"}) {
    EXPECT_TRUE(fs::is_directory(root + "/var/mobile/" + path)) << path;
  }
  EXPECT_FALSE(fs::exists(root + "/var/mobile/Library/ApplicationSync"));
  expectRefused(kDeviceInUse, "in use");
  const auto before = tree(root);
  const PropertyList whileOpen = status();
  EXPECT_EQ(tree(root), before);
  device.reset();
  EXPECT_TRUE(open());
  EXPECT_EQ(status(), whileOpen);
}

TEST_F(DeviceTest, WhatIsNoDeviceIsLeftAlone) {
  put(root + "/thesis.txt", "years of work");
  const auto before = tree(top);
  expectRefused(kDeviceUnusable, "is no device");
  EXPECT_FALSE(Device::status(root, nullptr));
  EXPECT_EQ(tree(top), before);
  fs::remove_all(root);
  put(root, "a file");
  expectRefused(kDeviceUnusable, "is no directory");
  fs::remove(root);
  put(root + "/state/x.plist", "x");
  put(root + "/var/mobile/tmp", "a file where a directory belongs");
  expectRefused(kDeviceUnusable, "/var/mobile/tmp");
}

TEST_F(DeviceTest, FirstStartThatIsCutShortCanBeDoneAgain) {
  bool cutShort = true;
  for (int at = 0; cutShort; ++at) {
    fs::remove_all(root);
    PowerCut disk(at);
    DeviceOptions options;
    options.directory = root;
    options.disk = &disk;
    std::optional<Error> error;
    const bool opened = Device::open(options, &error) != nullptr;
    cutShort = disk.happened();
    EXPECT_TRUE(opened || (cutShort && error)) << at;
    EXPECT_TRUE(open(&error)) << at << " " << describe(error);
    ASSERT_LT(at, 200);
  }
}

TEST_F(DeviceTest, OneUnreadableRecordDoesNotMakeTheDeviceUnusable) {
  open();
  put(root + "/state/settings.plist", "bplist00 no more");
  put(root + "/state/applications/org.a.plist", "<plist>");
  put(root + "/var/mobile/.tmp-appsync-0123456789abcdef", "left by a crash");
  put(root + "/var/mobile/.tmp-appsync-mine", "somebody's own");
  put(root + "/var/mobile/Containers/1/A.app/data/.tmp-appsync-0123456789abcdef", "the application's own");
  const auto device = open();
  ASSERT_TRUE(device);
  ASSERT_EQ(device->repairs().size(), 2U);
  EXPECT_NE(device->repairs()[1].find("settings.plist.damaged"), std::string::npos) << device->repairs()[1];
  EXPECT_TRUE(fs::exists(root + "/state/applications/org.a.plist.damaged"));
  EXPECT_FALSE(fs::exists(root + "/var/mobile/.tmp-appsync-0123456789abcdef"));
  EXPECT_TRUE(fs::exists(root + "/var/mobile/.tmp-appsync-mine"));
  // The container may be that of the application whose record is damaged, and what it holds is its own.
  EXPECT_TRUE(fs::exists(root + "/var/mobile/Containers/1/A.app/data/.tmp-appsync-0123456789abcdef"));
}

PropertyList dictionary(std::vector<std::pair<std::string, PropertyList>> members) {
  return PropertyList::dictionary(std::move(members));
}

TEST_F(DeviceTest, WhatOneDeviceShowsSeedsAnother) {
  const PropertyList seed = dictionary(
      {{"schema", PropertyList::integer(1)},
       {"ok", true},
       {"installed", PropertyList::array({dictionary({{"identifier", "org.a"}, {"name", "A"}, {"version", "2"}})})},
       {"placeholders", PropertyList::array({dictionary({{"identifier", "org.b"}, {"name", "B"}})})},
       {"coordinators",
        PropertyList::array({dictionary({{"identifier", "org.b"}, {"kind", "initiating"}, {"error", "it died"}})})},
       {"todo", PropertyList::array({dictionary({{"identifier", "org.b"}, {"operation", "install"}}),
                                     dictionary({{"operation", "remove"}})})},
       {"homeScreen", PropertyList::array({"org.b", "org.a"})},
       {"uninstalled", PropertyList::array({"org.gone"})},
       {"syncing", true},
       {"settings", dictionary({{"AppRemovalAllowed", PropertyList::integer(2)}})},
       {"restoreState", dictionary({{"org.b", dictionary({{"1", dictionary({{"path", "/var/b.ipa"}})}})}})},
       {"lastSync", PropertyList::array({"org.a"})}});
  std::optional<Error> error;
  auto device = open();
  ASSERT_TRUE(device && device->seed(seed, &error)) << describe(error);
  device.reset();
  const PropertyList shown = status();
  for (const char* key : {"todo", "homeScreen", "uninstalled", "syncing", "restoreState", "lastSync"}) {
    ASSERT_TRUE(shown.find(key)) << key;
    EXPECT_EQ(*shown.find(key), *seed.find(key));
  }
  for (const char* key : {"installed", "placeholders", "coordinators"}) EXPECT_EQ(shown.find(key)->count(), 1U) << key;
  EXPECT_NE(read("/var/mobile/Library/ApplicationSync/RestoreState.plist").find("<?xml"), std::string::npos);

  fs::remove_all(root);
  device = open();
  ASSERT_TRUE(device && device->seed(shown, &error)) << describe(error);
  device.reset();
  EXPECT_EQ(status().description(), shown.description());
}

TEST_F(DeviceTest, BadSeedChangesNothing) {
  const auto device = open();
  const auto before = tree(root);
  const PropertyList text("text");
  const std::pair<const char*, PropertyList> cases[] = {
      {"unknown", text},
      {"syncing", text},
      {"todo", text},
      {"todo", PropertyList::array({text})},
      {"todo", PropertyList::array({dictionary({{"operation", true}})})},
      {"restoreState", dictionary({{"org.a", dictionary({{"1", text}})}})},
      {"restoreState", dictionary({{"org.a", dictionary({{"1", dictionary({{"path", "\x01"}})}})}})},
      {"lastSync", PropertyList::array({true})},
      {"settings", dictionary({{"AppRemovalAllowed", true}})},
      {"installed", text},
      {"installed", PropertyList::array({dictionary({{"identifier", "../x"}})})},
      {"placeholders", PropertyList::array({dictionary({{"identifier", "a/b"}})})},
      {"coordinators", PropertyList::array({dictionary({{"identifier", "org.a"}, {"kind", "other"}})})},
      {"uninstalled", PropertyList::array({true})},
      {"homeScreen", text},
  };
  for (const auto& [key, value] : cases) {
    std::optional<Error> error;
    EXPECT_FALSE(device->seed(dictionary({{"uninstalled", PropertyList::array({"org.x"})}, {key, value}}), &error));
    ASSERT_TRUE(error) << key;
    EXPECT_EQ(error->code(), kDeviceBadSeed);
    EXPECT_NE(error->text().find(key), std::string::npos) << error->description();
    EXPECT_EQ(tree(root), before) << key;
  }
}

// Other programs have a "state" or a "var" too.
TEST_F(DeviceTest, DirectoriesThatOnlyLookLikeADeviceAreLeftAlone) {
  for (const char* file : {"/state/app.plist", "/var/mobile/notes.txt", "/var/log/messages", "/lock/x"}) {
    fs::remove_all(root);
    put(root + file, "somebody's own");
    const auto before = tree(top);
    expectRefused(kDeviceUnusable, "name an empty or new directory");
    std::optional<Error> error;
    EXPECT_TRUE(!Device::status(root, &error) && error->description().find(root) != std::string::npos) << file;
    EXPECT_EQ(tree(top), before) << file;
  }
  fs::remove_all(root);
  for (const char* directory : {"/state", "/var"}) fs::create_directories(root + directory);
  put(root + "/lock", "");
  EXPECT_TRUE(open()) << "what a first start made that was cut short";
}

}  // namespace
}  // namespace appsync
