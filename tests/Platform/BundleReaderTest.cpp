// The file bundle reader.
#include "Platform/BundleReader.h"

#include "Platform/RegistryFixture.h"

namespace qstest {
namespace {

using platform::URL;

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

// The info dictionary gains the Info.plist's URL; the filtered one is read
// afresh and keeps only the keys asked for.
TEST_F(BundleReading, ReadsTheInfoDictionaryAndAFreshFilteredInfoPlist) {
  makeBundle(dir_ / "Notes.app", {.identifier = "com.example.notes", .version = "4.1"});
  auto bundle = reader_.openBundle(URL::fileURL(dir_ / "Notes.app", true));
  ASSERT_TRUE(bundle);
  EXPECT_EQ(bundle->identifier(), "com.example.notes");
  std::optional<platform::Dictionary> info = reader_.infoDictionary(*bundle);
  ASSERT_TRUE(info && info->at(platform::kBundleInfoPlistURLKey).asURL());
  EXPECT_EQ(info->at(platform::kBundleVersionKey).description(), "4.1");
  EXPECT_EQ(info->at(platform::kBundleInfoPlistURLKey).asURL()->path(), dir_ / "Notes.app/Info.plist");
  EXPECT_FALSE(bundle->info()->count(platform::kBundleInfoPlistURLKey)) << "the bundle's own dictionary is unchanged";

  makeBundle(dir_ / "Notes.app", {.identifier = "com.example.changed"});
  std::optional<platform::Value> filtered = reader_.filteredInfoPlist(*bundle, {"RkBundleIdentifier", "RkMissing"});
  ASSERT_TRUE(filtered && filtered->isDictionary());
  ASSERT_EQ(filtered->asDictionary()->size(), 1u);
  EXPECT_EQ(filtered->get("RkBundleIdentifier")->description(), "com.example.changed");
}

TEST_F(BundleReading, OpensOnlyDirectoriesAndGivesNoInfoDictionaryForAMissingOrBadInfoPlist) {
  ASSERT_TRUE(writeFile(dir_ / "file.app", "x"));
  EXPECT_FALSE(reader_.openBundle(URL::fileURL(dir_ / "file.app", true)));
  EXPECT_FALSE(reader_.openBundle(URL::fileURL(dir_ / "missing.app", true)) || reader_.openBundle(URL()));
  auto empty = open("Empty.app", "");
  ASSERT_TRUE(empty);
  EXPECT_FALSE(empty->info() || reader_.infoDictionary(*empty) || empty->identifier());
  auto array = open("Array.app", "<?xml version=\"1.0\"?><plist version=\"1.0\"><array><string>x</string></array></plist>");
  ASSERT_TRUE(array);
  EXPECT_FALSE(reader_.infoDictionary(*array));
  std::optional<platform::Value> root = reader_.filteredInfoPlist(*array, {"x"});
  EXPECT_TRUE(root && root->isArray()) << "the root is returned as read, whatever its type";
  auto broken = open("Broken.app", "<plist><dict><key>");
  ASSERT_TRUE(broken);
  EXPECT_FALSE(reader_.infoDictionary(*broken) || reader_.filteredInfoPlist(*broken, {"RkBundleIdentifier"}));
}

}  // namespace
}  // namespace qstest
