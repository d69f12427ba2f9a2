// What a copy keeps beyond metadata: holes, hard links and shared blocks,
// within a file system and across two, always with the bytes compared.
#include <linux/fiemap.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/mount.h>

#include <cstdio>
#include <tuple>
#include <vector>

#include "FileLayerTestSupport.h"
#include "Platform/FileTree/TreeWalk.h"

namespace {

using platform::ScopedFD;
using qstest::fileURL;
using qstest::lstatOf;

constexpr off_t kBlock = 4096;
constexpr off_t kMiB = 1 << 20;
// What a file system may allocate beyond the data (extent blocks and the like).
constexpr off_t kAllocationSlack = 16 * 1024;

using CopyFidelity = qstest::FileLayerTest;

off_t allocatedBytes(const std::string& path) {
  auto status = lstatOf(path);
  return status ? status->st_blocks * 512 : -1;
}

// The first offset from `at` on where the file open at `fd` has data: `size`
// when there is none, `at` itself when the kernel cannot tell.
off_t nextData(int fd, off_t at, off_t size) {
  off_t data = lseek(fd, at, SEEK_DATA);
  return data >= 0 ? data : errno == ENXIO ? size : at;
}

// Both files hold the same bytes. What the kernel reports as a hole in both
// reads as zeros in both and is skipped, so that large sparse files compare
// quickly; everything else is read.
testing::AssertionResult sameContent(const std::string& a, const std::string& b) {
  ScopedFD fa(open(a.c_str(), O_RDONLY | O_CLOEXEC)), fb(open(b.c_str(), O_RDONLY | O_CLOEXEC));
  const off_t size = lseek(fa.get(), 0, SEEK_END);
  if (size < 0 || lseek(fb.get(), 0, SEEK_END) != size) {
    return testing::AssertionFailure() << a << " and " << b << " differ in size";
  }
  std::vector<char> ba(kMiB), bb(kMiB);
  for (off_t at = 0; at < size; at += kMiB) {
    at = std::min(nextData(fa.get(), at, size), nextData(fb.get(), at, size));
    ssize_t na = pread(fa.get(), ba.data(), ba.size(), at), nb = pread(fb.get(), bb.data(), bb.size(), at);
    if (na < 0 || na != nb || memcmp(ba.data(), bb.data(), static_cast<size_t>(na)) != 0) {
      return testing::AssertionFailure() << a << " and " << b << " differ in the MiB at " << at;
    }
  }
  return testing::AssertionSuccess();
}

// A file of `size` bytes that has data (bytes that depend on their offset)
// only in the blocks at `extents`, holes elsewhere.
struct SparseFile {
  const char* name;
  off_t size;
  std::vector<off_t> extents;
};

void makeSparseFile(const std::string& directory, const SparseFile& file) {
  ScopedFD fd(open((directory + "/" + file.name).c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0640));
  ASSERT_TRUE(fd.valid()) << file.name;
  ASSERT_EQ(ftruncate(fd.get(), file.size), 0);
  for (off_t at : file.extents) {
    std::string bytes(static_cast<size_t>(std::min(kBlock, file.size - at)), '\0');
    for (size_t i = 0; i < bytes.size(); ++i) bytes[i] = static_cast<char>((at + i) % 251 + 1);
    ASSERT_EQ(pwrite(fd.get(), bytes.data(), bytes.size(), at), static_cast<ssize_t>(bytes.size())) << file.name;
  }
}

const std::vector<SparseFile> kSparseFiles = {
    {"two-extents", off_t{1} << 30, {0, 512 * kMiB}},  // most of it a trailing hole
    {"leading-hole", 64 * kMiB, {64 * kMiB - kBlock}},
    {"hole-only", 64 * kMiB, {}},
    {"partial-tail", kMiB + 100, {0, kMiB}},  // data in the last, partial block
    {"empty", 0, {}},
};

// Every copy: size, bytes, and no more blocks than the source (plus slack).
void expectSparseCopies(const std::string& source, const std::string& copy) {
  for (const SparseFile& file : kSparseFiles) {
    const std::string from = source + "/" + file.name, to = copy + "/" + file.name;
    auto status = lstatOf(to);
    ASSERT_TRUE(status) << to;
    EXPECT_EQ(status->st_size, file.size) << to;
    EXPECT_LE(allocatedBytes(to), allocatedBytes(from) + kAllocationSlack) << to;
    EXPECT_TRUE(sameContent(from, to));
  }
}

// From ext4 to tmpfs by a copy, and back by a move (copy and removal).
TEST_F(CopyFidelity, HolesStayHolesAcrossFileSystemsBothWays) {
  qstest::ShmDir shm;
  const std::string src = dir / "src", onShm = shm / "copy", back = dir / "back";
  ASSERT_TRUE(qstest::makeDirs(src));
  for (const SparseFile& file : kSparseFiles) ASSERT_NO_FATAL_FAILURE(makeSparseFile(src, file));
  ASSERT_LT(allocatedBytes(src + "/two-extents"), kAllocationSlack);
  ASSERT_TRUE(fm.copyItemAtURL(fileURL(src, true), fileURL(onShm, true)));
  ASSERT_NO_FATAL_FAILURE(expectSparseCopies(src, onShm));
  ASSERT_TRUE(fm.moveItemAtURL(fileURL(onShm, true), fileURL(back, true)));
  EXPECT_FALSE(qstest::exists(onShm));
  expectSparseCopies(src, back);
}

// Opens the chain of `depth` directories named `name` below `root`, making
// them first when `make` is set. Used for paths longer than PATH_MAX.
ScopedFD openChain(const std::string& root, const std::string& name, int depth, bool make) {
  ScopedFD current(open(root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  for (int level = 0; level < depth && current.valid(); ++level) {
    if (make) {
      EXPECT_EQ(mkdirat(current.get(), name.c_str(), 0755), 0) << level;
    }
    current.reset(openat(current.get(), name.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  }
  EXPECT_TRUE(current.valid()) << root;
  return current;
}

struct stat statAt(int directoryFD, const char* name) {
  struct stat status {};
  EXPECT_EQ(fstatat(directoryFD, name, &status, AT_SYMLINK_NOFOLLOW), 0) << name << ": " << strerror(errno);
  return status;
}

// Names of one item in the source, each group checked in the copy: one
// inode, as many names as the group has, the source's bytes.
struct LinkGroup {
  std::vector<const char*> names;  // below the tree's top
  nlink_t namesInCopy;
};

// Three names of a file (two in one directory, one deeper in another), two of
// a fifo and of a link, a file whose other name is outside the tree, and two
// names in different branches deeper than the walk keeps open and than
// PATH_MAX; copied within ext4 and to tmpfs.
TEST_F(CopyFidelity, HardLinksInTheTreeStayLinksAtAnyDepth) {
  const std::string src = dir / "src";
  const std::vector<LinkGroup> groups = {
      {{"Documents/a", "Documents/b", "Library/sub/c"}, 3},
      {{"Documents/fifo", "Library/fifo"}, 2},
      {{"Documents/link", "Library/sub/link"}, 2},
      {{"Documents/once"}, 1},
  };
  ASSERT_NO_FATAL_FAILURE(qstest::makeTree(src, {"Library/sub/", "Documents/once"}));
  ASSERT_TRUE(qstest::writeFile(src + "/Documents/a", "linked"));
  ASSERT_EQ(mkfifo((src + "/Documents/fifo").c_str(), 0600), 0);
  qstest::makeSymlink("a", src + "/Documents/link");
  for (const LinkGroup& group : groups) {
    for (size_t i = 1; i < group.names.size(); ++i) {
      ASSERT_EQ(link((src + "/" + group.names[0]).c_str(), (src + "/" + group.names[i]).c_str()), 0);
    }
  }
  ASSERT_EQ(link((src + "/Documents/once").c_str(), (dir / "elsewhere").c_str()), 0);
  const std::string longName(40, 'n');
  constexpr int kDepth = static_cast<int>(platform::fs::kMaxOpenDirectories) + 2;  // 130 x 41 bytes: beyond PATH_MAX
  ASSERT_NO_FATAL_FAILURE(qstest::makeTree(src, {"deep1/", "deep2/"}));
  {
    ScopedFD one = openChain(src + "/deep1", longName, kDepth, true),
             two = openChain(src + "/deep2", longName, kDepth, true);
    ASSERT_TRUE(one.valid() && two.valid());
    ScopedFD x(openat(one.get(), "x", O_WRONLY | O_CREAT | O_CLOEXEC, 0644));
    ASSERT_EQ(pwrite(x.get(), "deep", 4, 0), 4);
    ASSERT_EQ(linkat(one.get(), "x", two.get(), "y", 0), 0);
  }

  qstest::ShmDir shm;
  for (const std::string& copy : {dir / "copy", shm / "copy"}) {
    SCOPED_TRACE(copy);
    ASSERT_TRUE(fm.copyItemAtURL(fileURL(src, true), fileURL(copy, true)));
    for (const LinkGroup& group : groups) {
      auto first = lstatOf(copy + "/" + group.names[0]);
      ASSERT_TRUE(first) << group.names[0];
      EXPECT_EQ(first->st_nlink, group.namesInCopy) << group.names[0];
      for (const char* name : group.names) {
        auto status = lstatOf(copy + "/" + name);
        ASSERT_TRUE(status) << name;
        EXPECT_EQ(status->st_ino, first->st_ino) << name;
        EXPECT_TRUE(!S_ISREG(status->st_mode) || sameContent(src + "/" + name, copy + "/" + name));
      }
    }
    EXPECT_EQ(fm.destinationOfSymbolicLinkAtURL(fileURL(copy + "/Library/sub/link"))->path(), "a");
    ScopedFD one = openChain(copy + "/deep1", longName, kDepth, false),
             two = openChain(copy + "/deep2", longName, kDepth, false);
    ASSERT_TRUE(one.valid() && two.valid());
    const struct stat x = statAt(one.get(), "x"), y = statAt(two.get(), "y");
    EXPECT_EQ(std::tie(x.st_ino, x.st_nlink, x.st_size), std::tie(y.st_ino, y.st_nlink, y.st_size));
    EXPECT_EQ(x.st_nlink, 2u);
    char bytes[8] = {};
    EXPECT_EQ(pread(ScopedFD(openat(two.get(), "y", O_RDONLY | O_CLOEXEC)).get(), bytes, sizeof bytes, 0), 4);
    EXPECT_STREQ(bytes, "deep");
  }
  // Paths longer than PATH_MAX, which the fixture's removal cannot take.
  for (const std::string& tree : {src, dir / "copy"}) EXPECT_TRUE(fm.removeItemAtURL(fileURL(tree, true)));
}

// ---- Shared blocks --------------------------------------------------------

// Runs a shell command line, with the administrator's programs on its path;
// its exit status, with its output in `output`.
int runCommand(const std::string& commandLine, std::string& output) {
  FILE* pipe = popen(("PATH=\"/usr/sbin:/sbin:$PATH\" " + commandLine + " 2>&1").c_str(), "r");
  if (pipe == nullptr) return -1;
  char buffer[512];
  while (size_t n = fread(buffer, 1, sizeof buffer, pipe)) output.append(buffer, n);
  return pclose(pipe);
}

// An XFS file system with shared blocks (reflink) on a loop device, mounted
// below `directory` for the object's lifetime.
class LoopXFS {
 public:
  explicit LoopXFS(const std::string& directory) : image_(directory + "/xfs.img"), mountPoint_(directory + "/xfs") {
    constexpr off_t kImageSize = 320 * kMiB;  // above mkfs.xfs's minimum; sparse
    ScopedFD image(open(image_.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
    EXPECT_TRUE(image.valid() && ftruncate(image.get(), kImageSize) == 0 && mkdir(mountPoint_.c_str(), 0755) == 0);
    std::string output;
    EXPECT_EQ(runCommand("mkfs.xfs -q -m reflink=1 '" + image_ + "'", output), 0) << output;
    mounted_ = runCommand("mount -o loop '" + image_ + "' '" + mountPoint_ + "'", why_) == 0;
  }
  ~LoopXFS() {
    // A lazy unmount as the last resort, so that nothing stays mounted.
    if (mounted_ && umount2(mountPoint_.c_str(), 0) != 0) {
      EXPECT_EQ(umount2(mountPoint_.c_str(), MNT_DETACH), 0) << strerror(errno);
    }
  }
  LoopXFS(const LoopXFS&) = delete;
  LoopXFS& operator=(const LoopXFS&) = delete;

  bool mounted() const { return mounted_; }
  const std::string& why() const { return why_; }
  std::string operator/(const std::string& rest) const { return mountPoint_ + "/" + rest; }

 private:
  std::string image_, mountPoint_, why_;
  bool mounted_ = false;
};

// The flags of each extent of a file's data.
std::vector<uint32_t> extentFlags(const std::string& path) {
  constexpr size_t kMaxExtents = 64;
  std::vector<char> buffer(sizeof(fiemap) + kMaxExtents * sizeof(fiemap_extent));
  auto* map = reinterpret_cast<fiemap*>(buffer.data());
  map->fm_length = FIEMAP_MAX_OFFSET;
  map->fm_flags = FIEMAP_FLAG_SYNC;
  map->fm_extent_count = kMaxExtents;
  ScopedFD fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  EXPECT_EQ(ioctl(fd.get(), FS_IOC_FIEMAP, map), 0) << path << ": " << strerror(errno);
  std::vector<uint32_t> flags;
  for (uint32_t i = 0; i < map->fm_mapped_extents; ++i) flags.push_back(map->fm_extents[i].fe_flags);
  return flags;
}

TEST_F(CopyFidelity, FilesShareTheirBlocksWithTheSourceWhereTheFileSystemCan) {
  LoopXFS xfs(dir.path());
  if (!xfs.mounted()) GTEST_SKIP() << "this kernel cannot mount a loop XFS: " << xfs.why();
  const std::string src = xfs / "src", copy = xfs / "copy";
  ASSERT_TRUE(qstest::makeDirs(src));
  std::string dense(8 * kMiB, '\0');
  for (size_t i = 0; i < dense.size(); ++i) dense[i] = static_cast<char>(i * 13 + i / kBlock);
  ASSERT_TRUE(qstest::writeFile(src + "/dense", dense));
  ASSERT_NO_FATAL_FAILURE(makeSparseFile(src, {"sparse", 256 * kMiB, {0, 128 * kMiB}}));
  ASSERT_EQ(chmod((src + "/dense").c_str(), 0604), 0);
  ASSERT_TRUE(fm.copyItemAtURL(fileURL(src, true), fileURL(copy, true)));
  for (const char* name : {"dense", "sparse"}) {
    const std::string from = src + "/" + name, to = copy + "/" + name;
    EXPECT_TRUE(sameContent(from, to));
    std::vector<uint32_t> flags = extentFlags(to);
    EXPECT_FALSE(flags.empty()) << name;
    for (uint32_t flag : flags) EXPECT_TRUE(flag & FIEMAP_EXTENT_SHARED) << name << " has an extent of its own";
    EXPECT_LE(allocatedBytes(to), allocatedBytes(from)) << name;
    auto a = lstatOf(from), b = lstatOf(to);
    EXPECT_EQ(std::tie(a->st_mode, a->st_size, a->st_mtim.tv_nsec),
              std::tie(b->st_mode, b->st_size, b->st_mtim.tv_nsec));
  }
}

}  // namespace
