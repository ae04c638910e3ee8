// The registry, installer and home screen of a device on a disk that can fail, and packages to install on it.
#pragma once

#include <stdlib.h>

#include <atomic>
#include <cerrno>
#include <filesystem>
#include <memory>
#include <mutex>
#include <stdexcept>
#include <string>
#include <vector>

#include "embedded/executor.h"
#include "embedded/file_manager.h"
#include "embedded/home_screen.h"
#include "embedded/installer.h"
#include "embedded/registry.h"
#include "embedded/state_store.h"

namespace appsync::test {

// Fails one call, or that one and all that follow, as after a crash: counted are the calls that change something. Any
// thread.
class FailingDisk : public Disk {
 public:
  std::atomic<int> failingCall = 0;  // 1 is the next one; 0: none
  std::atomic<bool> forGood = false;

  ssize_t write(int file, const void* bytes, std::size_t size) override {
    return fails() ? -1 : Disk::write(file, bytes, size);
  }
  int fsync(int /*file*/) override { return fails() ? -1 : 0; }  // no test here outlives its machine
  int mkdirat(int directory, const char* name, mode_t mode) override {
    return fails() ? -1 : Disk::mkdirat(directory, name, mode);
  }
  int renameat(int from, const char* name, int to, const char* newName) override {
    return fails() ? -1 : Disk::renameat(from, name, to, newName);
  }
  int renameat2(int from, const char* name, int to, const char* newName, unsigned flags) override {
    return fails() ? -1 : Disk::renameat2(from, name, to, newName, flags);
  }
  int unlinkat(int directory, const char* name, int flags) override {
    return fails() ? -1 : Disk::unlinkat(directory, name, flags);
  }

 private:
  bool fails() {
    errno = ENOSPC;
    const std::lock_guard<std::mutex> lock(_counting);
    if (failingCall == 0 || failingCall-- > 1) return false;
    failingCall = forGood ? 1 : 0;
    return true;
  }

  std::mutex _counting;
};

struct RegistryDevice {
  RegistryDevice() {
    std::string pattern = (std::filesystem::temp_directory_path() / "appsync-registry-XXXXXX").string();
    if (::mkdtemp(pattern.data()) == nullptr) throw std::runtime_error("no temporary directory");
    root = pattern;
    start();
  }
  ~RegistryDevice() {
    stop();
    std::filesystem::remove_all(root);
  }

  void start() {
    files = std::make_unique<EmbeddedFileManager>(root.string(), disk);
    files->createDirectory("/var/mobile/Media", true, {}, nullptr);
    files->createDirectory(kPlaceholdersDirectory, true, {}, nullptr);
    files->removeLeftTemporaryFiles();
    store = makeFileStateStore(*files);
    executor = makeThreadExecutor(2);
    registry = std::make_unique<EmbeddedRegistry>(*store, *files, *executor);
    installer = std::make_unique<EmbeddedInstaller>(*store, *files, *registry, limits);
    homeScreen = std::make_unique<EmbeddedHomeScreen>(*store, *registry);
  }
  void stop() {
    executor->drain();
    homeScreen.reset();
    installer.reset();
    registry.reset();
    executor.reset();
    store.reset();
  }
  // What the next process finds, the disk being in order again.
  void restart() {
    stop();
    disk.failingCall = 0;
    start();
  }

  bool install(const std::string& bundleID, const Bytes& package, std::optional<Error>* error = nullptr) {
    files->writeFile("/var/mobile/Media/p.ipa", package, nullptr);
    return installer->install(bundleID, "/var/mobile/Media/p.ipa", options, {}, {}, error);
  }
  std::optional<std::string> version(const std::string& bundleID) {
    const auto record = registry->applicationProxyForIdentifier(bundleID, false);
    return record ? record->bundleVersion : std::nullopt;
  }
  std::string text(const std::string& path) {
    const auto bytes = files->readFile(path, nullptr);
    return bytes ? std::string(bytes->begin(), bytes->end()) : "(none)";
  }
  // The names of all containers.
  std::vector<std::string> containers() {
    std::vector<std::string> names = *files->contentsOfDirectory(kContainersDirectory, nullptr);
    std::erase(names, "Placeholders");
    const auto placeholders = files->contentsOfDirectory(kPlaceholdersDirectory, nullptr);
    for (const std::string& name : *placeholders) names.push_back("Placeholders/" + name);
    return names;
  }

  FailingDisk disk;
  PackageLimits limits;
  KilnInstallOptions options;
  std::filesystem::path root;
  std::unique_ptr<EmbeddedFileManager> files;
  std::unique_ptr<StateStore> store;
  std::unique_ptr<Executor> executor;
  std::unique_ptr<EmbeddedRegistry> registry;
  std::unique_ptr<EmbeddedInstaller> installer;
  std::unique_ptr<EmbeddedHomeScreen> homeScreen;
};

}  // namespace appsync::test
