#include "ImageSupport.h"

#include <png.h>

#include <cstring>
#include <filesystem>

#include "TestSupport.h"

namespace qstest {

std::optional<platform::Image> decodePNG(const platform::Data& bytes) {
  png_image png;
  std::memset(&png, 0, sizeof png);
  png.version = PNG_IMAGE_VERSION;
  if (!png_image_begin_read_from_memory(&png, bytes.data(), bytes.size())) return std::nullopt;
  png.format = PNG_FORMAT_RGBA;
  platform::Image image;
  image.width = static_cast<int>(png.width);
  image.height = static_cast<int>(png.height);
  image.rgba.resize(PNG_IMAGE_SIZE(png));
  if (!png_image_finish_read(&png, nullptr, image.rgba.data(), 0, nullptr)) {
    png_image_free(&png);
    return std::nullopt;
  }
  return image;
}

std::optional<platform::Image> decodePNGFile(const std::string& path) {
  if (!std::filesystem::is_regular_file(path)) return std::nullopt;
  const std::string bytes = readFile(path);
  return decodePNG(platform::Data(bytes.begin(), bytes.end()));
}

bool writeSplitPNG(const std::string& path, int width, int height, uint32_t leftRGBA, uint32_t rightRGBA) {
  std::vector<uint8_t> pixels(static_cast<size_t>(width) * height * 4);
  for (int y = 0; y < height; ++y) {
    for (int x = 0; x < width; ++x) {
      const uint32_t rgba = x < width / 2 ? leftRGBA : rightRGBA;
      for (int k = 0; k < 4; ++k) pixels[(static_cast<size_t>(y) * width + x) * 4 + k] = rgba >> (24 - 8 * k);
    }
  }
  png_image png;
  std::memset(&png, 0, sizeof png);
  png.version = PNG_IMAGE_VERSION;
  png.width = static_cast<png_uint_32>(width);
  png.height = static_cast<png_uint_32>(height);
  png.format = PNG_FORMAT_RGBA;
  return png_image_write_to_file(&png, path.c_str(), 0, pixels.data(), 0, nullptr) != 0;
}

uint32_t pixelAt(const platform::Image& image, int x, int y) {
  const uint8_t* p = &image.rgba[(static_cast<size_t>(y) * image.width + x) * 4];
  return (uint32_t{p[0]} << 24) | (uint32_t{p[1]} << 16) | (uint32_t{p[2]} << 8) | p[3];
}

}  // namespace qstest
