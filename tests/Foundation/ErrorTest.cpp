#include "Platform/Foundation/Error.h"

#include <cerrno>

#include <gtest/gtest.h>

#include "Platform/Foundation/FileErrors.h"

using platform::Dictionary;
using platform::Error;
using platform::URL;
using platform::Value;

namespace {

TEST(ErrorRecord, DescriptionWithMessageAndUserInfo) {
  Error e("QSInstallerErrorDomain", 4, {{platform::kLocalizedDescriptionKey, Value("it failed")}, {"Extra", Value(7)}});
  EXPECT_EQ(e.description(),
            "Error Domain=QSInstallerErrorDomain Code=4 \"it failed\" UserInfo={Extra = 7; "
            "LocalizedDescription = \"it failed\"; }");
  EXPECT_EQ(e.localizedDescription(), "it failed");
}

TEST(ErrorRecord, DescriptionWithoutMessage) {
  EXPECT_EQ(Error("POSIXErrorDomain", -2).description(), "Error Domain=POSIXErrorDomain Code=-2 UserInfo={}");
  EXPECT_EQ(Error().description(), "Error Domain= Code=0 UserInfo={}");
}

TEST(ErrorRecord, NonStringMessageIsDescribed) {
  Error e("D", 1, {{platform::kLocalizedDescriptionKey, Value(42)}});
  EXPECT_EQ(e.localizedDescription(), "42");
}

TEST(ErrorRecord, UnderlyingErrorIsFoundOnlyWhenItIsAnError) {
  Error inner(platform::kPOSIXErrorDomain, ENOENT);
  Error outer("D", 1, {{platform::kUnderlyingErrorKey, Value(inner)}});
  ASSERT_NE(outer.underlyingError(), nullptr);
  EXPECT_TRUE(outer.underlyingError()->isPOSIX(ENOENT));
  EXPECT_EQ(Error("D", 1, {{platform::kUnderlyingErrorKey, Value("text")}}).underlyingError(), nullptr);
  EXPECT_NE(outer.description().find("UnderlyingError = Error Domain=POSIXErrorDomain Code=2"), std::string::npos)
      << outer.description();
}

TEST(ErrorRecord, DomainAndCodeTests) {
  Error e(platform::kPOSIXErrorDomain, EPERM);
  EXPECT_TRUE(e.is("POSIXErrorDomain", EPERM));
  EXPECT_TRUE(e.isPOSIX(EPERM));
  EXPECT_FALSE(e.isPOSIX(EACCES));
  EXPECT_FALSE(Error(platform::kFileErrorDomain, EPERM).isPOSIX(EPERM));
}

TEST(FileErrorRecords, POSIXCallNamesTheCallThePathAndTheText) {
  Error e = platform::POSIXCallError(ENOENT, "open", "/a/b");
  EXPECT_TRUE(e.isPOSIX(ENOENT));
  EXPECT_EQ(e.localizedDescription(), "open \"/a/b\": No such file or directory");
}

TEST(FileErrorRecords, ReadFailureIsNoSuchFileOnlyForENOENT) {
  URL url = URL::fileURL("/x");
  Error missing = platform::POSIXCallError(ENOENT, "open", "/x");
  Error denied = platform::POSIXCallError(EACCES, "open", "/x");
  EXPECT_EQ(platform::FileReadError(url, "r", &missing).code(), platform::kFileReadNoSuchFileError);
  EXPECT_EQ(platform::FileReadError(url, "r", &denied).code(), platform::kFileReadUnknownError);
  EXPECT_EQ(platform::FileReadError(url, "r").code(), platform::kFileReadUnknownError);
  Error write = platform::FileWriteError(url, "why", &denied);
  EXPECT_TRUE(write.is(platform::kFileErrorDomain, platform::kFileWriteUnknownError));
  EXPECT_EQ(write.localizedDescription(), "Could not write \"/x\": why");
  ASSERT_NE(write.underlyingError(), nullptr);
  EXPECT_TRUE(write.underlyingError()->isPOSIX(EACCES));
}

TEST(FileErrorRecords, FailWithWritesOnlyWhenAsked) {
  EXPECT_FALSE(platform::failWith(nullptr, Error("D", 1)));
  Error out;
  EXPECT_FALSE(platform::failWith(&out, Error("D", 3)));
  EXPECT_TRUE(out.is("D", 3));
}

}  // namespace
