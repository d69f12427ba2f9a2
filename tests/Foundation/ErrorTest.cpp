#include "Platform/Foundation/Error.h"

#include <gtest/gtest.h>

#include "Platform/Foundation/FileErrors.h"

namespace {

using namespace platform;

TEST(ErrorRecord, DescriptionIsTheLoggedTextAndOnlyENOENTIsNoSuchFile) {
  Error missing = POSIXCallError(ENOENT, "open", "/x");
  Error outer("QSInstallerErrorDomain", 4,
              {{kLocalizedDescriptionKey, Value("failed")}, {kUnderlyingErrorKey, Value(missing)}});
  EXPECT_EQ(outer.description(),
            "Error Domain=QSInstallerErrorDomain Code=4 \"failed\" UserInfo={LocalizedDescription = "
            "failed; UnderlyingError = " +
                missing.description() + "; }");
  EXPECT_EQ(missing.localizedDescription(), "open \"/x\": No such file or directory");
  EXPECT_TRUE(outer.underlyingError() && outer.underlyingError()->isPOSIX(ENOENT));
  EXPECT_EQ(Error("D", 1, {{kUnderlyingErrorKey, Value("text")}}).underlyingError(), nullptr);
  EXPECT_FALSE(Error(kFileErrorDomain, EPERM).isPOSIX(EPERM));
  Error denied = POSIXCallError(EACCES, "open", "/x");
  EXPECT_EQ(FileReadError(URL::fileURL("/x"), "r", &missing).code(), kFileReadNoSuchFileError);
  EXPECT_EQ(FileReadError(URL::fileURL("/x"), "r", &denied).code(), kFileReadUnknownError);
}

}  // namespace
