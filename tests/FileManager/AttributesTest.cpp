// Data-protection classes, directory creation and the bundle attributes on
// real files.
#include <tuple>

#include "FileLayerTestSupport.h"
#include "Shared/FileManager/DataProtection.h"

using platform::Error;
using platform::URL;
using platform::Value;
using qstest::fileURL;

namespace {

constexpr mode_t kMode = 0700;  // the same under any usual umask
constexpr int32_t kClass = 4;

class Attributes : public qstest::FileLayerTest {
 protected:
  void SetUp() override {
    ASSERT_TRUE(qstest::makeDirs(bundle_));
    ASSERT_TRUE(qstest::writeFile(file_, "x"));
  }
  URL bundleURL() const { return URL::fileURL(bundle_, true); }
  std::optional<int32_t> classOf(const std::string& path) {
    int32_t cls = -100;
    if (!fm.dataProtectionClassOfItemAtURL(fileURL(path), &cls)) return std::nullopt;
    return cls;
  }
  bool setClass(const std::string& path, int32_t cls, Error* error = nullptr) {
    return fm.setDataProtectionClassOfItemAtURL(fileURL(path), cls, nullptr, error);
  }

  std::string bundle_ = dir / "App.app";
  std::string file_ = dir / "file";
};

// A class goes on the item itself (never through a link), and a failed or
// refused change leaves the class it had.
TEST_F(Attributes, ClassesReadBackAndFailedOrRefusedChangesKeepTheClass) {
  EXPECT_EQ(classOf(file_), 0) << "an item without a class reads as 0";
  ASSERT_TRUE(setClass(file_, -2));
  int32_t seen = 0;
  EXPECT_TRUE(fm.setDataProtectionClassOfItemAtURL(fileURL(file_), 4, [&](int32_t now) { return (seen = now) == 0; }));
  EXPECT_EQ(seen, -2);
  qstest::makeSymlink(file_, dir / "link");
  Error readError, setError, error;
  EXPECT_FALSE(fm.dataProtectionClassOfItemAtURL(fileURL(dir / "link"), &seen, &readError));
  EXPECT_FALSE(setClass(dir / "link", 1, &setError));
  EXPECT_TRUE(readError.isPOSIX(ELOOP) && setError.isPOSIX(ELOOP) && seen == -2) << readError.description();
  EXPECT_FALSE(setClass(file_, kQSNoDataProtectionClass, &error));
  EXPECT_TRUE(error.isPOSIX(EINVAL));
  EXPECT_FALSE(qstest::whileImmutable(file_, [&] { return setClass(file_, 3, &error); }));
  EXPECT_TRUE(error.isPOSIX(EPERM));
  EXPECT_EQ(classOf(file_), -2);
  // A stored class of the wrong size fails the read and a guarded change; a
  // change without a predicate never reads it.
  qstest::setXattr(file_, platform::fs::kDataProtectionClassAttributeName, std::string(2, '\1'));
  EXPECT_FALSE(fm.dataProtectionClassOfItemAtURL(fileURL(file_), nullptr, &readError));
  EXPECT_FALSE(fm.setDataProtectionClassOfItemAtURL(fileURL(file_), 1, [](int32_t) { return true; }, &setError));
  EXPECT_TRUE(readError.isPOSIX(ERANGE) && setError.isPOSIX(ERANGE)) << readError.description();
  EXPECT_TRUE(setClass(file_, 1));
  EXPECT_EQ(classOf(file_), 1);
}

using FileManagerDirectories = Attributes;

TEST_F(FileManagerDirectories, IntermediatesGetTheModeAndTheLastOneTheClass) {
  EXPECT_TRUE(fm.createDirectoryAtURL(fileURL(dir / "a/b/c", true), true, kMode, kClass));
  for (const char* p : {"a", "a/b", "a/b/c"}) EXPECT_EQ(qstest::lstatOf(dir / p)->st_mode, S_IFDIR | kMode) << p;
  EXPECT_EQ(classOf(dir / "a/b/c"), kClass);
  EXPECT_FALSE(qstest::xattrOf(dir / "a/b", platform::fs::kDataProtectionClassAttributeName));
  // An existing directory keeps its mode and gets the class.
  ASSERT_EQ(chmod((dir / "a").c_str(), 0750), 0);
  EXPECT_TRUE(fm.createDirectoryAtURL(fileURL(dir / "a", true), true, kMode, kClass));
  EXPECT_EQ(classOf(dir / "a"), kClass);
  EXPECT_EQ(qstest::permissionsOf(dir / "a"), 0750u);
}

TEST_F(FileManagerDirectories, FailuresKeepWhatIsInThePath) {
  ASSERT_TRUE(qstest::makeDirs(dir / "locked"));
  for (const auto& [path, intermediates, cls, code] : {
           std::tuple{dir / "missing/a", false, kQSNoDataProtectionClass, ENOENT},
           {dir / "file/a/b", true, kQSNoDataProtectionClass, ENOTDIR},
           {file_, true, kQSNoDataProtectionClass, EEXIST},
           {file_, false, kClass, ENOTDIR},
           {dir / "locked", true, kClass, EPERM},
       }) {
    Error error;
    EXPECT_FALSE(qstest::whileImmutable(dir / "locked", [&] {
      return fm.createDirectoryAtURL(fileURL(path, true), intermediates, kMode, cls, &error);
    })) << path;
    EXPECT_TRUE(error.isPOSIX(code)) << error.description();
  }
  EXPECT_EQ(qstest::readFile(file_), "x");
  EXPECT_FALSE(qstest::xattrOf(dir / "locked", platform::fs::kDataProtectionClassAttributeName));
}

TEST_F(FileManagerDirectories, TemporaryDirectoryIsPrivateOrAnInstallerErrorWithTheTemplate) {
  Error error;
  auto first = fm.createTemporaryDirectoryInDirectoryURL(fileURL(dir.path(), true));
  ASSERT_TRUE(first && first->isDirectory());
  EXPECT_EQ(first->deletingLastPathComponent().path() + "/" + first->lastPathComponent().substr(0, 5), dir / "temp.");
  EXPECT_EQ(qstest::lstatOf(first->path())->st_mode, S_IFDIR | 0700);
  EXPECT_FALSE(fm.createTemporaryDirectoryInDirectoryURL(fileURL(dir / "missing", true), &error));
  qstest::expectInstallerError(error, kQSErrorCodeFileOperationFailed, ENOENT);
  EXPECT_EQ(log.count("Failed to create temp dir at path " + dir / "missing/temp.XXXXXX"), 1u);
}

TEST_F(Attributes, PlaceholderMarkIsFourBytesOnTheBundleItself) {
  EXPECT_FALSE(fm.bundleAtURLIsPlaceholder(bundleURL()));
  ASSERT_TRUE(fm.markBundleAsPlaceholder(bundleURL()));
  const uint32_t one = 1;
  EXPECT_EQ(qstest::xattrOf(bundle_, kQSPlaceholderAttributeName), std::string(reinterpret_cast<const char*>(&one), 4));
  EXPECT_TRUE(fm.bundleAtURLIsPlaceholder(bundleURL()));
  qstest::makeSymlink(bundle_, dir / "Link.app");
  EXPECT_FALSE(fm.bundleAtURLIsPlaceholder(fileURL(dir / "Link.app")));
  const std::string missing = dir / "absent.app";
  Error error;
  EXPECT_FALSE(fm.markBundleAsPlaceholder(fileURL(missing, true), &error));
  qstest::expectInstallerError(error, kQSErrorCodeFileOperationFailed, ENOENT);
  EXPECT_EQ(log.count("Could't set placeholder EA on \"" + missing + "\": No such file or directory"), 1u);
}

TEST_F(Attributes, InstallTypeReadsBackAndFailuresOfEveryKindAreLoggedRecords) {
  Error error;
  EXPECT_EQ(fm.installTypeForBundle(bundleURL()), Value(uint64_t{0})) << "absent reads 0";
  ASSERT_TRUE(fm.setInstallType(Value(UINT64_MAX), bundleURL()));
  EXPECT_EQ(fm.installTypeForBundle(bundleURL()), Value(UINT64_MAX));
  EXPECT_FALSE(
      qstest::whileImmutable(bundle_, [&] { return fm.setInstallType(Value(uint64_t{9}), bundleURL(), &error); }));
  qstest::expectInstallerError(error, kQSErrorCodeFileOperationFailed, EPERM);
  EXPECT_EQ(fm.installTypeForBundle(bundleURL()), Value(UINT64_MAX));
  qstest::setXattr(bundle_, kQSInstallTypeAttributeName, std::string(12, '\xAB'));  // does not fit the value
  EXPECT_FALSE(fm.installTypeForBundle(bundleURL(), &error));
  qstest::expectInstallerError(error, kQSErrorCodeFileOperationFailed, ERANGE);
  qstest::setXattr(bundle_, kQSInstallTypeAttributeName, "1234");
  EXPECT_FALSE(fm.installTypeForBundle(bundleURL(), &error));
  EXPECT_TRUE(error.is(QSInstallerErrorDomain, kQSErrorCodeFileOperationFailed) && !error.underlyingError());
  EXPECT_EQ(log.systemLines().size(), 3u) << "every failure is logged";
}

}  // namespace
