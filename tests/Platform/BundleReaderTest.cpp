// The file bundle reader.
#include "Platform/BundleReader.h"


#include "Platform/RegistryFixture.h"

namespace qstest {
namespace {

using platform::Dictionary;
using platform::FileBundleReader;
using platform::URL;
using platform::Value;

class BundleReading : public testing::Test {
 protected:
  std::string makeBundle(const std::string& name, const std::string& infoPlist) {
    std::string path = dir_ / name;
    EXPECT_TRUE(makeDirs(path));
    if (!infoPlist.empty()) {
      EXPECT_TRUE(writeFile(path + "/Info.plist", infoPlist));
    }
    return path;
  }
  TempDir dir_{"bundles"};
  FileBundleReader reader_;
};

TEST_F(BundleReading, ReadsXMLInfoDictionaryAndAddsItsURL) {
  std::string path = makeBundle("Notes.app", infoPlistXML(BundleSpec("com.example.notes").withVersion("4.1")));
  auto bundle = reader_.openBundle(URL::fileURL(path, true));
  ASSERT_TRUE(bundle);
  EXPECT_EQ(bundle->identifier(), "com.example.notes");
  EXPECT_EQ(bundle->description(), "RkBundle " + path + " (not loaded)");
  std::optional<Dictionary> info = reader_.infoDictionary(*bundle);
  ASSERT_TRUE(info);
  EXPECT_EQ(info->at(platform::kBundleVersionKey).description(), "4.1");
  const URL* plistURL = info->at(platform::kBundleInfoPlistURLKey).asURL();
  ASSERT_TRUE(plistURL);
  EXPECT_EQ(plistURL->path(), path + "/Info.plist");
  EXPECT_FALSE(bundle->info()->count(platform::kBundleInfoPlistURLKey)) << "the bundle's own dictionary is unchanged";
}

TEST_F(BundleReading, OpensOnlyDirectoriesAndGivesNoInfoDictionaryForAMissingOrBadInfoPlist) {
  EXPECT_FALSE(reader_.openBundle(URL::fileURL(dir_ / "missing.app", true)));
  ASSERT_TRUE(writeFile(dir_ / "file.app", "x"));
  EXPECT_FALSE(reader_.openBundle(URL::fileURL(dir_ / "file.app", true)));
  EXPECT_FALSE(reader_.openBundle(URL()));
  auto bundle = reader_.openBundle(URL::fileURL(makeBundle("Empty.app", ""), true));
  ASSERT_TRUE(bundle);
  EXPECT_FALSE(bundle->info());
  EXPECT_FALSE(reader_.infoDictionary(*bundle));
  EXPECT_FALSE(bundle->identifier());
  const std::string arrayPlist = "<?xml version=\"1.0\"?><plist version=\"1.0\"><array><string>x</string></array></plist>";
  auto array = reader_.openBundle(URL::fileURL(makeBundle("Array.app", arrayPlist), true));
  ASSERT_TRUE(array);
  EXPECT_FALSE(reader_.infoDictionary(*array));
  std::optional<Value> root = reader_.filteredInfoPlist(*array, {"x"});
  ASSERT_TRUE(root) << "the root is returned as read, whatever its type";
  EXPECT_TRUE(root->isArray());

  auto broken = reader_.openBundle(URL::fileURL(makeBundle("Broken.app", "<plist><dict><key>"), true));
  ASSERT_TRUE(broken);
  EXPECT_FALSE(reader_.infoDictionary(*broken));
  EXPECT_FALSE(reader_.filteredInfoPlist(*broken, {platform::kBundleIdentifierKey}));
}

TEST_F(BundleReading, FilteredInfoPlistKeepsOnlyTheKeysAndIsReadAfresh) {
  std::string path = makeBundle("Notes.app", infoPlistXML(BundleSpec("com.example.notes").withVersion("1")));
  auto bundle = reader_.openBundle(URL::fileURL(path, true));
  ASSERT_TRUE(bundle);
  ASSERT_TRUE(writeFile(path + "/Info.plist", infoPlistXML(BundleSpec("com.example.changed").withVersion("2"))));
  std::optional<Value> filtered = reader_.filteredInfoPlist(*bundle, {platform::kBundleIdentifierKey, "RkMissingKey"});
  ASSERT_TRUE(filtered && filtered->isDictionary());
  ASSERT_EQ(filtered->asDictionary()->size(), 1u);
  EXPECT_EQ(filtered->get(platform::kBundleIdentifierKey)->description(), "com.example.changed");
}

}  // namespace
}  // namespace qstest
