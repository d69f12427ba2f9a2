// RegistryReader: the registry read without a change, and its forecast.
#include "Platform/Registry/RegistryReader.h"
#include "RegistryFixture.h"

namespace qstest {
namespace {

using RegistryReaderTest = RegistryTest;
using platform::RegistryReader;

// Without a database: refused, or read as built-in applications only; either
// way nothing is made under the root.
TEST_F(RegistryReaderTest, RootWithoutDatabaseMakesNothing) {
  makeBundle(at("Applications/Clock.app"), {.identifier = "com.example.clock", .version = "3.0"});
  platform::Error error;
  EXPECT_FALSE(RegistryReader::open(base_, false, &error));
  EXPECT_EQ(registryCode(error), platform::kRegistryErrorNoDatabase);
  auto reader = RegistryReader::open(base_, true);
  ASSERT_TRUE(reader);
  const auto clock = reader->recordForIdentifier("com.example.clock");
  ASSERT_TRUE(clock);
  EXPECT_TRUE(clock->dataContainerToBeMade);
  EXPECT_FALSE(clock->dataContainerURL);
  EXPECT_TRUE(reader->isInstalled("com.example.clock"));
  EXPECT_FALSE(reader->isInstalled("com.example.none"));
  EXPECT_EQ(reader->allRecords().size(), 1u);
  EXPECT_FALSE(reader->installBundle(platform::URL::fileURL(at("Applications/Clock.app"), true), {}, &error));
  EXPECT_EQ(registryCode(error), platform::kRegistryErrorReadOnly);
  EXPECT_EQ(entries(base_), std::vector<std::string>{"Applications"});
}

// What a registry that was written holds is read back; the built-in copy
// refuses versions that are not newer, by the installation's own rule.
TEST_F(RegistryReaderTest, ReadsRecordsAndForetellsRefusals) {
  makeBundle(at("Applications/Clock.app"), {.identifier = "com.example.clock", .version = "3.0"});
  {
    auto registry = openRegistry();
    ASSERT_TRUE(installApp(*registry, {.identifier = "com.example.ledger", .groups = {"group.books"}}));
    ASSERT_TRUE(registry->recordForIdentifier("com.example.clock"));  // makes the built-in's data container
  }
  auto reader = RegistryReader::open(base_, false);
  ASSERT_TRUE(reader);
  const auto ledger = reader->recordForIdentifier("com.example.ledger");
  ASSERT_TRUE(ledger && ledger->dataContainerURL);
  EXPECT_EQ(reader->groupContainerForGroup("group.books"), ledger->groupContainerURLs->at("group.books"));
  EXPECT_FALSE(reader->groupContainerForGroup("group.none"));
  const auto clock = reader->recordForIdentifier("com.example.clock");
  ASSERT_TRUE(clock && clock->dataContainerURL);
  EXPECT_FALSE(clock->dataContainerToBeMade);
  const std::pair<const char*, bool> versions[] = {
      {"2.9", true}, {"3", true}, {"3.0", true}, {"3.0.1", false}, {"10", false}};
  for (const auto& [version, refused] : versions) {
    EXPECT_EQ(reader->refusesAsNotNewerThanBuiltIn("com.example.clock", version), refused) << version;
  }
  EXPECT_FALSE(reader->refusesAsNotNewerThanBuiltIn("com.example.ledger", "0.1"));
  EXPECT_EQ(reader->newDataContainerDirectory(true).path(), at("private/var/mobile/Containers/Data/PluginKitPlugin"));
}

}  // namespace
}  // namespace qstest
