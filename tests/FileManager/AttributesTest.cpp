// Data-protection classes, directory creation and the bundle attributes on
// real files.
#include "FileLayerTestSupport.h"
#include "Shared/FileManager/DataProtection.h"

using platform::Error;
using platform::URL;
using platform::Value;
using qstest::fileURL;

namespace {

constexpr char kCreateFn[] = "-[QSFileManager createDirectoryAtURL:withIntermediateDirectories:mode:class:error:]";
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
  Error error;
  EXPECT_FALSE(qstest::whileImmutable(file_, [&] { return setClass(file_, 3, &error); }));
  qstest::expectPOSIXError(error, EPERM, "Failed to setclass(3) on file " + file_ + ": Operation not permitted",
                           "-[QSFileManager setDataProtectionClassOfItemAtURL:toClass:ifPredicate:error:]");
  EXPECT_EQ(classOf(file_), 2);
}

using FileManagerDirectories = Attributes;

TEST_F(FileManagerDirectories, IntermediatesGetTheModeAndTheLastOneTheClass) {
  Error error = qstest::untouchedSentinel();
  EXPECT_TRUE(fm.createDirectoryAtURL(fileURL(dir / "a/b/c", true), true, kMode, kClass, &error));
  EXPECT_TRUE(error.is("Sentinel", 99));
  for (const char* p : {"a", "a/b", "a/b/c"}) {
    EXPECT_TRUE(S_ISDIR(qstest::lstatOf(dir / p)->st_mode));
    EXPECT_EQ(qstest::permissionsOf(dir / p), kMode) << p;
  }
  EXPECT_EQ(classOf(dir / "a/b/c"), kClass);
  EXPECT_FALSE(qstest::xattrOf(dir / "a/b", qsfs::kDataProtectionClassAttributeName));
  // An existing directory keeps its mode and gets the class again.
  ASSERT_EQ(chmod((dir / "a").c_str(), 0750), 0);
  ASSERT_TRUE(fm.createDirectoryAtURL(fileURL(dir / "a", true), false, kMode, 2));
  EXPECT_TRUE(fm.createDirectoryAtURL(fileURL(dir / "a", true), true, kMode, kClass));
  EXPECT_EQ(classOf(dir / "a"), kClass);
  EXPECT_EQ(qstest::permissionsOf(dir / "a"), 0750u);
}

TEST_F(FileManagerDirectories, FailuresNameTheCallAndThePath) {
  // Without intermediates a file at the path is no failure until a class is to be set.
  EXPECT_TRUE(fm.createDirectoryAtURL(fileURL(dir / "file", true), false, kMode));
  const struct {
    const char* path;
    bool intermediates;
    int32_t cls;
    int code;
    std::string message;
  } cases[] = {
      {"missing/a", false, kQSNoDataProtectionClass, ENOENT,
       "mkdir of " + dir.path() + "/missing/a failed: No such file or directory"},
      {"file/a/b", true, kQSNoDataProtectionClass, ENOTDIR,
       "mkpath_np of " + dir.path() + "/file/a/b failed: Not a directory"},
      {"file", true, kQSNoDataProtectionClass, EEXIST, "mkpath_np of " + dir.path() + "/file failed: File exists"},
      {"file", false, kClass, ENOTDIR, "opendir of " + dir.path() + "/file failed: Not a directory"},
  };
  for (const auto& c : cases) {
    Error error;
    EXPECT_FALSE(fm.createDirectoryAtURL(fileURL(dir / c.path, true), c.intermediates, kMode, c.cls, &error)) << c.path;
    qstest::expectPOSIXError(error, c.code, c.message, kCreateFn);
  }
  EXPECT_EQ(qstest::readFile(dir / "file"), "x");
}

TEST_F(FileManagerDirectories, ImmutableDirectoryRefusesTheClass) {
  ASSERT_TRUE(qstest::makeDirs(dir / "locked"));
  Error error;
  EXPECT_FALSE(qstest::whileImmutable(
      dir / "locked", [&] { return fm.createDirectoryAtURL(fileURL(dir / "locked", true), true, kMode, kClass, &error); }));
  qstest::expectPOSIXError(
      error, EPERM, "Failed to setclass(4) on directory " + dir.path() + "/locked: Operation not permitted", kCreateFn);
  EXPECT_FALSE(qstest::xattrOf(dir / "locked", qsfs::kDataProtectionClassAttributeName));
}

TEST_F(FileManagerDirectories, TemporaryDirectoriesArePrivateAndUniqueOrAnInstallerErrorWithTheTemplate) {
  Error error = qstest::untouchedSentinel();
  auto first = fm.createTemporaryDirectoryInDirectoryURL(fileURL(dir.path(), true), &error);
  auto second = fm.createTemporaryDirectoryInDirectoryURL(fileURL(dir.path(), true), &error);
  ASSERT_TRUE(first && second && first->isDirectory());
  EXPECT_TRUE(error.is("", 0)) << "the error is cleared at entry";
  EXPECT_NE(first->path(), second->path());
  EXPECT_EQ(first->deletingLastPathComponent().path() + "/" + first->lastPathComponent().substr(0, 5), dir / "temp.");
  EXPECT_EQ(qstest::lstatOf(first->path())->st_mode, S_IFDIR | 0700);
  const std::string templatePath = dir / "missing/temp.XXXXXX";
  EXPECT_FALSE(fm.createTemporaryDirectoryInDirectoryURL(fileURL(dir / "missing", true), &error));
  qstest::expectInstallerError(error, kQSErrorCodeFileOperationFailed,
                               "Failed to create temp dir at path " + templatePath, ENOENT);
  const platform::URL* argument = error.userInfo().at(QSPathArgumentErrorKey).asURL();
  ASSERT_TRUE(argument && argument->isDirectory());
  EXPECT_EQ(argument->path(), templatePath);
  EXPECT_EQ(log.count("Failed to create temp dir at path " + templatePath), 1u);
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

TEST_F(Attributes, InstallTypeReadsBackAndFailuresOfEveryKindAreLoggedRecords) {
  Error error = qstest::untouchedSentinel();
  EXPECT_EQ(fm.installTypeForBundle(bundleURL(), &error), Value(uint64_t{0})) << "absent reads 0";
  EXPECT_TRUE(error.is("Sentinel", 99));
  ASSERT_TRUE(fm.setInstallType(Value(UINT64_MAX), bundleURL()));
  EXPECT_EQ(fm.installTypeForBundle(bundleURL()), Value(UINT64_MAX));
  EXPECT_TRUE(log.systemLines().empty());

  const std::string unwritable = "Could't set installType EA on \"" + bundle_ + "\": Operation not permitted";
  EXPECT_FALSE(qstest::whileImmutable(bundle_, [&] { return fm.setInstallType(Value(uint64_t{9}), bundleURL(), &error); }));
  qstest::expectInstallerError(error, kQSErrorCodeFileOperationFailed, unwritable, EPERM);
  EXPECT_EQ(fm.installTypeForBundle(bundleURL()), Value(UINT64_MAX));

  qstest::setXattr(bundle_, kQSInstallTypeAttributeName, std::string(12, '\xAB'));  // does not fit the value
  EXPECT_FALSE(fm.installTypeForBundle(bundleURL(), &error));
  const std::string tooLong = "Couldn't get installType EA from \"" + bundle_ + "\": Numerical result out of range";
  qstest::expectInstallerError(error, kQSErrorCodeFileOperationFailed, tooLong, ERANGE);

  qstest::setXattr(bundle_, kQSInstallTypeAttributeName, "1234");
  EXPECT_FALSE(fm.installTypeForBundle(bundleURL(), &error));
  const std::string tooShort = "getxattr for installType EA on " + bundle_ + " returned 4 (expected 8)";
  EXPECT_TRUE(error.is(QSInstallerErrorDomain, kQSErrorCodeFileOperationFailed));
  EXPECT_EQ(error.localizedDescription(), tooShort);
  EXPECT_EQ(error.underlyingError(), nullptr);
  for (const std::string& line : {unwritable, tooLong, tooShort}) EXPECT_EQ(log.count(line), 1u) << line;
}

}  // namespace
