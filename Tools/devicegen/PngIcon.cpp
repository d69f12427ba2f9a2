#include "Tools/devicegen/PngIcon.h"

#include <png.h>

#include <algorithm>
#include <cmath>
#include <csetjmp>

namespace devicegen {
namespace {

// Fast compression: icons are small and images are made by the thousand.
constexpr int kCompressionLevel = 1;
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

void appendToBuffer(png_structp png, png_bytep data, png_size_t length) {
  auto* out = static_cast<std::vector<uint8_t>*>(png_get_io_ptr(png));
  out->insert(out->end(), data, data + length);
}

void noFlush(png_structp) {}

// Owns the libpng write structures.
class PngWriter {
 public:
  PngWriter() {
    png_ = png_create_write_struct(PNG_LIBPNG_VER_STRING, nullptr, nullptr, nullptr);
    if (png_) info_ = png_create_info_struct(png_);
  }
  ~PngWriter() { png_destroy_write_struct(png_ ? &png_ : nullptr, info_ ? &info_ : nullptr); }
  PngWriter(const PngWriter&) = delete;
  PngWriter& operator=(const PngWriter&) = delete;
  png_structp png() const { return png_; }
  png_infop info() const { return info_; }

 private:
  png_structp png_ = nullptr;
  png_infop info_ = nullptr;
};

// Kept free of objects with destructors: libpng reports errors by longjmp.
bool encodeRows(PngWriter& writer, int size, png_bytep* rows, std::vector<uint8_t>* out) {
  png_structp png = writer.png();
  png_infop info = writer.info();
  if (setjmp(png_jmpbuf(png))) return false;
  png_set_write_fn(png, out, appendToBuffer, noFlush);
  png_set_compression_level(png, kCompressionLevel);
  png_set_IHDR(png, info, static_cast<png_uint_32>(size), static_cast<png_uint_32>(size), 8, PNG_COLOR_TYPE_RGBA,
               PNG_INTERLACE_NONE, PNG_COMPRESSION_TYPE_DEFAULT, PNG_FILTER_TYPE_DEFAULT);
  png_write_info(png, info);
  png_write_image(png, rows);
  png_write_end(png, nullptr);
  return true;
}

}  // namespace

std::optional<std::vector<uint8_t>> encodeIcon(int size, int hue, std::string* why) {
  std::vector<uint8_t> pixels = drawIcon(size, hue);
  std::vector<png_bytep> rows(static_cast<size_t>(size));
  for (int y = 0; y < size; ++y) rows[y] = &pixels[static_cast<size_t>(y) * size * kChannels];
  PngWriter writer;
  std::vector<uint8_t> out;
  if (!writer.png() || !writer.info() || !encodeRows(writer, size, rows.data(), &out)) {
    if (why) *why = "libpng could not encode a " + std::to_string(size) + "-pixel icon";
    return std::nullopt;
  }
  return out;
}

}  // namespace devicegen
