#include <gtest/gtest.h>

#include "Platform/Foundation/PropertyList.h"
#include "Platform/Preferences.h"
#include "Platform/SystemVersion.h"
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

// Read once: changing the variable later has no effect.
TEST(SystemRoot, IsNormalisedAndReadOnce) {
  const std::string before = systemRootFromEnvironment();
  EXPECT_TRUE(before == normalizedSystemRoot(qstest::systemRoot() + "//") && normalizedSystemRoot("///").empty());
  setenv("QS_SYSTEM_ROOT", "/elsewhere", 1);
  EXPECT_EQ(systemRootFromEnvironment(), before);
  setenv("QS_SYSTEM_ROOT", qstest::systemRoot().c_str(), 1);
}

TEST(SystemVersionFile, IsReadWholeAndRefusedWhenMissingOrNotADictionary) {
  qstest::TempDir root;
  FileSystemVersionSource source(root.path() + "/");
  Error error;
  EXPECT_TRUE(!source.readSystemVersionDictionary(&error) && error.is(kFileErrorDomain, kFileReadNoSuchFileError));
  ASSERT_TRUE(qstest::makeDirs(root / "System/Library/CoreServices"));
  const URL file = URL::fileURL(root / "System/Library/CoreServices/SystemVersion.plist");
  ASSERT_TRUE(plist::writeFile(Value("21A100"), file));
  EXPECT_FALSE(source.systemVersionDictionary());
  Dictionary version{{kSystemVersionBuildVersionKey, Value("21A100")}, {"Extra", Value(Array{Value(1)})}};
  ASSERT_TRUE(plist::writeFile(Value(version), file, plist::Format::Binary));
  EXPECT_EQ(source.systemVersionDictionary(), version);
}

}  // namespace
