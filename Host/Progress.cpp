#include "Host/Progress.h"

#include <signal.h>
#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cmath>

#include "Platform/Foundation/Text.h"

namespace transvale {

namespace {

constexpr char kBarDone = '#';
constexpr char kBarToDo = '-';
// The bar takes a share of the terminal's width, within these bounds.
constexpr int kBarShareOfWidth = 3;
constexpr int kMinimumBarWidth = 10;
constexpr int kMaximumBarWidth = 40;
constexpr int kDefaultColumns = 80;
// The plug-in's estimate: kBaseDuration + kDurationPerEntry per entry.
constexpr double kBaseDuration = 20.0;
constexpr double kDurationPerEntry = 2.25;
constexpr double kEntryTolerance = 1e-3;
// No estimate of the time left before this share of the work is done.
constexpr double kShareBeforeEstimate = 0.02;
constexpr double kBytesPerUnit = 1000.0;

std::atomic<bool> terminalResized{true};
void onWindowChange(int) { terminalResized.store(true); }

bool isFraction(float fraction) { return fraction >= 0.0f && fraction <= 1.0f; }

std::string minutesAndSeconds(double seconds) {
  const long whole = static_cast<long>(seconds);
  char buffer[32];
  std::snprintf(buffer, sizeof buffer, "%02ld:%02ld", whole / 60, whole % 60);
  return buffer;
}

}  // namespace

std::string humanBytes(uint64_t bytes) {
  static constexpr const char* kUnits[] = {"B", "kB", "MB", "GB", "TB"};
  double value = static_cast<double>(bytes);
  size_t unit = 0;
  while (value >= kBytesPerUnit && unit + 1 < std::size(kUnits)) {
    value /= kBytesPerUnit;
    ++unit;
  }
  char buffer[32];
  if (unit == 0) {
    std::snprintf(buffer, sizeof buffer, "%llu B", static_cast<unsigned long long>(bytes));
  } else {
    std::snprintf(buffer, sizeof buffer, "%.1f %s", value, kUnits[unit]);
  }
  return buffer;
}

std::optional<unsigned long> entriesForEstimatedDuration(float duration) {
  const double entries = (static_cast<double>(duration) - kBaseDuration) / kDurationPerEntry;
  const double rounded = std::round(entries);
  if (rounded < 0 || std::fabs(entries - rounded) > kEntryTolerance) return std::nullopt;
  return static_cast<unsigned long>(rounded);
}

ProgressDisplay::ProgressDisplay(ProgressStyle style, std::FILE* out, std::optional<unsigned long> entries)
    : style_(style), out_(out), entries_(entries), start_(std::chrono::steady_clock::now()) {
  if (style_ == ProgressStyle::Bar) {
    struct sigaction action {};
    action.sa_handler = onWindowChange;
    sigemptyset(&action.sa_mask);
    action.sa_flags = SA_RESTART;
    sigaction(SIGWINCH, &action, nullptr);
  }
}

ProgressDisplay::~ProgressDisplay() {
  if (style_ == ProgressStyle::Bar) signal(SIGWINCH, SIG_DFL);
}

double ProgressDisplay::elapsedSeconds() const {
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - start_).count();
}

std::optional<unsigned long> ProgressDisplay::entriesFinished(float fraction) const {
  if (!entries_ || *entries_ == 0 || !isFraction(fraction)) return std::nullopt;
  return static_cast<unsigned long>(std::lround(fraction * static_cast<double>(*entries_)));
}

std::optional<double> ProgressDisplay::workDone(const ProgressSample& sample, std::optional<unsigned long> entries) {
  if (!entries || *entries == 0 || !isFraction(sample.fraction)) return std::nullopt;
  const double byEntries = sample.fraction;
  if (sample.bytesTotal == 0) return byEntries;
  // Time goes both into containers (registry work) and into bytes (copies).
  const double byBytes = static_cast<double>(sample.bytesMoved) / static_cast<double>(sample.bytesTotal);
  return (byEntries + std::min(byBytes, 1.0)) / 2;
}

std::optional<double> ProgressDisplay::secondsRemaining(double elapsed, std::optional<double> done) {
  if (!done || *done < kShareBeforeEstimate) return std::nullopt;
  return elapsed * (1.0 - *done) / *done;
}

int ProgressDisplay::terminalColumns() {
  if (terminalResized.exchange(false)) {
    struct winsize size {};
    columns_ = ioctl(fileno(out_), TIOCGWINSZ, &size) == 0 && size.ws_col > 0 ? size.ws_col : kDefaultColumns;
  }
  return columns_;
}

std::string ProgressDisplay::barLine(const ProgressSample& sample, int columns) const {
  const bool known = isFraction(sample.fraction) && entries_ && *entries_ > 0;
  std::string text;
  char percent[16];
  std::snprintf(percent, sizeof percent, known ? "%3d%%" : "  ?%%", static_cast<int>(sample.fraction * 100.0f));
  text += percent;
  if (auto finished = entriesFinished(sample.fraction)) {
    text += "  " + std::to_string(*finished) + "/" + std::to_string(*entries_) + " entries";
  }
  if (sample.bytesTotal > 0) text += "  " + humanBytes(sample.bytesMoved) + "/" + humanBytes(sample.bytesTotal);
  const double elapsed = elapsedSeconds();
  const auto remaining = secondsRemaining(elapsed, workDone(sample, entries_));
  text += "  " + minutesAndSeconds(elapsed) + (remaining ? " (" + minutesAndSeconds(*remaining) + " left)" : "");
  // The application's name comes from its bundle: escaped, it cannot move
  // the cursor or change the terminal's state.
  if (!sample.current.empty()) text += "  " + platform::printable(sample.current);

  // "[" bar "] " text, cut to the terminal's width. The bar keeps a third of
  // the width whatever the text, so that it does not jump as the text changes.
  const int width = std::clamp(columns / kBarShareOfWidth, kMinimumBarWidth, kMaximumBarWidth);
  const int filled = known ? static_cast<int>(sample.fraction * static_cast<float>(width)) : 0;
  std::string line = "[" + std::string(static_cast<size_t>(filled), kBarDone) +
                     std::string(static_cast<size_t>(width - filled), kBarToDo) + "] " + text;
  // One column stays free: a line that fills the last column makes some
  // terminals wrap before the next "\r".
  return std::string(platform::leadingColumns(line, static_cast<size_t>(std::max(columns - 1, 0))));
}

std::string ProgressDisplay::stepLine(const ProgressSample& sample) const {
  if (!entries_ || *entries_ == 0 || !isFraction(sample.fraction)) return "progress: nothing to migrate";
  std::string line = "progress: " + std::to_string(static_cast<int>(sample.fraction * 100.0f)) + "%";
  if (auto finished = entriesFinished(sample.fraction)) {
    line += " (" + std::to_string(*finished) + "/" + std::to_string(*entries_) + " entries";
    if (sample.bytesTotal > 0) line += ", " + humanBytes(sample.bytesMoved) + " of " + humanBytes(sample.bytesTotal);
    const auto remaining = secondsRemaining(elapsedSeconds(), workDone(sample, entries_));
    if (remaining && sample.fraction < 1.0f) line += ", " + minutesAndSeconds(*remaining) + " left";
    line += ")";
  }
  return line;
}

void ProgressDisplay::update(const ProgressSample& sample) {
  switch (style_) {
    case ProgressStyle::Silent:
      return;
    case ProgressStyle::Bar: {
      const std::string line = barLine(sample, terminalColumns());
      // Clear to the end of the line: a narrower terminal or a shorter line
      // leaves nothing of the last one.
      std::fprintf(out_, "\r%s\033[K", line.c_str());
      std::fflush(out_);
      drewBar_ = true;
      return;
    }
    case ProgressStyle::Lines: {
      // One line per step: a new line only when the figures changed.
      std::string line = stepLine(sample);
      const std::string key = line.substr(0, line.find(','));
      if (key == lastStep_) return;
      lastStep_ = key;
      std::fprintf(out_, "%s\n", line.c_str());
      std::fflush(out_);
      return;
    }
  }
}

void ProgressDisplay::finish(const ProgressSample& sample) {
  update(sample);
  if (drewBar_) {
    std::fputc('\n', out_);
    std::fflush(out_);
  }
}

}  // namespace transvale
