#include "Host/Progress.h"

#include <cmath>
#include <string>

namespace transvale {

namespace {

constexpr int kBarWidth = 30;
constexpr char kBarDone = '#';
constexpr char kBarToDo = '-';
// The plug-in's estimate: kBaseDuration + kDurationPerEntry per entry.
constexpr double kBaseDuration = 20.0;
constexpr double kDurationPerEntry = 2.25;
constexpr double kEntryTolerance = 1e-3;

bool isFraction(float fraction) { return fraction >= 0.0f && fraction <= 1.0f; }

std::string minutesAndSeconds(double seconds) {
  const long whole = static_cast<long>(seconds);
  char buffer[32];
  std::snprintf(buffer, sizeof buffer, "%02ld:%02ld", whole / 60, whole % 60);
  return buffer;
}

}  // namespace

std::optional<unsigned long> entriesForEstimatedDuration(float duration) {
  const double entries = (static_cast<double>(duration) - kBaseDuration) / kDurationPerEntry;
  const double rounded = std::round(entries);
  if (rounded < 0 || std::fabs(entries - rounded) > kEntryTolerance) return std::nullopt;
  return static_cast<unsigned long>(rounded);
}

ProgressDisplay::ProgressDisplay(ProgressStyle style, std::FILE* out, std::optional<unsigned long> entries)
    : style_(style), out_(out), entries_(entries), start_(std::chrono::steady_clock::now()) {}

double ProgressDisplay::elapsedSeconds() const {
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - start_).count();
}

std::optional<unsigned long> ProgressDisplay::entriesFinished(float fraction) const {
  if (!entries_ || !isFraction(fraction)) return std::nullopt;
  return static_cast<unsigned long>(std::lround(fraction * static_cast<double>(*entries_)));
}

void ProgressDisplay::update(float fraction) {
  switch (style_) {
    case ProgressStyle::Silent:
      return;
    case ProgressStyle::Bar:
      drawBar(fraction);
      return;
    case ProgressStyle::Lines: {
      const int percent = isFraction(fraction) ? static_cast<int>(fraction * 100.0f) : -1;
      if (percent == lastPercent_) return;
      lastPercent_ = percent;
      std::string line = "progress: " + (percent < 0 ? std::string("?") : std::to_string(percent) + "%");
      if (auto finished = entriesFinished(fraction)) {
        line += " (" + std::to_string(*finished) + "/" + std::to_string(*entries_) + " entries)";
      }
      std::fprintf(out_, "%s\n", line.c_str());
      std::fflush(out_);
      return;
    }
  }
}

void ProgressDisplay::drawBar(float fraction) {
  const bool known = isFraction(fraction);
  const int filled = known ? static_cast<int>(fraction * kBarWidth) : 0;
  std::string bar(static_cast<size_t>(filled), kBarDone);
  bar.append(static_cast<size_t>(kBarWidth - filled), kBarToDo);
  std::string text = "\r[" + bar + "] ";
  char percent[16];
  if (known) {
    std::snprintf(percent, sizeof percent, "%3d%%", static_cast<int>(fraction * 100.0f));
  } else {
    std::snprintf(percent, sizeof percent, "  ?%%");
  }
  text += percent;
  if (auto finished = entriesFinished(fraction)) {
    text += "  " + std::to_string(*finished) + "/" + std::to_string(*entries_) + " entries";
  }
  text += "  " + minutesAndSeconds(elapsedSeconds());
  std::fputs(text.c_str(), out_);
  std::fflush(out_);
  drewBar_ = true;
}

void ProgressDisplay::finish(float fraction) {
  update(fraction);
  if (drewBar_) {
    std::fputc('\n', out_);
    std::fflush(out_);
  }
}

}  // namespace transvale
