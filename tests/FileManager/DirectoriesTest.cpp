// Directory creation with modes and classes, and temporary directories.
#include "FileLayerTestSupport.h"
#include "Shared/FileManager/DataProtection.h"

namespace {

using platform::Error;
using qstest::fileURL;

constexpr char kCreateFn[] = "-[QSFileManager createDirectoryAtURL:withIntermediateDirectories:mode:class:error:]";
constexpr mode_t kMode = 0700;  // the same under any usual umask
constexpr int32_t kClass = 4;

class FileManagerDirectories : public qstest::FileLayerTest {
 protected:
  std::optional<int32_t> classOf(const std::string& path) {
    int32_t cls = -100;
    if (!fm.dataProtectionClassOfItemAtURL(fileURL(path), &cls)) return std::nullopt;
    return cls;
  }
};

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
}

TEST_F(FileManagerDirectories, ExistingDirectoryKeepsItsModeAndGetsTheClassAgain) {
  ASSERT_TRUE(qstest::makeDirs(dir / "a", 0750));
  ASSERT_TRUE(fm.createDirectoryAtURL(fileURL(dir / "a", true), false, kMode, 2));
  EXPECT_TRUE(fm.createDirectoryAtURL(fileURL(dir / "a", true), true, kMode, kClass));
  EXPECT_EQ(classOf(dir / "a"), kClass);
  EXPECT_EQ(qstest::permissionsOf(dir / "a"), 0750u);
}

TEST_F(FileManagerDirectories, FailuresNameTheCallAndThePath) {
  ASSERT_TRUE(qstest::writeFile(dir / "file", "x"));
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
  ASSERT_TRUE(qstest::setImmutable(dir / "locked", true));
  Error error;
  bool created = fm.createDirectoryAtURL(fileURL(dir / "locked", true), true, kMode, kClass, &error);
  ASSERT_TRUE(qstest::setImmutable(dir / "locked", false));
  EXPECT_FALSE(created);
  qstest::expectPOSIXError(
      error, EPERM, "Failed to setclass(4) on directory " + dir.path() + "/locked: Operation not permitted", kCreateFn);
  EXPECT_FALSE(qstest::xattrOf(dir / "locked", qsfs::kDataProtectionClassAttributeName));
}

TEST_F(FileManagerDirectories, TemporaryDirectoriesArePrivateAndUniqueOrAnInstallerErrorWithTheTemplate) {
  Error error = qstest::untouchedSentinel();
  auto first = fm.createTemporaryDirectoryInDirectoryURL(fileURL(dir.path(), true), &error);
  auto second = fm.createTemporaryDirectoryInDirectoryURL(fileURL(dir.path(), true), &error);
  ASSERT_TRUE(first && second);
  EXPECT_TRUE(error.is("", 0)) << "the error is cleared at entry";
  EXPECT_NE(first->path(), second->path());
  EXPECT_EQ(first->deletingLastPathComponent().path(), dir.path());
  EXPECT_EQ(first->lastPathComponent().substr(0, 5), "temp.");
  EXPECT_TRUE(S_ISDIR(qstest::lstatOf(first->path())->st_mode) && first->isDirectory());
  EXPECT_EQ(qstest::permissionsOf(first->path()), 0700u);
  const std::string templatePath = dir.path() + "/missing/temp.XXXXXX";
  EXPECT_FALSE(fm.createTemporaryDirectoryInDirectoryURL(fileURL(dir / "missing", true), &error));
  qstest::expectInstallerError(error, kQSErrorCodeFileOperationFailed,
                               "Failed to create temp dir at path " + templatePath, ENOENT);
  const platform::URL* argument = error.userInfo().at(QSPathArgumentErrorKey).asURL();
  ASSERT_TRUE(argument && argument->isDirectory());
  EXPECT_EQ(argument->path(), templatePath);
  EXPECT_EQ(log.count("Failed to create temp dir at path " + templatePath), 1u);
}

}  // namespace
