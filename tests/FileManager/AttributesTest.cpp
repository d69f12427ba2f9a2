// Data-protection classes and the bundle attributes on real files.

#include <cstdint>
#include <vector>

#include "FileLayerTestSupport.h"
#include "Shared/FileManager/DataProtection.h"
#include "Shared/FileManager/QSFileManager.h"
#include "Shared/Support/QSLog.h"

using platform::Error;
using platform::URL;
using platform::Value;

namespace {

constexpr char kInstallTypeFn[] = "-[QSFileManager installTypeForBundle:error:]";

// The attribute's bytes, empty when it is absent.
std::vector<uint8_t> attribute(const std::string& path, const char* name) {
  std::string bytes = qstest::xattrOf(path, name).value_or("");
  return std::vector<uint8_t>(bytes.begin(), bytes.end());
}

void setAttribute(const std::string& path, const char* name, const std::vector<uint8_t>& bytes) {
  ASSERT_EQ(lsetxattr(path.c_str(), name, bytes.data(), bytes.size(), 0), 0) << strerror(errno);
}

class AttributesFixture : public testing::Test {
 protected:
  void SetUp() override {
    bundle_ = tmp_ / "App.app";
    ASSERT_TRUE(qstest::makeDirs(bundle_));
    file_ = tmp_ / "file";
    ASSERT_TRUE(qstest::writeFile(file_, "x"));
  }

  URL bundleURL() const { return URL::fileURL(bundle_, true); }

  QSFileManager& fm_ = QSFileManager::defaultManager();
  qstest::TempDir tmp_{"attributes"};
  qstest::LogCapture log_;
  std::string bundle_;
  std::string file_;
};

// --- Data-protection classes -----------------------------------------------------

using AttributesClass = AttributesFixture;

TEST_F(AttributesClass, SetClassReadsBackOnFilesAndDirectories) {
  for (const std::string& path : {file_, bundle_}) {
    ASSERT_TRUE(fm_.setDataProtectionClassOfItemAtURL(URL::fileURL(path), 3, nullptr));
    int32_t cls = 0;
    ASSERT_TRUE(fm_.dataProtectionClassOfItemAtURL(URL::fileURL(path), &cls));
    EXPECT_EQ(cls, 3) << path;
  }
}

TEST_F(AttributesClass, RefusingPredicateSeesTheCurrentClassAndChangesNothing) {
  ASSERT_TRUE(fm_.setDataProtectionClassOfItemAtURL(URL::fileURL(file_), 2, nullptr));
  int32_t seen = -7;
  int calls = 0;
  Error error("Untouched", 1);
  EXPECT_TRUE(fm_.setDataProtectionClassOfItemAtURL(
      URL::fileURL(file_), 4,
      [&](int32_t current) {
        seen = current;
        ++calls;
        return false;
      },
      &error));
  EXPECT_EQ(seen, 2);
  EXPECT_EQ(calls, 1);
  EXPECT_TRUE(error.is("Untouched", 1));
  int32_t cls = 0;
  ASSERT_TRUE(fm_.dataProtectionClassOfItemAtURL(URL::fileURL(file_), &cls));
  EXPECT_EQ(cls, 2);
}

TEST_F(AttributesClass, SymbolicLinkFailsAtTheOpen) {
  std::string link = tmp_ / "link";
  ASSERT_EQ(symlink(file_.c_str(), link.c_str()), 0);
  for (bool set : {false, true}) {
    Error error;
    int32_t cls = 99;
    bool ok = set ? fm_.setDataProtectionClassOfItemAtURL(URL::fileURL(link), 1, nullptr, &error)
                  : fm_.dataProtectionClassOfItemAtURL(URL::fileURL(link), &cls, &error);
    EXPECT_FALSE(ok);
    EXPECT_EQ(cls, 99);
    EXPECT_TRUE(error.isPOSIX(ELOOP)) << error.description();
    EXPECT_EQ(error.localizedDescription(), "Failed to open " + link + " : Too many levels of symbolic links");
  }
  EXPECT_EQ(attribute(file_, qsfs::kDataProtectionClassAttributeName).size(), 0u);
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(AttributesClass, UnreadableClassFailsBothTheReadAndAGuardedChange) {
  // A stored class of the wrong size cannot be read.
  setAttribute(file_, qsfs::kDataProtectionClassAttributeName, {1, 2});
  Error error;
  int32_t cls = 0;
  EXPECT_FALSE(fm_.dataProtectionClassOfItemAtURL(URL::fileURL(file_), &cls, &error));
  EXPECT_TRUE(error.isPOSIX(ERANGE));
  EXPECT_EQ(error.localizedDescription(), "Failed to getclass of file " + file_ + ": Numerical result out of range");

  bool called = false;
  Error guarded;
  EXPECT_FALSE(fm_.setDataProtectionClassOfItemAtURL(
      URL::fileURL(file_), 1,
      [&](int32_t) {
        called = true;
        return true;
      },
      &guarded));
  EXPECT_FALSE(called);
  EXPECT_TRUE(guarded.isPOSIX(ERANGE));
  // Without a predicate the current class is never read, so the change works.
  EXPECT_TRUE(fm_.setDataProtectionClassOfItemAtURL(URL::fileURL(file_), 1, nullptr));
}

TEST_F(AttributesClass, ImmutableItemKeepsItsClass) {
  ASSERT_TRUE(fm_.setDataProtectionClassOfItemAtURL(URL::fileURL(file_), 2, nullptr));
  ASSERT_TRUE(qstest::setImmutable(file_, true));
  Error error;
  bool ok = fm_.setDataProtectionClassOfItemAtURL(URL::fileURL(file_), 3, nullptr, &error);
  ASSERT_TRUE(qstest::setImmutable(file_, false));
  EXPECT_FALSE(ok);
  EXPECT_TRUE(error.isPOSIX(EPERM));
  EXPECT_EQ(error.localizedDescription(), "Failed to setclass(3) on file " + file_ + ": Operation not permitted");
  int32_t cls = 0;
  ASSERT_TRUE(fm_.dataProtectionClassOfItemAtURL(URL::fileURL(file_), &cls));
  EXPECT_EQ(cls, 2);
}

// --- Placeholder mark ---------------------------------------------------------------

using AttributesPlaceholder = AttributesFixture;

TEST_F(AttributesPlaceholder, MarkIsAFourByteOneInNativeOrder) {
  ASSERT_TRUE(fm_.markBundleAsPlaceholder(bundleURL()));
  EXPECT_EQ(attribute(bundle_, kQSPlaceholderAttributeName), (std::vector<uint8_t>{1, 0, 0, 0}));
  EXPECT_TRUE(fm_.bundleAtURLIsPlaceholder(bundleURL()));
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(AttributesPlaceholder, AnyFourBytesAndOnlyFourMarkAPlaceholder) {
  EXPECT_FALSE(fm_.bundleAtURLIsPlaceholder(bundleURL()));
  EXPECT_FALSE(fm_.bundleAtURLIsPlaceholder(URL::fileURL(tmp_ / "absent.app", true)));
  const std::pair<std::vector<uint8_t>, bool> cases[] = {
      {{0, 0, 0, 0}, true}, {{9, 8, 7, 6}, true}, {{1}, false}, {{1, 0, 0, 0, 0, 0, 0, 0}, false}};
  for (const auto& [bytes, marked] : cases) {
    setAttribute(bundle_, kQSPlaceholderAttributeName, bytes);
    EXPECT_EQ(fm_.bundleAtURLIsPlaceholder(bundleURL()), marked) << bytes.size();
  }
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(AttributesPlaceholder, LinkToAMarkedBundleIsNotFollowed) {
  ASSERT_TRUE(fm_.markBundleAsPlaceholder(bundleURL()));
  std::string link = tmp_ / "Link.app";
  ASSERT_EQ(symlink(bundle_.c_str(), link.c_str()), 0);
  EXPECT_FALSE(fm_.bundleAtURLIsPlaceholder(URL::fileURL(link)));
}

TEST_F(AttributesPlaceholder, FailedMarkIsLoggedWithTheUnderlyingError) {
  std::string missing = tmp_ / "absent.app";
  Error error;
  EXPECT_FALSE(fm_.markBundleAsPlaceholder(URL::fileURL(missing, true), &error));
  EXPECT_TRUE(error.is(QSInstallerErrorDomain, kQSErrorCodeFileOperationFailed));
  std::string message = "Could't set placeholder EA on \"" + missing + "\": No such file or directory";
  EXPECT_EQ(error.localizedDescription(), message);
  ASSERT_NE(error.underlyingError(), nullptr);
  EXPECT_TRUE(error.underlyingError()->isPOSIX(ENOENT));
  EXPECT_TRUE(error.underlyingError()->userInfo().empty());
  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].function, "-[QSFileManager markBundleAsPlaceholder:withError:]");
  EXPECT_NE(lines[0].message.find(": " + message + " ("), std::string::npos);
}

// --- Install type -------------------------------------------------------------------

using AttributesInstallType = AttributesFixture;

TEST_F(AttributesInstallType, AbsentAttributeReadsZeroWithoutError) {
  Error error("Untouched", 1);
  auto value = fm_.installTypeForBundle(bundleURL(), &error);
  ASSERT_TRUE(value);
  EXPECT_TRUE(value->isInteger());
  EXPECT_EQ(value->uint64Value(), 0u);
  EXPECT_TRUE(error.is("Untouched", 1));
  EXPECT_TRUE(log_.systemLines().empty());
}

TEST_F(AttributesInstallType, ValuesReadBackUnchanged) {
  for (uint64_t v : {uint64_t{0}, uint64_t{1}, UINT64_MAX}) {
    ASSERT_TRUE(fm_.setInstallType(Value(v), bundleURL()));
    EXPECT_EQ(attribute(bundle_, kQSInstallTypeAttributeName).size(), 8u);
    auto value = fm_.installTypeForBundle(bundleURL());
    ASSERT_TRUE(value);
    EXPECT_EQ(value->uint64Value(), v);
  }
}

TEST_F(AttributesInstallType, ShortValueIsReportedWithItsSize) {
  setAttribute(bundle_, kQSInstallTypeAttributeName, {1, 2, 3, 4});
  Error error;
  EXPECT_FALSE(fm_.installTypeForBundle(bundleURL(), &error));
  EXPECT_TRUE(error.is(QSInstallerErrorDomain, kQSErrorCodeFileOperationFailed));
  std::string message = "getxattr for installType EA on " + bundle_ + " returned 4 (expected 8)";
  EXPECT_EQ(error.localizedDescription(), message);
  EXPECT_EQ(error.underlyingError(), nullptr);
  auto lines = log_.systemLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].function, kInstallTypeFn);
  EXPECT_EQ(lines[0].level, kQSLogLevelError);
  EXPECT_NE(lines[0].message.find(": " + message), std::string::npos);
}

TEST_F(AttributesInstallType, LongValueDoesNotFitTheBuffer) {
  setAttribute(bundle_, kQSInstallTypeAttributeName, std::vector<uint8_t>(12, 0xAB));
  Error error;
  EXPECT_FALSE(fm_.installTypeForBundle(bundleURL(), &error));
  EXPECT_TRUE(error.is(QSInstallerErrorDomain, kQSErrorCodeFileOperationFailed));
  EXPECT_EQ(error.localizedDescription(),
            "Couldn't get installType EA from \"" + bundle_ + "\": Numerical result out of range");
  ASSERT_NE(error.underlyingError(), nullptr);
  EXPECT_TRUE(error.underlyingError()->isPOSIX(ERANGE));
  EXPECT_EQ(log_.count("Couldn't get installType EA from"), 1u);
}

TEST_F(AttributesInstallType, FailedWriteLeavesTheOldValue) {
  ASSERT_TRUE(fm_.setInstallType(Value(uint64_t{7}), bundleURL()));
  ASSERT_TRUE(qstest::setImmutable(bundle_, true));
  Error error;
  bool ok = fm_.setInstallType(Value(uint64_t{9}), bundleURL(), &error);
  ASSERT_TRUE(qstest::setImmutable(bundle_, false));
  EXPECT_FALSE(ok);
  EXPECT_TRUE(error.is(QSInstallerErrorDomain, kQSErrorCodeFileOperationFailed));
  EXPECT_EQ(error.localizedDescription(), "Could't set installType EA on \"" + bundle_ + "\": Operation not permitted");
  ASSERT_NE(error.underlyingError(), nullptr);
  EXPECT_TRUE(error.underlyingError()->isPOSIX(EPERM));
  EXPECT_EQ(log_.count("Could't set installType EA on"), 1u);
  EXPECT_EQ(fm_.installTypeForBundle(bundleURL())->uint64Value(), 7u);
}

}  // namespace
