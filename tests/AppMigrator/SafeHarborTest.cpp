// Safe-harbor registration from the safe-harbor map.
#include "FakePlatform.h"

namespace qstest {
namespace {

class SafeHarbors : public MigratorTest {
 protected:
  static Value entry(const Value& path) { return Value(Dictionary{{"HarborPathKey", path}}); }
  bool migrate(const Dictionary& map) {
    writePlist(harborMapPath(), Value(map));
    auto migrator = createMigrator();
    return migrator && migrator->_migrateSafeHarbors();
  }
};

TEST_F(SafeHarbors, UnreadableMapIsNothingToDoAndStays) {
  ASSERT_TRUE(makeDirs(dataDirectoryPath()));
  ASSERT_TRUE(writeFile(harborMapPath(), "<plist><array>"));
  auto migrator = createMigrator();
  ASSERT_NE(migrator, nullptr);
  EXPECT_TRUE(migrator->performMigration());
  EXPECT_TRUE(platform_->daemon.safeHarborCalls.empty());
  EXPECT_TRUE(pathExists(harborMapPath()));
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Failed to load existing harbor map from " + harborMapPath()));
}

TEST_F(SafeHarbors, EveryEntryIsRegisteredWithTypeTwoAndNoOptionsAndTheMapGoes) {
  EXPECT_TRUE(
      migrate(Dictionary{{"com.example.a", entry(Value("/harbor/a"))}, {"com.example.b", entry(Value("/harbor/b"))}}));
  EXPECT_EQ(platform_->daemon.safeHarborCalls,
            (std::vector<std::string>{"com.example.a /harbor/a 2", "com.example.b /harbor/b 2"}));
  EXPECT_FALSE(pathExists(harborMapPath()));
}

TEST_F(SafeHarbors, RefusedRegistrationKeepsTheMapAndTheOthersAreStillTried) {
  platform_->daemon.refuseSafeHarborOf = {"com.example.b"};
  EXPECT_FALSE(migrate(Dictionary{{"com.example.a", entry(Value("/harbor/a"))},
                                  {"com.example.b", entry(Value("/harbor/b"))},
                                  {"com.example.c", entry(Value("/harbor/c"))}}));
  EXPECT_EQ(platform_->daemon.safeHarborCalls.size(), 3u);
  EXPECT_TRUE(
      loggedOnce("QSAppMigrator: Failed to migrate safe harbor for identifier com.example.b at /harbor/b : (null)"));
  EXPECT_TRUE(pathExists(harborMapPath()));
}

TEST_F(SafeHarbors, MalformedEntriesAreSkippedAndTheMapStillGoes) {
  EXPECT_TRUE(migrate(Dictionary{{"com.example.array", Value(platform::makeStringArray({"/harbor"}))},
                                 {"com.example.number", entry(Value(3))},
                                 {"com.example.good", entry(Value("/harbor/good"))}}));
  EXPECT_EQ(platform_->daemon.safeHarborCalls, std::vector<std::string>{"com.example.good /harbor/good 2"});
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Failed to get harbor info for identifier com.example.array"));
  EXPECT_TRUE(loggedOnce("QSAppMigrator: Failed to get harbor path from harbor entry for com.example.number : " +
                         entry(Value(3)).description()));
  EXPECT_FALSE(pathExists(harborMapPath()));
}

}  // namespace
}  // namespace qstest
