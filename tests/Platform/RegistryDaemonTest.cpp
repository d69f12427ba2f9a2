// The installation daemon's calls: safe harbors and the data-protection
// update.
#include <sys/xattr.h>

#include "Platform/RegistryFixture.h"

namespace qstest {
namespace {

using platform::Dictionary;
using platform::Value;

using RegistrySafeHarbor = RegistryTest;

TEST_F(RegistrySafeHarbor, IsRegisteredOnlyForAnExistingDirectory) {
  auto registry = openRegistry();
  ASSERT_TRUE(makeDirs(at("harbors/game")));
  ASSERT_TRUE(writeFile(at("harbors/file"), "not a directory"));
  LogCapture log;

  EXPECT_FALSE(
      registry->QuillsetRegisterSafeHarborForContainerType(at("harbors/missing"), "com.example.a", 2, nullptr));
  EXPECT_FALSE(registry->QuillsetRegisterSafeHarborForContainerType(at("harbors/file"), "com.example.b", 2, nullptr));
  EXPECT_TRUE(log.contains("Safe harbor " + at("harbors/missing") + " of com.example.a is not an existing directory"));
  EXPECT_TRUE(registry->safeHarbors().empty());

  EXPECT_TRUE(registry->QuillsetRegisterSafeHarborForContainerType(at("harbors/game"), "com.example.game", 2, nullptr));
  auto reopened = openRegistry();
  std::vector<platform::SafeHarborRecord> harbors = reopened->safeHarbors();
  ASSERT_EQ(harbors.size(), 1u);
  EXPECT_EQ(harbors[0].identifier, "com.example.game");
  EXPECT_EQ(harbors[0].path, at("harbors/game"));
  EXPECT_EQ(harbors[0].containerType, 2);

  // Registering again replaces the path.
  ASSERT_TRUE(makeDirs(at("harbors/two")));
  ASSERT_TRUE(reopened->QuillsetRegisterSafeHarborForContainerType(at("harbors/two"), "com.example.game", 2, nullptr));
  ASSERT_EQ(reopened->safeHarbors().size(), 1u);
  EXPECT_EQ(reopened->safeHarbors()[0].path, at("harbors/two"));
}

class RegistryDataProtection : public RegistryTest {
 protected:
  // The protection class of a directory; -1 when the attribute is missing.
  static int32_t protectionClass(const std::string& path) {
    int32_t value = 0;
    ssize_t n = getxattr(path.c_str(), platform::kProtectionClassAttributeName, &value, sizeof value);
    return n == sizeof value ? value : -1;
  }
  const Dictionary updateSystemApps_{{platform::kQSUpdateSystemAppDataContainerDataProtection, Value(true)}};
};

TEST_F(RegistryDataProtection, UpdateSetsClassThreeOnEverySystemDataContainer) {
  makeBuiltIn("Mail.app", BundleSpec("com.example.mail"));
  makeBuiltIn("Maps.app", BundleSpec("com.example.maps"));
  makeBuiltIn("Settings.app", BundleSpec("com.example.settings").withoutDataContainer());
  auto registry = openRegistry();
  std::string mailData = registry->recordForIdentifier("com.example.mail")->dataContainerURL->path();
  // Without the option nothing changes.
  EXPECT_TRUE(registry->QuillsetUpdateContainerDataProtectionForMigratorOnly({}));
  EXPECT_TRUE(registry->QuillsetUpdateContainerDataProtectionForMigratorOnly(
      {{platform::kQSUpdateSystemAppDataContainerDataProtection, Value(false)}}));
  EXPECT_EQ(protectionClass(mailData), -1);
  EXPECT_EQ(entries(appDataContainers()).size(), 1u);

  ASSERT_TRUE(registry->QuillsetUpdateContainerDataProtectionForMigratorOnly(updateSystemApps_));
  EXPECT_EQ(protectionClass(mailData), 3);
  std::optional<platform::URL> maps = registry->recordForIdentifier("com.example.maps")->dataContainerURL;
  ASSERT_TRUE(maps) << "the update makes the containers not looked up yet";
  EXPECT_EQ(protectionClass(maps->path()), 3);
  EXPECT_FALSE(registry->recordForIdentifier("com.example.settings")->dataContainerURL);
  EXPECT_EQ(entries(appDataContainers()).size(), 2u);
}

TEST_F(RegistryDataProtection, ContainerThatRefusesTheAttributeFailsTheUpdate) {
  makeBuiltIn("Mail.app", BundleSpec("com.example.mail"));
  makeBuiltIn("Maps.app", BundleSpec("com.example.maps"));
  auto registry = openRegistry();
  std::string mailData = registry->recordForIdentifier("com.example.mail")->dataContainerURL->path();
  std::string mapsData = registry->recordForIdentifier("com.example.maps")->dataContainerURL->path();
  ASSERT_TRUE(setImmutable(mailData, true));
  LogCapture log;
  EXPECT_FALSE(registry->QuillsetUpdateContainerDataProtectionForMigratorOnly(updateSystemApps_));
  EXPECT_TRUE(log.contains("Could not update the data protection of com.example.mail"));
  EXPECT_EQ(protectionClass(mapsData), 3) << "the other containers are still updated";
  ASSERT_TRUE(setImmutable(mailData, false));
  EXPECT_EQ(protectionClass(mailData), -1);
}

}  // namespace
}  // namespace qstest
