

#include "FileLayerTestSupport.h"
#include "Shared/FileManager/DataProtection.h"
#include "Shared/FileManager/QSFileManager.h"

namespace {

using platform::Error;
using qstest::fileURL;

constexpr char kCreateFn[] = "-[QSFileManager createDirectoryAtURL:withIntermediateDirectories:mode:class:error:]";
constexpr mode_t kMode = 0755;
constexpr int32_t kClass = 4;

class FileManagerDirectories : public testing::Test {
 protected:
  void SetUp() override { savedUmask_ = umask(022); }
  void TearDown() override { umask(savedUmask_); }

  static std::optional<int32_t> classOf(const std::string& path) {
    qsfs::ScopedFD fd(open(path.c_str(), O_RDONLY | O_NOFOLLOW));
    int32_t value = -100;
    if (!fd.valid() || qsfs::getDataProtectionClass(fd.get(), &value) != 0) return std::nullopt;
    return value;
  }
  static bool hasClassAttribute(const std::string& path) {
    return qstest::xattrOf(path, qsfs::kDataProtectionClassAttributeName).has_value();
  }

  QSFileManager& fm = QSFileManager::defaultManager();
  qstest::TempDir dir{"directories"};
  mode_t savedUmask_ = 0;
};

TEST_F(FileManagerDirectories, IntermediatesAreCreatedWithTheMode) {
  Error error = qstest::untouchedSentinel();
  EXPECT_TRUE(fm.createDirectoryAtURL(fileURL(dir / "a/b/c", true), true, kMode, &error));
  EXPECT_TRUE(error.is("Sentinel", 99));
  for (const char* p : {"a", "a/b", "a/b/c"}) {
    auto status = qstest::lstatOf(dir / p);
    ASSERT_TRUE(status) << p;
    EXPECT_TRUE(S_ISDIR(status->st_mode));
    EXPECT_EQ(status->st_mode & 07777, kMode) << p;
  }
}

TEST_F(FileManagerDirectories, ExistingDirectoryIsNoFailureAndKeepsItsMode) {
  ASSERT_TRUE(qstest::makeDirs(dir / "a", 0700));
  EXPECT_TRUE(fm.createDirectoryAtURL(fileURL(dir / "a", true), true, kMode));
  EXPECT_TRUE(fm.createDirectoryAtURL(fileURL(dir / "a", true), false, kMode));
  EXPECT_EQ(qstest::lstatOf(dir / "a")->st_mode & 07777, 0700u);
}

TEST_F(FileManagerDirectories, ClassGoesOnTheLastDirectoryOnly) {
  EXPECT_TRUE(fm.createDirectoryAtURL(fileURL(dir / "a/b", true), true, kMode, kClass));
  EXPECT_EQ(classOf(dir / "a/b"), kClass);
  EXPECT_FALSE(hasClassAttribute(dir / "a"));
  EXPECT_EQ(classOf(dir / "a"), 0) << "a directory without a class reads as 0";
}

TEST_F(FileManagerDirectories, ClassIsAppliedAgainToAnExistingDirectory) {
  ASSERT_TRUE(fm.createDirectoryAtURL(fileURL(dir / "a", true), false, kMode, 2));
  EXPECT_TRUE(fm.createDirectoryAtURL(fileURL(dir / "a", true), false, kMode, kClass));
  EXPECT_EQ(classOf(dir / "a"), kClass);
}

TEST_F(FileManagerDirectories, FailuresNameTheCallAndThePath) {
  ASSERT_TRUE(qstest::writeFile(dir / "file", "x"));
  const struct {
    const char* path;
    bool intermediates;
    int code;
    std::string message;
  } cases[] = {
      {"missing/a", false, ENOENT, "mkdir of " + dir.path() + "/missing/a failed: No such file or directory"},
      {"file/a/b", true, ENOTDIR, "mkpath_np of " + dir.path() + "/file/a/b failed: Not a directory"},
      {"file", true, EEXIST, "mkpath_np of " + dir.path() + "/file failed: File exists"},
  };
  for (const auto& c : cases) {
    Error error;
    EXPECT_FALSE(fm.createDirectoryAtURL(fileURL(dir / c.path, true), c.intermediates, kMode, &error)) << c.path;
    qstest::expectPOSIXError(error, c.code, c.message, kCreateFn);
  }
}

TEST_F(FileManagerDirectories, FileAtThePathWithoutIntermediatesDependsOnTheClass) {
  ASSERT_TRUE(qstest::writeFile(dir / "file", "x"));
  EXPECT_TRUE(fm.createDirectoryAtURL(fileURL(dir / "file", true), false, kMode, kQSNoDataProtectionClass));
  Error error;
  EXPECT_FALSE(fm.createDirectoryAtURL(fileURL(dir / "file", true), false, kMode, kClass, &error));
  qstest::expectPOSIXError(error, ENOTDIR, "opendir of " + dir.path() + "/file failed: Not a directory", kCreateFn);
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
  EXPECT_FALSE(hasClassAttribute(dir / "locked"));
}

TEST_F(FileManagerDirectories, ImmutableParentRefusesCreation) {
  ASSERT_TRUE(qstest::makeDirs(dir / "locked"));
  ASSERT_TRUE(qstest::setImmutable(dir / "locked", true));
  Error single, intermediate;
  bool createdSingle = fm.createDirectoryAtURL(fileURL(dir / "locked/a", true), false, kMode, &single);
  bool createdPath = fm.createDirectoryAtURL(fileURL(dir / "locked/a/b", true), true, kMode, &intermediate);
  ASSERT_TRUE(qstest::setImmutable(dir / "locked", false));
  EXPECT_FALSE(createdSingle);
  EXPECT_FALSE(createdPath);
  qstest::expectPOSIXError(single, EPERM, "mkdir of " + dir.path() + "/locked/a failed: Operation not permitted",
                           kCreateFn);
  qstest::expectPOSIXError(intermediate, EPERM,
                           "mkpath_np of " + dir.path() + "/locked/a/b failed: Operation not permitted", kCreateFn);
}

// The class mechanism itself.
class DataProtection : public FileManagerDirectories {
 protected:
  qsfs::ScopedFD openItem(const std::string& path) { return qsfs::ScopedFD(open(path.c_str(), O_RDONLY)); }
};

TEST_F(DataProtection, ClassesRoundTripIncludingNegativeOnes) {
  ASSERT_TRUE(qstest::writeFile(dir / "file", "x"));
  qsfs::ScopedFD fd = openItem(dir / "file");
  for (int32_t value : {1, 4, -2, INT32_MAX, INT32_MIN}) {
    ASSERT_EQ(qsfs::setDataProtectionClass(fd.get(), value), 0);
    int32_t read = 0;
    ASSERT_EQ(qsfs::getDataProtectionClass(fd.get(), &read), 0);
    EXPECT_EQ(read, value);
  }
  EXPECT_EQ(qstest::xattrOf(dir / "file", qsfs::kDataProtectionClassAttributeName)->size(), sizeof(int32_t));
}

TEST_F(DataProtection, NoClassValueIsNeverStored) {
  ASSERT_TRUE(qstest::writeFile(dir / "file", "x"));
  qsfs::ScopedFD fd = openItem(dir / "file");
  ASSERT_EQ(qsfs::setDataProtectionClass(fd.get(), 3), 0);
  EXPECT_EQ(qsfs::setDataProtectionClass(fd.get(), kQSNoDataProtectionClass), EINVAL);
  int32_t read = 0;
  ASSERT_EQ(qsfs::getDataProtectionClass(fd.get(), &read), 0);
  EXPECT_EQ(read, 3);
}

}  // namespace
