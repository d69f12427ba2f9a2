#include <gtest/gtest.h>

#include "Platform/Foundation/PropertyList.h"
#include "Platform/Preferences.h"
#include "support/TestSupport.h"

namespace {

using namespace platform;
constexpr char kDomain[] = "com.vantrel.quill.set";

class FilePreferences : public testing::Test {
 protected:
  void writeDomain(const Value& contents, const std::string& domain = kDomain) {
    ASSERT_TRUE(qstest::makeDirs(root_ / "private/var/quilld/Library/Preferences"));
    ASSERT_TRUE(plist::writeFile(contents, URL::fileURL(store_.pathForDomain(domain))));
  }
  qstest::TempDir root_;
  FilePreferenceStore store_{root_.path() + "//"};
};

TEST_F(FilePreferences, ValuesAreReadAfreshFromTheDomainFileAndABadFileReadsAsEmpty) {
  EXPECT_EQ(store_.pathForDomain(kDomain),
            root_ / "private/var/quilld/Library/Preferences/com.vantrel.quill.set.plist");
  writeDomain(Value(Dictionary{{"k", Value(true)}}));
  EXPECT_EQ(store_.copyValue("k", kDomain), Value(true));
  writeDomain(Value(Dictionary{{"k", Value(3)}}));
  EXPECT_EQ(store_.copyValue("k", kDomain), Value(3));
  writeDomain(Value(Array{Value("k")}));
  EXPECT_FALSE(store_.copyValue("k", kDomain));
}

TEST_F(FilePreferences, DomainNamesThatLeaveTheDirectoryAreRefused) {
  ASSERT_TRUE(qstest::makeDirs(root_ / "private/var/quilld/Library/x"));
  writeDomain(Value(Dictionary{{"k", Value(2)}}), "../outside");
  writeDomain(Value(Dictionary{{"k", Value(2)}}), "../x/inside");
  for (const char* domain : {"../outside", "", "../x/inside", ".."}) {
    Error error;
    EXPECT_FALSE(store_.copyDomain(domain, &error)) << domain;
    EXPECT_TRUE(error.is(kFileErrorDomain, kFileReadUnknownError)) << domain;
  }
}

}  // namespace
