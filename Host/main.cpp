// transvale: the data-migration host. Loads the application-migration
// plug-in, creates its migrator, runs the migration on a worker thread while it
// shows progress, and routes every log line of the process into one log. With
// --plan it asks the plug-in for a dry run instead and prints the plan.
#include <fcntl.h>
#include <malloc.h>
#include <pthread.h>
#include <signal.h>
#include <stdlib.h>
#include <unistd.h>

#include <cerrno>
#include <condition_variable>
#include <cstring>
#include <cstdio>
#include <filesystem>
#include <mutex>
#include <string>
#include <thread>

#include "Host/LogFile.h"
#include "Host/Options.h"
#include "Host/PlanOutput.h"
#include "Host/Plugin.h"
#include "Host/Progress.h"
#include "Host/RunRecord.h"
#include "Platform/Preferences.h"
#include "Shared/Support/QSGlobalConfiguration.h"
#include "Shared/Support/QSLog.h"

using namespace transvale;

namespace {

constexpr char kSystemRootVariable[] = "QS_SYSTEM_ROOT";
constexpr char kDefaultLogPathInRoot[] = "/private/var/mobile/Library/Logs/Transvale/transvale.log";
constexpr char kTemporarySuffix[] = ".tmp";
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
  return isatty(STDERR_FILENO) ? ProgressStyle::Bar : ProgressStyle::Lines;
}

ProgressSample sampleOf(platform::DataClassMigrator& migrator, const RunRecord& record) {
  const RunRecord::Progress progress = record.progress();
  return {migrator.migrationProgress(), progress.containers, progress.containersDone, progress.bytesTotal,
          progress.bytesMoved, progress.current};
}

// Runs performMigration on a worker thread and shows progress until it ends.
bool runMigration(platform::DataClassMigrator& migrator, ProgressDisplay& display, const RunRecord& record) {
  std::mutex mutex;  // guards finished and result
  std::condition_variable ended;
  bool finished = false;
  bool result = false;
  // The window-size signal is for this thread: its next redraw then has the
  // new width, and no system call of the migration is interrupted by it. The
  // worker, and every thread it starts, inherits the blocked signal.
  sigset_t windowChange, previousMask;
  sigemptyset(&windowChange);
  sigaddset(&windowChange, SIGWINCH);
  pthread_sigmask(SIG_BLOCK, &windowChange, &previousMask);
  std::thread worker([&] {
    const bool migrated = migrator.performMigration();
    std::lock_guard<std::mutex> lock(mutex);
    result = migrated;
    finished = true;
    ended.notify_one();
  });
  pthread_sigmask(SIG_SETMASK, &previousMask, nullptr);
  {
    std::unique_lock<std::mutex> lock(mutex);
    while (!finished) {
      lock.unlock();
      display.update(sampleOf(migrator, record));
      lock.lock();
      ended.wait_for(lock, kProgressInterval, [&] { return finished; });
    }
  }
  worker.join();
  display.finish(sampleOf(migrator, record));
  return result;
}

// Writes `text` to `path` atomically: a temporary file beside it, flushed,
// renamed over it, and the directory flushed.
bool writeFileAtomically(const std::string& path, const std::string& text, std::string* error) {
  const std::string temporary = path + kTemporarySuffix;
  const int fd = ::open(temporary.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  bool ok = fd >= 0;
  for (size_t written = 0; ok && written < text.size();) {
    const ssize_t n = ::write(fd, text.data() + written, text.size() - written);
    if (n < 0 && errno == EINTR) continue;
    ok = n > 0;
    if (ok) written += static_cast<size_t>(n);
  }
  ok = ok && ::fsync(fd) == 0;
  if (fd >= 0) ok = ::close(fd) == 0 && ok;
  ok = ok && ::rename(temporary.c_str(), path.c_str()) == 0;
  if (!ok) {
    *error = "cannot write the report " + path + ": " + std::strerror(errno);
    ::unlink(temporary.c_str());
    return false;
  }
  const std::string directory = std::filesystem::path(path).parent_path().string();
  const int dirFD = ::open(directory.empty() ? "." : directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (dirFD >= 0) {
    (void)::fsync(dirFD);  // the report is in place; a lost flush only risks it after a power cut
    ::close(dirFD);
  }
  return true;
}

int runPlan(const LoadedPlugin& plugin, const Options& options) {
  if (!plugin.plan) {
    std::fprintf(stderr, "transvale: the plug-in %s cannot make a plan (it has no entry point %s)\n",
                 plugin.path.c_str(), kMigrationPlanEntryPoint);
    return kExitPluginUnusable;
  }
  std::unique_ptr<platform::MigrationPlan> plan(plugin.plan());
  if (!plan) {
    std::fprintf(stderr, "transvale: the plug-in %s could not read the old layout%s\n", plugin.path.c_str(),
                 options.log ? "; the log says why" : "; run again with --log - to see why");
    return kExitPluginUnusable;
  }
  const std::string text = options.json ? planJSON(*plan) : planText(*plan);
  std::fwrite(text.data(), 1, text.size(), stdout);
  return kExitMigrated;
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
  // A plan changes nothing on disk, so it writes no log unless asked to.
  const std::string logPath = options->log.value_or(systemRoot + kDefaultLogPathInRoot);
  std::unique_ptr<LogFile> log = options->plan && !options->log
                                     ? LogFile::discarding(options->logFormat)
                                     : LogFile::open(logPath, options->logFormat, &error);
  if (!log) {
    std::fprintf(stderr, "transvale: %s\n", error.c_str());
    return kExitUsage;
  }
  RunRecord record;
  log->setListener([&record](const LogRecord& line) { record.logLine(line); });
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
  if (options->plan) return runPlan(*plugin, *options);

  if (plugin->setObserver) plugin->setObserver(&record);
  std::unique_ptr<platform::DataClassMigrator> migrator(plugin->create());
  if (!migrator) {
    std::fprintf(stderr, "transvale: the plug-in %s could not create its migrator; the log %s says why\n",
                 pluginPath.c_str(), logPath.c_str());
    return kExitPluginUnusable;
  }

  const float estimatedDuration = migrator->estimatedDuration();
  const std::optional<unsigned long> entries = entriesForEstimatedDuration(estimatedDuration);
  std::printf("Data class: %s\n", migrator->dataClassName().c_str());
  std::printf("Estimated duration: %g s\n", estimatedDuration);
  if (entries && *entries == 0) {
    std::printf("transvale: no old application layout under %s (nothing in %s); only safe harbors and the system "
                "version are taken care of\n",
                systemRoot.empty() ? "/" : systemRoot.c_str(),
                QSGlobalConfiguration::sharedInstance().oldContainerPath().path().c_str());
  }
  std::fflush(stdout);

  ProgressDisplay display(progressStyleFor(options->progress), stderr, entries);
  const bool migrated = runMigration(*migrator, display, record);
  const int status = migrated ? kExitMigrated : kExitMigrationFailed;
  const double seconds = display.elapsedSeconds();

  const RunRecord::Counts counts = record.counts();
  std::printf(
      "transvale: migration %s: %llu migrated, %llu kept, %llu failed, %llu removed%s in %.2f s (log: %s)\n",
      migrated ? "succeeded" : "failed", static_cast<unsigned long long>(counts.migrated),
      static_cast<unsigned long long>(counts.kept), static_cast<unsigned long long>(counts.failed),
      static_cast<unsigned long long>(counts.removed),
      entries ? (" of " + std::to_string(*entries) + " entries").c_str() : "", seconds, logPath.c_str());
  if (options->report) {
    if (!writeFileAtomically(*options->report,
                             record.reportJSON(systemRoot.empty() ? "/" : systemRoot, migrated, status, seconds),
                             &error)) {
      std::fprintf(stderr, "transvale: %s\n", error.c_str());
    }
  }
  return status;
}
