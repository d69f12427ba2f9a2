#include "Host/RunRecord.h"

#include "Platform/Foundation/Json.h"

namespace transvale {

namespace {

constexpr int kReportFormatVersion = 1;
// A migrated entry's report keeps only the lines that say something went
// wrong (level 3 and below); any other entry keeps every line.
constexpr int kFailureLevel = 3;

}  // namespace

const char* outcomeName(platform::EntryOutcome outcome) {
  switch (outcome) {
    case platform::EntryOutcome::Migrated:
      return "migrated";
    case platform::EntryOutcome::Kept:
      return "kept";
    case platform::EntryOutcome::Failed:
      return "failed";
    case platform::EntryOutcome::Removed:
      return "removed";
  }
  return "failed";
}

void RunRecord::migrationPlanned(uint64_t containers, uint64_t bytes) {
  std::lock_guard lock(mutex_);
  progress_.containers = containers;
  progress_.bytesTotal = bytes;
}

void RunRecord::entryStarted(const std::string& identifier, const std::string& path) {
  std::lock_guard lock(mutex_);
  // An entry introspection let through starts again when it is migrated;
  // what was recorded for it so far is replaced.
  current_ = Entry{identifier, path, platform::EntryOutcome::Failed, {}, 0, 0, 0, {}};
  currentStart_ = std::chrono::steady_clock::now();
  progress_.current = identifier.empty() ? path : identifier;
}

void RunRecord::itemsMoved(uint64_t files, uint64_t bytes) {
  std::lock_guard lock(mutex_);
  progress_.bytesMoved += bytes;
  if (!current_) return;
  current_->filesMoved += files;
  current_->bytesMoved += bytes;
}

void RunRecord::entryFinished(platform::EntryOutcome outcome, const std::string& reason) {
  std::lock_guard lock(mutex_);
  if (!current_) return;
  current_->outcome = outcome;
  current_->reason = reason;
  if (current_->reason.empty() && outcome != platform::EntryOutcome::Migrated) {
    // The first failure line says why.
    for (const LogRecord& line : current_->lines) {
      if (line.level <= kFailureLevel) {
        current_->reason = line.message;
        break;
      }
    }
  }
  if (outcome == platform::EntryOutcome::Migrated) {
    std::erase_if(current_->lines, [](const LogRecord& line) { return line.level > kFailureLevel; });
  }
  current_->seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - currentStart_).count();
  if (outcome != platform::EntryOutcome::Removed) ++progress_.containersDone;
  finished_.push_back(std::move(*current_));
  current_.reset();
  progress_.current.clear();
}

void RunRecord::logLine(const LogRecord& record) {
  std::lock_guard lock(mutex_);
  if (current_) current_->lines.push_back(record);
}

RunRecord::Progress RunRecord::progress() const {
  std::lock_guard lock(mutex_);
  return progress_;
}

RunRecord::Counts RunRecord::counts() const {
  std::lock_guard lock(mutex_);
  Counts counts;
  for (const Entry& entry : finished_) {
    switch (entry.outcome) {
      case platform::EntryOutcome::Migrated: ++counts.migrated; break;
      case platform::EntryOutcome::Kept: ++counts.kept; break;
      case platform::EntryOutcome::Failed: ++counts.failed; break;
      case platform::EntryOutcome::Removed: ++counts.removed; break;
    }
  }
  return counts;
}

std::vector<RunRecord::Entry> RunRecord::entries() const {
  std::lock_guard lock(mutex_);
  return finished_;
}

std::string RunRecord::reportJSON(const std::string& systemRoot, bool succeeded, int exitStatus,
                                  double seconds) const {
  const std::vector<Entry> all = entries();
  const Counts total = counts();
  uint64_t files = 0, bytes = 0;
  for (const Entry& entry : all) {
    files += entry.filesMoved;
    bytes += entry.bytesMoved;
  }
  platform::JsonWriter json(true);
  json.beginObject();
  json.key("formatVersion").number(kReportFormatVersion);
  json.key("systemRoot").string(systemRoot);
  json.key("succeeded").boolean(succeeded);
  json.key("exitStatus").number(exitStatus);
  json.key("durationSeconds").real(seconds);
  json.key("totals").beginObject();
  json.key("entries").number(static_cast<uint64_t>(all.size()));
  json.key("migrated").number(total.migrated);
  json.key("kept").number(total.kept);
  json.key("failed").number(total.failed);
  json.key("removed").number(total.removed);
  json.key("filesMoved").number(files);
  json.key("bytesMoved").number(bytes);
  json.endObject();
  json.key("entries").beginArray();
  for (const Entry& entry : all) {
    json.beginObject();
    json.key("identifier").optionalString(entry.identifier.empty() ? std::nullopt
                                                                   : std::optional<std::string>(entry.identifier));
    json.key("path").string(entry.path);
    json.key("outcome").string(outcomeName(entry.outcome));
    json.key("reason").optionalString(entry.reason.empty() ? std::nullopt : std::optional<std::string>(entry.reason));
    json.key("filesMoved").number(entry.filesMoved);
    json.key("bytesMoved").number(entry.bytesMoved);
    json.key("durationSeconds").real(entry.seconds);
    json.key("log").beginArray();
    for (const LogRecord& line : entry.lines) {
      json.beginObject();
      json.key("level").number(line.level);
      json.key("function").string(line.function);
      json.key("message").string(line.message);
      json.endObject();
    }
    json.endArray();
    json.endObject();
  }
  json.endArray();
  json.endObject();
  return json.text() + "\n";
}

}  // namespace transvale
