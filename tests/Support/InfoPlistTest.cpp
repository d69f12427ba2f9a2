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

TEST_F(LoadInfoPlist, WholeDictionaryWithoutTheReadersURLEntry) {
  URL bundle = bundleAt("A.app", {{"RkBundleIdentifier", "com.example.a"}, {"RkBundleVersion", "1.2"}});
  std::optional<Dictionary> info = QSLoadInfoPlist(bundle);
  ASSERT_TRUE(info.has_value());
  EXPECT_EQ(*info, (Dictionary{{"RkBundleIdentifier", Value("com.example.a")}, {"RkBundleVersion", Value("1.2")}}));
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(LoadInfoPlist, WholeDictionaryDropsAnRkBundleInfoPlistURLEntryOfTheFile) {
  URL bundle = bundleAt("B.app", {{"RkBundleIdentifier", "com.example.b"}, {"RkBundleInfoPlistURL", "/elsewhere"}});
  std::optional<Dictionary> info = QSLoadInfoPlist(bundle);
  ASSERT_TRUE(info.has_value());
  EXPECT_EQ(info->count("RkBundleInfoPlistURL"), 0u);
  EXPECT_EQ(info->size(), 1u);
}

TEST_F(LoadInfoPlist, FilterKeepsOnlyThePresentKeys) {
  URL bundle = bundleAt("C.app", {{"RkBundleIdentifier", "com.example.c"}, {"Other", "x"}});
  std::set<std::string> keys{"RkBundleIdentifier", "RkBundleVersion"};
  std::optional<Dictionary> info = QSLoadInfoPlist(bundle, &keys);
  ASSERT_TRUE(info.has_value());
  EXPECT_EQ(*info, (Dictionary{{"RkBundleIdentifier", Value("com.example.c")}}));
}

TEST_F(LoadInfoPlist, FilterIncludingTheURLKeyKeepsIt) {
  URL bundle = bundleAt("D.app", {{"RkBundleIdentifier", "com.example.d"}, {"RkBundleInfoPlistURL", "/kept"}});
  std::set<std::string> keys{"RkBundleInfoPlistURL"};
  std::optional<Dictionary> info = QSLoadInfoPlist(bundle, &keys);
  ASSERT_TRUE(info.has_value());
  EXPECT_EQ(*info, (Dictionary{{"RkBundleInfoPlistURL", Value("/kept")}}));
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

TEST_F(LoadInfoPlist, FilteredRootThatIsNotADictionaryIsRefused) {
  std::string path = dir_ / "Array.app";
  ASSERT_TRUE(qstest::makeDirs(path));
  ASSERT_TRUE(supporttest::writeStringArrayPlist(path + "/Info.plist", {"a", "b"}));
  std::set<std::string> keys{"RkBundleIdentifier"};
  EXPECT_EQ(QSLoadInfoPlist(URL::fileURL(path, true), &keys), std::nullopt);
  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, 3);
  EXPECT_EQ(lines[0].message,
            "Object returned from _RkBundleCreateFilteredInfoPlist was not a dictionary, was type array");
}

TEST_F(LoadInfoPlist, UnreadableWholeInfoIsReported) {
  std::string path = dir_ / "Garbage.app";
  ASSERT_TRUE(qstest::makeDirs(path));
  ASSERT_TRUE(qstest::writeFile(path + "/Info.plist", "not a property list"));
  EXPECT_EQ(QSLoadInfoPlist(URL::fileURL(path, true)), std::nullopt);
  EXPECT_EQ(log_.systemMessages(),
            std::vector<std::string>{"RkBundleGetInfoDictionary failed for bundle file://" + path + "/"});
}

TEST_F(LoadInfoPlist, UnreadableFilteredInfoNamesKeysAndBundle) {
  std::string path = dir_ / "Garbage2.app";
  ASSERT_TRUE(qstest::makeDirs(path));
  ASSERT_TRUE(qstest::writeFile(path + "/Info.plist", "<plist><dict><key>x"));
  std::set<std::string> keys{"RkBundleIdentifier", "RkBundleVersion"};
  EXPECT_EQ(QSLoadInfoPlist(URL::fileURL(path, true), &keys), std::nullopt);
  platform::Bundle bundle(URL::fileURL(path, true), std::nullopt);
  EXPECT_EQ(log_.systemMessages(),
            std::vector<std::string>{"Failed to get filtered Info.plist with keys (RkBundleIdentifier, "
                                     "RkBundleVersion) from bundle " +
                                     bundle.description()});
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
