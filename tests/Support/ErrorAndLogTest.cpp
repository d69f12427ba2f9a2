// The error-record constructors and the level test of the system log.
#include <gtest/gtest.h>

#include "Shared/Support/QSError.h"
#include "Support/SupportFixtures.h"

using platform::Dictionary;
using platform::Error;
using platform::Value;
using supporttest::ScopedLogHandle;

namespace {

constexpr char kFunction[] = "-[QSFileManager removeItemAtURL:error:]";

TEST(ErrorConstructors, RecordsHoldTheirKeysAndOnlyALoggedRecordWithAFormatWritesALine) {
  ScopedLogHandle noHandle(std::nullopt);
  qstest::LogCapture log;
  Error error = _CreateError(kFunction, 77, QSInstallerErrorDomain, 4, "Failed to remove %s: %d", "/x", 5);
  EXPECT_EQ(error.userInfo(), (Dictionary{{platform::kLocalizedDescriptionKey, Value("Failed to remove /x: 5")},
                                          {"FunctionName", Value(kFunction)},
                                          {"SourceFileLine", Value(77)}}));
  EXPECT_TRUE(QSPOSIXError(kFunction, 12, ENOENT, "unlink failed").isPOSIX(ENOENT));
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
  Error plain = _CreateAndLogError(kFunction, 281, QSInstallerErrorDomain, 70, nullptr, nullptr, "Bad link %@", "L");
  Error wrapped = _CreateAndLogError(kFunction, 281, QSInstallerErrorDomain, 4, &underlying, &additions, "At %s", "/p");
  EXPECT_EQ(plain.localizedDescription(), "Bad link L");
  EXPECT_TRUE(wrapped.underlyingError() && wrapped.underlyingError()->isPOSIX(EIO));
  EXPECT_EQ(log.systemMessages(),
            (std::vector<std::string>{"281: Bad link L", "281: At /p (" + underlying.description() + ")"}));
  EXPECT_EQ(log.systemLines()[0].level, 3);
  EXPECT_EQ(log.systemLines()[0].function, kFunction);
}

// Each case: the handle's level (none: no handle), whether error, notice and debug lines pass.
TEST(LogLevel, LinesPassAccordingToTheHandle) {
  const std::tuple<std::optional<int>, bool, bool, bool> cases[] = {{std::nullopt, true, true, false},
                                                                    {0, false, false, false},
                                                                    {4, true, false, false},
                                                                    {5, true, true, false},
                                                                    {6, true, true, false},
                                                                    {7, true, true, true}};
  for (const auto& [level, error, notice, debug] : cases) {
    ScopedLogHandle handle(level);
    qstest::LogCapture log;
    QS_SYSLOG(kQSLogLevelError, "f", "error");
    QS_SYSLOG(kQSLogLevelNotice, "f", "notice");
    QS_SYSLOG(kQSLogLevelDebug, "f", "debug");
    (void)_CreateAndLogError(kFunction, 5, QSInstallerErrorDomain, 4, nullptr, nullptr, "constructor");
    const std::vector<bool> passed = {log.contains("error"), log.contains("notice"), log.contains("debug"),
                                      log.contains("constructor")};
    EXPECT_EQ(passed, (std::vector<bool>{error, notice, debug, error})) << level.value_or(-1);
    EXPECT_EQ(QSShouldLog(kQSLogLevelNotice), notice);
  }
}

}  // namespace
