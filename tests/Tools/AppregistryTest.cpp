// appregistry: run as a program on registries filled through the real
// registry.
#include "Platform/RegistryFixture.h"
#include "ToolTestSupport.h"

namespace tooltest {
namespace {

constexpr char kLedger[] = "com.example.ledger";

class Appregistry : public qstest::RegistryTest {
 protected:
  // A system root whose name holds a quote, a space and a byte that is not
  // UTF-8, so that every path the registry reports carries them.
  void SetUp() override {
    base_ = root_ / "root \"q\" \xFF";
    ASSERT_TRUE(qstest::makeDirs(base_));
  }
  // An application with one group, a placeholder and a safe harbor.
  void fill() {
    auto registry = openRegistry();
    ASSERT_TRUE(installApp(*registry, {.identifier = kLedger, .version = "2.4.1", .groups = {"group.books"}}));
    qstest::makeBundle(at("staged.app"), {});
    const Dictionary placeholder = qstest::installOptions("com.example.a", platform::kRegistryPackageTypePlaceholder);
    ASSERT_TRUE(registry->installBundle(platform::URL::fileURL(at("staged.app"), true), placeholder, nullptr));
    ASSERT_TRUE(qstest::makeDirs(at("harbor")) &&
                registry->QuillsetRegisterSafeHarborForContainerType(at("harbor"), "com.example.retired", 2, nullptr));
  }
  RunResult run(std::vector<std::string> args) {
    args.insert(args.end(), {"--root", base_});
    return runTool("appregistry", args);
  }
  // A path as the text output shows it: the stray byte escaped.
  static std::string shown(std::string path) { return path.replace(path.find('\xFF'), 1, "\\xff"); }
};

// The text output aligns its columns and escapes the stray byte; the JSON
// escapes quotes, writes each stray byte as the escape of a lone low
// surrogate, and null for what a record does not have.
TEST_F(Appregistry, ListAndShowAsTextAndJsonWithPathsEscaped) {
  fill();
  EXPECT_EQ(run({"show", "com.example.none", "--json"}).out, "");
  const RunResult list = run({"list"});
  ASSERT_EQ(list.status, 0) << list.err;
  // Ordered by identifier, each type under TYPE.
  const size_t type = list.out.find("TYPE"), a = list.out.find("\ncom.example.a ") + 1,
               ledger = list.out.find(std::string("\n") + kLedger + " ") + 1;
  ASSERT_TRUE(type < a && a < ledger) << list.out;
  EXPECT_EQ(list.out.find("Placeholder", a), a + type) << list.out;
  EXPECT_EQ(list.out.find("User", ledger), ledger + type) << list.out;
  for (const std::string& text :
       {std::string(" yes "), std::string(" 2.4.1 "), std::string("2 records\n"), std::string("1 safe harbor\n"),
        "com.example.retired  2               " + shown(at("harbor"))}) {
    EXPECT_NE(list.out.find(text), std::string::npos) << text << "\n" << list.out;
  }
  auto record = openRegistry()->recordForIdentifier(kLedger);
  const RunResult show = run({"show", kLedger});
  for (const std::string& expected :
       {std::string("identifier:        com.example.ledger\nbundle type:       User\nversion:           2.4.1\n"),
        "bundle URL:        file://" + shown(record->bundleURL.path()),
        "data container:    file://" + shown(record->dataContainerURL->path()),
        "group containers:  group.books file://" + shown(record->groupContainerURLs->at("group.books").path())}) {
    EXPECT_NE(show.out.find(expected), std::string::npos) << "missing: " << expected << "\n" << show.out;
  }
  EXPECT_NE(run({"show", "com.example.a"}).out.find("group containers:  -\n"), std::string::npos);

  const RunResult json = run({"list", "--json"});
  ASSERT_EQ(json.status, 0) << json.err;
  EXPECT_EQ((list.out + show.out + json.out).find('\xFF'), std::string::npos) << "stray bytes never show raw";
  const std::string jsonRoot = root_.path() + "/root \\\"q\\\" \\udcff/";
  for (const std::string& text :
       {std::string("{\"identifier\":\"com.example.ledger\",\"bundleType\":\"User\",\"version\":\"2.4.1\""),
        "\"dataContainerPath\":\"" + jsonRoot, "\"groupContainers\":{\"group.books\":\"" + jsonRoot,
        std::string("\"groupContainers\":null")}) {
    EXPECT_NE(json.out.find(text), std::string::npos) << text << "\n" << json.out;
  }
  EXPECT_NE(run({"show", "com.example.a", "--json"}).out.find("\"placeholder\":true"), std::string::npos);
}

TEST_F(Appregistry, UsageErrorsExit64AndWhatCannotBeShownExits1) {
  fill();
  for (const auto& args : std::vector<std::vector<std::string>>{{}, {"show"}, {"list", "--yaml"}, {"drop"}}) {
    const RunResult result = run(args);
    EXPECT_TRUE(result.status == kUsageStatus && !result.err.empty()) << (args.empty() ? "" : args[0]) << result.err;
  }
  EXPECT_EQ(runTool("appregistry", {"list"}).status, kUsageStatus) << "the root is required";
  const RunResult unknown = run({"show", "com.example.none"});
  EXPECT_TRUE(unknown.status == 1 && unknown.out.empty()) << unknown.out;
  EXPECT_NE(unknown.err.find("no record for com.example.none"), std::string::npos) << unknown.err;
  const RunResult missing = runTool("appregistry", {"list", "--root", root_ / "absent"});
  EXPECT_TRUE(missing.status == 1 && missing.err.find("is not a directory") != std::string::npos) << missing.err;
}

// A root without a registry is refused, and left as it was: no database, no
// directory is made for one.
TEST_F(Appregistry, RootWithoutRegistryIsRefusedAndLeftUntouched) {
  for (const auto& args : std::vector<std::vector<std::string>>{{"list"}, {"show", kLedger, "--json"}}) {
    const RunResult refused = run(args);
    EXPECT_EQ(refused.status, 1);
    EXPECT_EQ(refused.out, "");
    EXPECT_NE(refused.err.find("holds no application registry (no "), std::string::npos) << refused.err;
    EXPECT_TRUE(entries(base_).empty()) << "appregistry made something under the root";
  }
  fill();
  const RunResult listed = run({"list"});
  EXPECT_EQ(listed.status, 0) << listed.err;
}

}  // namespace
}  // namespace tooltest
