// transvale: the data-migration host. Loads the application-migration
// plug-in, creates its migrator, runs the migration on a worker thread while it
// shows progress, and routes every log line of the process into one log.
#include <malloc.h>
#include <stdlib.h>
#include <unistd.h>

#include <condition_variable>
#include <cstdio>
#include <mutex>
#include <string>
#include <thread>

#include "Host/LogFile.h"
#include "Host/Options.h"
#include "Host/Plugin.h"
#include "Host/Progress.h"
#include "Platform/Preferences.h"
#include "Shared/Support/QSLog.h"

using namespace transvale;

namespace {

constexpr char kSystemRootVariable[] = "QS_SYSTEM_ROOT";
constexpr char kDefaultLogPathInRoot[] = "/private/var/mobile/Library/Logs/Transvale/transvale.log";
// How often the progress display is refreshed while the run goes on.
constexpr std::chrono::milliseconds kProgressInterval(100);

ProgressStyle progressStyleFor(ProgressMode mode) {
  switch (mode) {
    case ProgressMode::Never:
      return ProgressStyle::Silent;
    case ProgressMode::Always:
      return ProgressStyle::Bar;
    case ProgressMode::Auto:
      break;
  }
  return isatty(STDOUT_FILENO) ? ProgressStyle::Bar : ProgressStyle::Lines;
}

// Runs performMigration on a worker thread and shows progress until it ends.
bool runMigration(platform::DataClassMigrator& migrator, ProgressDisplay& display) {
  std::mutex mutex;  // guards finished and result
  std::condition_variable ended;
  bool finished = false;
  bool result = false;
  std::thread worker([&] {
    const bool migrated = migrator.performMigration();
    std::lock_guard<std::mutex> lock(mutex);
    result = migrated;
    finished = true;
    ended.notify_one();
  });
  {
    std::unique_lock<std::mutex> lock(mutex);
    while (!finished) {
      lock.unlock();
      display.update(migrator.migrationProgress());
      lock.lock();
      ended.wait_for(lock, kProgressInterval, [&] { return finished; });
    }
  }
  worker.join();
  display.finish(migrator.migrationProgress());
  return result;
}

}  // namespace

// The migration frees and allocates the same few hundred kilobytes for every
// application (icon surfaces, the PNG encoder's zlib state). Handing them back
// to the kernel at each free and faulting them in again, with a TLB flush on
// every core the process runs on, cost about half its system time; kept for
// reuse instead, they add nothing to the peak.
namespace {
constexpr int kMallocMmapThreshold = 4 << 20;
constexpr int kMallocTrimThreshold = 32 << 20;
}  // namespace

int main(int argc, char** argv) {
  (void)mallopt(M_MMAP_THRESHOLD, kMallocMmapThreshold);  // only a tuning: a refusal changes nothing else
  (void)mallopt(M_TRIM_THRESHOLD, kMallocTrimThreshold);
  int exitCode = kExitUsage;
  std::optional<Options> options = parseOptions(argc, argv, &exitCode);
  if (!options) return exitCode;

  // The root must be in place before anything (this program or the plug-in)
  // reads it.
  if (options->root) setenv(kSystemRootVariable, options->root->c_str(), 1);
  const std::string& systemRoot = platform::systemRootFromEnvironment();

  std::string error;
  const std::string logPath = options->log.value_or(systemRoot + kDefaultLogPathInRoot);
  std::unique_ptr<LogFile> log = LogFile::open(logPath, options->logFormat, &error);
  if (!log) {
    std::fprintf(stderr, "transvale: %s\n", error.c_str());
    return kExitUsage;
  }
  log->installSinks();
  if (options->systemLogLevel) {
    auto* handle = new platform::LogHandle;  // lives for the rest of the process
    handle->level = *options->systemLogLevel;
    gLogHandle.store(handle);
  }

  const std::string pluginPath = options->plugin.value_or(defaultPluginPath());
  std::optional<LoadedPlugin> plugin = loadPlugin(pluginPath, &error);
  if (!plugin) {
    std::fprintf(stderr, "transvale: %s\n", error.c_str());
    return kExitPluginUnusable;
  }
  std::unique_ptr<platform::DataClassMigrator> migrator(plugin->create());
  if (!migrator) {
    std::fprintf(stderr, "transvale: the plug-in %s could not create its migrator; the log %s says why\n",
                 pluginPath.c_str(), logPath.c_str());
    return kExitPluginUnusable;
  }

  const float estimatedDuration = migrator->estimatedDuration();
  std::printf("Data class: %s\n", migrator->dataClassName().c_str());
  std::printf("Estimated duration: %g\n", estimatedDuration);
  std::fflush(stdout);

  ProgressDisplay display(progressStyleFor(options->progress), stdout,
                          entriesForEstimatedDuration(estimatedDuration));
  const bool migrated = runMigration(*migrator, display);

  std::string summary = std::string("transvale: migration ") + (migrated ? "succeeded" : "failed");
  if (auto finished = display.entriesFinished(migrator->migrationProgress())) {
    summary += ", " + std::to_string(*finished) + " of " +
               std::to_string(*entriesForEstimatedDuration(estimatedDuration)) + " entries finished";
  }
  char elapsed[32];
  std::snprintf(elapsed, sizeof elapsed, " in %.2f s", display.elapsedSeconds());
  std::printf("%s%s (log: %s)\n", summary.c_str(), elapsed, logPath.c_str());
  return migrated ? kExitMigrated : kExitMigrationFailed;
}
