// Home-screen icons: IconRenderer renders a bundle's icon, ImageEncoder writes
// images into a growable buffer.
//
// Both are interfaces so that unit tests can substitute failures;
// CairoIconRenderer and PNGImageEncoding are the real ones.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string_view>
#include <vector>

#include "Platform/BundleReader.h"
#include "Platform/Foundation/Value.h"

namespace platform {

// The type identifier of PNG data.
inline constexpr char kImageTypePNG[] = "public.png";
// The icon file a bundle falls back to without RkBundleIconFile.
inline constexpr char kDefaultIconFileName[] = "Icon.png";
// Size of a home-screen icon, in pixels.
inline constexpr int kHomeScreenIconSize = 120;

// An image: straight (not premultiplied) RGBA, 8 bits per channel, rows
// top to bottom.
struct Image {
  int width = 0;
  int height = 0;
  std::vector<uint8_t> rgba;  // width * height * 4 bytes
};

// The PNG encoding of `image` (libpng), or none when its pixels do not match
// its size or libpng fails.
std::optional<Data> encodePNG(const Image& image);

class IconRenderer {
 public:
  virtual ~IconRenderer() = default;
  // The bundle's home-screen icon, or none.
  virtual std::optional<Image> homeScreenIconForBundle(const Bundle& bundle) = 0;
};

class ImageEncoder {
 public:
  virtual ~ImageEncoder() = default;
  virtual void addImage(const Image& image) = 0;
  // True when the encoded data has been written into the buffer.
  [[nodiscard]] virtual bool finalize() = 0;
};

class ImageEncoding {
 public:
  virtual ~ImageEncoding() = default;
  // An encoder writing into `buffer` (which must outlive it), or null when the
  // type is not supported or the count is not 1.
  virtual std::unique_ptr<ImageEncoder> createEncoder(Data& buffer, std::string_view typeIdentifier,
                                                      size_t imageCount) = 0;
};

class CairoIconRenderer final : public IconRenderer {
 public:
  std::optional<Image> homeScreenIconForBundle(const Bundle& bundle) override;
};

class PNGImageEncoding final : public ImageEncoding {
 public:
  std::unique_ptr<ImageEncoder> createEncoder(Data& buffer, std::string_view typeIdentifier,
                                              size_t imageCount) override;
};

}  // namespace platform
