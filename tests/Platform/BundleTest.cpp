// Reading bundles and rendering their icons; the PNG encoder. Images are
// checked by decoding what the system made.
#include "Platform/BundleReader.h"
#include "Platform/Imaging.h"
#include "Platform/RegistryFixture.h"
#include "support/ImageSupport.h"

namespace qstest {
namespace {

using platform::Data;
using platform::Dictionary;
using platform::Image;
using platform::URL;
using platform::Value;

class BundleReading : public testing::Test {
 protected:
  // A bundle whose Info.plist holds `text` (none when empty).
  std::shared_ptr<platform::Bundle> open(const std::string& name, const std::string& text) {
    EXPECT_TRUE(makeDirs(dir_ / name) && (text.empty() || writeFile(dir_ / name + "/Info.plist", text)));
    return reader_.openBundle(URL::fileURL(dir_ / name, true));
  }
  TempDir dir_{"bundles"};
  platform::FileBundleReader reader_;
};

// The info dictionary gains the Info.plist's URL (the bundle's own does
// not); the filtered one is read afresh and keeps only the keys asked for.
TEST_F(BundleReading, ReadsTheInfoDictionaryAndAFreshFilteredInfoPlist) {
  makeBundle(dir_ / "Notes.app", {.identifier = "com.example.notes", .version = "4.1"});
  auto bundle = reader_.openBundle(URL::fileURL(dir_ / "Notes.app", true));
  ASSERT_TRUE(bundle);
  EXPECT_EQ(bundle->identifier(), "com.example.notes");
  std::optional<Dictionary> info = reader_.infoDictionary(*bundle);
  ASSERT_TRUE(info && info->at(platform::kBundleInfoPlistURLKey).asURL());
  EXPECT_EQ(info->at(platform::kBundleVersionKey).description(), "4.1");
  EXPECT_EQ(info->at(platform::kBundleInfoPlistURLKey).asURL()->path(), dir_ / "Notes.app/Info.plist");
  EXPECT_FALSE(bundle->info()->count(platform::kBundleInfoPlistURLKey));
  makeBundle(dir_ / "Notes.app", {.identifier = "com.example.changed"});
  std::optional<Value> filtered = reader_.filteredInfoPlist(*bundle, {"RkBundleIdentifier", "RkMissing"});
  ASSERT_TRUE(filtered && filtered->isDictionary());
  EXPECT_EQ(*filtered->asDictionary(), (Dictionary{{"RkBundleIdentifier", "com.example.changed"}}));
}

TEST_F(BundleReading, OpensOnlyDirectoriesAndGivesNoInfoDictionaryForAMissingOrBadInfoPlist) {
  ASSERT_TRUE(writeFile(dir_ / "file.app", "x"));
  EXPECT_FALSE(reader_.openBundle(URL::fileURL(dir_ / "file.app", true)));
  EXPECT_FALSE(reader_.openBundle(URL::fileURL(dir_ / "missing.app", true)) || reader_.openBundle(URL()));
  auto empty = open("Empty.app", "");
  ASSERT_TRUE(empty);
  EXPECT_FALSE(empty->info() || reader_.infoDictionary(*empty) || empty->identifier());
  auto array =
      open("Array.app", "<?xml version=\"1.0\"?><plist version=\"1.0\"><array><string>x</string></array></plist>");
  ASSERT_TRUE(array);
  EXPECT_FALSE(reader_.infoDictionary(*array));
  std::optional<Value> root = reader_.filteredInfoPlist(*array, {"x"});
  EXPECT_TRUE(root && root->isArray()) << "the root is returned as read, whatever its type";
  auto broken = open("Broken.app", "<plist><dict><key>");
  ASSERT_TRUE(broken);
  EXPECT_FALSE(reader_.infoDictionary(*broken) || reader_.filteredInfoPlist(*broken, {"RkBundleIdentifier"}));
}

constexpr uint32_t kRed = 0xff0000ff, kBlue = 0x0000ffff, kGreen = 0x00ff00ff;
constexpr int kSize = platform::kHomeScreenIconSize;

class IconRendering : public testing::Test {
 protected:
  std::optional<Image> render(std::optional<Dictionary> info = Dictionary{}) {
    return renderer_.homeScreenIconForBundle(platform::Bundle(URL::fileURL(dir_.path(), true), std::move(info)));
  }
  TempDir dir_{"icon"};
  platform::CairoIconRenderer renderer_;
};

// A 57x40 icon, blue on the left and green on the right, comes out at the
// home-screen size with its layout kept, masked to a rounded square whose
// edge is straight (not premultiplied) alpha.
TEST_F(IconRendering, DefaultIconIsScaledAndMaskedWithStraightAlpha) {
  ASSERT_TRUE(writeSplitPNG(dir_ / "Icon.png", 57, 40, kBlue, kGreen));
  const std::optional<Image> icon = render();
  ASSERT_TRUE(icon);
  ASSERT_EQ(std::tie(icon->width, icon->height), std::make_tuple(kSize, kSize));
  ASSERT_EQ(icon->rgba.size(), static_cast<size_t>(kSize * kSize * 4));
  for (auto [x, y, rgba] : {std::tuple{kSize / 4, kSize / 2, kBlue},
                            {3 * kSize / 4, kSize / 2, kGreen},
                            {0, kSize / 2, kBlue},
                            {kSize / 2 - 10, kSize - 1, kBlue},
                            {0, 0, 0u},
                            {kSize - 1, 0, 0u},
                            {0, kSize - 1, 0u},
                            {kSize - 1, kSize - 1, 0u}}) {
    EXPECT_EQ(pixelAt(*icon, x, y) & (rgba ? ~0u : 0xffu), rgba) << x << "," << y;
  }
  int i = 0;
  while (i < kSize / 2 && (pixelAt(*icon, i, i) & 0xff) == 0) ++i;
  const uint32_t edge = pixelAt(*icon, i, i);
  ASSERT_LT(edge & 0xff, 255u) << "a partly transparent pixel on the diagonal";
  EXPECT_GE((edge >> 8) & 0xff, 250u) << "alpha " << (edge & 0xff);
}

// The icon-file key names a file inside the bundle; a value that is not a
// string falls back to Icon.png; a name leading outside, a missing, garbage
// or truncated file gives none.
TEST_F(IconRendering, IconFileKeyChoosesAReadablePNGInsideTheBundle) {
  ASSERT_TRUE(writeSolidPNG(dir_ / "Icon.png", 8, 8, kRed) && writeSolidPNG(dir_ / "AppIcon.png", 8, 8, kBlue));
  TempDir outside("outside");
  ASSERT_TRUE(writeSolidPNG(outside / "Evil.png", 8, 8, kRed));
  const std::string whole = readFile(dir_ / "Icon.png");
  ASSERT_TRUE(writeFile(dir_ / "Half.png", whole.substr(0, whole.size() / 2)) && writeFile(dir_ / "Junk.png", "junk"));
  const struct {
    Value iconFile;
    std::optional<uint32_t> centre;
  } cases[] = {{Value("AppIcon.png"), kBlue},
               {Value(7), kRed},
               {"../" + URL::fileURL(outside.path()).lastPathComponent() + "/Evil.png", {}},
               {Value("Absent.png"), {}},
               {Value("Junk.png"), {}},
               {Value("Half.png"), {}}};
  for (const auto& c : cases) {
    const std::optional<Image> icon = render(Dictionary{{platform::kBundleIconFileKey, c.iconFile}});
    ASSERT_EQ(icon.has_value(), c.centre.has_value()) << c.iconFile.description();
    EXPECT_TRUE(!icon || pixelAt(*icon, kSize / 2, kSize / 2) == *c.centre) << c.iconFile.description();
  }
}

Image gradient(int width, int height) {
  Image image{width, height, {}};
  for (int y = 0; y < height; ++y) {
    for (int x = 0; x < width; ++x)
      image.rgba.insert(image.rgba.end(), {uint8_t(x * 7), uint8_t(y * 5), uint8_t(x + y), uint8_t(255 - x)});
  }
  return image;
}

TEST(PNGEncoding, RoundTripsPixelsExactlyAndRefusesAnythingButOneWellFormedImage) {
  platform::PNGImageEncoding encoding;
  Data buffer;
  auto encoder = encoding.createEncoder(buffer, platform::kImageTypePNG, 1);
  ASSERT_TRUE(encoder);
  encoder->addImage(gradient(33, 17));
  ASSERT_TRUE(encoder->finalize());
  const std::optional<Image> decoded = decodePNG(buffer);
  ASSERT_TRUE(decoded);
  EXPECT_EQ(std::tie(decoded->width, decoded->height, decoded->rgba), std::make_tuple(33, 17, gradient(33, 17).rgba));

  buffer.clear();
  EXPECT_FALSE(encoding.createEncoder(buffer, "public.jpeg", 1));
  EXPECT_FALSE(encoding.createEncoder(buffer, platform::kImageTypePNG, 0));
  EXPECT_FALSE(encoding.createEncoder(buffer, platform::kImageTypePNG, 2));
  Image truncated = gradient(4, 4);
  truncated.rgba.pop_back();
  for (const std::vector<Image>& images :
       std::vector<std::vector<Image>>{{}, {gradient(2, 2), gradient(2, 2)}, {truncated}, {Image{}}}) {
    encoder = encoding.createEncoder(buffer, platform::kImageTypePNG, 1);
    ASSERT_TRUE(encoder);
    for (const Image& added : images) encoder->addImage(added);
    EXPECT_FALSE(encoder->finalize()) << images.size();
    EXPECT_TRUE(buffer.empty());
  }
}

}  // namespace
}  // namespace qstest
