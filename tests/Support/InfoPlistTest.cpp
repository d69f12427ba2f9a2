// QSLoadInfoPlist: whole and filtered Info.plist loading, and its failures.
#include <gtest/gtest.h>

#include "Shared/Support/QSUtilities.h"
#include "Support/SupportFixtures.h"
#include "support/TestSupport.h"

using platform::Dictionary;
using platform::URL;
using platform::Value;

namespace {

// A reader that fails in the ways the file system cannot be made to.
class FailingBundleReader final : public platform::BundleReader {
 public:
  enum class Failure { Open, Info, Filtered };
  explicit FailingBundleReader(Failure failure) : failure_(failure) {}
  std::shared_ptr<platform::Bundle> openBundle(const URL& url) override {
    ++opens;
    if (failure_ == Failure::Open) return nullptr;
    return std::make_shared<platform::Bundle>(url, Dictionary{});
  }
  std::optional<Dictionary> infoDictionary(const platform::Bundle&) override { return std::nullopt; }
  std::optional<Value> filteredInfoPlist(const platform::Bundle&, const std::set<std::string>&) override {
    return std::nullopt;
  }
  int opens = 0;

 private:
  Failure failure_;
};

class LoadInfoPlist : public ::testing::Test {
 protected:
  URL bundleAt(const std::string& name, const std::map<std::string, std::string>& entries) {
    std::string path = dir_ / name;
    EXPECT_TRUE(supporttest::makeBundle(path, entries));
    return URL::fileURL(path, true);
  }

  supporttest::ScopedLogHandle noHandle_{std::nullopt};
  qstest::TempDir dir_{"infoplist"};
  qstest::LogCapture log_;
};

TEST_F(LoadInfoPlist, WholeDictionaryDropsTheURLEntryAFilterNamingItKeepsIt) {
  URL bundle = bundleAt("B.app", {{"RkBundleIdentifier", "com.example.b"},
                                  {"RkBundleVersion", "1.2"},
                                  {"RkBundleInfoPlistURL", "/kept"}});
  EXPECT_EQ(QSLoadInfoPlist(bundle),
            (Dictionary{{"RkBundleIdentifier", Value("com.example.b")}, {"RkBundleVersion", Value("1.2")}}));
  std::set<std::string> keys{"RkBundleIdentifier", "RkBundleInfoPlistURL", "Absent"};
  EXPECT_EQ(QSLoadInfoPlist(bundle, &keys),
            (Dictionary{{"RkBundleIdentifier", Value("com.example.b")}, {"RkBundleInfoPlistURL", Value("/kept")}}));
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(LoadInfoPlist, MissingInfoPlistWritesOnlyADebugLine) {
  std::string path = dir_ / "Empty.app";
  ASSERT_TRUE(qstest::makeDirs(path));
  URL bundle = URL::fileURL(path, true);
  EXPECT_EQ(QSLoadInfoPlist(bundle), std::nullopt);
  EXPECT_TRUE(log_.systemLines().empty());

  supporttest::ScopedLogHandle verbose(7);
  FailingBundleReader reader(FailingBundleReader::Failure::Open);
  EXPECT_EQ(QSLoadInfoPlist(bundle, nullptr, reader), std::nullopt);
  EXPECT_EQ(reader.opens, 0);
  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, 7);
  EXPECT_EQ(lines[0].function, "QSLoadInfoPlist");
  EXPECT_EQ(lines[0].message, "Missing Info.plist at file://" + path + "/Info.plist");
}

TEST_F(LoadInfoPlist, UnreadableInfoIsReported) {
  std::string array = dir_ / "Array.app";
  std::string garbage = dir_ / "Garbage.app";
  ASSERT_TRUE(qstest::makeDirs(array) && qstest::makeDirs(garbage));
  ASSERT_TRUE(supporttest::writeStringArrayPlist(array + "/Info.plist", {"a", "b"}));
  ASSERT_TRUE(qstest::writeFile(garbage + "/Info.plist", "<plist><dict><key>x"));
  std::set<std::string> keys{"RkBundleIdentifier", "RkBundleVersion"};
  EXPECT_EQ(QSLoadInfoPlist(URL::fileURL(array, true), &keys), std::nullopt);
  EXPECT_EQ(QSLoadInfoPlist(URL::fileURL(garbage, true)), std::nullopt);
  EXPECT_EQ(QSLoadInfoPlist(URL::fileURL(garbage, true), &keys), std::nullopt);
  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 3u);
  for (const auto& line : lines) EXPECT_EQ(line.level, 3);
  EXPECT_EQ(lines[0].message,
            "Object returned from _RkBundleCreateFilteredInfoPlist was not a dictionary, was type array");
  EXPECT_EQ(lines[1].message, "RkBundleGetInfoDictionary failed for bundle file://" + garbage + "/");
  EXPECT_EQ(lines[2].message, "Failed to get filtered Info.plist with keys (RkBundleIdentifier, RkBundleVersion) "
                              "from bundle " + platform::Bundle(URL::fileURL(garbage, true), std::nullopt).description());
}

TEST_F(LoadInfoPlist, BundleThatCannotBeOpenedIsReported) {
  URL bundle = bundleAt("E.app", {{"RkBundleIdentifier", "com.example.e"}});
  FailingBundleReader reader(FailingBundleReader::Failure::Open);
  EXPECT_EQ(QSLoadInfoPlist(bundle, nullptr, reader), std::nullopt);
  EXPECT_EQ(reader.opens, 1);
  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, 3);
  EXPECT_EQ(lines[0].function, "QSLoadInfoPlist");
  EXPECT_EQ(lines[0].message, "Failed to create RkBundle from URL " + bundle.description());
}

TEST_F(LoadInfoPlist, EveryCallOpensAFreshBundle) {
  URL bundle = bundleAt("F.app", {{"RkBundleIdentifier", "com.example.f"}});
  EXPECT_TRUE(QSLoadInfoPlist(bundle).has_value());
  ASSERT_TRUE(supporttest::writeStringDictionaryPlist(bundle.path() + "/Info.plist",
                                                      {{"RkBundleIdentifier", "com.example.changed"}}));
  std::optional<Dictionary> info = QSLoadInfoPlist(bundle);
  ASSERT_TRUE(info.has_value());
  EXPECT_EQ(info->at("RkBundleIdentifier"), Value("com.example.changed"));
}

}  // namespace
