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
  EXPECT_TRUE(error.is("QSInstallerErrorDomain", 4));
  EXPECT_EQ(error.userInfo(), (Dictionary{{platform::kLocalizedDescriptionKey, Value("Failed to remove /x: 5")},
                                          {"FunctionName", Value(kFunction)},
                                          {"SourceFileLine", Value(77)}}));
  ASSERT_TRUE(error.userInfo().at("SourceFileLine").isInteger());
  Error posix = QSPOSIXError(kFunction, 12, ENOENT, "unlink of %s failed: %s", "/a", QSErrorText(ENOENT));
  EXPECT_TRUE(posix.isPOSIX(ENOENT));
  EXPECT_EQ(posix.localizedDescription(), "unlink of /a failed: No such file or directory");
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(ErrorConstructors, LoggedErrorLineIsSourceLineColonMessageAndTheUnderlyingError) {
  Error plain = _CreateAndLogError(kFunction, 281, QSInstallerErrorDomain, 70, nullptr, nullptr, "Bad link %@", "L");
  Error underlying = QSPOSIXUnderlyingError(EACCES);
  Error error =
      _CreateAndLogError(kFunction, 281, QSInstallerErrorDomain, 4, &underlying, nullptr, "Failed at %s", "/p");
  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_EQ(lines[0].level, 3);
  EXPECT_EQ(lines[0].function, kFunction);
  // The line reports the source line; the code is only in the record.
  EXPECT_EQ(lines[0].message, "281: Bad link L");
  EXPECT_EQ(lines[1].message, "281: Failed at /p (" + underlying.description() + ")");
  EXPECT_EQ(plain.code(), 70);
  EXPECT_EQ(plain.localizedDescription(), "Bad link L");
  EXPECT_EQ(plain.userInfo().size(), 3u);
  ASSERT_NE(error.underlyingError(), nullptr);
  EXPECT_TRUE(error.underlyingError()->isPOSIX(EACCES));
  EXPECT_EQ(error.userInfo().size(), 4u);
}

TEST_F(ErrorConstructors, NoFormatGivesNoLineAndKeepsTheAdditionsDescription) {
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
  Dictionary described{{platform::kLocalizedDescriptionKey, Value("kept")}};
  EXPECT_EQ(_CreateAndLogError(kFunction, 42, QSInstallerErrorDomain, 4, nullptr, &described, nullptr)
                .localizedDescription(),
            "kept");
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

// --- Level test ----------------------------------------------------------------------

TEST(LogLevel, LinesPassAccordingToTheHandle) {
  const struct {
    std::optional<int> handleLevel;
    bool error, notice, debug;
  } cases[] = {{std::nullopt, true, true, false}, {0, false, false, false}, {3, true, false, false},
               {4, true, false, false},           {5, true, true, false},   {6, true, true, false},
               {7, true, true, true}};
  for (const auto& c : cases) {
    ScopedLogHandle handle(c.handleLevel);
    qstest::LogCapture log;
    QS_SYSLOG(kQSLogLevelError, "f", "error %d", 3);
    QS_SYSLOG(kQSLogLevelNotice, "f", "notice %d", 5);
    QS_SYSLOG(kQSLogLevelDebug, "f", "debug %d", 7);
    const std::string level = c.handleLevel ? std::to_string(*c.handleLevel) : "none";
    EXPECT_EQ(log.contains("error 3"), c.error) << level;
    EXPECT_EQ(log.contains("notice 5"), c.notice) << level;
    EXPECT_EQ(log.contains("debug 7"), c.debug) << level;
    EXPECT_EQ(QSShouldLog(kQSLogLevelError), c.error) << level;
    EXPECT_EQ(QSShouldLog(kQSLogLevelNotice), c.notice) << level;
    EXPECT_EQ(QSShouldLog(kQSLogLevelDebug), c.debug) << level;
  }
  // The lines of the error constructor obey the same test.
  ScopedLogHandle silent(2);
  qstest::LogCapture log;
  EXPECT_EQ(_CreateAndLogError(kFunction, 5, QSInstallerErrorDomain, 4, nullptr, nullptr, "quiet").localizedDescription(),
            "quiet");
  EXPECT_TRUE(log.systemLines().empty());
}

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
