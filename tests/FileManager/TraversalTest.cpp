// Tree walks, ownership standardisation and symbolic links on real trees.
#include "FileLayerTestSupport.h"

using platform::Error;
using platform::URL;

namespace {

constexpr uid_t kForeignUID = 1234;
constexpr gid_t kForeignGID = 5678;
constexpr uid_t kUID = 4321;
constexpr gid_t kGID = 8765;

class Traversal : public qstest::FileLayerTest {
 protected:
  void SetUp() override { ASSERT_TRUE(qstest::makeDirs(root_)); }
  URL rootURL() const { return URL::fileURL(root_, true); }
  bool standardize(bool validateSymlinks, Error* error = nullptr) {
    return fm.standardizeOwnershipAtURL(rootURL(), kUID, kGID, validateSymlinks, error);
  }
  void chmodAll(std::initializer_list<std::pair<const char*, mode_t>> modes) {
    for (const auto& [rel, mode] : modes) ASSERT_EQ(chmod((root_ + rel).c_str(), mode), 0) << rel;
  }

  std::string root_ = dir / "tree";
};

TEST_F(Traversal, MissingOrUnopenableRootFails) {
  Error missing, unopenable;
  EXPECT_FALSE(fm._traverseDirectory(URL::fileURL(dir / "absent", true), &missing, nullptr));
  EXPECT_FALSE(fm._traverseDirectory(URL(), &unopenable, nullptr));
  EXPECT_TRUE(missing.isPOSIX(ENOENT) && unopenable.isPOSIX(ENOENT)) << missing.description();
}

TEST_F(Traversal, ModesAndOwnersBecomeStandardAndLinksInsideTheTreePass) {
  // Special bits go too, also where the permission bits are already standard.
  ASSERT_NO_FATAL_FAILURE(qstest::makeTree(root_, {"private/f", "sticky/", "setuid"}));
  ASSERT_NO_FATAL_FAILURE(chmodAll({{"/private", 0700}, {"/sticky", 01755}, {"/setuid", 04644}, {"/private/f", 0600}}));
  for (const char* rel : {"/private", "/private/f"})
    ASSERT_EQ(lchown((root_ + rel).c_str(), kForeignUID, kForeignGID), 0);
  ASSERT_EQ(mkfifo((root_ + "/fifo").c_str(), 0600), 0);
  qstest::makeSymlink("private/../setuid", root_ + "/ok");
  qstest::makeSymlink("..", root_ + "/private/up");
  Error error;
  ASSERT_TRUE(standardize(true, &error)) << error.description();
  const std::pair<const char*, mode_t> standard[] = {{"", 0755},           {"/private", 0755}, {"/sticky", 0755},
                                                     {"/private/f", 0644}, {"/setuid", 0644},  {"/fifo", 0644},
                                                     {"/ok", 0777}};
  for (const auto& [rel, mode] : standard) {
    auto status = qstest::lstatOf(root_ + rel);
    EXPECT_EQ(std::tuple(status->st_mode & 07777, status->st_uid, status->st_gid), std::tuple(mode, kUID, kGID)) << rel;
  }
  EXPECT_TRUE(log.systemLines().empty());
}

TEST_F(Traversal, LinkItselfIsChangedAndItsTargetNever) {
  // Not validated either: this absolute link would be refused.
  const std::string target = dir / "target";
  ASSERT_TRUE(qstest::writeFile(target, "x"));
  ASSERT_EQ(chmod(target.c_str(), 0600) | chown(target.c_str(), kForeignUID, kForeignGID), 0);
  qstest::makeSymlink(target, root_ + "/link");
  ASSERT_TRUE(standardize(false));
  EXPECT_EQ(qstest::lstatOf(root_ + "/link")->st_uid, kUID);
  auto status = qstest::lstatOf(target);
  EXPECT_EQ(std::tuple(status->st_mode & 07777, status->st_uid, status->st_gid),
            std::tuple(mode_t{0600}, kForeignUID, kForeignGID));
  EXPECT_TRUE(log.systemLines().empty()) << "a link's own mode is no failure";
}

TEST_F(Traversal, LinkClimbingOutStopsTheWalkWithCode70) {
  ASSERT_EQ(chmod(root_.c_str(), 0700), 0);
  qstest::makeSymlink("../x", root_ + "/escape");
  Error error;
  EXPECT_FALSE(standardize(true, &error));
  EXPECT_TRUE(error.is(QSInstallerErrorDomain, kQSErrorCodeInvalidSymlink));
  EXPECT_EQ(error.userInfo().at(kQSLegacyErrorStringKey), platform::Value(70));
  EXPECT_EQ(log.count(": invalid symlink at " + root_ + "/escape"), 1u);
  EXPECT_EQ(qstest::permissionsOf(root_), 0755u) << "the root was visited first and keeps its change";
}

TEST_F(Traversal, UnchangeableItemIsLoggedAndPassedOver) {
  ASSERT_NO_FATAL_FAILURE(qstest::makeTree(root_, {"stuck", "other"}));
  ASSERT_NO_FATAL_FAILURE(chmodAll({{"/stuck", 0755}, {"/other", 0600}}));
  const std::string stuck = root_ + "/stuck";
  EXPECT_TRUE(qstest::whileImmutable(stuck, [&] { return standardize(true); }));
  ASSERT_EQ(log.systemMessages(), (std::vector<std::string>{"Could not chown " + stuck + ": Operation not permitted",
                                                            "Could not chmod " + stuck + ": Operation not permitted"}));
  EXPECT_EQ(qstest::permissionsOf(root_ + "/other"), 0644u);
  EXPECT_EQ(qstest::lstatOf(root_ + "/other")->st_uid, kUID);
}

TEST_F(Traversal, LinksAreCreatedOnlyOnFreeNamesAndReadBackUnresolvedUpTo1024Bytes) {
  Error error;
  ASSERT_TRUE(fm.createSymbolicLinkAtURL(URL::fileURL(root_ + "/link"), URL::fileURL("sub/../target"), &error));
  EXPECT_EQ(fm.destinationOfSymbolicLinkAtURL(URL::fileURL(root_ + "/link"))->path(), "sub/../target");
  EXPECT_FALSE(fm.createSymbolicLinkAtURL(URL::fileURL(root_ + "/link"), URL::fileURL("/dest"), &error));
  EXPECT_TRUE(error.isPOSIX(EEXIST));
  qstest::makeSymlink(std::string(1500, 'n'), root_ + "/long");
  EXPECT_EQ(fm.destinationOfSymbolicLinkAtURL(URL::fileURL(root_ + "/long"))->path(), std::string(1024, 'n'));
  EXPECT_FALSE(fm.destinationOfSymbolicLinkAtURL(rootURL(), &error));
  EXPECT_TRUE(error.isPOSIX(EINVAL));
}

}  // namespace
