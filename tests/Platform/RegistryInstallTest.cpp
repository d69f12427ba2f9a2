// Installing packages, placeholders and built-in applications: containers,
// records, groups, VPN plug-ins and refusals; the daemon's calls.
#include <sys/xattr.h>
#include <unistd.h>

#include <cstdio>
#include <stdexcept>

#include "Platform/RegistryFixture.h"

namespace qstest {
namespace {

using namespace platform;

using RegistryInstall = RegistryTest;

// A package whose identifier the options do not claim, that has no or two
// applications, a broken Info.plist or a symbolic link for its application
// is refused and left as it was, and no container is made.
TEST_F(RegistryInstall, BadPackagesAreRefusedAndLeftAsTheyWere) {
  const std::string plist = "/Payload/App.app/Info.plist", app = "/Payload/App.app";
  const std::string array = "<?xml version=\"1.0\"?><plist version=\"1.0\"><array><string>a</string></array></plist>";
  const std::string real = at("Real.app");
  // The damage done to the package (none: the options claim another
  // identifier), and the refusal's code.
  using Case = std::tuple<const char*, std::function<bool(const std::string&)>, int64_t>;
  const int64_t badPackage = kRegistryErrorInvalidPackage, badPlist = kRegistryErrorInvalidInfoPlist;
  const Case cases[] = {
      {"claimed", {}, kRegistryErrorIdentifierMismatch},
      {"no-payload", [](auto p) { return !rename((p + "/Payload").c_str(), (p + "/P").c_str()); }, badPackage},
      {"broken", [&](auto p) { return writeFile(p + plist, "<plist><dict><key>RkBundle"); }, badPlist},
      {"array", [&](auto p) { return writeFile(p + plist, array); }, badPlist},
      {"two-apps", [&](auto p) { return makeDirs(p + "/Payload/Second.app"); }, badPackage},
      {"link",
       [&](auto p) { return !rename((p + app).c_str(), real.c_str()) && !symlink(real.c_str(), (p + app).c_str()); },
       badPackage},
  };
  auto registry = openRegistry();
  for (const auto& [name, damage, code] : cases) {
    SCOPED_TRACE(name);
    std::string package = makePackage(name, {.identifier = "ex.x"});
    ASSERT_TRUE(!damage || damage(package));
    const std::string identifier = damage ? "ex.x" : "ex.claimed";
    std::vector<std::string> before = entries(package + "/Payload");
    Error error;
    EXPECT_FALSE(install(*registry, package, identifier, &error));
    EXPECT_EQ(registryCode(error), code) << error.description();
    EXPECT_EQ(errors_.size(), 1u) << "one report of the failure";
    EXPECT_EQ(entries(package + "/Payload"), before);
    EXPECT_EQ(allContainers(), (std::vector<std::vector<std::string>>(4)));
    EXPECT_FALSE(registry->isInstalled(identifier));
  }
  EXPECT_TRUE(exists(real + "/Info.plist"));
  // A placeholder type for a package.
  Error error;
  const Dictionary options = installOptions("ex.x", kRegistryPackageTypePlaceholder);
  EXPECT_FALSE(registry->installPackage(URL::fileURL(at("packages/claimed"), true), options, {}, &error));
  EXPECT_EQ(registryCode(error), kRegistryErrorInvalidOptions);
  EXPECT_TRUE(exists(at("packages/claimed/Payload/App.app")));
}

// A placeholder is a copy of a staged bundle, installed for the options'
// identifier (never its Info.plist's), with the store metadata and a data
// container but no group dictionary. The data container outlives a second
// placeholder and the real application; a placeholder cannot replace that.
TEST_F(RegistryInstall, PlaceholderIsACopyWhoseDataContainerOutlivesItsReplacements) {
  auto registry = openRegistry();
  TempDir staging("staging");
  const std::string staged = staging / "Staged.app";
  makeBundle(staged, {.identifier = "ex.inner", .groups = {"group.game"}});
  auto placeholder = [&](const std::string& identifier, std::optional<Value> metadata, const std::string& bundle) {
    Dictionary options = installOptions(identifier, kRegistryPackageTypePlaceholder);
    if (metadata) options[kRegistryStoreMetadataKey] = *metadata;
    Error error;
    return registry->installBundle(URL::fileURL(bundle, true), options, &error) ? 0 : registryCode(error);
  };
  ASSERT_EQ(placeholder("ex.game", Value(Data{'<', 0, 0xFF}), staged), 0);
  EXPECT_FALSE(registry->isInstalled("ex.inner"));
  const BundleRecord first = *registry->recordForIdentifier("ex.game");
  EXPECT_EQ(first.bundleType, kBundleTypePlaceholder);
  EXPECT_TRUE(first.isPlaceholder);
  EXPECT_FALSE(first.groupContainerURLs) << "a placeholder's record has no group dictionary";
  EXPECT_EQ(readFile(first.bundleURL.path() + "/Info.plist"), readFile(staged + "/Info.plist"));
  EXPECT_EQ(readFile(first.bundleContainerURL.path() + "/VendraMetadata.plist"), std::string("<\0\xFF", 3));
  EXPECT_TRUE(exists(staged)) << "the caller removes its staged directory";
  ASSERT_TRUE(writeFile(first.dataContainerURL->path() + "/save.dat", "level 9"));

  makeBundle(staged, {});
  ASSERT_EQ(placeholder("ex.game", std::nullopt, staged), 0);
  const BundleRecord second = *registry->recordForIdentifier("ex.game");
  EXPECT_FALSE(exists(first.bundleContainerURL.path()));
  ASSERT_TRUE(installApp(*registry, {.identifier = "ex.game", .groups = {"group.game"}}));
  const BundleRecord real = *registry->recordForIdentifier("ex.game");
  EXPECT_FALSE(real.isPlaceholder);
  EXPECT_THAT(real.groupContainerURLs, testing::Optional(testing::SizeIs(1)));
  EXPECT_EQ(readFile(real.dataContainerURL->path() + "/save.dat"), "level 9");
  EXPECT_FALSE(exists(second.bundleContainerURL.path()));

  EXPECT_EQ(placeholder("ex.game", std::nullopt, staged), kRegistryErrorNotReplaceable);
  EXPECT_EQ(placeholder("ex.x", std::nullopt, staged + "x"), kRegistryErrorInvalidPackage);
  EXPECT_EQ(placeholder("ex.x", std::nullopt, "relative.app"), kRegistryErrorInvalidPackage);
  EXPECT_EQ(placeholder("ex.x", Value("not data"), staged), kRegistryErrorInvalidOptions);
  EXPECT_EQ(entries(bundleContainers()).size(), 1u);
}

// The protection class of a directory; -1 when the attribute is missing.
int32_t protectionClass(const std::string& path) {
  int32_t value = -1;
  getxattr(path.c_str(), kProtectionClassAttributeName, &value, sizeof value);
  return value;
}

// A package not newer than the built-in application is refused and removed.
// A built-in application's data container is made on its first lookup
// (unless it has none) and kept; its group container is the one installed
// applications of the group share. The daemon's update puts class three on
// every one, making those not looked up yet; a container that refuses it
// fails the update but not the others'. A safe harbor is registered only
// for an existing directory; the next one replaces it. A progress callback
// that throws loses its reports, not the installation.
TEST_F(RegistryInstall, BuiltInContainersAndTheDaemonsCalls) {
  makeBundle(at("Applications/Weather.app"), {.identifier = "ex.weather", .version = "3", .groups = {"group.shared"}});
  makeBundle(at("Applications/Settings.app"), {.identifier = "ex.settings", .noDataContainer = true});
  makeBundle(at("Applications/Clock.app"), {.identifier = "ex.clock", .version = "2.10"});
  auto registry = openRegistry();
  EXPECT_TRUE(entries(appDataContainers()).empty()) << "nothing is made before the first lookup";
  EXPECT_FALSE(registry->recordForIdentifier("ex.settings")->dataContainerURL) << "RkNoDataContainer";
  std::optional<BundleRecord> record = registry->recordForIdentifier("ex.weather");
  ASSERT_TRUE(record && record->dataContainerURL && record->groupContainerURLs);
  EXPECT_EQ(openRegistry()->recordForIdentifier("ex.weather")->dataContainerURL, record->dataContainerURL);
  const std::string weather = record->dataContainerURL->path();
  LogCapture log;
  const std::string a = makePackage("a", {.identifier = "ex.a", .groups = {"group.shared"}});
  ASSERT_TRUE(install(*registry, a, "ex.a", nullptr, "StagingFiles", [] { throw std::runtime_error("x"); }));
  EXPECT_EQ(log.count("Progress callback threw on report"), 1u);
  EXPECT_EQ(registry->recordForIdentifier("ex.a")->groupContainerURLs->at("group.shared"),
            record->groupContainerURLs->at("group.shared"));
  EXPECT_EQ(entries(groupContainers()).size(), 1u);

  const std::string update = kQSUpdateSystemAppDataContainerDataProtection;
  EXPECT_TRUE(registry->QuillsetUpdateContainerDataProtectionForMigratorOnly({{update, false}}));
  EXPECT_EQ(protectionClass(weather), -1) << "without the option nothing changes";
  EXPECT_EQ(entries(appDataContainers()).size(), 2u);
  ASSERT_TRUE(setImmutable(weather, true));
  EXPECT_FALSE(registry->QuillsetUpdateContainerDataProtectionForMigratorOnly({{update, true}}));
  EXPECT_TRUE(log.contains("Could not update the data protection of ex.weather"));
  ASSERT_TRUE(setImmutable(weather, false));
  EXPECT_EQ(protectionClass(registry->recordForIdentifier("ex.clock")->dataContainerURL->path()), 3);
  ASSERT_TRUE(registry->QuillsetUpdateContainerDataProtectionForMigratorOnly({{update, true}}));
  EXPECT_EQ(protectionClass(weather), 3);
  EXPECT_EQ(entries(appDataContainers()).size(), 3u) << "built-ins, but not the one without a data container";

  for (const char* version : {"2.9", "2.10.0"}) {  // not newer: refused, and the package removed
    std::string package = makePackage(version, {.identifier = "ex.clock", .version = version});
    Error error;
    EXPECT_FALSE(install(*registry, package, "ex.clock", &error)) << version;
    EXPECT_EQ(registryCode(error), kRegistryErrorAlreadyInstalled);
    EXPECT_FALSE(exists(package));
    EXPECT_EQ(registry->recordForIdentifier("ex.clock")->bundleType, kBundleTypeSystem);
    EXPECT_EQ(entries(bundleContainers()).size(), 1u) << "only ex.a's";
  }

  ASSERT_TRUE(makeDirs(at("harbors/game")) && makeDirs(at("harbors/two")) && writeFile(at("harbors/file"), "x"));
  EXPECT_FALSE(registry->QuillsetRegisterSafeHarborForContainerType(at("harbors/file"), "ex.b", 2, nullptr));
  EXPECT_TRUE(log.contains("Safe harbor " + at("harbors/file") + " of ex.b is not an existing directory"));
  EXPECT_TRUE(registry->safeHarbors().empty());
  for (const char* path : {"harbors/game", "harbors/two"}) {
    EXPECT_TRUE(registry->QuillsetRegisterSafeHarborForContainerType(at(path), "ex.game", 2, nullptr));
    std::vector<std::tuple<std::string, std::string, int>> harbors;
    for (const SafeHarborRecord& h : openRegistry()->safeHarbors())
      harbors.emplace_back(h.identifier, h.path, h.containerType);
    EXPECT_EQ(harbors, (std::vector<std::tuple<std::string, std::string, int>>{{"ex.game", at(path), 2}}));
  }
}

}  // namespace
}  // namespace qstest
