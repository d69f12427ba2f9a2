#include "Platform/Imaging.h"

#include <cairo.h>
#include <png.h>

#include <cstring>
#include <numbers>

#include "Platform/Foundation/PropertyList.h"

namespace platform {

namespace {

// Corner radius of the home-screen mask, as a fraction of the icon's side.
constexpr double kIconCornerRadiusFraction = 0.225;
constexpr int kBytesPerPixel = 4;
// libpng's fast compression (no filters, a low zlib level): icons are small
// and made by the thousand.
constexpr png_uint_32 kPNGCompressionFlags = PNG_IMAGE_FLAG_FAST;
constexpr uint8_t kOpaqueAlpha = 255;
// Largest side of an icon image that is decoded (an icon is shown at 120).
constexpr uint32_t kIconDimensionLimit = 4096;

// --- cairo objects, each released by its owner --------------------------------

struct SurfaceDeleter {
  void operator()(cairo_surface_t* s) const { cairo_surface_destroy(s); }
};
struct ContextDeleter {
  void operator()(cairo_t* c) const { cairo_destroy(c); }
};
struct PatternDeleter {
  void operator()(cairo_pattern_t* p) const { cairo_pattern_destroy(p); }
};
using SurfacePtr = std::unique_ptr<cairo_surface_t, SurfaceDeleter>;
using ContextPtr = std::unique_ptr<cairo_t, ContextDeleter>;
using PatternPtr = std::unique_ptr<cairo_pattern_t, PatternDeleter>;

// The icon file a bundle names, else the default. A name that would leave the
// bundle directory is not used: none.
std::optional<std::string> iconFileName(const Bundle& bundle) {
  std::string name = kDefaultIconFileName;
  if (bundle.info()) {
    const auto found = bundle.info()->find(kBundleIconFileKey);
    if (found != bundle.info()->end() && found->second.isString() && !found->second.asString()->empty()) {
      name = *found->second.asString();
    }
  }
  if (name.find('/') != std::string::npos || name == "." || name == "..") return std::nullopt;
  return name;
}

// A PNG in memory, handed to cairo piece by piece.
struct PNGSource {
  const Data& bytes;
  size_t offset = 0;
};

cairo_status_t readFromMemory(void* closure, unsigned char* out, unsigned int length) {
  auto* source = static_cast<PNGSource*>(closure);
  if (source->bytes.size() - source->offset < length) return CAIRO_STATUS_READ_ERROR;
  std::memcpy(out, source->bytes.data() + source->offset, length);
  source->offset += length;
  return CAIRO_STATUS_SUCCESS;
}

// The width and height a PNG's header claims, before anything is decoded
// (signature, chunk length, "IHDR", then both as big-endian 32-bit values).
bool claimedDimensionsFit(const Data& png) {
  constexpr size_t kWidthOffset = 16;
  constexpr size_t kHeaderEnd = 24;
  if (png.size() < kHeaderEnd) return false;
  auto be32 = [&](size_t at) {
    return (uint32_t{png[at]} << 24) | (uint32_t{png[at + 1]} << 16) | (uint32_t{png[at + 2]} << 8) | png[at + 3];
  };
  return be32(kWidthOffset) <= kIconDimensionLimit && be32(kWidthOffset + 4) <= kIconDimensionLimit;
}

// The decoded PNG, or none when it cannot be read or is empty. The file is
// read through the bounded reader (so a FIFO, a device or a huge file is
// refused, not waited on or swallowed) and an image whose header claims more
// pixels than an icon could use is not decoded at all.
SurfacePtr decodePNG(const URL& file) {
  const std::optional<Data> bytes = plist::readFileBytes(file, plist::ReadOptions{.sizeLimit = plist::kIconFileSizeLimit});
  if (!bytes || !claimedDimensionsFit(*bytes)) return nullptr;
  PNGSource source{*bytes};
  SurfacePtr surface(cairo_image_surface_create_from_png_stream(&readFromMemory, &source));
  // cairo never returns null: a failed decode is a surface in an error state.
  if (cairo_surface_status(surface.get()) != CAIRO_STATUS_SUCCESS) return nullptr;
  if (cairo_image_surface_get_width(surface.get()) <= 0 || cairo_image_surface_get_height(surface.get()) <= 0) {
    return nullptr;
  }
  return surface;
}

// Adds a rounded square of side `size` and corner radius `radius` to the path.
void addRoundedSquare(cairo_t* cr, double size, double radius) {
  const double half = std::numbers::pi / 2;
  cairo_new_sub_path(cr);
  cairo_arc(cr, size - radius, radius, radius, -half, 0);
  cairo_arc(cr, size - radius, size - radius, radius, 0, half);
  cairo_arc(cr, radius, size - radius, radius, half, 2 * half);
  cairo_arc(cr, radius, radius, radius, 2 * half, 3 * half);
  cairo_close_path(cr);
}

// Draws `source` scaled to fill a size x size square, clipped to the mask.
SurfacePtr renderMasked(cairo_surface_t* source, int size) {
  SurfacePtr target(cairo_image_surface_create(CAIRO_FORMAT_ARGB32, size, size));
  if (cairo_surface_status(target.get()) != CAIRO_STATUS_SUCCESS) return nullptr;
  ContextPtr cr(cairo_create(target.get()));
  if (cairo_status(cr.get()) != CAIRO_STATUS_SUCCESS) return nullptr;

  PatternPtr pattern(cairo_pattern_create_for_surface(source));
  cairo_matrix_t matrix;
  cairo_matrix_init_scale(&matrix, static_cast<double>(cairo_image_surface_get_width(source)) / size,
                          static_cast<double>(cairo_image_surface_get_height(source)) / size);
  cairo_pattern_set_matrix(pattern.get(), &matrix);
  // GOOD averages over the source pixels a target pixel covers when it
  // shrinks (no aliasing) and interpolates when it enlarges; BEST's wider
  // kernel costs three to four times as much for no visible gain at this size.
  cairo_pattern_set_filter(pattern.get(), CAIRO_FILTER_GOOD);
  // Padding keeps the edge pixels from blending with transparent black.
  cairo_pattern_set_extend(pattern.get(), CAIRO_EXTEND_PAD);

  addRoundedSquare(cr.get(), size, size * kIconCornerRadiusFraction);
  cairo_clip(cr.get());
  cairo_set_source(cr.get(), pattern.get());
  cairo_paint(cr.get());
  if (cairo_status(cr.get()) != CAIRO_STATUS_SUCCESS) return nullptr;
  cairo_surface_flush(target.get());
  return target;
}

// cairo's premultiplied native-endian ARGB32 to straight RGBA.
Image toStraightRGBA(cairo_surface_t* surface) {
  Image image;
  image.width = cairo_image_surface_get_width(surface);
  image.height = cairo_image_surface_get_height(surface);
  image.rgba.resize(static_cast<size_t>(image.width) * image.height * kBytesPerPixel);
  const unsigned char* data = cairo_image_surface_get_data(surface);
  const int stride = cairo_image_surface_get_stride(surface);
  uint8_t* out = image.rgba.data();
  for (int y = 0; y < image.height; ++y) {
    const auto* row = reinterpret_cast<const uint32_t*>(data + static_cast<size_t>(y) * stride);
    for (int x = 0; x < image.width; ++x) {
      const uint32_t pixel = row[x];
      const uint32_t a = pixel >> 24;
      const uint32_t channels[3] = {(pixel >> 16) & 0xff, (pixel >> 8) & 0xff, pixel & 0xff};
      for (uint32_t c : channels) {
        // Undo the premultiplication, rounding to nearest; most of an icon is
        // opaque, where there is nothing to undo.
        *out++ = a == kOpaqueAlpha ? static_cast<uint8_t>(c)
                 : a == 0          ? 0
                                   : static_cast<uint8_t>((c * kOpaqueAlpha + a / 2) / a);
      }
      *out++ = static_cast<uint8_t>(a);
    }
  }
  return image;
}

class PNGImageEncoder final : public ImageEncoder {
 public:
  explicit PNGImageEncoder(Data& buffer) : buffer_(buffer) {}

  void addImage(const Image& image) override { images_.push_back(image); }

  bool finalize() override {
    if (images_.size() != 1) return false;
    const Image& image = images_.front();
    std::optional<Data> encoded = encodePNG(image);
    if (!encoded) return false;
    buffer_.insert(buffer_.end(), encoded->begin(), encoded->end());
    return true;
  }

 private:
  Data& buffer_;
  std::vector<Image> images_;
};

}  // namespace

std::optional<Data> encodePNG(const Image& image) {
  if (image.width <= 0 || image.height <= 0 ||
      image.rgba.size() != static_cast<size_t>(image.width) * static_cast<size_t>(image.height) * kBytesPerPixel) {
    return std::nullopt;
  }
  png_image description{};
  description.version = PNG_IMAGE_VERSION;
  description.width = static_cast<png_uint_32>(image.width);
  description.height = static_cast<png_uint_32>(image.height);
  description.format = PNG_FORMAT_RGBA;
  description.flags = kPNGCompressionFlags;
  // The largest encoding there can be, so that libpng compresses once.
  Data encoded(PNG_IMAGE_PNG_SIZE_MAX(description));
  png_alloc_size_t size = encoded.size();
  const bool written = png_image_write_to_memory(&description, encoded.data(), &size, 0, image.rgba.data(),
                                                 0 /* rows are packed */, nullptr) != 0;
  png_image_free(&description);
  if (!written) return std::nullopt;
  encoded.resize(size);
  return encoded;
}

std::optional<Image> CairoIconRenderer::homeScreenIconForBundle(const Bundle& bundle) {
  const std::optional<std::string> name = iconFileName(bundle);
  if (!name) return std::nullopt;
  SurfacePtr source = decodePNG(bundle.url().appending(*name));
  if (!source) return std::nullopt;
  SurfacePtr icon = renderMasked(source.get(), kHomeScreenIconSize);
  if (!icon) return std::nullopt;
  return toStraightRGBA(icon.get());
}

std::unique_ptr<ImageEncoder> PNGImageEncoding::createEncoder(Data& buffer, std::string_view typeIdentifier,
                                                              size_t imageCount) {
  if (typeIdentifier != kImageTypePNG || imageCount != 1) return nullptr;
  return std::make_unique<PNGImageEncoder>(buffer);
}

}  // namespace platform
