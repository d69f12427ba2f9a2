// Crash safety of whole migrations: transvale is killed at every call that
// changes a file system, the power is cut at every point the crash model
// allows, and file systems fail under it; every time a later run must finish
// and devicegen verify must find every file. The world (image and temporary
// directory) lives on a tmpfs of its own, so that the many runs cost no disk
// flushes; the new containers are on the same file system or on a second
// tmpfs.
//
// The crash model: per file system, changes of names and attributes persist
// in the order they were made; the data a file received since its last
// fsync, fdatasync or syncfs (of its file system) may be lost; nothing orders
// two file systems except that a flush makes what preceded it on its file
// system durable.
#include <sys/mount.h>
#include <sys/xattr.h>

#include <fcntl.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <map>
#include <functional>
#include <set>

#include <gtest/gtest.h>

#include "AppMigrator/QSAppMigrator.h"
#include "Platform/FileTree/CopyTree.h"
#include "Shared/FileManager/QSFileManager.h"
#include "e2e/Programs.h"
#include "support/TestSupport.h"

namespace fs = std::filesystem;

namespace qstest {
namespace {

constexpr char kContainers[] = "/image/private/var/mobile/Containers";
constexpr char kOldApplications[] = "/image/private/var/mobile/Applications";
constexpr char kLog[] = "/image/private/var/mobile/Library/Logs/Transvale/transvale.log";
constexpr int kRunsToFinish = 3;  // a run may fail once on what a crash left, then succeed
// One application with a group: the smallest image that moves data, group
// items and store metadata.
const std::vector<std::string> kSmallImage{"--apps", "1", "--groups", "1", "--files-per-app", "1",
                                           "--bytes-per-file", "2000", "--seed", "3"};
const std::string kTrap = kBin + "/../lib/libqs_calltrap.so";
// Every how many calls a kill or a power cut is tried: QS_CRASH_STRIDE, 1 by
// default (every call); a larger stride gives a quicker run by hand.
const long kStride = getenv("QS_CRASH_STRIDE") ? std::max(1L, atol(getenv("QS_CRASH_STRIDE"))) : 1;

enum class Layout { SameFileSystem, ContainersOnTmpfs };

// A tmpfs mounted for the object's life.
class Tmpfs {
 public:
  Tmpfs(std::string path, const std::string& options) : path_(std::move(path)) {
    EXPECT_TRUE(makeDirs(path_));
    mounted_ = mount("tmpfs", path_.c_str(), "tmpfs", MS_NOSUID | MS_NODEV, options.c_str()) == 0;
    EXPECT_TRUE(mounted_) << path_ << ": " << strerror(errno);
  }
  ~Tmpfs() {
    if (mounted_) {
      EXPECT_EQ(umount2(path_.c_str(), MNT_DETACH), 0) << path_ << ": " << strerror(errno);
    }
  }
  Tmpfs(const Tmpfs&) = delete;
  Tmpfs& operator=(const Tmpfs&) = delete;
  void remount(unsigned long flags, const std::string& options) {
    EXPECT_EQ(mount("tmpfs", path_.c_str(), "tmpfs", MS_REMOUNT | MS_NOSUID | MS_NODEV | flags, options.c_str()), 0)
        << strerror(errno);
  }
  const std::string& path() const { return path_; }

 private:
  std::string path_;
  bool mounted_ = false;
};

// ---- The record of one run and the crash states it allows -------------------------------

struct Call {
  std::string op;
  uint64_t dev = 0, ino = 0;
  std::string path, other;  // other: the source of a rename or link, a link's text, an attribute's name
  long long n1 = 0, n2 = 0, n3 = 0;
  std::string data;
  size_t flushedBy = SIZE_MAX;  // writes: the first later call that makes their data durable
};

std::string unhex(const std::string& text) {
  if (text == "-") return "";
  std::string bytes(text.size() / 2, '\0');
  for (size_t i = 0; i < bytes.size(); ++i) bytes[i] = static_cast<char>(std::stoi(text.substr(2 * i, 2), nullptr, 16));
  return bytes;
}

std::vector<Call> readRecord(const std::string& path) {
  std::vector<Call> calls;
  std::ifstream in(path);
  for (std::string line; std::getline(in, line);) {
    std::vector<std::string> f;
    for (size_t at = 0, tab; at <= line.size(); at = tab + 1) {
      tab = line.find('\t', at);
      if (tab == std::string::npos) tab = line.size();
      f.push_back(line.substr(at, tab - at));
    }
    if (f.size() != 9) continue;
    calls.push_back({f[0], std::stoull(f[1]), std::stoull(f[2]), unhex(f[3]), unhex(f[4]), std::stoll(f[5]),
                     std::stoll(f[6]), std::stoll(f[7]), unhex(f[8])});
  }
  // The first flush after each write that covers it: an fsync of its file or
  // a syncfs of its file system.
  std::map<std::pair<uint64_t, uint64_t>, size_t> nextFsync;
  std::map<uint64_t, size_t> nextSyncfs;
  for (size_t i = calls.size(); i-- > 0;) {
    Call& c = calls[i];
    if (c.op == "fsync") nextFsync[{c.dev, c.ino}] = i;
    if (c.op == "syncfs") nextSyncfs[c.dev] = i;
    if (c.op == "write") {
      auto f = nextFsync.find({c.dev, c.ino});
      auto s = nextSyncfs.find(c.dev);
      c.flushedBy = std::min(f == nextFsync.end() ? SIZE_MAX : f->second, s == nextSyncfs.end() ? SIZE_MAX : s->second);
    }
  }
  return calls;
}

bool isDeleted(const std::string& path) { return path.ends_with(" (deleted)"); }

// Rebuilds the world as a power cut would leave it: call i survives when it
// came before the cut of its file system; a write survives only when its
// flush did too. Unnamed files get a scratch name until they are linked,
// then lose it. Returns the calls that could not be replayed.
std::vector<std::string> replay(const std::vector<Call>& calls, const std::map<uint64_t, size_t>& cuts) {
  std::vector<std::string> failures;
  std::map<uint64_t, std::string> scratch;  // unnamed files by inode
  const auto target = [&](const Call& c) {
    if (!isDeleted(c.path)) return c.path;
    auto s = scratch.find(c.ino);
    return s == scratch.end() ? std::string() : s->second;
  };
  for (size_t i = 0; i < calls.size(); ++i) {
    const Call& c = calls[i];
    const size_t cut = cuts.at(c.dev);
    if (i >= cut) continue;
    int r = 0;
    if (c.op == "open") {
      if ((c.n1 & O_TMPFILE) == O_TMPFILE) {
        const std::string name = c.path.substr(0, c.path.rfind('/')) + "/.replay-unnamed-" + std::to_string(c.ino);
        scratch[c.ino] = name;
        r = open(name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, c.n2 & 07777);
      } else {
        r = open(c.path.c_str(), O_WRONLY | O_CLOEXEC | (c.n1 & (O_CREAT | O_TRUNC)), c.n2 & 07777);
      }
      if (r >= 0) r = close(r);
    } else if (c.op == "write" || c.op == "trunc") {
      if (c.op == "write" && c.flushedBy >= cut) continue;
      const std::string path = target(c);
      if (path.empty()) continue;  // a file unlinked while it was open
      int fd = open(path.c_str(), O_WRONLY | O_CLOEXEC);
      r = fd < 0 ? -1
          : c.op == "write"
              ? (pwrite(fd, c.data.data(), c.data.size(), c.n1) == static_cast<ssize_t>(c.data.size()) ? 0 : -1)
              : ftruncate(fd, c.n1);
      if (fd >= 0) close(fd);
    } else if (c.op == "mkdir") {
      r = mkdir(c.path.c_str(), static_cast<mode_t>(c.n1));
    } else if (c.op == "rmdir") {
      r = rmdir(c.path.c_str());
    } else if (c.op == "unlink") {
      r = unlink(c.path.c_str());
    } else if (c.op == "rename") {
      r = renameat2(AT_FDCWD, c.other.c_str(), AT_FDCWD, c.path.c_str(), static_cast<unsigned>(c.n1));
    } else if (c.op == "link") {
      if (isDeleted(c.other)) {
        // The unnamed file gets its name: its scratch name goes.
        r = link(scratch[c.ino].c_str(), c.path.c_str());
        if (r == 0) r = unlink(scratch[c.ino].c_str());
        scratch.erase(c.ino);
      } else {
        r = link(c.other.c_str(), c.path.c_str());
      }
    } else if (c.op == "symlink") {
      r = symlink(c.other.c_str(), c.path.c_str());
    } else if (c.op == "mknod") {
      r = mknod(c.path.c_str(), static_cast<mode_t>(c.n1), static_cast<dev_t>(c.n2));
    } else if (c.op == "setxattr" || c.op == "removexattr" || c.op == "chmod" || c.op == "chown" ||
               c.op == "utimens") {
      const std::string path = target(c);
      if (path.empty()) continue;
      const int noFollow = c.n3 ? AT_SYMLINK_NOFOLLOW : 0;
      if (c.op == "setxattr") r = lsetxattr(path.c_str(), c.other.c_str(), c.data.data(), c.data.size(), 0);
      if (c.op == "removexattr") r = lremovexattr(path.c_str(), c.other.c_str());
      if (c.op == "chmod") r = chmod(path.c_str(), static_cast<mode_t>(c.n1));
      if (c.op == "chown") {
        r = fchownat(AT_FDCWD, path.c_str(), static_cast<uid_t>(c.n1), static_cast<gid_t>(c.n2), noFollow);
      }
      if (c.op == "utimens") {
        r = utimensat(AT_FDCWD, path.c_str(), reinterpret_cast<const timespec*>(c.data.data()),
                      c.n1 ? AT_SYMLINK_NOFOLLOW : 0);
      }
    }
    if (r < 0) failures.push_back(c.op + " " + c.path + " " + c.other + ": " + strerror(errno));
  }
  for (const auto& [ino, name] : scratch) unlink(name.c_str());
  return failures;
}

// ---- The fixture ------------------------------------------------------------------------------

class World : public testing::Test {
 protected:
  explicit World(Layout layout) : layout_(layout) {}
  void SetUp() override {
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
    GTEST_SKIP() << "the preloaded library cannot come before a sanitizer's runtime";
#endif
    world_ = std::make_unique<Tmpfs>(dir_ / "world", "size=256m,mode=0755");
    ASSERT_TRUE(makeDirs(world() + "/tmp") && makeDirs(world() + kContainers));
  }
  void TearDown() override {
    if (HasFailure()) std::cerr << "--- log (tail) ---\n" << tail(readFile(world() + kLog));
    containers_.reset();
    world_.reset();
  }
  static std::string tail(const std::string& text) { return text.substr(text.size() > 4000 ? text.size() - 4000 : 0); }
  std::string world() const { return dir_ / "world"; }
  std::string image() const { return world() + "/image"; }

  // The image, with the new containers on a tmpfs of their own when the
  // layout asks for it, and a copy of the world to restore it from.
  void createImage(const std::vector<std::string>& options, const std::string& containersSize = "64m") {
    if (layout_ == Layout::ContainersOnTmpfs) {
      containers_ = std::make_unique<Tmpfs>(world() + kContainers, "size=" + containersSize + ",mode=0755");
    }
    std::vector<std::string> argv{"devicegen", "create", "--root", image()};
    argv.insert(argv.end(), options.begin(), options.end());
    ASSERT_EQ(run(argv), 0);
    if (options == kSmallImage) {
      ASSERT_NO_FATAL_FAILURE(linkAcrossItems());
    }
    ASSERT_EQ(run({"/bin/cp", "-a", world() + "/.", dir_ / "pristine"}), 0);
  }
  // Gives a file of the old container's Documents a second name there and a
  // third in its Library: three names of one file in two items.
  void linkAcrossItems() {
    for (const auto& entry : fs::recursive_directory_iterator(world() + kOldApplications)) {
      const std::string path = entry.path().string();
      if (fs::is_regular_file(entry.symlink_status()) && path.find("/Documents/") != std::string::npos &&
          fs::file_size(path) > 0) {
        const std::string documents = path.substr(0, path.find("/Documents/") + 10);
        ASSERT_EQ(link(path.c_str(), (documents + "/" + kLinkedNames[0]).c_str()), 0) << strerror(errno);
        ASSERT_EQ(link(path.c_str(), (documents + "/../Library/" + kLinkedNames[1]).c_str()), 0) << strerror(errno);
        linkedNames_ = {entry.path().filename().string(), kLinkedNames[0], kLinkedNames[1]};
        linkedContents_ = readFile(path);
        return;
      }
    }
    FAIL() << "no file in Documents";
  }
  // The three names of linkAcrossItems in the new data container, with the
  // file's contents, and names of one file when `oneFile`: "" or what is
  // wrong.
  std::string checkLinkedNames(bool oneFile) const {
    if (linkedContents_.empty()) return "";
    std::set<uint64_t> inodes;
    size_t found = 0;
    for (const auto& entry : fs::recursive_directory_iterator(world() + kContainers + "/Data")) {
      const std::string name = entry.path().filename().string();
      if (std::find(linkedNames_.begin(), linkedNames_.end(), name) == linkedNames_.end()) continue;
      ++found;
      if (readFile(entry.path().string()) != linkedContents_) return "contents of " + entry.path().string();
      struct stat status {};
      if (lstat(entry.path().c_str(), &status) == 0) inodes.insert(status.st_ino);
    }
    if (found != linkedNames_.size()) return std::to_string(found) + " of the linked names in the new container";
    if (oneFile && inodes.size() != 1) return "the linked names arrived as " + std::to_string(inodes.size()) + " files";
    return "";
  }
  // Back to the world devicegen made, mount points kept.
  void restore() {
    clear(world());
    ASSERT_EQ(run({"/bin/cp", "-a", dir_ / "pristine/.", world()}), 0);
  }
  void clear(const std::string& dir) {
    const std::string mountPoint = world() + kContainers;
    for (const auto& entry : fs::directory_iterator(dir)) {
      const std::string path = entry.path().string();
      if (containers_ && mountPoint.starts_with(path) &&
          (mountPoint.size() == path.size() || mountPoint[path.size()] == '/')) {
        clear(path);
      } else {
        fs::remove_all(path);
      }
    }
  }

  int run(const std::vector<std::string>& argv, std::vector<std::pair<std::string, std::string>> env = {}) {
    env.emplace_back("TMPDIR", world() + "/tmp");
    return Process(argv, dir_.path(), env).wait();
  }
  std::vector<std::pair<std::string, std::string>> trap(std::vector<std::pair<std::string, std::string>> env) const {
    env.insert(env.end(), {{"LD_PRELOAD", kTrap}, {"QS_TRAP_SCOPE", world()}});
    return env;
  }
  std::vector<std::string> transvale() const { return {"transvale", "--root", image(), "--progress", "never"}; }
  int migrate(const std::vector<std::pair<std::string, std::string>>& env = {}) {
    return run(transvale(), env.empty() ? env : trap(env));
  }
  // Runs until a run succeeds (at most kRunsToFinish), then verifies every
  // file and that nothing a move hides is left anywhere. An empty string
  // when all is well, else what went wrong.
  std::string finishAndVerify() {
    int status = -1;
    for (int attempt = 0; attempt < kRunsToFinish && status != 0; ++attempt) status = migrate();
    if (status != 0) return "no run succeeded (" + std::to_string(status) + ")";
    if (run({"devicegen", "verify", "--root", image()}) != 0) {
      // A run killed after the last container went but before the old
      // directory and the map were removed leaves an empty directory, which
      // the next run removes when it starts, and the map, which the
      // documented run then never removes. It is no user data: counted apart.
      const std::string report = readFile(dir_ / "stdout");
      if (report.find("problems: 1 (left behind 1)") != std::string::npos &&
          report.find("left behind: old install map") != std::string::npos) {
        ++mapsLeft_;
        return "";
      }
      return "verify: " + tail(report);
    }
    if (std::string left = hiddenLeftover(); !left.empty()) return "left behind: " + left;
    return checkLinkedNames(false);
  }
  // A hidden name of a move, or an item that still carries a move's ticket
  // or mark.
  std::string hiddenLeftover() const {
    char value[64];
    for (const auto& entry : fs::recursive_directory_iterator(image())) {
      if (QSFileManager::isInterruptedMoveItemName(entry.path().filename().string())) return entry.path().string();
      for (const char* attribute : {"ticket", "aside"}) {
        const std::string name = std::string(platform::fs::kMoveAttributePrefix) + attribute;
        if (lgetxattr(entry.path().c_str(), name.c_str(), value, sizeof value) >= 0) {
          return entry.path().string() + " (" + name + ")";
        }
      }
    }
    return "";
  }
  // The calls of one whole run, with a record when `record` is set.
  long countCalls(const std::string& record = "") {
    std::vector<std::pair<std::string, std::string>> env{{"QS_TRAP_COUNT", dir_ / "count"}};
    if (!record.empty()) env.emplace_back("QS_TRAP_RECORD", record);
    EXPECT_EQ(migrate(env), 0);
    EXPECT_EQ(checkLinkedNames(true), "");
    return std::stol(readFile(dir_ / "count"));
  }

  static constexpr const char* kLinkedNames[] = {"second name", "third name"};
  const Layout layout_;
  std::vector<std::string> linkedNames_;
  std::string linkedContents_;
  size_t mapsLeft_ = 0;
  TempDir dir_{"crash"};
  std::unique_ptr<Tmpfs> world_, containers_;
};

class CrashSafety : public World, public testing::WithParamInterface<Layout> {
 protected:
  CrashSafety() : World(GetParam()) {}
};

std::string layoutName(const testing::TestParamInfo<Layout>& info) {
  return info.param == Layout::SameFileSystem ? "SameFileSystem" : "ContainersOnTmpfs";
}

// Every call that changes a file system, the Nth of the first run, is where
// one attempt is killed; the runs after it must finish with every file.
TEST_P(CrashSafety, KilledAtEveryCallARestartedRunFinishesWithEveryFile) {
  ASSERT_NO_FATAL_FAILURE(createImage(kSmallImage));
  const long calls = countCalls();
  ASSERT_GT(calls, 100);
  std::vector<std::string> failures;
  long tried = 0;
  for (long n = 1; n <= calls; n += kStride, ++tried) {
    ASSERT_NO_FATAL_FAILURE(restore());
    ASSERT_EQ(migrate({{"QS_TRAP_KILL_AT", std::to_string(n)}}), -SIGKILL) << "call " << n;
    if (std::string failure = finishAndVerify(); !failure.empty()) {
      failures.push_back("killed at call " + std::to_string(n) + ": " + failure);
    }
  }
  std::cout << "[ figures ] " << layoutName({GetParam(), 0}) << ": calls " << calls << ", kill points " << tried
            << ", failed " << failures.size() << ", install map left " << mapsLeft_ << "\n";
  for (const std::string& failure : failures) ADD_FAILURE() << failure;
}

// Every state a power cut can leave after each call of a recorded run: all
// calls so far survive on the file system the call hit; on the other, all of
// them, or only those before its last flush; data not flushed is lost.
TEST_P(CrashSafety, PowerCutAtEveryCallLeavesAStateARunFinishesWithEveryFile) {
  ASSERT_NO_FATAL_FAILURE(createImage(kSmallImage));
  const std::string recordPath = dir_ / "record";
  countCalls(recordPath);
  const std::vector<Call> calls = readRecord(recordPath);
  ASSERT_GT(calls.size(), 100u);
  std::set<uint64_t> devices;
  for (const Call& c : calls) devices.insert(c.dev);
  std::map<uint64_t, size_t> lastFlush;  // per device, the index after its last flush so far
  size_t states = 0;
  std::vector<std::string> failures;
  for (size_t crash = 1; crash <= calls.size(); ++crash) {
    const Call& last = calls[crash - 1];
    if (last.op == "fsync" || last.op == "syncfs") lastFlush[last.dev] = crash;
    if ((crash - 1) % kStride != 0) continue;
    std::vector<std::map<uint64_t, size_t>> variants{{}};
    for (uint64_t dev : devices) variants[0][dev] = crash;
    for (uint64_t dev : devices) {
      if (dev == last.dev || lastFlush[dev] == crash) continue;
      auto behind = variants[0];
      behind[dev] = lastFlush[dev];
      variants.push_back(behind);
    }
    for (const auto& cuts : variants) {
      ++states;
      ASSERT_NO_FATAL_FAILURE(restore());
      const std::vector<std::string> replayFailures = replay(calls, cuts);
      ASSERT_TRUE(replayFailures.empty()) << "state " << states << ": " << replayFailures.front();
      if (std::string failure = finishAndVerify(); !failure.empty()) {
        failures.push_back("cut after call " + std::to_string(crash) + " (" + last.op + " " + last.path +
                           "): " + failure);
      }
    }
  }
  std::cout << "[ figures ] " << layoutName({GetParam(), 0}) << ": calls " << calls.size() << ", crash states "
            << states << ", failed " << failures.size() << ", install map left " << mapsLeft_ << "\n";
  for (const std::string& failure : failures) ADD_FAILURE() << failure;
}

// Faults of the new containers' file system, or of a source file, during
// moves to it: the run fails with a line that says why, the container stays
// with its marker, no hidden copy is left taking space, and a run after the
// fault is gone finishes with every file.
class Faults : public World {
 public:
  Faults() : World(Layout::ContainersOnTmpfs) {}
  using World::containers_;
  using World::world;
};

TEST_F(Faults, FullReadOnlyOrFailingFileSystemsFailARunThatLosesNothing) {
  struct Case {
    const char* name;
    std::string containersSize;
    std::string line;  // in the failed run's log (or, for a full file system, the space check's refusal)
    std::function<std::vector<std::pair<std::string, std::string>>(Faults&)> fault;  // the trap's settings, if any
    std::function<void(Faults&)> repair;
  };
  // A file of the old container's Documents, read with an I/O error.
  const auto documentsFile = [](Faults& t) {
    for (const auto& entry : fs::recursive_directory_iterator(t.world() + kOldApplications)) {
      if (fs::is_regular_file(entry.symlink_status()) &&
          entry.path().string().find("/Documents/") != std::string::npos) {
        return entry.path().filename().string();
      }
    }
    return std::string("none");
  };
  const Case cases[] = {
      {"destination fills up", "300k", "No space left on device", nullptr,
       [](Faults& t) { t.containers_->remount(0, "size=64m"); }},
      {"source file that cannot be read", "64m", "Input/output error",
       [&](Faults& t) { return std::vector<std::pair<std::string, std::string>>{{"QS_TRAP_EIO", documentsFile(t)}}; },
       nullptr},
      {"read-only destination", "64m", "Read-only file system",
       [](Faults& t) {
         t.containers_->remount(MS_RDONLY, "");
         return std::vector<std::pair<std::string, std::string>>{};
       },
       [](Faults& t) { t.containers_->remount(0, ""); }},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    containers_.reset();
    clear(world());
    ASSERT_TRUE(makeDirs(world() + "/tmp"));
    ASSERT_NO_FATAL_FAILURE(createImage({"--apps", "1", "--files-per-app", "6", "--bytes-per-file", "60000"},
                                        c.containersSize));
    fs::remove_all(dir_ / "pristine");
    auto env = c.fault ? c.fault(*this) : std::vector<std::pair<std::string, std::string>>{};
    EXPECT_EQ(migrate(env), 1);
    const std::string log = readFile(world() + kLog);
    EXPECT_TRUE(log.find(c.line) != std::string::npos ||
                (c.line == "No space left on device" && log.find("QSAppMigrator: Not enough room at ") != std::string::npos));
    EXPECT_EQ(hiddenLeftover(), "");
    const auto kept = fs::directory_iterator(world() + kOldApplications);
    EXPECT_TRUE(std::any_of(fs::begin(kept), fs::end(kept), [](const fs::directory_entry& e) {
      return fs::exists(e.path() / kQSMigrationMarkerFileName);
    }));
    if (c.repair) c.repair(*this);
    EXPECT_EQ(finishAndVerify(), "");
  }
}

// A source file that cannot be removed (immutable): its complete copy arrives,
// the source stays set aside, and neither that run nor the next one removes
// anything of the copy; once the flag is gone a run finishes.
TEST_F(Faults, SourceFileThatCannotBeRemovedEndsWithEveryFileSafe) {
  ASSERT_NO_FATAL_FAILURE(createImage(kSmallImage));
  std::string locked;
  for (const auto& entry : fs::recursive_directory_iterator(world() + kOldApplications)) {
    if (fs::is_regular_file(entry.symlink_status()) && entry.path().string().find("/Documents/") != std::string::npos) {
      locked = entry.path().filename().string();
      ASSERT_TRUE(setImmutable(entry.path().string(), true));
      break;
    }
  }
  ASSERT_FALSE(locked.empty());
  EXPECT_EQ(migrate(), 1);
  EXPECT_EQ(migrate(), 1);
  EXPECT_NE(readFile(world() + kLog).find("Failed to remove move source after copy at "), std::string::npos);
  for (const auto& entry : fs::recursive_directory_iterator(world() + kOldApplications)) {
    if (entry.path().filename() == locked) {
      ASSERT_TRUE(setImmutable(entry.path().string(), false));
    }
  }
  EXPECT_EQ(finishAndVerify(), "");
}

// Items an application named like the hidden names of a move: a
// ".qs-move-outgoing.Documents" in its container beside Documents, and in its
// group container a ".qs-move-outgoing.<item>" beside <item> and a
// ".qs-move-incoming.<item>". However many runs follow, every file of the
// image (planted ones included) is still somewhere with its contents; once the
// item in Documents' way is gone, a run finishes.
TEST_F(Faults, ItemsNamedLikeAMovesHiddenNamesAreNeverTakenForLeftovers) {
  ASSERT_NO_FATAL_FAILURE(createImage(kSmallImage));
  std::string container, group;
  for (const auto& entry : fs::directory_iterator(world() + kOldApplications)) {
    if (entry.is_directory()) container = entry.path().string();
  }
  for (const auto& entry : fs::directory_iterator(image() + "/private/var/mobile/Library/AppGroups")) {
    group = entry.path().string();
  }
  ASSERT_FALSE(container.empty() || group.empty());
  const std::string plantedAside = container + "/" + kQSMoveOutgoingPrefix + "Documents";
  ASSERT_TRUE(makeDirs(plantedAside) && writeFile(plantedAside + "/planted-documents", "documents aside"));
  ASSERT_TRUE(writeFile(group + "/" + kQSMoveOutgoingPrefix + "Shared", "group aside"));
  ASSERT_TRUE(writeFile(group + "/" + kQSMoveIncomingPrefix + "Library", "group incoming"));
  // Every regular file under `roots` by name and contents.
  const auto files = [&](const std::vector<std::string>& roots) {
    std::multiset<std::pair<std::string, std::string>> found;
    for (const std::string& root : roots) {
      for (const auto& entry : fs::recursive_directory_iterator(root)) {
        if (fs::is_regular_file(entry.symlink_status())) {
          found.emplace(entry.path().filename().string(), readFile(entry.path().string()));
        }
      }
    }
    return found;
  };
  const auto before = files({container, group});
  const auto everywhere = [&] { return files({image()}); };
  for (int attempt = 1; attempt <= 4; ++attempt) {
    EXPECT_EQ(migrate(), 1) << "run " << attempt;
    const auto after = everywhere();
    for (const auto& file : before) EXPECT_GE(after.count(file), before.count(file)) << "run " << attempt << ": " << file.first;
  }
  EXPECT_EQ(readFile(plantedAside + "/planted-documents"), "documents aside");
  std::error_code renamed;
  fs::rename(plantedAside, container + "/Documents/planted", renamed);
  ASSERT_FALSE(renamed) << renamed.message();
  EXPECT_EQ(migrate(), 0);
  EXPECT_EQ(run({"devicegen", "verify", "--root", image()}), 0) << readFile(dir_ / "stdout");
  const auto finished = everywhere();
  for (const auto& file : before) EXPECT_GE(finished.count(file), before.count(file)) << file.first;
}

INSTANTIATE_TEST_SUITE_P(Layouts, CrashSafety, testing::Values(Layout::SameFileSystem, Layout::ContainersOnTmpfs),
                         layoutName);

}  // namespace
}  // namespace qstest
