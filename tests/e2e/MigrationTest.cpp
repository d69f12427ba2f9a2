// End to end: device images made by devicegen are migrated by transvale with
// the real plug-in and registry, then checked by devicegen verify.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <random>
#include <sstream>
#include <thread>

#include <gtest/gtest.h>

#include "AppMigrator/QSAppMigrator.h"
#include "Platform/Foundation/PropertyList.h"
#include "Platform/Preferences.h"
#include "Platform/Registry/SQLiteRegistry.h"
#include "Shared/Support/QSGlobalConfiguration.h"
#include "support/TestSupport.h"

namespace fs = std::filesystem;
using platform::Dictionary;
using platform::URL;
using platform::Value;

namespace qstest {
namespace {

bool pathExists(const std::string& path) {
  std::error_code ec;
  return fs::exists(fs::symlink_status(path, ec));
}

constexpr int kExitSuccess = 0;
constexpr int kExitRunFailed = 1;

// Where the built programs are: $QS_BUILD_DIR/bin under ctest, else beside
// this test binary.
std::string programPath(const std::string& name) {
  if (const char* build = std::getenv("QS_BUILD_DIR"); build && *build) return std::string(build) + "/bin/" + name;
  return fs::read_symlink("/proc/self/exe").parent_path().string() + "/" + name;
}

// A running program whose output goes to a file.
class Process {
 public:
  Process(const std::vector<std::string>& argv, const std::string& outputPath, const std::string& tmpdir) {
    pid_ = fork();
    if (pid_ != 0) return;
    FILE* out = freopen(outputPath.c_str(), "a", stdout);
    if (!out || dup2(fileno(stdout), STDERR_FILENO) < 0) _exit(127);
    setenv("TMPDIR", tmpdir.c_str(), 1);
    unsetenv("QS_SYSTEM_ROOT");
    std::vector<char*> args;
    for (const std::string& arg : argv) args.push_back(const_cast<char*>(arg.c_str()));
    args.push_back(nullptr);
    execv(args[0], args.data());
    _exit(127);
  }
  // The exit status, or -signal when it was killed.
  int wait() {
    int status = 0;
    while (waitpid(pid_, &status, 0) < 0 && errno == EINTR) {
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
  }
  void kill() { ::kill(pid_, SIGKILL); }
  bool running() {
    int status = 0;
    const pid_t r = waitpid(pid_, &status, WNOHANG);
    if (r == 0) return true;
    exited_ = WIFEXITED(status) ? WEXITSTATUS(status) : -WTERMSIG(status);
    return false;
  }
  int exited() const { return exited_; }

 private:
  pid_t pid_ = -1;
  int exited_ = 0;
};

class Migration : public testing::Test {
 protected:
  void SetUp() override {
    root_ = std::make_unique<TempDir>("e2e");
    image_ = root_->path() + "/image";
    tmpdir_ = root_->path() + "/tmp";
    ASSERT_TRUE(makeDirs(tmpdir_));
  }
  void TearDown() override {
    for (const std::string& path : immutable_) setImmutable(path, false);
    if (HasFailure()) {
      std::cerr << "--- program output ---\n" << readOutput() << "--- transvale log (tail) ---\n" << logTail();
    }
  }

  int runProgram(const std::vector<std::string>& argv) { return Process(argv, outputPath(), tmpdir_).wait(); }
  std::string outputPath() const { return root_->path() + "/output.txt"; }
  std::string readOutput() const { return pathExists(outputPath()) ? readFile(outputPath()) : ""; }
  std::string logPath() const { return root_->path() + "/transvale.log"; }
  std::string logTail() const {
    if (!pathExists(logPath())) return "";
    const std::string log = readFile(logPath());
    return log.size() > 6000 ? log.substr(log.size() - 6000) : log;
  }

  void createImage(const std::vector<std::string>& options) {
    std::vector<std::string> argv{programPath("devicegen"), "create", "--root", image_};
    argv.insert(argv.end(), options.begin(), options.end());
    ASSERT_EQ(runProgram(argv), kExitSuccess) << readOutput();
    image_ = fs::canonical(image_).string();
  }
  std::vector<std::string> transvaleArguments() const {
    return {programPath("transvale"), "--root", image_, "--progress", "never", "--log", logPath()};
  }
  int migrate() { return runProgram(transvaleArguments()); }
  int verify() { return runProgram({programPath("devicegen"), "verify", "--root", image_}); }

  // The image's layout, as the migrator sees it.
  QSGlobalConfiguration& layout() {
    if (!configuration_) {
      preferences_ = std::make_unique<platform::FilePreferenceStore>(image_);
      configuration_ = std::make_unique<QSGlobalConfiguration>(image_, *preferences_);
    }
    return *configuration_;
  }
  std::string oldApplications() { return layout().oldContainerPath().path(); }
  // The containers of the old applications directory that hold an
  // application bundle, sorted.
  std::vector<std::string> applicationContainers() {
    std::vector<std::string> found;
    for (const std::string& name : directoryNamesOf(oldApplications())) {
      const std::string container = oldApplications() + "/" + name;
      if (!bundleIn(container).empty()) found.push_back(container);
    }
    return found;
  }
  static std::vector<std::string> directoryNamesOf(const std::string& path) {
    std::vector<std::string> names;
    std::error_code ec;
    for (const auto& entry : fs::directory_iterator(path, ec)) names.push_back(entry.path().filename().string());
    std::sort(names.begin(), names.end());
    return names;
  }
  static std::string bundleIn(const std::string& container) {
    for (const std::string& name : directoryNamesOf(container)) {
      if (fs::path(name).extension() == ".app" && !fs::is_symlink(container + "/" + name)) {
        return container + "/" + name;
      }
    }
    return "";
  }
  static std::string identifierOf(const std::string& bundle) {
    const auto info = platform::plist::readDictionary(URL::fileURL(bundle + "/Info.plist"));
    const std::string* identifier = info ? QSStringForKey(*info, platform::kBundleIdentifierKey) : nullptr;
    return identifier ? *identifier : "";
  }
  void makeImmutable(const std::string& path) {
    ASSERT_TRUE(setImmutable(path, true));
    immutable_.push_back(path);
  }
  // `killedRuns`: a run killed while it installed a placeholder may leave
  // that placeholder's staging directory under the temporary directory.
  void expectMigratedAndVerified(bool killedRuns = false) {
    EXPECT_FALSE(pathExists(oldApplications()));
    EXPECT_FALSE(pathExists(layout().oldInstallMapPath().path()));
    EXPECT_TRUE(pathExists(layout().dataDirectoryPath().path() + "/AppMigratorLastSystemVersion.plist"));
    EXPECT_EQ(verify(), kExitSuccess) << readOutput();
    // Placeholders are staged under the temporary directory and never left.
    if (!killedRuns) {
      EXPECT_TRUE(directoryNamesOf(tmpdir_ + "/com.vantrel.quill.set.migrator").empty());
    }
  }

  std::unique_ptr<TempDir> root_;
  std::string image_;
  std::string tmpdir_;
  std::unique_ptr<platform::FilePreferenceStore> preferences_;
  std::unique_ptr<QSGlobalConfiguration> configuration_;
  std::vector<std::string> immutable_;
};

TEST_F(Migration, ImageOfEveryShapeMigratesAndVerifies) {
  // Groups cycle through 3, 1 and 2 members, so group 1 is shared by three
  // applications; some applications have a newer built-in copy (the
  // registry refuses them as already installed) and some old bundles are
  // placeholders.
  createImage({"--apps", "24", "--vpn-only", "3", "--groups", "6", "--harbors", "3", "--placeholders", "2",
               "--builtin-older", "2", "--files-per-app", "5", "--bytes-per-file", "1500", "--seed", "11"});
  ASSERT_EQ(migrate(), kExitSuccess) << logTail();
  expectMigratedAndVerified();
  // A second run finds nothing to do and succeeds.
  EXPECT_EQ(migrate(), kExitSuccess) << logTail();
  EXPECT_EQ(verify(), kExitSuccess) << readOutput();
}

TEST_F(Migration, ContainerInterruptedAfterStagingIsResumedFromItsMarker) {
  createImage({"--apps", "6", "--groups", "2", "--seed", "5"});
  const std::vector<std::string> containers = applicationContainers();
  ASSERT_FALSE(containers.empty());
  const std::string container = containers.front();
  const std::string bundle = bundleIn(container);
  const std::string identifier = identifierOf(bundle);
  ASSERT_FALSE(identifier.empty());

  // What an attempt killed during staging leaves: the marker, the
  // placeholder installed, the bundle and store metadata in the package.
  const Dictionary info{{kQSContainerPathKey, Value(container)},
                        {kQSBundlePathKey, Value(bundle)},
                        {kQSBundleIdentifierKey, Value(identifier)},
                        {kQSContainerTypeKey, Value(kQSContainerTypeApp)}};
  ASSERT_TRUE(platform::plist::writeFile(Value(info), URL::fileURL(container + "/" + kQSMigrationMarkerFileName)));
  {
    const std::string placeholder = tmpdir_ + "/placeholder/" + identifier + ".app";
    ASSERT_TRUE(makeDirs(placeholder));
    ASSERT_TRUE(platform::plist::writeFile(Value(Dictionary{{platform::kBundleIdentifierKey, Value(identifier)}}),
                                           URL::fileURL(placeholder + "/Info.plist")));
    platform::Error error;
    auto registry = platform::SQLiteApplicationRegistry::open(image_, &error);
    ASSERT_TRUE(registry) << error.description();
    const Dictionary options{{platform::kRegistryInstallTypeKey, Value(kQSMigratorInstallType)},
                             {platform::kRegistryPackageTypeKey, Value(platform::kRegistryPackageTypePlaceholder)},
                             {platform::kBundleIdentifierKey, Value(identifier)}};
    ASSERT_TRUE(registry->installBundle(URL::fileURL(placeholder, true), options, &error)) << error.description();
  }
  ASSERT_TRUE(makeDirs(container + "/Staging/Payload"));
  fs::rename(bundle, container + "/Staging/Payload/" + fs::path(bundle).filename().string());
  if (pathExists(container + "/VendraMetadata.plist")) {
    fs::rename(container + "/VendraMetadata.plist", container + "/Staging/VendraMetadata.plist");
  }

  ASSERT_EQ(migrate(), kExitSuccess) << logTail();
  EXPECT_NE(readFile(logPath()).find("App " + identifier + " is already installed, so not creating placeholder."),
            std::string::npos);
  expectMigratedAndVerified();
}

TEST_F(Migration, ContainerThatCannotMoveIsKeptAndASecondRunFinishes) {
  createImage({"--apps", "8", "--vpn-only", "1", "--groups", "3", "--seed", "7"});
  const std::vector<std::string> containers = applicationContainers();
  ASSERT_GE(containers.size(), 2u);
  std::string stuck;
  for (const std::string& container : containers) {
    if (pathExists(container + "/Documents")) {
      stuck = container + "/Documents";
      break;
    }
  }
  ASSERT_FALSE(stuck.empty());
  makeImmutable(stuck);

  EXPECT_EQ(migrate(), kExitRunFailed) << logTail();
  const std::string container = fs::path(stuck).parent_path().string();
  EXPECT_TRUE(pathExists(container + "/" + kQSMigrationMarkerFileName));
  EXPECT_TRUE(pathExists(layout().oldInstallMapPath().path()));
  EXPECT_EQ(directoryNamesOf(oldApplications()), std::vector<std::string>{fs::path(container).filename().string()});
  EXPECT_NE(verify(), kExitSuccess);

  ASSERT_TRUE(setImmutable(stuck, false));
  immutable_.clear();
  ASSERT_EQ(migrate(), kExitSuccess) << logTail();
  expectMigratedAndVerified();
}

// Counts the containers whose migration has started, reading only what the
// log gained since the last call.
class MigrationStartCounter {
 public:
  explicit MigrationStartCounter(std::string log) : log_(std::move(log)) {}
  size_t count() {
    std::ifstream in(log_, std::ios::binary);
    in.seekg(static_cast<std::streamoff>(offset_));
    std::string line;
    while (std::getline(in, line)) {
      if (in.eof()) break;  // an unfinished line: read it again next time
      offset_ += line.size() + 1;
      if (line.find(kMarker) != std::string::npos) ++count_;
    }
    return count_;
  }

 private:
  static constexpr char kMarker[] = "QSAppMigrator: Migrating ";
  std::string log_;
  size_t offset_ = 0;
  size_t count_ = 0;
};

TEST_F(Migration, RunKilledAtRandomPointsFinishesWhenRestarted) {
  createImage({"--apps", "60", "--vpn-only", "3", "--groups", "6", "--harbors", "2", "--placeholders", "2",
               "--builtin-older", "2", "--files-per-app", "4", "--bytes-per-file", "2000", "--seed", "23"});
  std::mt19937 random(static_cast<unsigned>(std::chrono::steady_clock::now().time_since_epoch().count()));
  // Each run is killed once a few more containers have started, a random
  // moment later, so that the kills fall anywhere in a container's work.
  std::uniform_int_distribution<size_t> containersBeforeKill(1, 8);
  std::uniform_int_distribution<int> extraDelayUs(0, 40000);
  constexpr int kKills = 6;
  MigrationStartCounter started(logPath());
  int killed = 0;
  for (int attempt = 0; attempt < kKills; ++attempt) {
    const size_t target = started.count() + containersBeforeKill(random);
    Process run(transvaleArguments(), outputPath(), tmpdir_);
    while (run.running() && started.count() < target) std::this_thread::sleep_for(std::chrono::milliseconds(1));
    std::this_thread::sleep_for(std::chrono::microseconds(extraDelayUs(random)));
    if (!run.running()) {
      // The run ended before the kill: it must have succeeded.
      EXPECT_EQ(run.exited(), kExitSuccess) << "after " << killed << " kills; " << logTail();
      break;
    }
    run.kill();
    EXPECT_EQ(run.wait(), -SIGKILL);
    ++killed;
  }
  EXPECT_GE(killed, 2) << "the runs ended before they could be killed";
  RecordProperty("killedRuns", killed);
  std::cerr << "runs killed: " << killed << ", containers started: " << started.count() << "\n";
  // A run killed after an installation but before its container was removed
  // leaves a container that fails once (its bundle is gone) and is removed;
  // the next run then finds nothing left.
  int status = migrate();
  if (status != kExitSuccess) status = migrate();
  ASSERT_EQ(status, kExitSuccess) << logTail();
  expectMigratedAndVerified(true);
}

}  // namespace
}  // namespace qstest
