// The progress display of a running migration, on standard error: on a
// terminal a bar that fits the terminal's width (read with TIOCGWINSZ, read
// again after SIGWINCH) and is redrawn in place; otherwise one line per step
// (each finished container).
//
// It shows the plug-in's fraction, the containers and bytes done, the time
// remaining estimated from the rate observed so far, and the application
// being worked on.
//
// Thread safety: used from the host's main thread only (the SIGWINCH handler
// only sets a flag).
#pragma once

#include <chrono>
#include <cstdint>
#include <cstdio>
#include <optional>
#include <string>

namespace transvale {

enum class ProgressStyle { Bar, Lines, Silent };

struct ProgressSample {
  float fraction = 0;  // the plug-in's figure; outside 0...1 when it has none
  uint64_t containers = 0;
  uint64_t containersDone = 0;
  uint64_t bytesTotal = 0;
  uint64_t bytesMoved = 0;
  std::string current;
};

class ProgressDisplay {
 public:
  // `entries` is the number of entries the run works through, when known.
  ProgressDisplay(ProgressStyle style, std::FILE* out, std::optional<unsigned long> entries);
  ~ProgressDisplay();
  ProgressDisplay(const ProgressDisplay&) = delete;
  ProgressDisplay& operator=(const ProgressDisplay&) = delete;

  void update(const ProgressSample& sample);
  // Shows the last figure and ends the display's line.
  void finish(const ProgressSample& sample);

  // Time since the display was made.
  double elapsedSeconds() const;
  // Entries finished at `fraction`, when the number of entries is known and
  // not zero.
  std::optional<unsigned long> entriesFinished(float fraction) const;
  // The share of the work done, from entries and bytes; none before any.
  static std::optional<double> workDone(const ProgressSample& sample, std::optional<unsigned long> entries);
  // Seconds left at the rate observed so far; none until there is a rate.
  static std::optional<double> secondsRemaining(double elapsed, std::optional<double> done);
  // The bar's line for a terminal `columns` wide (never wider).
  std::string barLine(const ProgressSample& sample, int columns) const;
  // The line of the line-per-step display.
  std::string stepLine(const ProgressSample& sample) const;

 private:
  int terminalColumns();

  const ProgressStyle style_;
  std::FILE* const out_;
  const std::optional<unsigned long> entries_;
  const std::chrono::steady_clock::time_point start_;
  std::string lastStep_;
  bool drewBar_ = false;
  int columns_ = 0;
};

// The number of entries behind an estimated duration (the plug-in estimates a
// base time plus a fixed time per entry), or none when the figure does not
// come from that formula.
std::optional<unsigned long> entriesForEstimatedDuration(float duration);

// "12.3 MB", "999 B": sizes for people.
std::string humanBytes(uint64_t bytes);

}  // namespace transvale
