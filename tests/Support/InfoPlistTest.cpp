// QSLoadInfoPlist: whole and filtered Info.plist loading, and its failures.
#include <gtest/gtest.h>

#include "Shared/Support/QSUtilities.h"
#include "Support/SupportFixtures.h"

using platform::Dictionary;
using platform::URL;
using platform::Value;

namespace {

// A reader that cannot open any bundle, as the file system cannot be made to refuse.
class UnopenableBundleReader final : public platform::BundleReader {
 public:
  std::shared_ptr<platform::Bundle> openBundle(const URL&) override {
    ++opens;
    return nullptr;
  }
  std::optional<Dictionary> infoDictionary(const platform::Bundle&) override { return std::nullopt; }
  std::optional<Value> filteredInfoPlist(const platform::Bundle&, const std::set<std::string>&) override { return {}; }
  int opens = 0;
};

class LoadInfoPlist : public ::testing::Test {
 protected:
  URL bundleAt(const std::string& name, const Value& info) {
    EXPECT_TRUE(qstest::makeDirs(dir_ / name));
    EXPECT_TRUE(platform::plist::writeFile(info, URL::fileURL(dir_ / (name + "/Info.plist"))));
    return URL::fileURL(dir_ / name, true);
  }
  const std::set<std::string> keys_{"RkBundleIdentifier", "RkBundleVersion"};
  supporttest::ScopedLogHandle noHandle_{std::nullopt};
  qstest::TempDir dir_{"infoplist"};
  qstest::LogCapture log_;
};

// Every call opens the bundle afresh: a changed Info.plist is read as it is now.
TEST_F(LoadInfoPlist, WholeDictionaryDropsTheURLEntryAFilterNamingItKeepsItAndNothingIsCached) {
  const Dictionary info{
      {"RkBundleIdentifier", Value("b")}, {"RkBundleVersion", Value("1")}, {"RkBundleInfoPlistURL", Value("/kept")}};
  URL bundle = bundleAt("B.app", Value(info));
  EXPECT_EQ(QSLoadInfoPlist(bundle), (Dictionary{{"RkBundleIdentifier", Value("b")}, {"RkBundleVersion", Value("1")}}));
  std::set<std::string> keys{"RkBundleIdentifier", "RkBundleInfoPlistURL", "Absent"};
  EXPECT_EQ(QSLoadInfoPlist(bundle, &keys),
            (Dictionary{{"RkBundleIdentifier", Value("b")}, {"RkBundleInfoPlistURL", Value("/kept")}}));
  bundleAt("B.app", Value(Dictionary{{"RkBundleIdentifier", Value("changed")}}));
  EXPECT_EQ(QSLoadInfoPlist(bundle, &keys_), (Dictionary{{"RkBundleIdentifier", Value("changed")}}));
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(LoadInfoPlist, MissingUnreadableAndUnopenableBundlesAreReported) {
  UnopenableBundleReader reader;
  ASSERT_TRUE(qstest::makeDirs(dir_ / "Empty.app"));
  EXPECT_EQ(QSLoadInfoPlist(URL::fileURL(dir_ / "Empty.app", true), nullptr, reader), std::nullopt);
  EXPECT_EQ(reader.opens, 0) << "a missing Info.plist is not worth opening the bundle for";
  EXPECT_TRUE(log_.systemLines().empty()) << "it is a debug line";

  URL array = bundleAt("Array.app", Value(platform::Array{Value("a")}));
  ASSERT_TRUE(qstest::makeDirs(dir_ / "Garbage.app") && qstest::writeFile(dir_ / "Garbage.app/Info.plist", "<dict>"));
  URL garbage = URL::fileURL(dir_ / "Garbage.app", true);
  for (auto [url, filter] : {std::pair{array, &keys_}, {garbage, nullptr}, {garbage, &keys_}}) {
    EXPECT_EQ(QSLoadInfoPlist(url, filter), std::nullopt);
  }
  EXPECT_EQ(QSLoadInfoPlist(array, nullptr, reader), std::nullopt);
  EXPECT_EQ(log_.systemMessages(),
            (std::vector<std::string>{
                "Object returned from _RkBundleCreateFilteredInfoPlist was not a dictionary, was type array",
                "RkBundleGetInfoDictionary failed for bundle " + garbage.description(),
                "Failed to get filtered Info.plist with keys (RkBundleIdentifier, RkBundleVersion) from bundle " +
                    platform::Bundle(garbage, std::nullopt).description(),
                "Failed to create RkBundle from URL " + array.description()}));
  for (const auto& line : log_.systemLines()) EXPECT_EQ(line.level, 3);
}

}  // namespace
