// The error-record constructors and the level test of the system log.
#include <gtest/gtest.h>

#include "Shared/Support/QSError.h"
#include "Shared/Support/QSLog.h"
#include "Support/SupportFixtures.h"
#include "support/TestSupport.h"

using platform::Dictionary;
using platform::Error;
using platform::Value;
using supporttest::ScopedLogHandle;

namespace {

constexpr char kFunction[] = "-[QSFileManager removeItemAtURL:error:]";

class ErrorConstructors : public ::testing::Test {
 protected:
  ScopedLogHandle noHandle_{std::nullopt};
  qstest::LogCapture log_;
};

TEST_F(ErrorConstructors, CreateErrorHoldsExactlyThreeKeysAndLogsNothing) {
  Error error = _CreateError(kFunction, 77, QSInstallerErrorDomain, 4, "Failed to remove %s: %d", "/x", 5);
  EXPECT_EQ(error.domain(), "QSInstallerErrorDomain");
  EXPECT_EQ(error.code(), 4);
  const Dictionary& info = error.userInfo();
  ASSERT_EQ(info.size(), 3u);
  EXPECT_EQ(info.at(platform::kLocalizedDescriptionKey), Value("Failed to remove /x: 5"));
  EXPECT_EQ(info.at("FunctionName"), Value(kFunction));
  ASSERT_TRUE(info.at("SourceFileLine").isInteger());
  EXPECT_EQ(info.at("SourceFileLine").int64Value(), 77);
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(ErrorConstructors, CreateErrorInThePOSIXDomainKeepsTheErrno) {
  Error error = QSPOSIXError(kFunction, 12, ENOENT, "unlink of %s failed: %s", "/a", QSErrorText(ENOENT));
  EXPECT_TRUE(error.isPOSIX(ENOENT));
  EXPECT_EQ(error.localizedDescription(), "unlink of /a failed: No such file or directory");
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(ErrorConstructors, LoggedErrorLineIsSourceLineColonMessage) {
  Error error = _CreateAndLogError(kFunction, 281, QSInstallerErrorDomain, 70, nullptr, nullptr, "Bad link %@", "L");
  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, 3);
  EXPECT_EQ(lines[0].function, kFunction);
  EXPECT_EQ(lines[0].message, "281: Bad link L");
  // The line reports the source line; the code is only in the record.
  EXPECT_EQ(error.code(), 70);
  EXPECT_EQ(error.localizedDescription(), "Bad link L");
  EXPECT_EQ(error.userInfo().size(), 3u);
}

TEST_F(ErrorConstructors, LoggedErrorLineEndsWithTheUnderlyingError) {
  Error underlying = QSPOSIXUnderlyingError(EACCES);
  Error error =
      _CreateAndLogError(kFunction, 281, QSInstallerErrorDomain, 4, &underlying, nullptr, "Failed at %s", "/p");
  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].message, "281: Failed at /p (" + underlying.description() + ")");
  ASSERT_NE(error.underlyingError(), nullptr);
  EXPECT_TRUE(error.underlyingError()->isPOSIX(EACCES));
  EXPECT_EQ(error.userInfo().size(), 4u);
}

TEST_F(ErrorConstructors, NoFormatGivesNoDescriptionAndNoLine) {
  Dictionary additions{{"LegacyErrorString", Value("EXTRA")}, {"PathArgument", Value(platform::URL::fileURL("/p"))}};
  Error underlying = QSPOSIXUnderlyingError(EIO);
  Error error = _CreateAndLogError(kFunction, 9, QSInstallerErrorDomain, 24, &underlying, &additions, nullptr);
  const Dictionary& info = error.userInfo();
  EXPECT_EQ(info.count(platform::kLocalizedDescriptionKey), 0u);
  EXPECT_EQ(info.size(), 5u);
  EXPECT_EQ(info.at("LegacyErrorString"), Value("EXTRA"));
  EXPECT_EQ(info.at("PathArgument"), Value(platform::URL::fileURL("/p")));
  EXPECT_EQ(info.at("FunctionName"), Value(kFunction));
  EXPECT_EQ(info.at("SourceFileLine").int64Value(), 9);
  EXPECT_TRUE(info.count(platform::kUnderlyingErrorKey));
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(ErrorConstructors, ConstructorValuesOverrideTheAdditions) {
  Dictionary additions{{"FunctionName", Value("impostor")},
                       {"SourceFileLine", Value(1)},
                       {platform::kLocalizedDescriptionKey, Value("stale")}};
  Error error = _CreateAndLogError(kFunction, 42, QSInstallerErrorDomain, 4, nullptr, &additions, "fresh");
  EXPECT_EQ(error.userInfo().at("FunctionName"), Value(kFunction));
  EXPECT_EQ(error.userInfo().at("SourceFileLine").int64Value(), 42);
  EXPECT_EQ(error.localizedDescription(), "fresh");
}

TEST_F(ErrorConstructors, AdditionsDescriptionSurvivesWithoutFormat) {
  Dictionary additions{{platform::kLocalizedDescriptionKey, Value("kept")}};
  Error error = _CreateAndLogError(kFunction, 42, QSInstallerErrorDomain, 4, nullptr, &additions, nullptr);
  EXPECT_EQ(error.localizedDescription(), "kept");
}

TEST_F(ErrorConstructors, LoggedLineIsSubjectToTheLevelTest) {
  ScopedLogHandle silent(2);
  Error error = _CreateAndLogError(kFunction, 5, QSInstallerErrorDomain, 4, nullptr, nullptr, "quiet");
  EXPECT_EQ(error.localizedDescription(), "quiet");
  EXPECT_TRUE(log_.systemLines().empty());
}

// --- Level test ----------------------------------------------------------------------

struct LevelCase {
  std::optional<int> handleLevel;
  bool error;
  bool notice;
  bool debug;
};

class LogLevelTest : public ::testing::TestWithParam<LevelCase> {};

TEST_P(LogLevelTest, LinesPassAccordingToTheHandle) {
  const LevelCase& c = GetParam();
  ScopedLogHandle handle(c.handleLevel);
  qstest::LogCapture log;
  QS_SYSLOG(kQSLogLevelError, "f", "error %d", 3);
  QS_SYSLOG(kQSLogLevelNotice, "f", "notice %d", 5);
  QS_SYSLOG(kQSLogLevelDebug, "f", "debug %d", 7);
  EXPECT_EQ(log.contains("error 3"), c.error);
  EXPECT_EQ(log.contains("notice 5"), c.notice);
  EXPECT_EQ(log.contains("debug 7"), c.debug);
  EXPECT_EQ(QSShouldLog(kQSLogLevelError), c.error);
  EXPECT_EQ(QSShouldLog(kQSLogLevelNotice), c.notice);
  EXPECT_EQ(QSShouldLog(kQSLogLevelDebug), c.debug);
}

INSTANTIATE_TEST_SUITE_P(HandleAbsentOrAtEachLevel, LogLevelTest,
                         ::testing::Values(LevelCase{std::nullopt, true, true, false},
                                           LevelCase{0, false, false, false}, LevelCase{3, true, false, false},
                                           LevelCase{4, true, false, false}, LevelCase{5, true, true, false},
                                           LevelCase{6, true, true, false}, LevelCase{7, true, true, true}));

TEST(SystemLogSink, LineCarriesLevelFunctionAndFormattedMessage) {
  ScopedLogHandle noHandle(std::nullopt);
  qstest::LogCapture log;
  QS_SYSLOG(kQSLogLevelNotice, "-[QSGlobalConfiguration init]", "%s=%ld %@", "n", 4L, platform::URL::fileURL("/d", true));
  auto lines = log.systemLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, 5);
  EXPECT_EQ(lines[0].function, "-[QSGlobalConfiguration init]");
  EXPECT_EQ(lines[0].message, "n=4 file:///d/");
}

}  // namespace
