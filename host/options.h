// What the command line asked for.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace appsync {

// Of every command that takes a device.
struct DeviceOptionsGiven {
  std::string device;
  bool json = false;
  bool quiet = false;
  std::optional<std::string> log;  // "-": standard error
  std::optional<std::string> trace;
  std::optional<std::string> plugin;
  std::vector<std::string> faults;
};

struct SyncOptions {
  DeviceOptionsGiven common;
  std::string host;
  std::uint32_t type = 0;
  bool failPhase = false;
  bool reportInstalls = false;
  std::uint64_t rate = 0;  // bytes a second; 0: as fast as possible
  std::vector<std::string> cancel;
  std::vector<std::string> prioritize;
};

struct RestoreOptions {
  DeviceOptionsGiven common;
  std::string backup;
  std::int32_t type = 2;
  std::string hostProcess = "com.zelk.datamigrator";
};

struct BackupOptions {
  DeviceOptionsGiven common;
};

struct StatusOptions {
  DeviceOptionsGiven common;
};

struct ClearOptions {
  DeviceOptionsGiven common;
};

struct SettingsOptions {
  DeviceOptionsGiven common;
  std::optional<std::string> key;
  std::optional<std::string> value;
};

struct SeedOptions {
  DeviceOptionsGiven common;
  std::string file;
};

struct PlayOptions {
  DeviceOptionsGiven common;
  std::string script;
};

struct PlistOptions {
  std::string file;
  std::optional<std::string> to;      // "xml", "binary" or "json"; absent: an outline
  std::optional<std::string> output;  // absent: standard output
};

struct SampleOptions {
  std::string directory;
  bool backup = false;  // a backup directory instead of a host's
  std::uint32_t applications = 8;
  std::uint64_t seed = 1;
};

}  // namespace appsync
