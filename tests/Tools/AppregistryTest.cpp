// appregistry: run as a program on registries filled through the real
// registry.
#include <gtest/gtest.h>

#include "Platform/BundleReader.h"
#include "Platform/Foundation/PropertyList.h"
#include "Platform/Registry/SQLiteRegistry.h"
#include "ToolTestSupport.h"
#include "support/TestSupport.h"

namespace {

using platform::Dictionary;
using platform::URL;
using platform::Value;

constexpr char kIdentifier[] = "com.example.ledger";
constexpr char kGroup[] = "group.com.example.books";

class Appregistry : public ::testing::Test {
 protected:
  // A system root whose name holds a quote, a space and a byte that is not
  // UTF-8, so that every path the registry reports carries them.
  void SetUp() override {
    root_ = dir_ / "root \"q\" \xFF";
    ASSERT_TRUE(qstest::makeDirs(root_));
  }

  std::unique_ptr<platform::SQLiteApplicationRegistry> registry() {
    platform::Error error;
    auto r = platform::SQLiteApplicationRegistry::open(root_, &error);
    EXPECT_TRUE(r) << error.description();
    return r;
  }

  // Installs an application with one group through the registry.
  void installApplication() {
    const std::string package = dir_ / "package";
    const std::string bundle = package + "/Payload/Ledger.app";
    ASSERT_TRUE(qstest::makeDirs(bundle));
    const Dictionary info{{platform::kBundleIdentifierKey, kIdentifier},
                          {platform::kBundleVersionKey, "2.4.1"},
                          {platform::kBundleExecutableKey, "Ledger"},
                          {platform::kApplicationGroupsKey, platform::makeStringArray({kGroup})}};
    ASSERT_TRUE(platform::plist::writeFile(info, URL::fileURL(bundle + "/Info.plist")));
    ASSERT_TRUE(qstest::writeFile(bundle + "/Ledger", "#!/bin/sh\n"));
    const Dictionary options{{platform::kRegistryInstallTypeKey, Value(6ULL)},
                             {platform::kRegistryPackageTypeKey, platform::kRegistryPackageTypeCustomer},
                             {"VerifyForMigrator", true},
                             {"SkipBlacklist", true},
                             {platform::kBundleIdentifierKey, kIdentifier}};
    platform::Error error;
    ASSERT_TRUE(registry()->installPackage(URL::fileURL(package, true), options, {}, &error)) << error.description();
  }

  void installPlaceholder(const std::string& identifier) {
    const std::string bundle = dir_ / (identifier + ".app");
    ASSERT_TRUE(qstest::makeDirs(bundle));
    ASSERT_TRUE(platform::plist::writeFile(Dictionary{{platform::kBundleIdentifierKey, identifier}},
                                           URL::fileURL(bundle + "/Info.plist")));
    const Dictionary options{{platform::kRegistryInstallTypeKey, Value(6ULL)},
                             {platform::kRegistryPackageTypeKey, platform::kRegistryPackageTypePlaceholder},
                             {platform::kBundleIdentifierKey, identifier}};
    platform::Error error;
    ASSERT_TRUE(registry()->installBundle(URL::fileURL(bundle, true), options, &error)) << error.description();
  }

  tooltest::RunResult run(std::vector<std::string> args) { return tooltest::runTool("appregistry", args); }

  // The root as it must appear in JSON: the quote escaped, the stray byte as
  // the escape of a lone low surrogate.
  std::string jsonRoot() const { return dir_.path() + "/root \\\"q\\\" \\udcff"; }

  qstest::TempDir dir_{"appregistry"};
  std::string root_;
};

TEST_F(Appregistry, EmptyRegistryListsNothing) {
  const tooltest::RunResult table = run({"list", "--root", root_});
  EXPECT_EQ(table.status, 0) << table.err;
  EXPECT_NE(table.out.find("0 records\nno safe harbors\n"), std::string::npos) << table.out;
  const tooltest::RunResult json = run({"list", "--root", root_, "--json"});
  EXPECT_EQ(json.status, 0) << json.err;
  EXPECT_EQ(json.out, "{\"records\":[],\"safeHarbors\":[]}\n");
}

TEST_F(Appregistry, ListAlignsRecordsAndShowsSafeHarbors) {
  installApplication();
  installPlaceholder("com.example.a");
  const std::string harbor = dir_ / "harbor";
  ASSERT_TRUE(qstest::makeDirs(harbor));
  ASSERT_TRUE(registry()->QuillsetRegisterSafeHarborForContainerType(harbor, "com.example.retired", 2, nullptr));

  const tooltest::RunResult result = run({"list", "--root", root_});
  ASSERT_EQ(result.status, 0) << result.err;
  std::vector<std::string> lines;
  for (size_t at = 0, next; (next = result.out.find('\n', at)) != std::string::npos; at = next + 1) {
    lines.push_back(result.out.substr(at, next - at));
  }
  ASSERT_GE(lines.size(), 4u) << result.out;
  const size_t typeColumn = lines[0].find("TYPE");
  ASSERT_NE(typeColumn, std::string::npos);
  bool sawLedger = false, sawPlaceholder = false;
  for (size_t i = 1; i < 3; ++i) {
    if (lines[i].rfind(kIdentifier, 0) == 0) {
      sawLedger = true;
      EXPECT_EQ(lines[i].find("User"), typeColumn) << result.out;
      EXPECT_NE(lines[i].find("2.4.1"), std::string::npos);
    }
    if (lines[i].rfind("com.example.a ", 0) == 0) {
      sawPlaceholder = true;
      EXPECT_EQ(lines[i].find("Placeholder"), typeColumn) << result.out;
      EXPECT_NE(lines[i].find(" yes "), std::string::npos) << lines[i];
    }
  }
  EXPECT_TRUE(sawLedger && sawPlaceholder) << result.out;
  EXPECT_NE(result.out.find("2 records\n"), std::string::npos) << result.out;
  EXPECT_NE(result.out.find("com.example.retired  2               " + harbor), std::string::npos) << result.out;
  EXPECT_NE(result.out.find("1 safe harbor\n"), std::string::npos) << result.out;
  // Paths below the root show the stray byte escaped, never raw.
  EXPECT_EQ(result.out.find('\xFF'), std::string::npos);
  EXPECT_NE(result.out.find("root \"q\" \\xff/"), std::string::npos) << result.out;
}

TEST_F(Appregistry, JsonEscapesQuotesAndBytesThatAreNotUTF8) {
  installApplication();
  const tooltest::RunResult result = run({"list", "--json", "--root", root_});
  ASSERT_EQ(result.status, 0) << result.err;
  EXPECT_EQ(result.out.find('\xFF'), std::string::npos);
  EXPECT_NE(result.out.find("{\"records\":[{\"identifier\":\"com.example.ledger\",\"bundleType\":\"User\","
                            "\"version\":\"2.4.1\""),
            std::string::npos)
      << result.out;
  EXPECT_NE(result.out.find("\"dataContainerPath\":\"" + jsonRoot() + "/"), std::string::npos) << result.out;
  EXPECT_NE(result.out.find("\"groupContainers\":{\"group.com.example.books\":\"" + jsonRoot() + "/"),
            std::string::npos)
      << result.out;
}

TEST_F(Appregistry, ShowPrintsEveryFieldOfOneRecord) {
  installApplication();
  const tooltest::RunResult text = run({"show", kIdentifier, "--root", root_});
  ASSERT_EQ(text.status, 0) << text.err;
  auto record = registry()->recordForIdentifier(kIdentifier);
  ASSERT_TRUE(record && record->dataContainerURL && record->groupContainerURLs);
  for (const std::string& expected :
       {std::string("identifier:        com.example.ledger\n"), std::string("bundle type:       User\n"),
        std::string("version:           2.4.1\n"), std::string("placeholder:       no\n"),
        "bundle URL:        file://" + record->bundleURL.path(),
        "data container:    file://" + record->dataContainerURL->path(),
        "group containers:  group.com.example.books file://" + record->groupContainerURLs->at(kGroup).path()}) {
    std::string shown = expected;
    for (size_t at; (at = shown.find('\xFF')) != std::string::npos;) shown.replace(at, 1, "\\xff");
    EXPECT_NE(text.out.find(shown), std::string::npos) << "missing: " << shown << "\n" << text.out;
  }
}

TEST_F(Appregistry, ShowOfAPlaceholderHasNoGroupContainers) {
  installPlaceholder("com.example.a");
  const tooltest::RunResult json = run({"show", "com.example.a", "--root", root_, "--json"});
  ASSERT_EQ(json.status, 0) << json.err;
  EXPECT_NE(json.out.find("\"placeholder\":true"), std::string::npos) << json.out;
  EXPECT_NE(json.out.find("\"groupContainers\":null"), std::string::npos) << json.out;
  const tooltest::RunResult text = run({"show", "com.example.a", "--root", root_});
  EXPECT_NE(text.out.find("group containers:  -\n"), std::string::npos) << text.out;
}

TEST_F(Appregistry, UsageErrorsExit64) {
  for (const auto& args : std::vector<std::vector<std::string>>{
           {}, {"list"}, {"show", "--root", root_}, {"list", "--root", root_, "--yaml"}, {"drop", "--root", root_}}) {
    const tooltest::RunResult result = run(args);
    EXPECT_EQ(result.status, tooltest::kUsageStatus) << (args.empty() ? "" : args[0]) << "\n" << result.err;
    EXPECT_FALSE(result.err.empty());
  }
}

TEST_F(Appregistry, UnknownIdentifierOrMissingRootIsAFailure) {
  const tooltest::RunResult unknown = run({"show", "com.example.none", "--root", root_});
  EXPECT_EQ(unknown.status, 1);
  EXPECT_EQ(unknown.out, "");
  EXPECT_NE(unknown.err.find("no record for com.example.none"), std::string::npos) << unknown.err;
  const tooltest::RunResult missing = run({"list", "--root", dir_ / "absent"});
  EXPECT_EQ(missing.status, 1);
  EXPECT_NE(missing.err.find("appregistry: "), std::string::npos) << missing.err;
}

}  // namespace
