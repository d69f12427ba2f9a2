// Installing packages: containers, records, groups, VPN plug-ins, refusals and
// replays.
#include <unistd.h>

#include <cstdio>
#include <functional>
#include <stdexcept>
#include <thread>

#include "Platform/BundleReader.h"
#include "Platform/Foundation/Error.h"
#include "Platform/RegistryFixture.h"

namespace qstest {
namespace {

using platform::BundleRecord;
using platform::Error;

using RegistryInstall = RegistryTest;

TEST_F(RegistryInstall, MovesBundleIntoNewContainersAndRemovesPackage) {
  auto registry = openRegistry();
  std::string package =
      makePackage("notes", BundleSpec("com.example.notes").withVersion("1.2").withDisplayName("Notes"), {},
                  {"VendraMetadata.plist", "Manifest.plist"});
  Error error;
  ASSERT_TRUE(install(*registry, package, "com.example.notes", &error)) << error.description();

  EXPECT_EQ(statuses(reports_), (std::vector<std::string>{"VerifyingApplication", "StagingFiles",
                                                          "RegisteringApplication", "CleaningUp", "Complete"}));
  for (std::thread::id id : reporterThreads_) {
    EXPECT_NE(id, std::this_thread::get_id()) << "reports come from the registry's worker thread";
  }
  EXPECT_FALSE(exists(package));

  std::optional<BundleRecord> record = registry->recordForIdentifier("com.example.notes");
  ASSERT_TRUE(record);
  EXPECT_EQ(record->bundleType, platform::kBundleTypeUser);
  EXPECT_EQ(record->version, "1.2");
  EXPECT_EQ(record->displayName, "Notes");
  EXPECT_FALSE(record->isPlaceholder);
  EXPECT_TRUE(record->foundBackingBundle);
  EXPECT_EQ(record->bundleContainerURL.deletingLastPathComponent().path(), bundleContainers());
  EXPECT_EQ(record->bundleURL.path(), record->bundleContainerURL.path() + "/App.app");
  EXPECT_EQ(readFile(record->bundleURL.path() + "/main"), "executable of com.example.notes");
  EXPECT_EQ(readFile(record->bundleContainerURL.path() + "/VendraMetadata.plist"), "metadata VendraMetadata.plist");
  EXPECT_EQ(readFile(record->bundleContainerURL.path() + "/Manifest.plist"), "metadata Manifest.plist");
  ASSERT_TRUE(record->dataContainerURL);
  EXPECT_EQ(record->dataContainerURL->deletingLastPathComponent().path(), appDataContainers());
  EXPECT_TRUE(isDirectory(record->dataContainerURL->path()));
  ASSERT_TRUE(record->groupContainerURLs) << "an installed bundle always has a group dictionary";
  EXPECT_TRUE(record->groupContainerURLs->empty());
  EXPECT_TRUE(registry->isInstalled("com.example.notes"));
  EXPECT_FALSE(registry->isInstalled("com.example.other"));
}

TEST_F(RegistryInstall, ThrowingProgressCallbackDoesNotStopTheInstallation) {
  auto registry = openRegistry();
  std::string package = makePackage("notes", BundleSpec("com.example.notes"));
  LogCapture log;
  Error error;
  EXPECT_TRUE(registry->installPackage(
      platform::URL::fileURL(package, true), customerOptions("com.example.notes"),
      [](const platform::Dictionary&) { throw std::runtime_error("callback failure"); }, &error))
      << error.description();
  EXPECT_EQ(log.count("Progress callback threw on report"), 5u);
  EXPECT_TRUE(registry->recordForIdentifier("com.example.notes")->foundBackingBundle);
}

TEST_F(RegistryInstall, ReinstallKeepsDataContainerAndRemovesOldBundleContainer) {
  auto registry = openRegistry();
  ASSERT_TRUE(installApp(*registry, BundleSpec("com.example.mail").withVersion("1")));
  BundleRecord first = *registry->recordForIdentifier("com.example.mail");
  ASSERT_TRUE(writeFile(first.dataContainerURL->path() + "/inbox", "user data"));

  ASSERT_TRUE(installApp(*registry, BundleSpec("com.example.mail").withVersion("2")));
  BundleRecord second = *registry->recordForIdentifier("com.example.mail");
  EXPECT_EQ(second.version, "2");
  EXPECT_EQ(second.dataContainerURL->path(), first.dataContainerURL->path());
  EXPECT_EQ(readFile(second.dataContainerURL->path() + "/inbox"), "user data");
  EXPECT_NE(second.bundleContainerURL.path(), first.bundleContainerURL.path());
  EXPECT_FALSE(exists(first.bundleContainerURL.path()));
  EXPECT_EQ(entries(bundleContainers()).size(), 1u);
}

TEST_F(RegistryInstall, GroupContainerIsSharedByApplicationsOfTheGroupBuiltInOrNot) {
  makeBuiltIn("Photos.app", BundleSpec("com.example.photos").withGroups({"group.shared"}));
  auto registry = openRegistry();
  ASSERT_TRUE(installApp(*registry, BundleSpec("com.example.a").withGroups({"group.shared", "group.a"})));
  ASSERT_TRUE(installApp(*registry, BundleSpec("com.example.b").withGroups({"group.shared"})));
  auto a = *registry->recordForIdentifier("com.example.a")->groupContainerURLs;
  auto b = *registry->recordForIdentifier("com.example.b")->groupContainerURLs;
  auto system = *registry->recordForIdentifier("com.example.photos")->groupContainerURLs;
  ASSERT_EQ(a.size(), 2u);
  ASSERT_EQ(b.size(), 1u);
  EXPECT_EQ(b.at("group.shared").path(), a.at("group.shared").path());
  EXPECT_EQ(system.at("group.shared").path(), a.at("group.shared").path());
  EXPECT_NE(a.at("group.a").path(), a.at("group.shared").path());
  EXPECT_TRUE(isDirectory(a.at("group.shared").path()));
  EXPECT_TRUE(isDirectory(a.at("group.a").path()));
  EXPECT_EQ(a.at("group.a").deletingLastPathComponent().path(), groupContainers());
  EXPECT_EQ(entries(groupContainers()).size(), 2u);
}

TEST_F(RegistryInstall, VPNPluginInTheSamePayloadGetsARecordOfItsOwn) {
  auto registry = openRegistry();
  ASSERT_TRUE(installApp(*registry, BundleSpec("com.example.vpn"), BundleSpec("com.example.vpn.tunnel")));
  BundleRecord app = *registry->recordForIdentifier("com.example.vpn");
  std::optional<BundleRecord> plugin = registry->recordForIdentifier("com.example.vpn.tunnel");
  ASSERT_TRUE(plugin);
  EXPECT_EQ(app.bundleType, platform::kBundleTypeUser);
  EXPECT_EQ(plugin->bundleType, platform::kBundleTypeVPNPlugin);
  EXPECT_EQ(plugin->bundleURL.lastPathComponent(), "Tunnel.vpnplugin");
  EXPECT_TRUE(isDirectory(plugin->bundleURL.path()));
  ASSERT_TRUE(plugin->dataContainerURL);
  EXPECT_EQ(plugin->dataContainerURL->deletingLastPathComponent().path(), pluginDataContainers());
  EXPECT_NE(plugin->dataContainerURL->path(), app.dataContainerURL->path());
  EXPECT_TRUE(plugin->groupContainerURLs);
}

TEST_F(RegistryInstall, OlderOrEqualToBuiltInIsRefusedAndPackageRemovedNewerIsInstalled) {
  makeBuiltIn("Clock.app", BundleSpec("com.example.clock").withVersion("2.10"));
  auto registry = openRegistry();
  for (const char* version : {"2.9", "2.10.0"}) {
    std::string package = makePackage(version, BundleSpec("com.example.clock").withVersion(version));
    Error error;
    EXPECT_FALSE(install(*registry, package, "com.example.clock", &error));
    EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, platform::kRegistryErrorAlreadyInstalled)) << version;
    EXPECT_EQ(reportedError(reports_), "ApplicationAlreadyInstalled");
    EXPECT_FALSE(exists(package));
    EXPECT_EQ(registry->recordForIdentifier("com.example.clock")->bundleType, platform::kBundleTypeSystem);
    EXPECT_TRUE(entries(bundleContainers()).empty());
  }
  ASSERT_TRUE(installApp(*registry, BundleSpec("com.example.clock").withVersion("2.10.1")));
  EXPECT_EQ(registry->recordForIdentifier("com.example.clock")->bundleType, platform::kBundleTypeUser);
}

// A refusal other than "already installed" leaves the package as it was and
// makes no container.
using RegistryRefusal = RegistryTest;

TEST_F(RegistryRefusal, BadPackagesAreLeftAsTheyWere) {
  const std::string plist = "/Payload/App.app/Info.plist";
  const std::string arrayPlist =
      "<?xml version=\"1.0\"?><plist version=\"1.0\"><array><string>a</string></array></plist>";
  struct Case {
    const char* name;
    std::function<void(const std::string& package)> damage;  // none: the options claim another identifier
    int64_t code;
    const char* error;
  } cases[] = {
      {"claimed", {}, platform::kRegistryErrorIdentifierMismatch, "BundleIdentifierMismatch"},
      {"no-payload", [](const std::string& p) { ASSERT_EQ(rename((p + "/Payload").c_str(), (p + "/P").c_str()), 0); },
       platform::kRegistryErrorInvalidPackage, "InvalidPackage"},
      {"broken-plist", [&](const std::string& p) { ASSERT_TRUE(writeFile(p + plist, "<plist><dict><key>RkBundle")); },
       platform::kRegistryErrorInvalidInfoPlist, "InvalidInfoPlist"},
      {"array-plist", [&](const std::string& p) { ASSERT_TRUE(writeFile(p + plist, arrayPlist)); },
       platform::kRegistryErrorInvalidInfoPlist, "InvalidInfoPlist"},
      {"no-plist", [&](const std::string& p) { ASSERT_EQ(unlink((p + plist).c_str()), 0); },
       platform::kRegistryErrorInvalidInfoPlist, "InvalidInfoPlist"},
      {"two-apps", [&](const std::string& p) { makeBundle(p + "/Payload/Second.app", BundleSpec("com.example.x")); },
       platform::kRegistryErrorInvalidPackage, "InvalidPackage"},
      {"link",
       [&](const std::string& p) {
         ASSERT_EQ(rename((p + "/Payload/App.app").c_str(), at("Real.app").c_str()), 0);
         ASSERT_EQ(symlink(at("Real.app").c_str(), (p + "/Payload/App.app").c_str()), 0);
       },
       platform::kRegistryErrorInvalidPackage, "InvalidPackage"},
  };
  auto registry = openRegistry();
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    std::string package = makePackage(c.name, BundleSpec("com.example.x"));
    if (c.damage) c.damage(package);
    const std::string identifier = c.damage ? "com.example.x" : "com.example.claimed";
    std::vector<std::string> before = entries(package + "/Payload");
    Error error;
    EXPECT_FALSE(install(*registry, package, identifier, &error));
    EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, c.code)) << error.description();
    EXPECT_FALSE(error.localizedDescription().empty());
    EXPECT_EQ(reportedError(reports_), c.error);
    EXPECT_EQ(statuses(reports_).back(), "Failed");
    EXPECT_EQ(entries(package + "/Payload"), before);
    EXPECT_TRUE(isDirectory(package));
    EXPECT_TRUE(entries(bundleContainers()).empty());
    EXPECT_TRUE(entries(appDataContainers()).empty());
    EXPECT_FALSE(registry->isInstalled(identifier));
  }
  EXPECT_TRUE(exists(at("Real.app/Info.plist")));
}

TEST_F(RegistryRefusal, RelativeLocationsAndPlaceholderPackageType) {
  std::string package = makePackage("p", BundleSpec("com.example.x"));
  auto registry = openRegistry();
  Error error;
  EXPECT_FALSE(registry->installPackage(platform::URL::fileURL("packages/p", true), customerOptions("com.example.x"),
                                        {}, &error));
  EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, platform::kRegistryErrorInvalidPackage)) << error.description();
  EXPECT_FALSE(registry->installBundle(platform::URL(), {}, &error));
  EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, platform::kRegistryErrorInvalidPackage)) << error.description();
  platform::Dictionary options = customerOptions("com.example.x");
  options[platform::kRegistryPackageTypeKey] = platform::Value(platform::kRegistryPackageTypePlaceholder);
  EXPECT_FALSE(registry->installPackage(platform::URL::fileURL(package, true), options, {}, &error));
  EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, platform::kRegistryErrorInvalidOptions)) << error.description();
  EXPECT_TRUE(exists(package + "/Payload/App.app"));
}

using RegistryReplay = RegistryTest;

TEST_F(RegistryReplay, InstalledPackageWithEmptiedPayloadSucceedsWithoutChange) {
  auto registry = openRegistry();
  std::string package = makePackage("notes", BundleSpec("com.example.notes"));
  ASSERT_TRUE(install(*registry, package, "com.example.notes"));
  BundleRecord before = *registry->recordForIdentifier("com.example.notes");

  // An interrupted caller staged again: the bundle has already gone.
  ASSERT_TRUE(makeDirs(package + "/Payload"));
  Error error;
  ASSERT_TRUE(install(*registry, package, "com.example.notes", &error)) << error.description();
  EXPECT_EQ(statuses(reports_).back(), "AlreadyInstalledFromPackage");
  EXPECT_FALSE(exists(package));
  BundleRecord after = *registry->recordForIdentifier("com.example.notes");
  EXPECT_EQ(after.bundleContainerURL.path(), before.bundleContainerURL.path());
  EXPECT_TRUE(after.foundBackingBundle);

  // Without a package directory at all it is the same.
  ASSERT_TRUE(install(*registry, package, "com.example.notes", &error)) << error.description();
}

TEST_F(RegistryReplay, OtherPackagePathOrIdentifierIsRefused) {
  auto registry = openRegistry();
  ASSERT_TRUE(installApp(*registry, BundleSpec("com.example.notes")));
  ASSERT_TRUE(makeDirs(at("packages/elsewhere/Payload")));
  Error error;
  EXPECT_FALSE(install(*registry, at("packages/elsewhere"), "com.example.notes", &error));
  EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, platform::kRegistryErrorInvalidPackage));
  ASSERT_TRUE(makeDirs(at("packages/notes/Payload")));
  EXPECT_FALSE(install(*registry, at("packages/notes"), "com.example.other", &error));
  EXPECT_TRUE(error.is(platform::kRegistryErrorDomain, platform::kRegistryErrorInvalidPackage));
  EXPECT_TRUE(isDirectory(at("packages/notes/Payload")));
}

}  // namespace
}  // namespace qstest
