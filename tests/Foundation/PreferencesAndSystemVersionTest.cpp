#include <cerrno>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "Platform/Foundation/PropertyList.h"
#include "Platform/Preferences.h"
#include "Platform/SystemVersion.h"
#include "support/TestSupport.h"

using platform::Array;
using platform::Dictionary;
using platform::Error;
using platform::URL;
using platform::Value;
namespace plist = platform::plist;

namespace {

constexpr char kDomain[] = "com.vantrel.quill.set";

class FilePreferences : public testing::Test {
 protected:
  FilePreferences() : store_(root_.path()) {}
  void writeDomain(const Value& contents) {
    ASSERT_TRUE(qstest::makeDirs(root_ / "private/var/quilld/Library/Preferences"));
    ASSERT_TRUE(plist::writeFile(contents, URL::fileURL(store_.pathForDomain(kDomain))));
  }
  qstest::TempDir root_;
  platform::FilePreferenceStore store_;
};

TEST_F(FilePreferences, DomainFileIsUnderThePreferencesDirectory) {
  EXPECT_EQ(store_.pathForDomain(kDomain), root_ / "private/var/quilld/Library/Preferences/com.vantrel.quill.set.plist");
  for (const char* root : {"/", ""}) {
    EXPECT_EQ(platform::FilePreferenceStore(root).pathForDomain("d"), "/private/var/quilld/Library/Preferences/d.plist");
  }
  EXPECT_EQ(platform::FilePreferenceStore("/r//").pathForDomain("d"),
            "/r/private/var/quilld/Library/Preferences/d.plist");
}

TEST_F(FilePreferences, ValuesAreReadWithTheirTypesAfreshOnEachCall) {
  writeDomain(Value(Dictionary{{"LowerInstallPriority", Value(true)}, {"List", Value(Array{Value("a")})}}));
  EXPECT_EQ(store_.copyValue("LowerInstallPriority", kDomain), Value(true));
  EXPECT_EQ(store_.copyValue("List", kDomain), Value(Array{Value("a")}));
  EXPECT_FALSE(store_.copyValue("SkipThinningCheck", kDomain));
  writeDomain(Value(Dictionary{{"LowerInstallPriority", Value(3)}}));
  EXPECT_EQ(store_.copyValue("LowerInstallPriority", kDomain), Value(3));
}

TEST_F(FilePreferences, MissingOrBadDomainReadsAsEmpty) {
  Error error;
  EXPECT_FALSE(store_.copyValue("k", kDomain));
  EXPECT_FALSE(store_.copyDomain(kDomain, &error));
  EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadNoSuchFileError)) << error.description();

  writeDomain(Value(Array{Value("k")}));
  EXPECT_FALSE(store_.copyValue("k", kDomain));
  EXPECT_FALSE(store_.copyDomain(kDomain, &error));
  EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadUnknownError));
  EXPECT_NE(error.localizedDescription().find("not a dictionary"), std::string::npos);

  ASSERT_TRUE(qstest::writeFile(store_.pathForDomain(kDomain),
                                "<plist><dict><key>k</key><integer>abc</integer></dict></plist>"));
  EXPECT_FALSE(store_.copyValue("k", kDomain));
}

TEST_F(FilePreferences, DomainNamesThatLeaveTheDirectoryAreRefused) {
  writeDomain(Value(Dictionary{{"k", Value(1)}}));
  ASSERT_TRUE(plist::writeFile(Value(Dictionary{{"k", Value(2)}}),
                               URL::fileURL(root_ / "private/var/quilld/Library/outside.plist")));
  for (const char* domain : {"../outside", "", "a/b", ".."}) {
    Error error;
    EXPECT_FALSE(store_.copyDomain(domain, &error)) << domain;
    EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadUnknownError)) << domain;
    EXPECT_NE(error.localizedDescription().find("is not a preference domain name"), std::string::npos);
    EXPECT_FALSE(store_.copyValue("k", domain)) << domain;
  }
}

TEST(SystemRoot, IsNormalisedAndReadOnceIntoOneObject) {
  for (const char* root : {"/", "///", ""}) EXPECT_EQ(platform::normalizedSystemRoot(root), "");
  for (const char* root : {"/tmp/root/", "/tmp/root//", "/tmp/root"}) {
    EXPECT_EQ(platform::normalizedSystemRoot(root), "/tmp/root");
  }
  EXPECT_EQ(platform::systemRootFromEnvironment(), platform::normalizedSystemRoot(qstest::systemRoot()));
  EXPECT_FALSE(platform::systemRootFromEnvironment().empty());

  std::vector<const std::string*> seen(8);
  std::vector<std::thread> threads;
  for (size_t i = 0; i < seen.size(); ++i) {
    threads.emplace_back([&seen, i] { seen[i] = &platform::systemRootFromEnvironment(); });
  }
  for (std::thread& t : threads) t.join();
  EXPECT_EQ(std::set<const std::string*>(seen.begin(), seen.end()).size(), 1u);

  // Changing the variable later has no effect.
  const std::string before = platform::systemRootFromEnvironment();
  setenv("QS_SYSTEM_ROOT", "/elsewhere", 1);
  EXPECT_EQ(platform::systemRootFromEnvironment(), before);
  setenv("QS_SYSTEM_ROOT", qstest::systemRoot().c_str(), 1);
}

TEST(SystemVersionFile, IsReadWholeFromCoreServicesAndRefusedWhenMissingOrNotADictionary) {
  qstest::TempDir root;
  platform::FileSystemVersionSource source(root.path() + "/");
  EXPECT_EQ(source.path(), root / "System/Library/CoreServices/SystemVersion.plist");
  EXPECT_EQ(platform::FileSystemVersionSource("/").path(), "/System/Library/CoreServices/SystemVersion.plist");

  Error error;
  EXPECT_FALSE(source.systemVersionDictionary());
  EXPECT_FALSE(source.readSystemVersionDictionary(&error));
  EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadNoSuchFileError)) << error.description();
  ASSERT_NE(error.underlyingError(), nullptr);
  EXPECT_TRUE(error.underlyingError()->isPOSIX(ENOENT));

  ASSERT_TRUE(qstest::makeDirs(root / "System/Library/CoreServices"));
  ASSERT_TRUE(plist::writeFile(Value("21A100"), URL::fileURL(source.path())));
  EXPECT_FALSE(source.systemVersionDictionary());
  EXPECT_FALSE(source.readSystemVersionDictionary(&error));
  EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadUnknownError));
  EXPECT_NE(error.localizedDescription().find("root is a string, not a dictionary"), std::string::npos);

  Dictionary version{{platform::kSystemVersionBuildVersionKey, Value("21A100")},
                     {platform::kSystemVersionProductVersionKey, Value("17.0")},
                     {"Extra", Value(Array{Value(1)})}};
  ASSERT_TRUE(plist::writeFile(Value(version), URL::fileURL(source.path()), plist::Format::Binary));
  EXPECT_EQ(source.systemVersionDictionary(), version);
}

}  // namespace
