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
  const RunResult list = run({"list"});
  ASSERT_THAT(list, exited(0));
  // Ordered by identifier, each type under TYPE.
  const size_t type = list.out.find("TYPE"), a = list.out.find("\ncom.example.a ") + 1,
               ledger = list.out.find(std::string("\n") + kLedger + " ") + 1;
  ASSERT_LT(type, a) << list.out;
  ASSERT_LT(a, ledger) << list.out;
  EXPECT_EQ(list.out.find("Placeholder", a), a + type) << list.out;
  EXPECT_EQ(list.out.find("User", ledger), ledger + type) << list.out;
  for (const std::string& text :
       {std::string(" yes "), std::string(" 2.4.1 "), std::string("2 records\n"), std::string("1 safe harbor\n"),
        "com.example.retired  2               " + shown(at("harbor"))}) {
    EXPECT_THAT(list.out, HasSubstr(text));
  }
  auto record = openRegistry()->recordForIdentifier(kLedger);
  const RunResult show = run({"show", kLedger});
  for (const std::string& expected :
       {std::string("identifier:        com.example.ledger\nbundle type:       User\nversion:           2.4.1\n"),
        "bundle URL:        file://" + shown(record->bundleURL.path()),
        "data container:    file://" + shown(record->dataContainerURL->path()),
        "group containers:  group.books file://" + shown(record->groupContainerURLs->at("group.books").path())}) {
    EXPECT_THAT(show.out, HasSubstr(expected));
  }
  EXPECT_THAT(run({"show", "com.example.a"}).out, HasSubstr("group containers:  -\n"));

  const RunResult json = run({"list", "--json"});
  ASSERT_THAT(json, exited(0));
  EXPECT_EQ((list.out + show.out + json.out).find('\xFF'), std::string::npos) << "stray bytes never show raw";
  const std::string jsonRoot = root_.path() + "/root \\\"q\\\" \\udcff/";
  for (const std::string& text :
       {std::string("{\"identifier\":\"com.example.ledger\",\"bundleType\":\"User\",\"version\":\"2.4.1\""),
        "\"dataContainerPath\":\"" + jsonRoot, "\"groupContainers\":{\"group.books\":\"" + jsonRoot,
        std::string("\"groupContainers\":null")}) {
    EXPECT_THAT(json.out, HasSubstr(text));
  }
  EXPECT_THAT(run({"show", "com.example.a", "--json"}).out, HasSubstr("\"placeholder\":true"));
}

// Usage errors exit 64, what cannot be shown 1, with nothing on standard
// output. A root without a registry is left as it was: no database, no
// directory is made for one.
TEST_F(Appregistry, RefusalsExit64ForUsageAnd1ForWhatCannotBeShown) {
  const std::vector<std::string> root = {"--root", base_};
  auto refuse = [&](std::vector<std::string> args, int status, const std::string& phrase, bool rooted = true) {
    if (rooted) args.insert(args.end(), root.begin(), root.end());
    EXPECT_THAT(runTool("appregistry", args), exited(status, AllOf(Not(IsEmpty()), HasSubstr(phrase)), IsEmpty()))
        << testing::PrintToString(args);
  };
  for (const std::vector<std::string>& args : {std::vector<std::string>{"list"}, {"show", kLedger, "--json"}}) {
    refuse(args, 1, "holds no application registry (no ");
    EXPECT_THAT(entries(base_), IsEmpty()) << "appregistry made something under the root";
  }
  fill();
  for (const auto& args : std::vector<std::vector<std::string>>{{}, {"show"}, {"list", "--yaml"}, {"drop"}})
    refuse(args, kUsageStatus, "");
  refuse({"list"}, kUsageStatus, "--root", false);
  refuse({"show", "com.example.none"}, 1, "no record for com.example.none");
  refuse({"show", "com.example.none", "--json"}, 1, "no record for com.example.none");
  refuse({"list", "--root", root_ / "absent"}, 1, "is not a directory", false);
}

}  // namespace
}  // namespace tooltest
