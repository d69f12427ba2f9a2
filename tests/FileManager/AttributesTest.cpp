// Data-protection classes and the bundle attributes on real files.
#include "FileLayerTestSupport.h"
#include "Shared/FileManager/DataProtection.h"

using platform::Error;
using platform::URL;
using platform::Value;

namespace {

class Attributes : public qstest::FileLayerTest {
 protected:
  void SetUp() override {
    ASSERT_TRUE(qstest::makeDirs(bundle_));
    ASSERT_TRUE(qstest::writeFile(file_, "x"));
  }
  URL bundleURL() const { return URL::fileURL(bundle_, true); }
  std::optional<int32_t> classOf(const std::string& path) {
    int32_t cls = -100;
    if (!fm.dataProtectionClassOfItemAtURL(URL::fileURL(path), &cls)) return std::nullopt;
    return cls;
  }
  bool setClass(const std::string& path, int32_t cls, Error* error = nullptr) {
    return fm.setDataProtectionClassOfItemAtURL(URL::fileURL(path), cls, nullptr, error);
  }

  std::string bundle_ = dir / "App.app";
  std::string file_ = dir / "file";
};

TEST_F(Attributes, ClassesReadBackAndARefusingPredicateChangesNothing) {
  EXPECT_EQ(classOf(file_), 0) << "an item without a class reads as 0";
  ASSERT_TRUE(setClass(file_, -2));
  int32_t seen = 0;
  Error error = qstest::untouchedSentinel();
  auto refuse = [&](int32_t current) {
    seen = current;
    return false;
  };
  EXPECT_TRUE(fm.setDataProtectionClassOfItemAtURL(URL::fileURL(file_), 4, refuse, &error));
  EXPECT_EQ(seen, -2);
  EXPECT_TRUE(error.is("Sentinel", 99));
  EXPECT_EQ(classOf(file_), -2);
  // "No class to set" is never stored.
  EXPECT_FALSE(setClass(file_, kQSNoDataProtectionClass, &error));
  EXPECT_TRUE(error.isPOSIX(EINVAL));
  EXPECT_EQ(classOf(file_), -2);
}

TEST_F(Attributes, ClassOfASymbolicLinkFailsAtTheOpen) {
  const std::string link = dir / "link";
  qstest::makeSymlink(file_, link);
  for (bool set : {false, true}) {
    Error error;
    int32_t cls = 99;
    EXPECT_FALSE(set ? setClass(link, 1, &error) : fm.dataProtectionClassOfItemAtURL(URL::fileURL(link), &cls, &error));
    EXPECT_EQ(cls, 99);
    EXPECT_TRUE(error.isPOSIX(ELOOP)) << error.description();
    EXPECT_EQ(error.localizedDescription(), "Failed to open " + link + " : Too many levels of symbolic links");
  }
  EXPECT_FALSE(qstest::xattrOf(file_, qsfs::kDataProtectionClassAttributeName));
}

TEST_F(Attributes, UnreadableClassFailsTheReadAndAGuardedChangeOnly) {
  qstest::setXattr(file_, qsfs::kDataProtectionClassAttributeName, std::string(2, '\1'));
  Error error, guarded;
  EXPECT_FALSE(fm.dataProtectionClassOfItemAtURL(URL::fileURL(file_), nullptr, &error));
  EXPECT_TRUE(error.isPOSIX(ERANGE));
  EXPECT_EQ(error.localizedDescription(), "Failed to getclass of file " + file_ + ": Numerical result out of range");
  auto never = [](int32_t) {
    ADD_FAILURE() << "predicate called";
    return true;
  };
  EXPECT_FALSE(fm.setDataProtectionClassOfItemAtURL(URL::fileURL(file_), 1, never, &guarded));
  EXPECT_TRUE(guarded.isPOSIX(ERANGE));
  // Without a predicate the current class is never read, so the change works.
  EXPECT_TRUE(setClass(file_, 1));
  EXPECT_EQ(classOf(file_), 1);
}

TEST_F(Attributes, ImmutableItemKeepsItsClass) {
  ASSERT_TRUE(setClass(file_, 2));
  ASSERT_TRUE(qstest::setImmutable(file_, true));
  Error error;
  bool ok = setClass(file_, 3, &error);
  ASSERT_TRUE(qstest::setImmutable(file_, false));
  EXPECT_FALSE(ok);
  qstest::expectPOSIXError(error, EPERM, "Failed to setclass(3) on file " + file_ + ": Operation not permitted",
                           "-[QSFileManager setDataProtectionClassOfItemAtURL:toClass:ifPredicate:error:]");
  EXPECT_EQ(classOf(file_), 2);
}

TEST_F(Attributes, PlaceholderMarkIsAnyFourBytesOnTheBundleItself) {
  EXPECT_FALSE(fm.bundleAtURLIsPlaceholder(bundleURL()));
  ASSERT_TRUE(fm.markBundleAsPlaceholder(bundleURL()));
  const uint32_t one = 1;
  EXPECT_EQ(qstest::xattrOf(bundle_, kQSPlaceholderAttributeName), std::string(reinterpret_cast<const char*>(&one), 4));
  EXPECT_TRUE(fm.bundleAtURLIsPlaceholder(bundleURL()));
  qstest::makeSymlink(bundle_, dir / "Link.app");
  EXPECT_FALSE(fm.bundleAtURLIsPlaceholder(URL::fileURL(dir / "Link.app")));
  for (const auto& [bytes, marked] : {std::pair{std::string("\x09\x08\x07\x06"), true}, {std::string(8, '\1'), false}}) {
    qstest::setXattr(bundle_, kQSPlaceholderAttributeName, bytes);
    EXPECT_EQ(fm.bundleAtURLIsPlaceholder(bundleURL()), marked) << bytes.size();
  }
  EXPECT_TRUE(log.systemLines().empty());
  const std::string missing = dir / "absent.app";
  Error error;
  EXPECT_FALSE(fm.markBundleAsPlaceholder(URL::fileURL(missing, true), &error));
  const std::string message = "Could't set placeholder EA on \"" + missing + "\": No such file or directory";
  qstest::expectInstallerError(error, kQSErrorCodeFileOperationFailed, message, ENOENT);
  EXPECT_EQ(log.count(message), 1u);
}

TEST_F(Attributes, InstallTypeIsZeroWhenAbsentAndReadsBackUnchanged) {
  Error error = qstest::untouchedSentinel();
  auto absent = fm.installTypeForBundle(bundleURL(), &error);
  ASSERT_TRUE(absent && absent->isInteger());
  EXPECT_EQ(absent->uint64Value(), 0u);
  EXPECT_TRUE(error.is("Sentinel", 99));
  ASSERT_TRUE(fm.setInstallType(Value(UINT64_MAX), bundleURL()));
  EXPECT_EQ(qstest::xattrOf(bundle_, kQSInstallTypeAttributeName)->size(), 8u);
  EXPECT_EQ(fm.installTypeForBundle(bundleURL())->uint64Value(), UINT64_MAX);
  EXPECT_TRUE(log.systemLines().empty());
}

TEST_F(Attributes, InstallTypeOfTheWrongSizeIsReported) {
  qstest::setXattr(bundle_, kQSInstallTypeAttributeName, "1234");
  Error error;
  EXPECT_FALSE(fm.installTypeForBundle(bundleURL(), &error));
  EXPECT_TRUE(error.is(QSInstallerErrorDomain, kQSErrorCodeFileOperationFailed));
  const std::string message = "getxattr for installType EA on " + bundle_ + " returned 4 (expected 8)";
  EXPECT_EQ(error.localizedDescription(), message);
  EXPECT_EQ(error.underlyingError(), nullptr);
  EXPECT_EQ(log.count(message), 1u);
  // Longer than the value: it does not fit the buffer.
  qstest::setXattr(bundle_, kQSInstallTypeAttributeName, std::string(12, '\xAB'));
  EXPECT_FALSE(fm.installTypeForBundle(bundleURL(), &error));
  const std::string tooLong = "Couldn't get installType EA from \"" + bundle_ + "\": Numerical result out of range";
  qstest::expectInstallerError(error, kQSErrorCodeFileOperationFailed, tooLong, ERANGE);
  EXPECT_EQ(log.count(tooLong), 1u);
}

TEST_F(Attributes, FailedInstallTypeWriteLeavesTheOldValue) {
  ASSERT_TRUE(fm.setInstallType(Value(uint64_t{7}), bundleURL()));
  ASSERT_TRUE(qstest::setImmutable(bundle_, true));
  Error error;
  bool ok = fm.setInstallType(Value(uint64_t{9}), bundleURL(), &error);
  ASSERT_TRUE(qstest::setImmutable(bundle_, false));
  EXPECT_FALSE(ok);
  const std::string message = "Could't set installType EA on \"" + bundle_ + "\": Operation not permitted";
  qstest::expectInstallerError(error, kQSErrorCodeFileOperationFailed, message, EPERM);
  EXPECT_EQ(log.count(message), 1u);
  EXPECT_EQ(fm.installTypeForBundle(bundleURL())->uint64Value(), 7u);
}

}  // namespace
