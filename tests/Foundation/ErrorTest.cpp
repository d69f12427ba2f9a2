#include "Platform/Foundation/Error.h"

#include <cerrno>

#include <gtest/gtest.h>

#include "Platform/Foundation/FileErrors.h"

using platform::Error;
using platform::URL;
using platform::Value;

namespace {

TEST(ErrorRecord, DescriptionIsTheLoggedText) {
  Error e("QSInstallerErrorDomain", 4, {{platform::kLocalizedDescriptionKey, Value("it failed")}, {"Extra", Value(7)}});
  EXPECT_EQ(e.description(),
            "Error Domain=QSInstallerErrorDomain Code=4 \"it failed\" UserInfo={Extra = 7; "
            "LocalizedDescription = \"it failed\"; }");
  EXPECT_EQ(Error("POSIXErrorDomain", -2).description(), "Error Domain=POSIXErrorDomain Code=-2 UserInfo={}");
  EXPECT_EQ(Error("D", 1, {{platform::kLocalizedDescriptionKey, Value(42)}}).localizedDescription(), "42");
}

TEST(ErrorRecord, UnderlyingErrorIsFoundOnlyWhenItIsAnError) {
  Error outer("D", 1, {{platform::kUnderlyingErrorKey, Value(Error(platform::kPOSIXErrorDomain, ENOENT))}});
  ASSERT_NE(outer.underlyingError(), nullptr);
  EXPECT_TRUE(outer.underlyingError()->isPOSIX(ENOENT));
  EXPECT_EQ(Error("D", 1, {{platform::kUnderlyingErrorKey, Value("text")}}).underlyingError(), nullptr);
  EXPECT_NE(outer.description().find("UnderlyingError = Error Domain=POSIXErrorDomain Code=2"), std::string::npos)
      << outer.description();
  EXPECT_FALSE(Error(platform::kFileErrorDomain, EPERM).isPOSIX(EPERM));
}

TEST(FileErrorRecords, ReadFailureIsNoSuchFileOnlyForENOENT) {
  URL url = URL::fileURL("/x");
  Error missing = platform::POSIXCallError(ENOENT, "open", "/x");
  Error denied = platform::POSIXCallError(EACCES, "open", "/x");
  EXPECT_EQ(missing.localizedDescription(), "open \"/x\": No such file or directory");
  EXPECT_EQ(platform::FileReadError(url, "r", &missing).code(), platform::kFileReadNoSuchFileError);
  EXPECT_EQ(platform::FileReadError(url, "r", &denied).code(), platform::kFileReadUnknownError);
  EXPECT_EQ(platform::FileReadError(url, "r").code(), platform::kFileReadUnknownError);
  Error write = platform::FileWriteError(url, "why", &denied);
  EXPECT_TRUE(write.is(platform::kFileErrorDomain, platform::kFileWriteUnknownError));
  EXPECT_EQ(write.localizedDescription(), "Could not write \"/x\": why");
  ASSERT_NE(write.underlyingError(), nullptr);
  EXPECT_TRUE(write.underlyingError()->isPOSIX(EACCES));
}

}  // namespace
