// The progress display of a running migration: a bar redrawn in place on a
// terminal, or one line per whole percent otherwise.
//
// Thread safety: used from the host's main thread only.
#pragma once

#include <chrono>
#include <cstdio>
#include <optional>

namespace transvale {

enum class ProgressStyle { Bar, Lines, Silent };

class ProgressDisplay {
 public:
  // `entries` is the number of entries the run works through, when known.
  ProgressDisplay(ProgressStyle style, std::FILE* out, std::optional<unsigned long> entries);

  // Shows `fraction` (the plug-in's figure; outside 0...1 when it has none).
  void update(float fraction);
  // Shows the last figure and ends the display's line.
  void finish(float fraction);

  // Time since the display was made.
  double elapsedSeconds() const;
  // Entries finished at `fraction`, when the number of entries is known.
  std::optional<unsigned long> entriesFinished(float fraction) const;

 private:
  void drawBar(float fraction);

  const ProgressStyle style_;
  std::FILE* const out_;
  const std::optional<unsigned long> entries_;
  const std::chrono::steady_clock::time_point start_;
  int lastPercent_ = -1;
  bool drewBar_ = false;
};

// The number of entries behind an estimated duration (the plug-in estimates a
// base time plus a fixed time per entry), or none when the figure does not
// come from that formula.
std::optional<unsigned long> entriesForEstimatedDuration(float duration);

}  // namespace transvale
