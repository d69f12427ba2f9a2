// Safe-harbor registration from the safe-harbor map.
#include "FakePlatform.h"

using platform::Dictionary;
using platform::Value;

namespace qstest {
namespace {

class SafeHarbors : public MigratorTest {
 protected:
  std::string harborMapPath() const { return dataDirectoryPath() + "/SafeHarbor.plist"; }
  static Value entry(const std::string& path) { return Value(Dictionary{{"HarborPathKey", Value(path)}}); }

  bool migrate() {
    auto migrator = createMigrator();
    EXPECT_NE(migrator, nullptr);
    return migrator && migrator->_migrateSafeHarbors();
  }
};

TEST_F(SafeHarbors, NoMapIsNothingToDo) {
  EXPECT_TRUE(migrate());
  EXPECT_TRUE(platform_->daemon.safeHarborCalls.empty());
  EXPECT_TRUE(log_->hostMessages().empty());
}

TEST_F(SafeHarbors, UnreadableMapIsNothingToDoAndStays) {
  ASSERT_TRUE(makeDirs(dataDirectoryPath()));
  ASSERT_TRUE(writeFile(harborMapPath(), "not a property list"));
  EXPECT_TRUE(migrate());
  EXPECT_TRUE(platform_->daemon.safeHarborCalls.empty());
  EXPECT_TRUE(pathExists(harborMapPath()));
  EXPECT_EQ(hostLineCount("QSAppMigrator: Failed to load existing harbor map from " + harborMapPath()), 1u);
}

TEST_F(SafeHarbors, EmptyMapIsRemoved) {
  writePlist(harborMapPath(), Value(Dictionary{}));
  EXPECT_TRUE(migrate());
  EXPECT_FALSE(pathExists(harborMapPath()));
}

TEST_F(SafeHarbors, EveryEntryIsRegisteredWithTypeTwoAndNoOptions) {
  writePlist(harborMapPath(), Value(Dictionary{{"com.example.a", entry("/harbor/a")},
                                               {"com.example.b", entry("/harbor/b")}}));
  EXPECT_TRUE(migrate());
  const auto& calls = platform_->daemon.safeHarborCalls;
  ASSERT_EQ(calls.size(), 2u);
  EXPECT_EQ(calls[0].identifier, "com.example.a");
  EXPECT_EQ(calls[0].path, "/harbor/a");
  EXPECT_EQ(calls[1].identifier, "com.example.b");
  EXPECT_EQ(calls[1].path, "/harbor/b");
  for (const auto& call : calls) {
    EXPECT_EQ(call.containerType, 2);
    EXPECT_TRUE(call.optionsWereNull);
  }
  auto lines = hostLines("QSAppMigrator: Migrating safe harbor for com.example.a at /harbor/a");
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, 5);
  EXPECT_EQ(lines[0].function, "-[QSAppMigrator _migrateSafeHarbors]");
  EXPECT_FALSE(pathExists(harborMapPath()));
}

TEST_F(SafeHarbors, RefusedRegistrationKeepsTheMapAndTheOthersAreStillTried) {
  writePlist(harborMapPath(), Value(Dictionary{{"com.example.a", entry("/harbor/a")},
                                               {"com.example.b", entry("/harbor/b")},
                                               {"com.example.c", entry("/harbor/c")}}));
  platform_->daemon.refuseSafeHarborOf = {"com.example.b"};
  EXPECT_FALSE(migrate());
  EXPECT_EQ(platform_->daemon.safeHarborCalls.size(), 3u);
  auto lines = hostLines("QSAppMigrator: Failed to migrate safe harbor for identifier com.example.b at /harbor/b : "
                         "(null)");
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, 3);
  EXPECT_TRUE(pathExists(harborMapPath()));
}

TEST_F(SafeHarbors, MalformedEntriesAreSkippedAndTheMapStillGoes) {
  const Value noPath(Dictionary{{"Other", Value("/harbor")}});
  const Value numericPath(Dictionary{{"HarborPathKey", Value(3)}});
  writePlist(harborMapPath(), Value(Dictionary{{"com.example.array", Value(platform::makeStringArray({"/harbor"}))},
                                               {"com.example.nopath", noPath},
                                               {"com.example.number", numericPath},
                                               {"com.example.good", entry("/harbor/good")}}));
  EXPECT_TRUE(migrate());
  ASSERT_EQ(platform_->daemon.safeHarborCalls.size(), 1u);
  EXPECT_EQ(platform_->daemon.safeHarborCalls[0].identifier, "com.example.good");
  EXPECT_EQ(hostLineCount("QSAppMigrator: Failed to get harbor info for identifier com.example.array"), 1u);
  // The entry is printed as the dictionary it is.
  EXPECT_EQ(hostLineCount("QSAppMigrator: Failed to get harbor path from harbor entry for com.example.nopath : " +
                          noPath.description()),
            1u);
  EXPECT_EQ(hostLineCount("QSAppMigrator: Failed to get harbor path from harbor entry for com.example.number : " +
                          numericPath.description()),
            1u);
  EXPECT_FALSE(pathExists(harborMapPath()));
}

}  // namespace
}  // namespace qstest
