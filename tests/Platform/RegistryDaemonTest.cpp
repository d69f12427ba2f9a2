// The installation daemon's calls: safe harbors and the data-protection
// update.
#include <sys/xattr.h>

#include "Platform/RegistryFixture.h"

namespace qstest {
namespace {

using platform::Value;

using RegistryDaemon = RegistryTest;

TEST_F(RegistryDaemon, SafeHarborIsRegisteredOnlyForAnExistingDirectoryAndReplacedByTheNextOne) {
  auto registry = openRegistry();
  ASSERT_TRUE(makeDirs(at("harbors/game")) && makeDirs(at("harbors/two")));
  ASSERT_TRUE(writeFile(at("harbors/file"), "not a directory"));
  LogCapture log;
  EXPECT_FALSE(registry->QuillsetRegisterSafeHarborForContainerType(at("harbors/missing"), "com.example.a", 2, nullptr));
  EXPECT_FALSE(registry->QuillsetRegisterSafeHarborForContainerType(at("harbors/file"), "com.example.b", 2, nullptr));
  EXPECT_TRUE(log.contains("Safe harbor " + at("harbors/missing") + " of com.example.a is not an existing directory"));
  EXPECT_TRUE(registry->safeHarbors().empty());

  EXPECT_TRUE(registry->QuillsetRegisterSafeHarborForContainerType(at("harbors/game"), "com.example.game", 2, nullptr));
  auto reopened = openRegistry();
  ASSERT_EQ(reopened->safeHarbors().size(), 1u);
  EXPECT_EQ(reopened->safeHarbors()[0].identifier, "com.example.game");
  EXPECT_EQ(reopened->safeHarbors()[0].path, at("harbors/game"));
  EXPECT_EQ(reopened->safeHarbors()[0].containerType, 2);
  ASSERT_TRUE(reopened->QuillsetRegisterSafeHarborForContainerType(at("harbors/two"), "com.example.game", 2, nullptr));
  ASSERT_EQ(reopened->safeHarbors().size(), 1u);
  EXPECT_EQ(reopened->safeHarbors()[0].path, at("harbors/two"));
}

// The protection class of a directory; -1 when the attribute is missing.
int32_t protectionClass(const std::string& path) {
  int32_t value = 0;
  ssize_t n = getxattr(path.c_str(), platform::kProtectionClassAttributeName, &value, sizeof value);
  return n == sizeof value ? value : -1;
}

// Class three goes on every built-in data container, made when missing; a
// container that refuses it fails the update but not the others'.
TEST_F(RegistryDaemon, DataProtectionUpdateSetsClassThreeOnEverySystemDataContainer) {
  makeBuiltIn("Mail.app", {.identifier = "com.example.mail"});
  makeBuiltIn("Maps.app", {.identifier = "com.example.maps"});
  makeBuiltIn("Settings.app", {.identifier = "com.example.settings", .noDataContainer = true});
  auto registry = openRegistry();
  std::string mail = registry->recordForIdentifier("com.example.mail")->dataContainerURL->path();
  EXPECT_TRUE(registry->QuillsetUpdateContainerDataProtectionForMigratorOnly({}));
  EXPECT_TRUE(registry->QuillsetUpdateContainerDataProtectionForMigratorOnly(
      {{platform::kQSUpdateSystemAppDataContainerDataProtection, Value(false)}}));
  EXPECT_EQ(protectionClass(mail), -1) << "without the option nothing changes";
  EXPECT_EQ(entries(appDataContainers()).size(), 1u);

  const platform::Dictionary update{{platform::kQSUpdateSystemAppDataContainerDataProtection, Value(true)}};
  ASSERT_TRUE(setImmutable(mail, true));
  LogCapture log;
  EXPECT_FALSE(registry->QuillsetUpdateContainerDataProtectionForMigratorOnly(update));
  EXPECT_TRUE(log.contains("Could not update the data protection of com.example.mail"));
  ASSERT_TRUE(setImmutable(mail, false));
  EXPECT_EQ(protectionClass(mail), -1);
  std::optional<platform::URL> maps = registry->recordForIdentifier("com.example.maps")->dataContainerURL;
  ASSERT_TRUE(maps) << "the update makes the containers not looked up yet";
  EXPECT_EQ(protectionClass(maps->path()), 3) << "the other containers are still updated";

  ASSERT_TRUE(registry->QuillsetUpdateContainerDataProtectionForMigratorOnly(update));
  EXPECT_EQ(protectionClass(mail), 3);
  EXPECT_FALSE(registry->recordForIdentifier("com.example.settings")->dataContainerURL);
  EXPECT_EQ(entries(appDataContainers()).size(), 2u);
}

}  // namespace
}  // namespace qstest
