// Copy and move on real trees, within and across file systems, and the
// capture of the store items that uses them.
#include <sys/mount.h>
#include <sys/resource.h>

#include <memory>
#include <tuple>

#include "FileLayerTestSupport.h"
#include "Platform/FileTree/CopyTree.h"
#include "Platform/FileTree/TreeWalk.h"

namespace {

using platform::Error;
using qstest::exists;
using qstest::fileURL;

constexpr uid_t kOwner = 1234;
constexpr gid_t kGroup = 5678;
constexpr time_t kMTime = 1000000000;  // 2001-09-09
const char* const kSourceItems[] = {"", "/data", "/link", "/dangling", "/sub", "/sub/big", "/sub/fifo"};

// A POSIX access ACL with an extra named-user entry (uid 4321) in the kernel's
// extended-attribute layout: version 2, then tag, permissions and id of every
// entry, sorted by tag (little-endian).
constexpr char kAccessACL[] =
    "\x02\0\0\0" "\x01\0\x06\0\xff\xff\xff\xff" "\x02\0\x04\0\xe1\x10\0\0" "\x04\0\x04\0\xff\xff\xff\xff"
    "\x10\0\x04\0\xff\xff\xff\xff" "\x20\0\0\0\xff\xff\xff\xff";

using FileManagerCopy = qstest::FileLayerTest;

// A copy on the same file system, then a move of the copy to another one
// (copy and removal of the source): both keep everything of
//   src/ (0750, owned 1234:5678, an attribute)
//     data      (0640, owned 1234:5678, user and trusted attributes, an access ACL)
//     sub/big   (3 MiB, more than one kernel copy call)
//     sub/fifo
//     link      -> data (owned 1234:5678)
//     dangling  -> nowhere
// where every item has the same nanosecond modification time.
TEST_F(FileManagerCopy, TreeCopiedAndMovedAcrossDevicesKeepsDataAttributesOwnersModesTimesAndLinks) {
  const std::string src = dir / "src";
  ASSERT_TRUE(qstest::makeDirs(src + "/sub"));
  ASSERT_TRUE(qstest::writeFile(src + "/data", "payload"));
  std::string big(3 << 20, '\0');
  for (size_t i = 0; i < big.size(); ++i) big[i] = static_cast<char>(i * 7 + i / 4096);
  ASSERT_TRUE(qstest::writeFile(src + "/sub/big", big));
  ASSERT_EQ(mkfifo((src + "/sub/fifo").c_str(), 0604), 0);
  qstest::makeSymlink("data", src + "/link");
  qstest::makeSymlink("nowhere", src + "/dangling");
  for (const char* name : {"user.note", "trusted.secret"}) qstest::setXattr(src + "/data", name, name);
  qstest::setXattr(src + "/data", "system.posix_acl_access", std::string(kAccessACL, sizeof kAccessACL - 1));
  qstest::setXattr(src, "user.dir", "d");
  for (const char* item : {"", "/data", "/link", "/sub/big"}) {
    ASSERT_EQ(lchown((src + item).c_str(), kOwner, kGroup), 0) << item;
  }
  ASSERT_EQ(chmod((src + "/data").c_str(), 0640), 0);
  ASSERT_EQ(chmod(src.c_str(), 0750), 0);
  const timespec times[2] = {{kMTime - 100, 0}, {kMTime, 123456789}};
  for (const char* item : kSourceItems) {
    ASSERT_EQ(utimensat(AT_FDCWD, (src + item).c_str(), times, AT_SYMLINK_NOFOLLOW), 0) << item;
  }

  qstest::ShmDir shm;
  const std::string dst = shm / "dst";
  Error error;
  ASSERT_TRUE(fm.copyItemAtURL(fileURL(src, true), fileURL(dir / "copy", true), &error)) << error.description();
  ASSERT_TRUE(fm.moveItemAtURL(fileURL(dir / "copy", true), fileURL(dst, true), &error)) << error.description();
  EXPECT_TRUE(exists(src + "/data") && !exists(dir / "copy"));
  EXPECT_TRUE(log.systemLines().empty());
  for (const char* item : kSourceItems) {
    auto a = qstest::lstatOf(src + item), b = qstest::lstatOf(dst + item);
    ASSERT_TRUE(a && b) << item;
    EXPECT_EQ(std::tie(a->st_mode, a->st_uid, a->st_gid, a->st_mtim.tv_sec, a->st_mtim.tv_nsec),
              std::tie(b->st_mode, b->st_uid, b->st_gid, b->st_mtim.tv_sec, b->st_mtim.tv_nsec))
        << item;
  }
  EXPECT_EQ(qstest::readFile(dst + "/data"), "payload");
  EXPECT_EQ(qstest::readFile(dst + "/sub/big"), big);
  EXPECT_EQ(fm.destinationOfSymbolicLinkAtURL(fileURL(dst + "/link"))->path(), "data");
  for (const char* name : {"user.note", "trusted.secret", "system.posix_acl_access"}) {
    EXPECT_EQ(qstest::xattrOf(dst + "/data", name), qstest::xattrOf(src + "/data", name)) << name;
  }
  EXPECT_EQ(qstest::xattrOf(dst, "user.dir"), "d");
  // A directory cannot be copied into itself.
  EXPECT_FALSE(fm.copyItemAtURL(fileURL(dst, true), fileURL(dst + "/sub/copy", true), &error));
  EXPECT_TRUE(error.isPOSIX(EINVAL)) << error.description();
}

// An unprivileged caller: a file it cannot read stops the copy (what was
// copied stays), and a source it cannot examine fails the if-exists forms
// instead of passing for absent.
TEST_F(FileManagerCopy, UnreadableOrUnexaminableSourceFailsTheCopyAndMove) {
  ASSERT_NO_FATAL_FAILURE(qstest::makeTree(dir.path(), {"src/secret", "private/item"}));
  ASSERT_EQ(chmod((dir / "src/secret").c_str(), 0600), 0);
  ASSERT_EQ(chmod((dir / "private").c_str(), 0700), 0);
  ASSERT_EQ(chmod(dir.path().c_str(), 0777), 0);
  const std::string item = dir / "private/item";
  int status = qstest::runAsNobody([&] {
    Error copyError, ifExistsCopyError, ifExistsMoveError;
    if (fm.copyItemAtURL(fileURL(dir / "src", true), fileURL(dir / "dst", true), &copyError)) return 1;
    auto copied = qstest::lstatOf(dir / "dst");
    if (!copyError.isPOSIX(EACCES) || !copied || !S_ISDIR(copied->st_mode)) return 2;
    if (fm.copyItemIfExistsAtURL(fileURL(item), fileURL(dir / "copy"), &ifExistsCopyError)) return 3;
    if (fm.moveItemIfExistsAtURL(fileURL(item), fileURL(dir / "moved"), &ifExistsMoveError)) return 4;
    return ifExistsCopyError.isPOSIX(EACCES) && ifExistsMoveError.isPOSIX(EACCES) ? 0 : 5;
  });
  EXPECT_EQ(status, 0);
}

// Both walks bound their open descriptors and never name a whole path.
TEST_F(FileManagerCopy, TreeDeeperThanTheDescriptorLimitAndPathMaxIsCopiedAndRemoved) {
  constexpr int kDepth = 2100;  // more than PATH_MAX bytes of "/d"
  // The copy keeps two descriptors for each of its open levels and removal
  // one; one per level of this tree would need 2,100.
  constexpr rlim_t kDescriptorLimit = 2 * platform::fs::kMaxOpenDirectories + 64;
  qstest::ShmDir shm;
  const std::string src = shm / "src", dst = shm / "dst", chain = qstest::chainPath(kDepth);
  ASSERT_NO_FATAL_FAILURE(qstest::makeChain(src, kDepth));
  ASSERT_TRUE(qstest::writeFile(src + chain.substr(0, 2000) + "/data", "deep"));
  ASSERT_EQ(chmod((src + chain.substr(0, 100)).c_str(), 0705), 0);
  rlimit saved{};
  ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &saved), 0);
  const rlimit lowered{kDescriptorLimit, saved.rlim_max};
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &lowered), 0);
  const bool done = fm.copyItemAtURL(fileURL(src, true), fileURL(dst, true)) && fm.removeItemAtURL(fileURL(src, true));
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &saved), 0);
  EXPECT_TRUE(done);
  EXPECT_FALSE(exists(src));
  EXPECT_EQ(qstest::readFile(dst + chain.substr(0, 2000) + "/data"), "deep");
  EXPECT_TRUE(exists(dst + chain.substr(0, 4000) + "/f"));
  EXPECT_EQ(qstest::permissionsOf(dst + chain.substr(0, 100)), 0705u) << "status goes on levels that were reopened";
}

using FileManagerMove = qstest::FileLayerTest;

// A source that cannot be removed whole (an immutable file in it) is left
// set aside, beside its complete copy; the next attempt on the item finds
// the copy and removes the aside once it can.
TEST_F(FileManagerMove, CrossDeviceSourceThatCannotBeRemovedStaysAsideBesideItsCompleteCopy) {
  qstest::ShmDir shm;
  ASSERT_NO_FATAL_FAILURE(qstest::makeTree(dir / "src", {"keep.txt", "locked.txt"}));
  const std::string aside = dir / (std::string(kQSMoveOutgoingPrefix) + "src");
  Error error("Sentinel", 99);  // the failed removal is no failure of the move
  ASSERT_TRUE(qstest::setImmutable(dir / "src/locked.txt", true));
  EXPECT_TRUE(fm.moveItemAtURL(fileURL(dir / "src", true), fileURL(shm / "dst", true), &error));
  EXPECT_FALSE(fm.finishInterruptedMoveOfItemAtURL(fileURL(dir / "src", true), fileURL(shm / "dst", true)));
  ASSERT_TRUE(qstest::setImmutable(aside + "/locked.txt", false));
  EXPECT_TRUE(error.is("Sentinel", 99));
  EXPECT_EQ(qstest::readFile(shm / "dst/keep.txt") + qstest::readFile(shm / "dst/locked.txt"), "xx");
  EXPECT_EQ(qstest::readFile(aside + "/locked.txt"), "x");
  EXPECT_FALSE(exists(dir / "src"));
  // The line that tells both copies are left, once (the retry above logs its own).
  EXPECT_EQ(log.count("Failed to remove move source after copy at " + dir.path() + "/src : "), 1u);
  EXPECT_TRUE(fm.finishInterruptedMoveOfItemAtURL(fileURL(dir / "src", true), fileURL(shm / "dst", true)));
  EXPECT_FALSE(exists(aside));
  EXPECT_EQ(qstest::readFile(shm / "dst/locked.txt"), "x");
}

TEST_F(FileManagerMove, CrossDeviceMoveNeverReplacesWhatIsAtTheDestinationAndLeavesNoCopy) {
  qstest::ShmDir shm;
  ASSERT_TRUE(qstest::writeFile(dir / "src", "new") && qstest::writeFile(shm / "dst", "there"));
  Error error;
  EXPECT_FALSE(fm.moveItemAtURL(fileURL(dir / "src"), fileURL(shm / "dst"), &error));
  EXPECT_TRUE(error.isPOSIX(EEXIST)) << error.description();
  EXPECT_EQ(qstest::readFile(shm / "dst"), "there");
  EXPECT_EQ(qstest::readFile(dir / "src"), "new");
  EXPECT_FALSE(exists(shm / (std::string(kQSMoveIncomingPrefix) + "dst")));
  // Without its source, a hidden copy is all there is: it stays.
  const std::string incoming = shm / (std::string(kQSMoveIncomingPrefix) + "other");
  ASSERT_TRUE(qstest::writeFile(incoming, "only copy"));
  EXPECT_FALSE(fm.moveItemAtURL(fileURL(dir / "absent"), fileURL(shm / "other"), &error));
  EXPECT_TRUE(error.isPOSIX(ENOENT)) << error.description();
  EXPECT_EQ(qstest::readFile(incoming), "only copy");
}

// A destination file system that fills up in the middle of the copy: the
// move fails with the copy's error, the source stays whole where it was and
// no part of the copy is left taking space at the destination.
TEST_F(FileManagerMove, CrossDeviceMoveThatRunsOutOfSpaceLeavesTheSourceWholeAndNoPartialCopy) {
  const std::string small = dir / "small";
  ASSERT_EQ(mkdir(small.c_str(), 0755), 0);
  ASSERT_EQ(mount("none", small.c_str(), "tmpfs", 0, "size=256k"), 0) << strerror(errno);
  const std::unique_ptr<const char, void (*)(const char*)> unmount(small.c_str(), [](const char* path) {
    EXPECT_EQ(umount2(path, MNT_DETACH), 0) << strerror(errno);
  });
  ASSERT_TRUE(qstest::makeDirs(dir / "src"));
  const std::string chunk(100 << 10, 'q');
  for (const char* name : {"a", "b", "c", "d"}) ASSERT_TRUE(qstest::writeFile(dir / "src/" + name, chunk)) << name;
  Error error;
  EXPECT_FALSE(fm.moveItemAtURL(fileURL(dir / "src", true), fileURL(small + "/dst", true), &error));
  EXPECT_TRUE(error.isPOSIX(ENOSPC)) << error.description();
  for (const char* name : {"a", "b", "c", "d"}) EXPECT_EQ(qstest::readFile(dir / "src/" + name), chunk) << name;
  EXPECT_EQ(fm.urlsForItemsInDirectoryAtURL(fileURL(small, true), false)->size(), 0u);
}

// What an interrupted move can leave, and what the next attempt makes of it:
// a leftover goes only when the item is provably complete elsewhere. An item
// at the aside's name is an aside only with the move's mark, and its copy is
// the destination only with the same token as ticket; a ticket whose aside
// is gone comes off.
TEST_F(FileManagerMove, LeftoversOfAnInterruptedMoveGoOnlyWhenTheItemIsCompleteElsewhere) {
  const std::string ticket = std::string(platform::fs::kMoveAttributePrefix) + "ticket";
  const std::string mark = std::string(platform::fs::kMoveAttributePrefix) + "aside";
  struct Case {
    const char* name;
    // "s": source, "d": destination, "in": hidden copy, "out": item at the
    // aside's name; the token of the destination's ticket and of the mark.
    std::vector<std::string> before;
    const char *ticketToken, *markToken;
    bool finished;
    std::vector<std::string> after;
  };
  const Case cases[] = {
      {"aside beside its copy", {"d", "out"}, "t1", "t1", true, {"d"}},
      {"aside without a copy", {"out"}, nullptr, "t1", false, {"out"}},
      {"aside beside another copy", {"d", "out"}, "t2", "t1", false, {"d", "out"}},
      {"aside beside a copy without a ticket", {"d", "out"}, nullptr, "t1", false, {"d", "out"}},
      {"an application's own item at the aside's name", {"d", "out"}, "t1", nullptr, true, {"d", "out"}},
      {"ticket of a move that ended", {"d"}, "t1", nullptr, true, {"d"}},
      {"unfinished copy while the source is in place", {"s", "in"}, nullptr, nullptr, true, {"s"}},
      {"hidden copy without its source", {"in"}, nullptr, nullptr, true, {"in"}},
      {"a copy replaced by the source again", {"s", "d"}, nullptr, nullptr, true, {"s", "d"}},
  };
  qstest::ShmDir shm;
  const std::map<std::string, std::string> paths{{"s", dir / "item"},
                                                 {"d", shm / "item"},
                                                 {"in", shm / (std::string(kQSMoveIncomingPrefix) + "item")},
                                                 {"out", dir / (std::string(kQSMoveOutgoingPrefix) + "item")}};
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    for (const std::string& item : c.before) {
      ASSERT_TRUE(qstest::makeDirs(paths.at(item)) && qstest::writeFile(paths.at(item) + "/f", item));
    }
    if (c.ticketToken) qstest::setXattr(paths.at("d"), ticket.c_str(), c.ticketToken);
    if (c.markToken) qstest::setXattr(paths.at("out"), mark.c_str(), c.markToken);
    EXPECT_EQ(fm.finishInterruptedMoveOfItemAtURL(fileURL(paths.at("s"), true), fileURL(paths.at("d"), true)),
              c.finished);
    const bool ticketStays = c.ticketToken && c.markToken && !c.finished;
    EXPECT_EQ(qstest::xattrOf(paths.at("d"), ticket.c_str()).value_or(""), ticketStays ? c.ticketToken : "");
    for (const auto& [item, path] : paths) {
      const bool kept = std::find(c.after.begin(), c.after.end(), item) != c.after.end();
      EXPECT_EQ(qstest::readFile(path + "/f"), kept ? item : "") << item;
      ASSERT_TRUE(fm.removeItemAtURL(fileURL(path, true)));
    }
  }
}

// The items of one container moved as a group: names of one file in several
// items (a top-level file among them) arrive as names of one file. An item
// whose move fails after its copy linked to an earlier item's file (the name
// is taken at the destination) takes only its own name away with its copy.
TEST_F(FileManagerMove, NamesOfOneFileInSeveralItemsOfAGroupStayOneFileAcrossDevices) {
  const std::string src = dir / "container";
  ASSERT_NO_FATAL_FAILURE(qstest::makeTree(src, {"Documents/a", "Library/x", "Blocked/y"}));
  ASSERT_TRUE(qstest::writeFile(src + "/Documents/a", "shared"));
  for (const char* name : {"/Documents/b", "/Library/c", "/top", "/Blocked/e"}) {
    ASSERT_EQ(link((src + "/Documents/a").c_str(), (src + name).c_str()), 0) << name;
  }
  qstest::ShmDir shm;
  ASSERT_TRUE(qstest::makeDirs(shm / "Blocked"));
  QSMoveGroup group;
  for (const char* item : {"Documents", "Blocked", "Library", "top"}) {
    Error error;
    EXPECT_EQ(fm.moveItemIfExistsAtURL(fileURL(src + "/" + item), fileURL(shm / item), group, &error),
              std::string(item) != "Blocked")
        << item << ": " << error.description();
  }
  EXPECT_TRUE(fm.finishMoveGroup(group));
  const auto first = qstest::lstatOf(shm / "Documents/a");
  ASSERT_TRUE(first);
  EXPECT_EQ(first->st_nlink, 4u);
  for (const char* name : {"Documents/b", "Library/c", "top"}) {
    const auto other = qstest::lstatOf(shm / name);
    ASSERT_TRUE(other) << name;
    EXPECT_EQ(other->st_ino, first->st_ino) << name;
  }
  EXPECT_EQ(qstest::readFile(shm / "top"), "shared");
  EXPECT_EQ(qstest::readFile(src + "/Blocked/e"), "shared");
  EXPECT_FALSE(exists(src + "/Documents") || exists(shm / "Blocked/e"));
  // The moves' ticket is off every copy once the group is finished.
  const std::string ticket = std::string(platform::fs::kMoveAttributePrefix) + "ticket";
  for (const char* item : {"Documents", "Library", "top"}) EXPECT_FALSE(qstest::xattrOf(shm / item, ticket.c_str())) << item;
}

// --- Capture of the store items ------------------------------------------------

using StoreData = qstest::FileLayerTest;

TEST_F(StoreData, FailureIsLoggedAndStopsTheCaptureOnlyWhenFatal) {
  const std::string from = dir / "container", to = dir / "staging";
  ASSERT_NO_FATAL_FAILURE(
      qstest::makeTree(from, {"VendraArtwork/icon.png", "Manifest.plist", "VendraMetadata.plist", "Unrelated.plist"}));
  // A non-empty directory where the artwork would go: neither a copy nor a
  // rename can replace it.
  ASSERT_NO_FATAL_FAILURE(qstest::makeTree(to, {"VendraArtwork/occupied"}));
  const std::string artwork = "file://" + from + "/VendraArtwork to file://" + to + "/VendraArtwork";
  EXPECT_TRUE(fm.captureStoreDataFromDirectory(fileURL(from, true), fileURL(to, true), true, false));
  for (const char* item : {"Manifest.plist", "VendraMetadata.plist"}) {
    EXPECT_EQ(qstest::readFile(to + "/" + item), qstest::readFile(from + "/" + item)) << item;
  }
  EXPECT_TRUE(exists(from + "/VendraArtwork/icon.png") && !exists(to + "/VendraArtwork/icon.png"));
  EXPECT_FALSE(exists(to + "/GeoJSON") || exists(to + "/Unrelated.plist"));
  // The one line that tells which item stayed behind.
  EXPECT_EQ(log.count("Failed to copy " + artwork), 1u);
  // Fatal: the first item goes, the third is never touched.
  Error error;
  EXPECT_FALSE(fm.captureStoreDataFromDirectory(fileURL(from, true), fileURL(to, true), false, true, &error));
  qstest::expectInstallerError(error, kQSErrorCodeStoreDataCaptureFailed, ENOTEMPTY);
  EXPECT_EQ(error.userInfo().at(kQSLegacyErrorStringKey), platform::Value("VendraArtworkCaptureFailed"));
  EXPECT_TRUE(!exists(from + "/Manifest.plist") && exists(from + "/VendraMetadata.plist"));
  EXPECT_EQ(log.count("Failed to move " + artwork), 1u);
  EXPECT_EQ(log.systemLines().size(), 2u);
}

}  // namespace
