// End to end: transvale runs the real plug-in and registry on device images
// made by devicegen (checked afterwards by devicegen verify), and on small
// hand-made roots for its exit codes, output and log modes.
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <random>
#include <regex>
#include <thread>

#include <gtest/gtest.h>

#include "AppMigrator/QSAppMigrator.h"
#include "Platform/Foundation/PropertyList.h"
#include "Platform/Registry/SQLiteRegistry.h"
#include "e2e/Programs.h"
#include "support/TestSupport.h"

namespace fs = std::filesystem;
using platform::Dictionary;
using platform::URL;
using platform::Value;

namespace qstest {
namespace {

constexpr int kExitSuccess = 0, kExitRunFailed = 1, kExitPluginUnusable = 2, kExitUsage = 64;
// Paths in a device root.
constexpr char kOldApplications[] = "/private/var/mobile/Applications";
constexpr char kOldInstallMap[] = "/private/var/mobile/Library/Caches/com.vantrel.quill.set.plist";
constexpr char kDefaultLog[] = "/private/var/mobile/Library/Logs/Transvale/transvale.log";
constexpr char kSystemVersion[] = "/System/Library/CoreServices/SystemVersion.plist";

bool pathExists(const std::string& path) {
  std::error_code ec;
  return fs::exists(fs::symlink_status(path, ec));
}

// The entries of `dir`, full paths, sorted.
std::vector<std::string> entriesOf(const std::string& dir) {
  std::vector<std::string> paths;
  std::error_code ec;
  for (const auto& entry : fs::directory_iterator(dir, ec)) paths.push_back(entry.path().string());
  std::sort(paths.begin(), paths.end());
  return paths;
}

class EndToEnd : public testing::Test {
 protected:
  void SetUp() override { ASSERT_TRUE(makeDirs(dir_ / "tmp")); }
  void TearDown() override {
    if (!HasFailure()) return;
    const std::string log = readFile(image_ + kDefaultLog);
    std::cerr << "--- stdout ---\n"
              << out() << "--- stderr ---\n"
              << err() << "--- log (tail) ---\n"
              << log.substr(log.size() > 6000 ? log.size() - 6000 : 0);
  }

  int run(const std::vector<std::string>& argv) { return Process(argv, dir_.path()).wait(); }
  std::string out() const { return readFile(dir_ / "stdout"); }
  std::string err() const { return readFile(dir_ / "stderr"); }
  std::string oldApplications() const { return image_ + kOldApplications; }

  TempDir dir_{"e2e"};
  std::string image_ = dir_ / "image";
};

// --- transvale's exit codes, output and log modes ---------------------------------------------

enum class Layout { Empty, OddEntries, ApplicationsIsAFile, NoRoot };
// Where a text must be found, or must not.
enum Where { InOutput, NotInOutput, InError, InLog, NotInLog };  // InLog: the default log

struct HostCase {
  const char* name;
  Layout layout;
  std::vector<std::string> arguments;  // after --root; "{root}" and "{bin}" are replaced
  int exitCode;
  std::vector<std::pair<Where, std::string>> texts;  // "{root}" and "{bin}" are replaced
};

class Transvale : public EndToEnd {
 protected:
  std::string expand(std::string text) const {
    for (const auto& [token, value] : {std::pair<std::string, std::string>{"{root}", image_}, {"{bin}", kBin}}) {
      for (size_t at; (at = text.find(token)) != std::string::npos;) text.replace(at, token.size(), value);
    }
    return text;
  }
  void makeLayout(Layout layout) {
    fs::remove_all(image_);
    if (layout == Layout::NoRoot) return;
    ASSERT_TRUE(makeDirs(fs::path(image_ + kSystemVersion).parent_path()));
    ASSERT_TRUE(writeFile(image_ + kSystemVersion,
                          "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
                          "<key>BuildVersion</key><string>21A100</string></dict></plist>\n"));
    if (layout == Layout::ApplicationsIsAFile) {
      ASSERT_TRUE(makeDirs(fs::path(oldApplications()).parent_path()));
      ASSERT_TRUE(writeFile(oldApplications(), "not a directory"));
    } else if (layout == Layout::OddEntries) {
      // A container whose bundle is a symbolic link (never touched), a link
      // the file layer ignores, a plain file, and a stray file whose name has
      // a quote, a control character and a byte that is not UTF-8.
      ASSERT_TRUE(makeDirs(oldApplications() + "/A"));
      ASSERT_EQ(symlink("/nowhere", (oldApplications() + "/A/Main.app").c_str()), 0);
      ASSERT_EQ(symlink("/nowhere", (oldApplications() + "/Link").c_str()), 0);
      ASSERT_TRUE(writeFile(oldApplications() + "/WhereDidMyApplicationsGo.txt", "x"));
      ASSERT_TRUE(writeFile(oldApplications() + "/stray \"quoted\"\t\xff\xc3\xa9", "x"));
    }
  }
};

TEST_F(Transvale, ExitCodesOutputAndLogModes) {
  const std::string apps = std::string("{root}") + kOldApplications;
  const std::string strayInJSON = apps + R"(/stray \"quoted\"\t\udcff)"
                                         "\xc3\xa9";
  using enum Layout;
  // clang-format off
  const HostCase cases[] = {
      {"unknown option", Empty, {"--bogus"}, kExitUsage, {{InError, "--bogus"}}},
      {"level out of range", Empty, {"--system-log-level", "8"}, kExitUsage, {}},
      {"root that is not there", NoRoot, {}, kExitUsage, {}},
      {"log that cannot be made", Empty, {"--log", "{root}" + std::string(kSystemVersion) + "/x.log"}, kExitUsage,
       {{InError, "transvale: cannot create the log directory"}}},
      {"help", Empty, {"--help"}, kExitSuccess, {{InOutput, "--system-log-level"}}},
      {"missing plug-in", Empty, {"--plugin", "{root}/absent.so"}, kExitPluginUnusable,
       {{InError, "transvale: cannot load the plug-in {root}/absent.so"}}},
      {"library without entry point", Empty, {"--plugin", "{bin}/../lib/libQSPlatform.so"}, kExitPluginUnusable,
       {{InError, "has no entry point QSCreateDataClassMigrator"}}},
      {"no migrator", ApplicationsIsAFile, {}, kExitPluginUnusable,
       {{InError, "could not create its migrator"}, {InLog, "QSAppMigrator: Failed to get items at file://" + apps}}},
      {"nothing to migrate", Empty, {"--progress", "never"}, kExitSuccess,
       {{InOutput, "Data class: QSAppMigrator\nEstimated duration: 20\n"}, {InOutput, "transvale: migration succeeded"},
        {NotInOutput, "progress"}, {InLog, "QSAppMigrator: Recorded current system version as 21A100"},
        {InLog, "host <5> [Transvaler] -[QSAppMigrator performMigration] (QSAppMigrator.cpp:"}}},
      {"progress bar", Empty, {"--progress", "always"}, kExitSuccess, {{InOutput, "\r["}, {InOutput, "0/0 entries"}}},
      {"entries left, progress lines, log on stderr", OddEntries, {"--log", "-"}, kExitRunFailed,
       {{InOutput, "Estimated duration: 26.75\n"}, {InOutput, "progress: 100% (3/3 entries)\n"},
        {InOutput, "transvale: migration failed, 3 of 3 entries finished"},
        {InError, "QSAppMigrator: Skipping container with app symlink at " + apps + "/A/Main.app"},
        {InError, "system <5> -[QSFileManager urlsForItemsInDirectoryAtURL:ignoringSymlinks:error:]: "
                  "Ignoring symlink at " + apps + "/Link"},
        {InError, "QSAppMigrator: Returning migration failed."}}},
      {"system log level", OddEntries, {"--system-log-level", "3"}, kExitRunFailed,
       {{InLog, "host <3> "}, {NotInLog, "system <5> "}}},
      {"JSON lines", OddEntries, {"--log-format", "jsonl"}, kExitRunFailed,
       {{InLog, R"("sink":"system","level":5,"category":null,"function":"-[QSFileManager )"},
        {InLog, R"("sink":"host","level":3,"category":"Transvaler",)"
                R"("function":"-[QSAppMigrator _introspectContainer:orderResultEarly:]","file":")"},
        {InLog, R"("message":"QSAppMigrator: Found regular file at )" + strayInJSON + R"( ; removing"})"}}},
  };
  // clang-format on
  // A JSON string, and a whole line of the jsonl format.
  const std::string s = R"x("(?:[^"\\\x00-\x1f]|\\["\\/bfnrt]|\\u[0-9a-f]{4})*")x";
  const std::regex jsonLine(R"x(\{"time":"\d{4}-\d\d-\d\dT\d\d:\d\d:\d\d\.\d{3}Z","sink":"(host|system)",)x"
                            R"x("level":\d,"category":(null|)x" +
                            s + R"x(),"function":)x" + s + R"x(,"file":(null|)x" + s +
                            R"x(),"line":(null|\d+),"message":)x" + s + "\\}");
  for (const HostCase& c : cases) {
    SCOPED_TRACE(c.name);
    makeLayout(c.layout);
    std::vector<std::string> argv{"transvale", "--root", image_};
    for (const std::string& argument : c.arguments) argv.push_back(expand(argument));
    EXPECT_EQ(run(argv), c.exitCode);
    const std::string output = out(), error = err(), log = readFile(image_ + kDefaultLog);
    for (const auto& [where, text] : c.texts) {
      const std::string& in = where <= NotInOutput ? output : where == InError ? error : log;
      EXPECT_EQ(in.find(expand(text)) != std::string::npos, where != NotInOutput && where != NotInLog) << text;
    }
    EXPECT_TRUE(c.layout != OddEntries || fs::is_symlink(oldApplications() + "/A/Main.app"));
    if (c.arguments.size() == 2 && c.arguments[1] == "jsonl") {
      std::istringstream lines(log);
      for (std::string line; std::getline(lines, line);) EXPECT_TRUE(std::regex_match(line, jsonLine)) << line;
    }
  }
}

// --- Migrations of device images -------------------------------------------------------------

class Migration : public EndToEnd {
 protected:
  void createImage(const std::vector<std::string>& options) {
    std::vector<std::string> argv{"devicegen", "create", "--root", image_};
    argv.insert(argv.end(), options.begin(), options.end());
    ASSERT_EQ(run(argv), kExitSuccess);
    image_ = fs::canonical(image_).string();
  }
  std::vector<std::string> transvale() const { return {"transvale", "--root", image_, "--progress", "never"}; }
  int migrate() { return run(transvale()); }
  int verify() { return run({"devicegen", "verify", "--root", image_}); }
  static std::string bundleIn(const std::string& container) {
    for (const std::string& path : entriesOf(container)) {
      if (fs::path(path).extension() == ".app" && !fs::is_symlink(path)) return path;
    }
    return "";
  }
  // devicegen verify checks that every item arrived and nothing of the old
  // layout is left. Placeholders are staged under the temporary directory and
  // never left there, except by a run killed while it installed one.
  void expectMigratedAndVerified(bool killedRuns = false) {
    EXPECT_EQ(verify(), kExitSuccess) << out();
    EXPECT_TRUE(killedRuns || entriesOf(dir_ / "tmp/com.vantrel.quill.set.migrator").empty());
  }

  // In what the log gained since the last call (complete lines only), counts
  // the containers whose migration started [0] and the installations begun [1].
  const std::array<size_t, 2>& logProgress() {
    std::ifstream in(image_ + kDefaultLog, std::ios::binary);
    in.seekg(static_cast<std::streamoff>(logRead_));
    std::string gained{std::istreambuf_iterator<char>(in), {}};
    gained.resize(gained.rfind('\n') + 1);
    for (size_t k = 0; k < seen_.size(); ++k) {
      for (size_t at = 0; (at = gained.find(kProgressMarks[k], at)) != std::string::npos; ++at) ++seen_[k];
    }
    logRead_ += gained.size();
    return seen_;
  }
  static constexpr const char* kProgressMarks[] = {"QSAppMigrator: Migrating ",
                                                   "QSAppMigrator: Staging and installing app "};
  size_t logRead_ = 0;
  std::array<size_t, 2> seen_{};
};

TEST_F(Migration, ImageOfEveryShapeMigratesAndVerifies) {
  // Groups cycle through 3, 1 and 2 members, so group 1 is shared by three
  // applications; some applications have a newer built-in copy (the
  // registry refuses them as already installed) and some old bundles are
  // placeholders.
  createImage({"--apps", "24", "--vpn-only", "3", "--groups", "6", "--harbors", "3", "--placeholders", "2",
               "--builtin-older", "2", "--files-per-app", "5", "--bytes-per-file", "1500", "--seed", "11"});
  ASSERT_EQ(migrate(), kExitSuccess);
  expectMigratedAndVerified();
  // A second run finds nothing to do and succeeds.
  EXPECT_EQ(migrate(), kExitSuccess);
  EXPECT_EQ(verify(), kExitSuccess) << out();
}

TEST_F(Migration, ContainerInterruptedAfterStagingIsResumedFromItsMarker) {
  createImage({"--apps", "6", "--groups", "2", "--seed", "5"});
  std::string container, bundle;
  for (const std::string& path : entriesOf(oldApplications())) {
    if (!(bundle = bundleIn(container = path)).empty()) break;
  }
  ASSERT_FALSE(bundle.empty());
  const auto info = platform::plist::readDictionary(URL::fileURL(bundle + "/Info.plist"));
  const std::string* identifier = info ? QSStringForKey(*info, platform::kBundleIdentifierKey) : nullptr;
  ASSERT_TRUE(identifier);

  // What an attempt killed during staging leaves: the marker, the
  // placeholder installed, the bundle and store metadata in the package.
  const Dictionary marker{{kQSContainerPathKey, Value(container)},
                          {kQSBundlePathKey, Value(bundle)},
                          {kQSBundleIdentifierKey, Value(*identifier)},
                          {kQSContainerTypeKey, Value(kQSContainerTypeApp)}};
  ASSERT_TRUE(platform::plist::writeFile(Value(marker), URL::fileURL(container + "/" + kQSMigrationMarkerFileName)));
  const std::string placeholder = dir_ / "tmp/placeholder/" + *identifier + ".app";
  ASSERT_TRUE(makeDirs(placeholder));
  ASSERT_TRUE(platform::plist::writeFile(Value(Dictionary{{platform::kBundleIdentifierKey, Value(*identifier)}}),
                                         URL::fileURL(placeholder + "/Info.plist")));
  platform::Error error;
  auto registry = platform::SQLiteApplicationRegistry::open(image_, &error);
  ASSERT_TRUE(registry) << error.description();
  const Dictionary options{{platform::kRegistryInstallTypeKey, Value(kQSMigratorInstallType)},
                           {platform::kRegistryPackageTypeKey, Value(platform::kRegistryPackageTypePlaceholder)},
                           {platform::kBundleIdentifierKey, Value(*identifier)}};
  ASSERT_TRUE(registry->installBundle(URL::fileURL(placeholder, true), options, &error)) << error.description();
  registry.reset();
  ASSERT_TRUE(makeDirs(container + "/Staging/Payload"));
  fs::rename(bundle, container + "/Staging/Payload/" + fs::path(bundle).filename().string());
  if (pathExists(container + "/VendraMetadata.plist")) {
    fs::rename(container + "/VendraMetadata.plist", container + "/Staging/VendraMetadata.plist");
  }

  ASSERT_EQ(migrate(), kExitSuccess);
  EXPECT_NE(
      readFile(image_ + kDefaultLog).find("App " + *identifier + " is already installed, so not creating placeholder."),
      std::string::npos);
  expectMigratedAndVerified();
}

TEST_F(Migration, ContainerThatCannotMoveIsKeptAndASecondRunFinishes) {
  createImage({"--apps", "8", "--vpn-only", "1", "--groups", "3", "--seed", "7"});
  std::string container;
  for (const std::string& path : entriesOf(oldApplications())) {
    if (fs::is_directory(path + "/Documents")) {
      container = path;
      break;
    }
  }
  ASSERT_FALSE(container.empty());
  ASSERT_TRUE(setImmutable(container + "/Documents", true));  // the flags are cleared by TempDir

  EXPECT_EQ(migrate(), kExitRunFailed);
  EXPECT_TRUE(pathExists(container + "/" + kQSMigrationMarkerFileName));
  EXPECT_TRUE(pathExists(image_ + kOldInstallMap));
  EXPECT_EQ(entriesOf(oldApplications()), std::vector<std::string>{container});
  EXPECT_NE(verify(), kExitSuccess);

  ASSERT_TRUE(setImmutable(container + "/Documents", false));
  ASSERT_EQ(migrate(), kExitSuccess);
  expectMigratedAndVerified();
}

TEST_F(Migration, RunKilledAtRandomPointsFinishesWhenRestarted) {
  createImage({"--apps", "60", "--vpn-only", "3", "--groups", "6", "--harbors", "2", "--placeholders", "2",
               "--builtin-older", "2", "--files-per-app", "4", "--bytes-per-file", "2000", "--seed", "23"});
  // Each run is killed a few containers further on: on even attempts a
  // moment later, anywhere in a container's work; on odd ones just after an
  // installation began, so that the registry's recovery is exercised too.
  std::mt19937 random(23);
  std::uniform_int_distribution<size_t> stepsBeforeKill(1, 8);
  std::uniform_int_distribution<int> containerDelayUs(0, 40000), installDelayUs(0, 6000);
  constexpr int kKills = 8;
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::minutes(3);
  int killed = 0;
  for (int attempt = 0; attempt < kKills; ++attempt) {
    const int mark = attempt % 2;
    const size_t target = logProgress()[mark] + stepsBeforeKill(random);
    Process run(transvale(), dir_.path());
    while (run.running() && logProgress()[mark] < target) {
      if (std::chrono::steady_clock::now() > deadline) run.kill();
      std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    ASSERT_LT(std::chrono::steady_clock::now(), deadline) << "a run stopped making progress";
    std::this_thread::sleep_for(std::chrono::microseconds(mark ? installDelayUs(random) : containerDelayUs(random)));
    if (!run.running()) {
      // The run ended before the kill: it must have succeeded.
      EXPECT_EQ(run.exited(), kExitSuccess) << "after " << killed << " kills";
      break;
    }
    run.kill();
    EXPECT_EQ(run.wait(), -SIGKILL);
    ++killed;
  }
  EXPECT_GE(killed, 2) << "the runs ended before they could be killed";
  // A run killed after an installation but before its container was removed
  // leaves a container that fails once (its bundle is gone) and is removed;
  // the next run then finds nothing left.
  int status = migrate();
  if (status != kExitSuccess) status = migrate();
  ASSERT_EQ(status, kExitSuccess);
  expectMigratedAndVerified(true);
}

}  // namespace
}  // namespace qstest
