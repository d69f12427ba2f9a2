// Application icons for generated bundles: a small RGBA picture (a diagonal
// gradient behind a rounded plate), PNG-encoded with libpng. Sizes vary from
// bundle to bundle so that the icon renderer really scales.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace devicegen {

// The PNG bytes of a `size` x `size` icon tinted by `hue` (0-359), or none
// with *why when libpng fails. REQUIRES: size > 0.
std::optional<std::vector<uint8_t>> encodeIcon(int size, int hue, std::string* why);

}  // namespace devicegen
