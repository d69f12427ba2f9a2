// Reading bundles and rendering their icons; the PNG encoder. Images are
// checked by decoding what the system made.
#include <sys/stat.h>
#include <unistd.h>

#include "Platform/Imaging.h"
#include "Platform/RegistryFixture.h"
#include "support/ImageSupport.h"

namespace qstest {
namespace {

using namespace platform;

// The info dictionary gains the Info.plist's URL (the bundle's own does
// not). Only a directory is a bundle; a missing Info.plist or one that is no
// dictionary gives neither info nor identifier. (Filtered, fresh reads are
// checked through their callers in the support tests.)
TEST(BundleReading, InfoDictionaryOfDirectoriesOnly) {
  TempDir dir("bundles");
  FileBundleReader reader;
  makeBundle(dir / "Notes.app", {.identifier = "ex.notes"});
  auto bundle = reader.openBundle(URL::fileURL(dir / "Notes.app", true));
  ASSERT_TRUE(bundle);
  EXPECT_EQ(bundle->identifier(), "ex.notes");
  std::optional<Dictionary> info = reader.infoDictionary(*bundle);
  ASSERT_TRUE(info && info->at(kBundleInfoPlistURLKey).asURL());
  EXPECT_EQ(info->at(kBundleInfoPlistURLKey).asURL()->path(), dir / "Notes.app/Info.plist");
  EXPECT_FALSE(bundle->info()->count(kBundleInfoPlistURLKey));

  ASSERT_TRUE(writeFile(dir / "file.app", "x"));
  for (const URL& notABundle : {URL::fileURL(dir / "file.app", true), URL(), URL::fileURL(dir / "missing.app", true)})
    EXPECT_FALSE(reader.openBundle(notABundle)) << notABundle.description();
  ASSERT_TRUE(writeFile(dir / "Notes.app/Info.plist",
                        "<?xml version=\"1.0\"?><plist><array><string>x</string></array></plist>"));
  for (const std::string& bad : {dir / "Notes.app", dir.path()}) {  // an array, and no Info.plist at all
    SCOPED_TRACE(bad);
    auto opened = reader.openBundle(URL::fileURL(bad, true));
    ASSERT_TRUE(opened);
    EXPECT_EQ(opened->info(), std::nullopt);
    EXPECT_EQ(reader.infoDictionary(*opened), std::nullopt);
    EXPECT_EQ(opened->identifier(), std::nullopt);
  }
}

constexpr uint32_t kRed = 0xff0000ff, kBlue = 0x0000ffff, kGreen = 0x00ff00ff;
constexpr int kSize = kHomeScreenIconSize;

// The home-screen icon of the bundle at `dir`.
std::optional<Image> render(const TempDir& dir, Dictionary info = {}) {
  return CairoIconRenderer().homeScreenIconForBundle(Bundle(URL::fileURL(dir.path(), true), std::move(info)));
}

// A 57x40 icon, blue on the left and green on the right, comes out at the
// home-screen size with its layout kept, masked to a rounded square whose
// edge is straight (not premultiplied) alpha. The icon-file key names a file
// inside the bundle; a value that is not a string falls back to Icon.png; a
// name leading outside, a missing, garbage or truncated file gives none.
TEST(IconRendering, IconIsScaledAndMaskedWithStraightAlphaFromAReadablePNGInsideTheBundle) {
  TempDir dir("icon"), outside("outside");
  ASSERT_TRUE(writeSplitPNG(dir / "Icon.png", 57, 40, kBlue, kGreen));
  const std::optional<Image> icon = render(dir);
  ASSERT_TRUE(icon);
  ASSERT_EQ(std::make_tuple(icon->width, icon->height, icon->rgba.size()),
            std::make_tuple(kSize, kSize, kSize * kSize * 4ul));
  const int q = kSize / 4, h = kSize / 2, e = kSize - 1;  // a quarter, the half, the edge
  const std::tuple<int, int, uint32_t> pixels[] = {{q, h, kBlue},      {3 * q, h, kGreen}, {0, h, kBlue},
                                                   {h - 10, e, kBlue}, {0, 0, 0},          {e, 0, 0},
                                                   {0, e, 0},          {e, e, 0}};  // corners: clear
  for (auto [x, y, rgba] : pixels) {
    EXPECT_EQ(pixelAt(*icon, x, y) & (rgba ? ~0u : 0xffu), rgba) << x << "," << y;
  }
  int i = 0;
  while (i < kSize / 2 && (pixelAt(*icon, i, i) & 0xff) == 0) ++i;
  const uint32_t edge = pixelAt(*icon, i, i);
  ASSERT_LT(edge & 0xff, 255u) << "a partly transparent pixel on the diagonal";
  EXPECT_GE((edge >> 8) & 0xff, 250u) << "alpha " << (edge & 0xff);

  ASSERT_TRUE(writeSolidPNG(dir / "AppIcon.png", 8, 8, kRed) && writeSolidPNG(outside / "Evil.png", 8, 8, kRed));
  const std::string whole = readFile(dir / "AppIcon.png");
  ASSERT_TRUE(writeFile(dir / "Half.png", whole.substr(0, whole.size() / 2)) && writeFile(dir / "Junk.png", "junk"));
  const std::string escape = "../" + URL::fileURL(outside.path()).lastPathComponent() + "/Evil.png";
  // Neither waited on nor decoded: a FIFO, a link to one, a device, an image
  // wider than any icon.
  ASSERT_TRUE(mkfifo((dir / "Pipe.png").c_str(), 0644) == 0 && symlink("Pipe.png", (dir / "Piped.png").c_str()) == 0);
  ASSERT_TRUE(symlink("/dev/zero", (dir / "Zero.png").c_str()) == 0 && writeSolidPNG(dir / "Wide.png", 5000, 1, kRed));
  const std::pair<Value, std::optional<uint32_t>> cases[] = {
      {"AppIcon.png", kRed}, {7, kBlue},       {escape, {}},      {"Absent.png", {}}, {"Junk.png", {}},
      {"Half.png", {}},      {"Pipe.png", {}}, {"Piped.png", {}}, {"Zero.png", {}},   {"Wide.png", {}}};
  for (const auto& [iconFile, atQuarter] : cases) {
    const std::optional<Image> icon = render(dir, {{kBundleIconFileKey, iconFile}});
    ASSERT_EQ(icon.has_value(), atQuarter.has_value()) << iconFile.description();
    EXPECT_TRUE(!icon || pixelAt(*icon, q, h) == *atQuarter) << iconFile.description();
  }
}

Image gradient(int width, int height) {
  Image image{width, height, {}};
  for (int at = 0; at < width * height; ++at)
    image.rgba.insert(image.rgba.end(), {uint8_t(at * 7), uint8_t(at / width * 5), uint8_t(at), uint8_t(255 - at)});
  return image;
}

TEST(PNGEncoding, RoundTripsPixelsExactlyAndRefusesAnythingButOneWellFormedImage) {
  PNGImageEncoding encoding;
  Data buffer;
  for (const auto& [type, count] : {std::pair{"public.jpeg", 1}, {kImageTypePNG, 0}, {kImageTypePNG, 2}})
    EXPECT_FALSE(encoding.createEncoder(buffer, type, count)) << type << " " << count;
  Image truncated = gradient(4, 4);
  truncated.rgba.pop_back();
  for (const std::vector<Image>& images : std::vector<std::vector<Image>>{
           {}, {gradient(2, 2), gradient(2, 2)}, {truncated}, {Image{}}, {gradient(33, 17)}}) {
    auto encoder = encoding.createEncoder(buffer, kImageTypePNG, 1);
    ASSERT_TRUE(encoder);
    for (const Image& added : images) encoder->addImage(added);
    EXPECT_EQ(encoder->finalize(), images.size() == 1 && images[0].width == 33) << images.size();
    EXPECT_EQ(buffer.empty(), images.size() != 1 || images[0].width != 33);
  }
  const std::optional<Image> decoded = decodePNG(buffer);
  ASSERT_TRUE(decoded);
  EXPECT_EQ(std::tie(decoded->width, decoded->height, decoded->rgba), std::make_tuple(33, 17, gradient(33, 17).rgba));
}

}  // namespace
}  // namespace qstest
