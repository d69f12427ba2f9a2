// The error-record constructors and the level test of the system log.
#include <gtest/gtest.h>

#include "Shared/Support/QSError.h"
#include "Support/SupportFixtures.h"

using platform::Dictionary;
using platform::Error;
using platform::Value;

namespace {

constexpr char kFunction[] = "-[QSFileManager removeItemAtURL:error:]";

TEST(ErrorConstructors, RecordsHoldTheirKeysAndOnlyALoggedRecordWithAFormatWritesALine) {
  qstest::LogCapture log;
  // Constructor values override the additions; without a format there is no description and no line.
  Dictionary additions{{"LegacyErrorString", Value("EXTRA")}, {"FunctionName", Value("impostor")}};
  Error underlying = QSPOSIXUnderlyingError(EIO);
  Error silent = _CreateAndLogError(kFunction, 9, QSInstallerErrorDomain, 24, &underlying, &additions, nullptr);
  EXPECT_EQ(silent.userInfo(), (Dictionary{{"LegacyErrorString", Value("EXTRA")},
                                           {"FunctionName", Value(kFunction)},
                                           {"SourceFileLine", Value(9)},
                                           {platform::kUnderlyingErrorKey, Value(underlying)}}));
  EXPECT_TRUE(log.systemLines().empty());
  // The line reports the source line; the code is only in the record.
  (void)_CreateAndLogError(kFunction, 281, QSInstallerErrorDomain, 70, nullptr, nullptr, "Bad link %@", "L");
  (void)_CreateAndLogError(kFunction, 281, QSInstallerErrorDomain, 4, &underlying, &additions, "At %s", "/p");
  EXPECT_EQ(log.systemMessages(),
            (std::vector<std::string>{"281: Bad link L", "281: At /p (" + underlying.description() + ")"}));
}

// Each case: the handle's level (none: no handle); whether error, notice, debug and constructor lines pass.
TEST(LogLevel, LinesPassAccordingToTheHandle) {
  const std::pair<std::optional<int>, std::string> cases[] = {
      {std::nullopt, "1101"}, {0, "0000"}, {4, "1001"}, {5, "1101"}, {7, "1111"}};
  for (const auto& [level, passed] : cases) {
    supporttest::ScopedLogHandle handle(level);
    qstest::LogCapture log;
    QS_SYSLOG(kQSLogLevelError, "f", "error");
    QS_SYSLOG(kQSLogLevelNotice, "f", "notice");
    QS_SYSLOG(kQSLogLevelDebug, "f", "debug");
    (void)_CreateAndLogError(kFunction, 5, QSInstallerErrorDomain, 4, nullptr, nullptr, "constructor");
    EXPECT_EQ(platform::Format("%d%d%d%d", log.contains("error"), log.contains("notice"), log.contains("debug"),
                               log.contains("constructor")),
              passed);
    EXPECT_EQ(QSShouldLog(kQSLogLevelNotice), passed[1] == '1');
  }
}

}  // namespace
