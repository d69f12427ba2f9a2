

#include "FileLayerTestSupport.h"
#include "Shared/FileManager/QSFileManager.h"

namespace {

using platform::Error;
using qstest::fileURL;

constexpr char kTempFn[] = "-[QSFileManager createTemporaryDirectoryInDirectoryURL:error:]";

class FileManagerTempDir : public testing::Test {
 protected:
  QSFileManager& fm = QSFileManager::defaultManager();
  qstest::TempDir dir{"tempdir"};
};

TEST_F(FileManagerTempDir, CreatesPrivateUniqueDirectoryInsideTheParent) {
  Error error = qstest::untouchedSentinel();
  auto first = fm.createTemporaryDirectoryInDirectoryURL(fileURL(dir.path(), true), &error);
  auto second = fm.createTemporaryDirectoryInDirectoryURL(fileURL(dir.path(), true), &error);
  ASSERT_TRUE(first && second);
  EXPECT_TRUE(error.is("", 0)) << "the error is cleared at entry";
  EXPECT_NE(first->path(), second->path());
  for (const auto& url : {*first, *second}) {
    EXPECT_TRUE(url.isDirectory());
    EXPECT_EQ(url.deletingLastPathComponent().path(), dir.path());
    std::string name = url.lastPathComponent();
    ASSERT_EQ(name.size(), 11u) << name;
    EXPECT_EQ(name.substr(0, 5), "temp.");
    EXPECT_NE(name.substr(5), "XXXXXX");
    auto status = qstest::lstatOf(url.path());
    ASSERT_TRUE(status);
    EXPECT_TRUE(S_ISDIR(status->st_mode));
    EXPECT_EQ(status->st_mode & 07777, 0700u);
  }
}

TEST_F(FileManagerTempDir, MissingParentIsAnInstallerErrorWithTheTemplate) {
  const std::string templatePath = dir.path() + "/missing/temp.XXXXXX";
  qstest::LogCapture log;
  Error error;
  EXPECT_FALSE(fm.createTemporaryDirectoryInDirectoryURL(fileURL(dir / "missing", true), &error));
  EXPECT_EQ(error.domain(), QSInstallerErrorDomain);
  EXPECT_EQ(error.code(), 4);
  EXPECT_EQ(error.localizedDescription(), "Failed to create temp dir at path " + templatePath);
  EXPECT_EQ(qstest::functionNameOf(error), kTempFn);
  ASSERT_NE(error.underlyingError(), nullptr);
  EXPECT_TRUE(error.underlyingError()->isPOSIX(ENOENT));
  EXPECT_TRUE(error.underlyingError()->userInfo().empty());
  auto argument = error.userInfo().find(QSPathArgumentErrorKey);
  ASSERT_NE(argument, error.userInfo().end());
  ASSERT_NE(argument->second.asURL(), nullptr);
  EXPECT_EQ(argument->second.asURL()->path(), templatePath);
  EXPECT_TRUE(argument->second.asURL()->isDirectory());

  auto lines = log.systemLines();
  ASSERT_EQ(lines.size(), 1u);
  EXPECT_EQ(lines[0].level, 3);
  EXPECT_EQ(lines[0].function, kTempFn);
  EXPECT_NE(lines[0].message.find("Failed to create temp dir at path " + templatePath), std::string::npos)
      << lines[0].message;
}

TEST_F(FileManagerTempDir, ImmutableParentGivesPermissionErrorUnderneath) {
  ASSERT_TRUE(qstest::makeDirs(dir / "locked"));
  ASSERT_TRUE(qstest::setImmutable(dir / "locked", true));
  Error error;
  auto created = fm.createTemporaryDirectoryInDirectoryURL(fileURL(dir / "locked", true), &error);
  ASSERT_TRUE(qstest::setImmutable(dir / "locked", false));
  EXPECT_FALSE(created);
  EXPECT_TRUE(error.is(QSInstallerErrorDomain, 4));
  ASSERT_NE(error.underlyingError(), nullptr);
  EXPECT_TRUE(error.underlyingError()->isPOSIX(EPERM));
}

}  // namespace
