// The icon renderer and the PNG encoder, checked by decoding what they make.
#include <gtest/gtest.h>

#include "Platform/Imaging.h"
#include "support/ImageSupport.h"
#include "support/TestSupport.h"

using platform::Data;
using platform::Dictionary;
using platform::Image;
using platform::URL;
using platform::Value;

namespace {

constexpr uint32_t kOpaqueRed = 0xff0000ff;
constexpr uint32_t kOpaqueBlue = 0x0000ffff;
constexpr uint32_t kOpaqueGreen = 0x00ff00ff;
constexpr int kSize = platform::kHomeScreenIconSize;

uint8_t alphaOf(uint32_t rgba) { return rgba & 0xff; }

// Encodes one image as PNG and decodes it again; none when encoding fails.
std::optional<Image> encodeAndDecode(const Image& image) {
  platform::PNGImageEncoding encoding;
  Data buffer;
  auto encoder = encoding.createEncoder(buffer, platform::kImageTypePNG, 1);
  if (!encoder) return std::nullopt;
  encoder->addImage(image);
  return encoder->finalize() ? qstest::decodePNG(buffer) : std::nullopt;
}

class IconRendering : public testing::Test {
 protected:
  std::optional<Image> render(std::optional<Dictionary> info = Dictionary{}) {
    return renderer_.homeScreenIconForBundle(platform::Bundle(URL::fileURL(dir_.path(), true), std::move(info)));
  }
  qstest::TempDir dir_{"icon"};
  platform::CairoIconRenderer renderer_;
};

// A 57x40 icon, blue on the left and green on the right, comes out at the
// home-screen size with its layout kept, masked to a rounded square whose
// edge is straight (not premultiplied) alpha, and encodes to PNG as such.
TEST_F(IconRendering, DefaultIconIsScaledMaskedAndEncodesToPNG) {
  ASSERT_TRUE(qstest::writeSplitPNG(dir_ / "Icon.png", 57, 40, kOpaqueBlue, kOpaqueGreen));
  const std::optional<Image> rendered = render();
  ASSERT_TRUE(rendered);
  ASSERT_EQ(rendered->rgba.size(), static_cast<size_t>(kSize * kSize * 4));
  const std::optional<Image> icon = encodeAndDecode(*rendered);
  ASSERT_TRUE(icon);
  ASSERT_EQ(icon->width, kSize);
  ASSERT_EQ(icon->height, kSize);
  EXPECT_EQ(icon->rgba, rendered->rgba);
  for (auto [x, y, colour] : {std::tuple{kSize / 4, kSize / 2, kOpaqueBlue}, {3 * kSize / 4, kSize / 2, kOpaqueGreen},
                              {0, kSize / 2, kOpaqueBlue}, {kSize / 2 - 10, kSize - 1, kOpaqueBlue}}) {
    EXPECT_EQ(qstest::pixelAt(*icon, x, y), colour) << x << "," << y;
  }
  for (auto [x, y] : {std::pair{0, 0}, {kSize - 1, 0}, {0, kSize - 1}, {kSize - 1, kSize - 1}}) {
    EXPECT_EQ(alphaOf(qstest::pixelAt(*icon, x, y)), 0) << x << "," << y;
  }
  bool sawPartial = false;
  for (int i = 0; i < kSize / 2 && !sawPartial; ++i) {
    const uint32_t pixel = qstest::pixelAt(*icon, i, i);
    if (alphaOf(pixel) > 0 && alphaOf(pixel) < 255) {
      sawPartial = true;
      EXPECT_GE((pixel >> 8) & 0xff, 250u) << "alpha " << int(alphaOf(pixel));
    }
  }
  EXPECT_TRUE(sawPartial);
}

// The icon-file key names a file inside the bundle; a value that is not a
// string falls back to Icon.png, and a name leading outside gives none.
TEST_F(IconRendering, IconFileKeyChoosesTheFileInsideTheBundle) {
  ASSERT_TRUE(qstest::writeSolidPNG(dir_ / "Icon.png", 8, 8, kOpaqueRed));
  ASSERT_TRUE(qstest::writeSolidPNG(dir_ / "AppIcon.png", 8, 8, kOpaqueBlue));
  qstest::TempDir outside("outside");
  ASSERT_TRUE(qstest::writeSolidPNG(outside / "Evil.png", 8, 8, kOpaqueRed));
  const std::string escape = "../" + URL::fileURL(outside.path()).lastPathComponent() + "/Evil.png";
  const struct {
    Value iconFile;
    std::optional<uint32_t> centre;
  } cases[] = {{Value("AppIcon.png"), kOpaqueBlue}, {Value(7), kOpaqueRed}, {Value(escape), std::nullopt}};
  for (const auto& c : cases) {
    const std::optional<Image> icon = render(Dictionary{{platform::kBundleIconFileKey, c.iconFile}});
    ASSERT_EQ(icon.has_value(), c.centre.has_value()) << c.iconFile.description();
    if (icon) {
      EXPECT_EQ(qstest::pixelAt(*icon, kSize / 2, kSize / 2), *c.centre) << c.iconFile.description();
    }
  }
}

TEST_F(IconRendering, MissingGarbageOrTruncatedPNGGivesNone) {
  EXPECT_FALSE(render());
  EXPECT_FALSE(render(std::nullopt));
  ASSERT_TRUE(qstest::writeFile(dir_ / "Icon.png", "this is not a PNG"));
  EXPECT_FALSE(render());
  ASSERT_TRUE(qstest::writeSolidPNG(dir_ / "Whole.png", 30, 30, kOpaqueRed));
  const std::string whole = qstest::readFile(dir_ / "Whole.png");
  ASSERT_TRUE(qstest::writeFile(dir_ / "Icon.png", whole.substr(0, whole.size() / 2)));
  EXPECT_FALSE(render());
}

Image gradient(int width, int height) {
  Image image{width, height, {}};
  for (int y = 0; y < height; ++y) {
    for (int x = 0; x < width; ++x) {
      image.rgba.insert(image.rgba.end(), {static_cast<uint8_t>(x * 7), static_cast<uint8_t>(y * 5),
                                           static_cast<uint8_t>(x + y), static_cast<uint8_t>(255 - x)});
    }
  }
  return image;
}

TEST(PNGEncoding, RoundTripsPixelsExactlyAndRefusesAnythingButOneWellFormedImage) {
  const Image image = gradient(33, 17);
  const std::optional<Image> decoded = encodeAndDecode(image);
  ASSERT_TRUE(decoded);
  EXPECT_EQ(decoded->width, 33);
  EXPECT_EQ(decoded->height, 17);
  EXPECT_EQ(decoded->rgba, image.rgba);

  platform::PNGImageEncoding encoding;
  Data buffer;
  EXPECT_FALSE(encoding.createEncoder(buffer, "public.jpeg", 1));
  EXPECT_FALSE(encoding.createEncoder(buffer, platform::kImageTypePNG, 0));
  EXPECT_FALSE(encoding.createEncoder(buffer, platform::kImageTypePNG, 2));
  Image truncated = gradient(4, 4);
  truncated.rgba.pop_back();
  for (const std::vector<Image>& images :
       std::vector<std::vector<Image>>{{}, {gradient(2, 2), gradient(2, 2)}, {truncated}, {Image{}}}) {
    auto encoder = encoding.createEncoder(buffer, platform::kImageTypePNG, 1);
    ASSERT_TRUE(encoder);
    for (const Image& added : images) encoder->addImage(added);
    EXPECT_FALSE(encoder->finalize()) << images.size();
    EXPECT_TRUE(buffer.empty());
  }
}

}  // namespace
