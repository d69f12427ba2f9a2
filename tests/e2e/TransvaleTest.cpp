// End to end: transvale runs the real plug-in and registry on device images
// made by devicegen (checked afterwards by devicegen verify), and on small
// hand-made roots for its exit codes, output and log modes.
#include <signal.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <map>
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
              << log.substr(log.size() > 6000 ? log.size() - 6000 : 0) << "--- failure lines of the log ---\n";
    std::istringstream lines(log);
    for (std::string line; std::getline(lines, line);) {
      if (line.find(" <3> ") != std::string::npos) std::cerr << line << "\n";
    }
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
enum Where { InOutput, NotInOutput, InError, NotInError, InLog, NotInLog };  // InLog: the default log

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
       {{InOutput, "Data class: QSAppMigrator\nEstimated duration: 20 s\n"},
        {InOutput, "transvale: no old application layout under {root}"}, {InOutput, "transvale: migration succeeded"},
        {NotInOutput, "progress"}, {InLog, "QSAppMigrator: Recorded current system version as 21A100"},
        {InLog, "host <5> [Transvaler] -[QSAppMigrator performMigration] (QSAppMigrator.cpp:"}}},
      {"progress bar", Empty, {"--progress", "always"}, kExitSuccess,
       {{InError, "\r["}, {NotInError, "0/0 entries"}, {NotInOutput, "\r["}}},
      {"progress lines of nothing", Empty, {"--progress", "auto"}, kExitSuccess,
       {{InError, "progress: nothing to migrate\n"}, {NotInError, "50%"}}},
      {"plan of nothing", Empty, {"--plan"}, kExitSuccess,
       {{InOutput, "No old application layout: {root}" + std::string(kOldApplications) + " is missing or empty"}}},
      {"plan of odd entries", OddEntries, {"--plan"}, kExitSuccess,
       {{InOutput, "(unknown): kept\n      container: " + apps + "/A\n"
                   "      kept because its application bundle is a symbolic link\n"},
        {InOutput, apps + "/WhereDidMyApplicationsGo.txt: the previous release's note file, 1 files, 1 bytes\n"},
        {InOutput, "stray file in the old applications directory, 1 files, 1 bytes"}}},
      {"JSON plan", OddEntries, {"--plan", "--json"}, kExitSuccess,
       {{InOutput, "\"action\": \"kept\""}, {InOutput, "\"reason\": \"its application bundle is a symbolic link\""}}},
      {"JSON without a plan", Empty, {"--json"}, kExitUsage, {{InError, "--json requires --plan"}}},
      {"entries left, progress lines, log on stderr", OddEntries, {"--log", "-"}, kExitRunFailed,
       {{InOutput, "Estimated duration: 26.75 s\n"}, {InError, "progress: 100% (3/3 entries)\n"},
        {InOutput, "transvale: migration failed: 0 migrated, 1 kept, 0 failed, 2 removed of 3 entries"},
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
      const std::string& in = where <= NotInOutput ? output : where <= NotInError ? error : log;
      EXPECT_EQ(in.find(expand(text)) != std::string::npos, where % 2 == 0) << text;
    }
    // The bar never runs past the terminal (80 columns when standard error is
    // not one).
    for (size_t at = 0; (at = error.find('\r', at)) != std::string::npos; ++at) {
      EXPECT_LT(error.find("\033[K", at) - at - 1, 80u) << error.substr(at, 120);
    }
    if (!c.arguments.empty() && c.arguments[0] == "--plan") {
      EXPECT_FALSE(pathExists(image_ + kDefaultLog)) << "a plan writes no log";
    }
    if (c.layout == OddEntries) {
      EXPECT_TRUE(fs::is_symlink(oldApplications() + "/A/Main.app")) << "the bundle link of container A was replaced";
    }
    if (c.arguments.size() == 2 && c.arguments[1] == "jsonl") {
      std::istringstream lines(log);
      for (std::string line; std::getline(lines, line);) EXPECT_TRUE(std::regex_match(line, jsonLine)) << line;
    }
  }
}

// A log in a directory that exists leaves that directory's mode alone (a log
// in /tmp must not take its sticky, world-writable mode away); directories
// made for a log get 0755.
TEST_F(Transvale, LogDirectoriesGetTheirModeOnlyWhenMadeForTheLog) {
  makeLayout(Layout::Empty);
  const std::string shared = dir_ / "shared";
  ASSERT_TRUE(makeDirs(shared));
  ASSERT_EQ(chmod(shared.c_str(), 01777), 0);
  for (const char* log : {"/x.log", "/made/x.log"}) {
    ASSERT_EQ(run({"transvale", "--root", image_, "--progress", "never", "--log", shared + log}), kExitSuccess);
  }
  struct stat st {};
  ASSERT_EQ(stat(shared.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 01777u);
  ASSERT_EQ(stat((shared + "/made").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0755u);
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
    if (!killedRuns) {
      EXPECT_EQ(entriesOf(dir_ / "tmp/com.vantrel.quill.set.migrator"), std::vector<std::string>{})
          << "placeholders left where they are staged";
    }
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

// --- Plan, report and room on the destination ----------------------------------------------

// Every item below `root`, by relative path: type, mode, size, modification
// and change times, and the bytes of files and link texts. Directory entries
// show as their paths.
std::map<std::string, std::string> treeState(const std::string& root) {
  std::map<std::string, std::string> state;
  for (auto it = fs::recursive_directory_iterator(root); it != fs::recursive_directory_iterator(); ++it) {
    struct stat st {};
    lstat(it->path().c_str(), &st);
    std::string item = std::to_string(st.st_mode) + " " + std::to_string(st.st_size) + " " +
                       std::to_string(st.st_mtim.tv_sec) + "." + std::to_string(st.st_mtim.tv_nsec) + " " +
                       std::to_string(st.st_ctim.tv_sec) + "." + std::to_string(st.st_ctim.tv_nsec);
    if (S_ISREG(st.st_mode)) item += " " + readFile(it->path());
    if (S_ISLNK(st.st_mode)) item += " " + fs::read_symlink(it->path()).string();
    state[it->path().string().substr(root.size())] = item;
  }
  return state;
}

// The type and mode, size and times of an item of treeState, without its bytes.
std::string metadataOf(const std::string& item) {
  size_t end = 0;
  for (int field = 0; field < 4 && end != std::string::npos; ++field) end = item.find(' ', end + (field > 0));
  return item.substr(0, end);
}

// The number after `"key": ` in JSON text (first occurrence after `from`).
long long jsonNumber(const std::string& json, const std::string& key, const std::string& from = "") {
  const size_t start = from.empty() ? 0 : json.find(from);
  const size_t at = json.find("\"" + key + "\": ", start == std::string::npos ? 0 : start);
  return at == std::string::npos ? -1 : std::atoll(json.c_str() + at + key.size() + 4);
}

long long manifestTotal(const std::string& image, const char* key) {
  const auto manifest = platform::plist::readDictionary(URL::fileURL(image + "/devicegen-manifest.plist"));
  const Value* totals = manifest ? QSValueForKey(*manifest, "Totals") : nullptr;
  const Value* value = totals && totals->isDictionary() ? QSValueForKey(*totals->asDictionary(), key) : nullptr;
  return value ? value->int64Value(-1) : -1;
}

TEST_F(Migration, PlanChangesNothingAndForetellsWhatTheReportThenConfirms) {
  createImage({"--apps", "10", "--vpn-only", "2", "--groups", "3", "--harbors", "2", "--placeholders", "1",
               "--builtin-older", "2", "--files-per-app", "4", "--bytes-per-file", "1500", "--seed", "9"});
  // What the run discards: a stray file, and a container without a bundle.
  ASSERT_TRUE(writeFile(oldApplications() + "/stray.bin", std::string(700, 'x')));
  ASSERT_TRUE(makeDirs(oldApplications() + "/NOBUNDLE/Documents"));
  ASSERT_TRUE(writeFile(oldApplications() + "/NOBUNDLE/Documents/notes.txt", std::string(300, 'y')));
  // An earlier attempt on one container: its marker, and its placeholder in
  // the registry, whose database is open (write-ahead log present) for the
  // first plan and closed for the second.
  // An ordinary application: neither a placeholder nor one with a built-in
  // copy, and without a VPN plug-in (a marker without it would strand the
  // plug-in's container, as the plan rightly says).
  const auto manifest = platform::plist::readDictionary(URL::fileURL(image_ + "/devicegen-manifest.plist"));
  ASSERT_TRUE(manifest);
  std::string container, bundle, identifier;
  for (const Value& entry : *QSValueForKey(*manifest, "Containers")->asArray()) {
    const Dictionary& c = *entry.asDictionary();
    if (*QSStringForKey(c, "Kind") != "App" || c.at("Placeholder").boolValue(true) ||
        c.at("BuiltInRefusal").boolValue(true) || c.count("VPNPluginIdentifier")) {
      continue;
    }
    container = image_ + "/" + *QSStringForKey(c, "Container");
    bundle = container + "/" + *QSStringForKey(c, "Bundle");
    identifier = *QSStringForKey(c, "Identifier");
    break;
  }
  ASSERT_FALSE(identifier.empty());
  ASSERT_TRUE(platform::plist::writeFile(
      Value(Dictionary{{kQSContainerPathKey, Value(container)}, {kQSBundlePathKey, Value(bundle)},
                       {kQSBundleIdentifierKey, Value(identifier)}, {kQSContainerTypeKey, Value(kQSContainerTypeApp)}}),
      URL::fileURL(container + "/" + kQSMigrationMarkerFileName)));
  const std::string placeholder = dir_ / "tmp/placeholder/" + identifier + ".app";
  ASSERT_TRUE(makeDirs(placeholder));
  ASSERT_TRUE(platform::plist::writeFile(Value(Dictionary{{platform::kBundleIdentifierKey, Value(identifier)}}),
                                         URL::fileURL(placeholder + "/Info.plist")));
  platform::Error error;
  auto registry = platform::SQLiteApplicationRegistry::open(image_, &error);
  ASSERT_TRUE(registry) << error.description();
  ASSERT_TRUE(registry->installBundle(
      URL::fileURL(placeholder, true),
      {{platform::kRegistryInstallTypeKey, Value(kQSMigratorInstallType)},
       {platform::kRegistryPackageTypeKey, Value(platform::kRegistryPackageTypePlaceholder)},
       {platform::kBundleIdentifierKey, Value(identifier)}},
      &error));
  const std::string database = image_ + "/private/var/db/appregistry/registry.sqlite";

  std::string plan;
  for (const bool databaseOpen : {true, false}) {
    SCOPED_TRACE(databaseOpen ? "registry open" : "registry closed");
    if (!databaseOpen) registry.reset();
    EXPECT_EQ(pathExists(database + "-wal"), databaseOpen);
    const auto before = treeState(image_);
    ASSERT_EQ(run({"transvale", "--root", image_, "--plan"}), kExitSuccess) << err();
    EXPECT_NE(out().find("com.example."), std::string::npos);
    ASSERT_EQ(run({"transvale", "--root", image_, "--plan", "--json"}), kExitSuccess) << err();
    plan = out();
    const auto after = treeState(image_);
    for (const auto& [path, state] : before) {
      const auto found = after.find(path);
      if (found == after.end()) {
        ADD_FAILURE() << "the plan removed " << path;
      } else if (found->second != state) {
        const std::string was = metadataOf(state), is = metadataOf(found->second);
        ADD_FAILURE() << "the plan changed " << path << ": " << (was == is ? "its bytes" : was + " -> " + is);
      }
    }
    for (const auto& [path, state] : after) EXPECT_TRUE(before.count(path)) << "the plan made " << path;
  }

  // What the image holds, as the plan tells it: 10 applications (1 placeholder,
  // 2 with a built-in copy, the one with a marker already installed) and 2
  // VPN-only containers; every byte of the manifest (data and groups) to
  // move; the three discards with their sizes; the harbors.
  const std::pair<const char*, long long> counts[] = {
      {"placeholder then install", 6}, {"placeholder only (the old bundle is a placeholder)", 1},
      {"already installed", 1}, {"refused: an equal or newer built-in copy exists", 2},
      {"VPN plug-in only", 2}, {"kept", 0}, {"discarded", 3}};
  for (const auto& [action, count] : counts) EXPECT_EQ(jsonNumber(plan, action, "\"totals\""), count) << action;
  EXPECT_EQ(jsonNumber(plan, "bytes", "\"toMove\""), manifestTotal(image_, "Bytes"));
  EXPECT_EQ(jsonNumber(plan, "files", "\"toMove\""), manifestTotal(image_, "Files"));
  EXPECT_EQ(jsonNumber(plan, "bytes", "/stray.bin\""), 700);
  EXPECT_EQ(jsonNumber(plan, "bytes", "/NOBUNDLE\""), 300);
  // The bundle-less container's data goes to the recovery directory first.
  const size_t recovered = plan.find("\"recoveredItems\"");
  ASSERT_NE(recovered, std::string::npos) << plan;
  EXPECT_NE(plan.substr(recovered, plan.find(']', recovered) - recovered).find("\"Documents\""), std::string::npos);
  EXPECT_NE(plan.find("\"resumedFromMarker\": true"), std::string::npos);
  EXPECT_NE(plan.find("\"enough\": true"), std::string::npos);
  EXPECT_EQ(plan.find("\"problem\": \""), std::string::npos) << "harbors the registry takes have no problem";

  const std::string report = dir_ / "report.json";
  ASSERT_EQ(run({"transvale", "--root", image_, "--report", report}), kExitSuccess) << err();
  // Progress lines (standard error is no terminal): entries, then bytes of
  // the data to move, all of them at the end.
  char all[32];
  std::snprintf(all, sizeof all, "%.1f kB", static_cast<double>(manifestTotal(image_, "Bytes")) / 1000);
  EXPECT_NE(err().find("progress: 100% (15/15 entries, " + std::string(all) + " of " + all + ")\n"), std::string::npos) << err();
  const std::string json = readFile(report);
  const std::pair<const char*, long long> outcomes[] = {
      {"migrated", 12}, {"kept", 0}, {"failed", 0}, {"removed", 3}};
  for (const auto& [key, count] : outcomes) EXPECT_EQ(jsonNumber(json, key, "\"totals\""), count) << key;
  EXPECT_EQ(jsonNumber(json, "exitStatus"), 0);
  EXPECT_EQ(jsonNumber(json, "bytesMoved", "\"totals\""), manifestTotal(image_, "Bytes"));
  EXPECT_EQ(jsonNumber(json, "filesMoved", "\"totals\""), manifestTotal(image_, "Files"));
  EXPECT_NE(json.find("\"reason\": \"no application or VPN plug-in bundle\""), std::string::npos);
  EXPECT_NE(out().find("transvale: migration succeeded: 12 migrated, 0 kept, 0 failed, 3 removed"),
            std::string::npos) << out();
  expectMigratedAndVerified();
}

// A tmpfs mounted over the new containers, too small for one application's data.
class SmallDestination {
 public:
  SmallDestination(const std::string& path, const char* size) : path_(path) {
    EXPECT_TRUE(makeDirs(path));
    mounted_ = mount("tmpfs", path.c_str(), "tmpfs", 0, (std::string("size=") + size).c_str()) == 0;
  }
  ~SmallDestination() {
    if (mounted_) {
      EXPECT_EQ(umount2(path_.c_str(), MNT_DETACH), 0);
    }
  }
  bool mounted() const { return mounted_; }

 private:
  std::string path_;
  bool mounted_ = false;
};

TEST_F(Migration, DataThatDoesNotFitOnAnotherFileSystemKeepsItsContainer) {
  createImage({"--apps", "3", "--groups", "1", "--files-per-app", "2", "--bytes-per-file", "1000", "--seed", "4"});
  std::string big;
  for (const std::string& path : entriesOf(oldApplications())) {
    if (fs::is_directory(path + "/Documents")) big = path;
  }
  ASSERT_FALSE(big.empty());
  constexpr size_t kBigFile = 6u << 20;
  ASSERT_TRUE(writeFile(big + "/Documents/big.bin", std::string(kBigFile, 'z')));
  SmallDestination destination(image_ + "/private/var/mobile/Containers", "4m");
  if (!destination.mounted()) GTEST_SKIP() << "cannot mount a tmpfs here";

  ASSERT_EQ(run({"transvale", "--root", image_, "--plan"}), kExitSuccess) << err();
  EXPECT_NE(out().find("another file system: copied, then removed"), std::string::npos) << out();
  EXPECT_NE(out().find(": NOT ENOUGH"), std::string::npos) << out();

  const std::string report = dir_ / "report.json";
  EXPECT_EQ(run({"transvale", "--root", image_, "--progress", "never", "--report", report}), kExitRunFailed);
  const std::string log = readFile(image_ + kDefaultLog);
  EXPECT_NE(log.find("QSAppMigrator: Not enough room at " + image_ + "/private/var/mobile/Containers/Data/Application/"),
            std::string::npos);
  EXPECT_NE(log.find("bytes needed (with margin), "), std::string::npos);
  // The container stays whole; no partial copy was started; the others moved.
  EXPECT_EQ(entriesOf(oldApplications()), std::vector<std::string>{big});
  EXPECT_EQ(fs::file_size(big + "/Documents/big.bin"), kBigFile);
  for (auto it = fs::recursive_directory_iterator(image_ + "/private/var/mobile/Containers");
       it != fs::recursive_directory_iterator(); ++it) {
    EXPECT_NE(it->path().filename(), "big.bin") << it->path();
  }
  const std::string json = readFile(report);
  EXPECT_EQ(jsonNumber(json, "kept", "\"totals\""), 1);
  EXPECT_EQ(jsonNumber(json, "migrated", "\"totals\""), 2);
  EXPECT_NE(json.find("\"reason\": \"QSAppMigrator: Not enough room at "), std::string::npos) << json;
}

}  // namespace
}  // namespace qstest
