// PNG helpers for tests that check rendered icons: decoding what the system
// wrote, and writing source images for it to read.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "Platform/Foundation/Value.h"
#include "Platform/Imaging.h"

namespace qstest {

// Decodes PNG bytes (or a PNG file) to straight RGBA; none when they are not
// a PNG image.
std::optional<platform::Image> decodePNG(const platform::Data& bytes);
std::optional<platform::Image> decodePNGFile(const std::string& path);

// Writes a width x height PNG whose left half is `leftRGBA` and right half
// `rightRGBA`; a solid one when they are the same.
bool writeSplitPNG(const std::string& path, int width, int height, uint32_t leftRGBA, uint32_t rightRGBA);
inline bool writeSolidPNG(const std::string& path, int width, int height, uint32_t rgba) {
  return writeSplitPNG(path, width, height, rgba, rgba);
}

// The pixel at (x, y) as 0xRRGGBBAA.
uint32_t pixelAt(const platform::Image& image, int x, int y);

}  // namespace qstest
