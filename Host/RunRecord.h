// What the host learns while a migration runs: the plug-in's observer calls
// (containers, bytes, outcomes) and the log lines written for each entry. It
// feeds the progress display and the outcome report (--report).
//
// Thread safety: every member may be called from any thread (the run's worker
// and the registry's installation thread write, the main thread reads).
#pragma once

#include <chrono>
#include <cstdint>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "Host/LogFile.h"
#include "Platform/Host/MigrationPlan.h"

namespace transvale {

class RunRecord final : public platform::MigrationObserver {
 public:
  struct Entry {
    std::string identifier;
    std::string path;
    platform::EntryOutcome outcome = platform::EntryOutcome::Failed;
    std::string reason;
    uint64_t filesMoved = 0;
    uint64_t bytesMoved = 0;
    double seconds = 0;
    std::vector<LogRecord> lines;
  };
  // What the progress display shows.
  struct Progress {
    uint64_t containers = 0;  // to migrate, once introspection has ended
    uint64_t containersDone = 0;
    uint64_t bytesTotal = 0;
    uint64_t bytesMoved = 0;
    std::string current;  // identifier (or path) of the entry being worked on
  };
  struct Counts {
    uint64_t migrated = 0, kept = 0, failed = 0, removed = 0;
  };

  void migrationPlanned(uint64_t containers, uint64_t bytes) override;
  void entryStarted(const std::string& identifier, const std::string& path) override;
  void itemsMoved(uint64_t files, uint64_t bytes) override;
  void entryFinished(platform::EntryOutcome outcome, const std::string& reason) override;
  // A log line of the process; it belongs to the entry being worked on.
  void logLine(const LogRecord& record);

  Progress progress() const;
  Counts counts() const;
  std::vector<Entry> entries() const;

  // The outcome report: one JSON document (see docs/transvale.md).
  std::string reportJSON(const std::string& systemRoot, bool succeeded, int exitStatus, double seconds) const;

 private:
  mutable std::mutex mutex_;  // guards everything below
  Progress progress_;
  std::vector<Entry> finished_;
  std::optional<Entry> current_;
  std::chrono::steady_clock::time_point currentStart_;
};

const char* outcomeName(platform::EntryOutcome outcome);

}  // namespace transvale
