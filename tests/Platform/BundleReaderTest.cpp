// The file bundle reader, and the registry's reading of bundle versions.
#include "Platform/BundleReader.h"

#include <gtest/gtest.h>

#include "Platform/Foundation/PropertyList.h"
#include "Platform/Registry/BundleInfo.h"
#include "Platform/RegistryFixture.h"
#include "support/TestSupport.h"

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

TEST_F(BundleReading, OpensOnlyDirectories) {
  EXPECT_FALSE(reader_.openBundle(URL::fileURL(dir_ / "missing.app", true)));
  ASSERT_TRUE(writeFile(dir_ / "file.app", "x"));
  EXPECT_FALSE(reader_.openBundle(URL::fileURL(dir_ / "file.app", true)));
  EXPECT_FALSE(reader_.openBundle(URL()));
  auto bundle = reader_.openBundle(URL::fileURL(makeBundle("Empty.app", ""), true));
  ASSERT_TRUE(bundle);
  EXPECT_FALSE(bundle->info());
  EXPECT_FALSE(reader_.infoDictionary(*bundle));
  EXPECT_FALSE(bundle->identifier());
}

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

TEST_F(BundleReading, ReadsBinaryInfoPlist) {
  std::string path = makeBundle("Bin.app", "");
  Dictionary contents{{platform::kBundleIdentifierKey, Value("com.example.binary")},
                      {platform::kApplicationGroupsKey, Value(platform::makeStringArray({"group.a"}))}};
  ASSERT_TRUE(
      platform::plist::writeFile(Value(contents), URL::fileURL(path + "/Info.plist"), platform::plist::Format::Binary));
  ASSERT_EQ(readFile(path + "/Info.plist").substr(0, 6), "bplist");
  auto bundle = reader_.openBundle(URL::fileURL(path, true));
  ASSERT_TRUE(bundle);
  EXPECT_EQ(bundle->identifier(), "com.example.binary");
}

TEST_F(BundleReading, NonDictionaryOrBrokenInfoPlistGivesNoInfoDictionary) {
  auto array = reader_.openBundle(URL::fileURL(
      makeBundle("Array.app",
                 "<?xml version=\"1.0\"?><plist version=\"1.0\"><array><string>x</string></array></plist>"),
      true));
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

TEST(BundleVersions, CompareNumericallyComponentByComponent) {
  using platform::registry::compareBundleVersions;
  EXPECT_GT(compareBundleVersions("1.10", "1.9"), 0);
  EXPECT_LT(compareBundleVersions("1.9", "1.10"), 0);
  EXPECT_EQ(compareBundleVersions("2", "2.0.0"), 0);
  EXPECT_GT(compareBundleVersions("1.0.1", "1"), 0);
  EXPECT_EQ(compareBundleVersions("", "0"), 0);
  EXPECT_EQ(compareBundleVersions("beta", "0"), 0);
  EXPECT_LT(compareBundleVersions("9", "10"), 0);
}

TEST(BundleVersions, InfoReadsGroupsAndNoDataContainer) {
  TempDir dir("info");
  std::string path = dir / "A.app";
  ASSERT_TRUE(makeDirs(path));
  ASSERT_TRUE(writeFile(path + "/Info.plist", infoPlistXML(BundleSpec("com.example.a")
                                                               .withVersion("3.2")
                                                               .withGroups({"g1", "g2"})
                                                               .withoutDataContainer()
                                                               .withDisplayName("A"))));
  platform::Error error;
  auto info = platform::registry::readBundleInfo(path, &error);
  ASSERT_TRUE(info) << error.description();
  EXPECT_EQ(info->identifier, "com.example.a");
  EXPECT_EQ(info->version, "3.2");
  EXPECT_EQ(info->displayName, "A");
  EXPECT_EQ(info->groups, (std::vector<std::string>{"g1", "g2"}));
  EXPECT_TRUE(info->noDataContainer);

  EXPECT_FALSE(platform::registry::readBundleInfo(dir / "missing.app", &error));
  EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, platform::kRegistryErrorInvalidInfoPlist));
  ASSERT_TRUE(error.underlyingError());
  EXPECT_TRUE(error.underlyingError()->is(platform::kFileErrorDomain, platform::kFileReadNoSuchFileError));
}

}  // namespace
}  // namespace qstest
