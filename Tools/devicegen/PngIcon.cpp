#include "Tools/devicegen/PngIcon.h"

#include <algorithm>
#include <cmath>

#include "Platform/Imaging.h"

namespace devicegen {
namespace {

constexpr int kChannels = 4;

struct Rgb {
  double r, g, b;
};

Rgb hueToRgb(int hue) {
  const double h = (hue % 360) / 60.0;
  const double x = 1.0 - std::fabs(std::fmod(h, 2.0) - 1.0);
  switch (static_cast<int>(h)) {
    case 0:
      return {1, x, 0};
    case 1:
      return {x, 1, 0};
    case 2:
      return {0, 1, x};
    case 3:
      return {0, x, 1};
    case 4:
      return {x, 0, 1};
    default:
      return {1, 0, x};
  }
}

uint8_t channel(double value) {
  return static_cast<uint8_t>(std::clamp(value, 0.0, 1.0) * 255.0 + 0.5);
}

std::vector<uint8_t> drawIcon(int size, int hue) {
  std::vector<uint8_t> pixels(static_cast<size_t>(size) * size * kChannels);
  const Rgb tint = hueToRgb(hue);
  const double radius = size * 0.2;
  const double inset = size * 0.12;
  for (int y = 0; y < size; ++y) {
    for (int x = 0; x < size; ++x) {
      const double t = (x + y) / (2.0 * size);
      double r = tint.r * (1 - t) + 0.1 * t, g = tint.g * (1 - t) + 0.1 * t, b = tint.b * (1 - t) + 0.3 * t;
      // A white plate with rounded corners in the middle.
      const double dx = std::max({inset + radius - x, x - (size - inset - radius), 0.0});
      const double dy = std::max({inset + radius - y, y - (size - inset - radius), 0.0});
      if (x >= inset && x < size - inset && y >= inset && y < size - inset && dx * dx + dy * dy <= radius * radius) {
        r = g = b = 0.95;
      }
      uint8_t* p = &pixels[(static_cast<size_t>(y) * size + x) * kChannels];
      p[0] = channel(r);
      p[1] = channel(g);
      p[2] = channel(b);
      p[3] = 255;
    }
  }
  return pixels;
}

}  // namespace

std::optional<std::vector<uint8_t>> encodeIcon(int size, int hue, std::string* why) {
  std::optional<std::vector<uint8_t>> png = platform::encodePNG(platform::Image{size, size, drawIcon(size, hue)});
  if (!png && why) *why = "libpng could not encode a " + std::to_string(size) + "-pixel icon";
  return png;
}

}  // namespace devicegen
