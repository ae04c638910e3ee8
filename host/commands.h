// The commands of the program. Each answers the exit status, and has said by then on the console what there is to say.
#pragma once

#include "host/console.h"
#include "host/options.h"

namespace appsync {

int runSync(const SyncOptions& options, Console& console);
int runRestore(const RestoreOptions& options, Console& console);
int runBackup(const BackupOptions& options, Console& console);
int runStatus(const StatusOptions& options, Console& console);
int runClear(const ClearOptions& options, Console& console);
int runSettings(const SettingsOptions& options, Console& console);
int runSeed(const SeedOptions& options, Console& console);
int runPlay(const PlayOptions& options, Console& console);
int runPlist(const PlistOptions& options, Console& console);
int runSample(const SampleOptions& options, Console& console);
int runFaults(Console& console);

}  // namespace appsync
