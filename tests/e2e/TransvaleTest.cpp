// transvale, the host program, run for real on small device trees.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <map>
#include <optional>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "support/TestSupport.h"

namespace {

namespace fs = std::filesystem;

struct ProgramResult {
  int exitCode = -1;
  std::string out;
  std::string err;
};

std::string buildDirectory() {
  const char* dir = std::getenv("QS_BUILD_DIR");
  return dir ? dir : "";
}

std::string transvalePath() { return buildDirectory() + "/bin/transvale"; }

// Runs transvale with `arguments`, standard output and error captured in
// files under `scratch`; QS_SYSTEM_ROOT is cleared so that only --root counts.
ProgramResult runTransvale(const std::vector<std::string>& arguments, const std::string& scratch) {
  const std::string outPath = scratch + "/stdout", errPath = scratch + "/stderr";
  const pid_t pid = fork();
  if (pid == 0) {
    const int out = open(outPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    const int err = open(errPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    if (out < 0 || err < 0) _exit(126);
    dup2(out, STDOUT_FILENO);
    dup2(err, STDERR_FILENO);
    unsetenv("QS_SYSTEM_ROOT");
    std::vector<char*> argv;
    const std::string program = transvalePath();
    argv.push_back(const_cast<char*>(program.c_str()));
    for (const std::string& argument : arguments) argv.push_back(const_cast<char*>(argument.c_str()));
    argv.push_back(nullptr);
    execv(program.c_str(), argv.data());
    _exit(127);
  }
  ProgramResult result;
  int status = 0;
  if (pid > 0 && waitpid(pid, &status, 0) == pid && WIFEXITED(status)) result.exitCode = WEXITSTATUS(status);
  result.out = qstest::readFile(outPath);
  result.err = qstest::readFile(errPath);
  return result;
}

// --- A small reader of the flat JSON objects of the log ---------------------------------

struct JSONValue {
  enum class Kind { String, Number, Null } kind = Kind::Null;
  std::string text;  // strings decoded to bytes (\udcXX gives the byte XX)
  long number = 0;
};
using JSONObject = std::map<std::string, JSONValue>;

void appendUTF8(std::string& out, unsigned codePoint) {
  if (codePoint < 0x80) {
    out += static_cast<char>(codePoint);
  } else if (codePoint < 0x800) {
    out += static_cast<char>(0xC0 | (codePoint >> 6));
    out += static_cast<char>(0x80 | (codePoint & 0x3F));
  } else if (codePoint < 0x10000) {
    out += static_cast<char>(0xE0 | (codePoint >> 12));
    out += static_cast<char>(0x80 | ((codePoint >> 6) & 0x3F));
    out += static_cast<char>(0x80 | (codePoint & 0x3F));
  } else {
    out += static_cast<char>(0xF0 | (codePoint >> 18));
    out += static_cast<char>(0x80 | ((codePoint >> 12) & 0x3F));
    out += static_cast<char>(0x80 | ((codePoint >> 6) & 0x3F));
    out += static_cast<char>(0x80 | (codePoint & 0x3F));
  }
}

std::optional<std::string> parseString(const std::string& s, size_t& i) {
  if (i >= s.size() || s[i] != '"') return std::nullopt;
  std::string out;
  for (++i; i < s.size(); ++i) {
    const unsigned char c = static_cast<unsigned char>(s[i]);
    if (c == '"') {
      ++i;
      return out;
    }
    if (c < 0x20) return std::nullopt;  // raw control characters are not allowed
    if (c != '\\') {
      out += static_cast<char>(c);
      continue;
    }
    if (++i >= s.size()) return std::nullopt;
    switch (s[i]) {
      case '"': out += '"'; break;
      case '\\': out += '\\'; break;
      case '/': out += '/'; break;
      case 'n': out += '\n'; break;
      case 'r': out += '\r'; break;
      case 't': out += '\t'; break;
      case 'b': out += '\b'; break;
      case 'f': out += '\f'; break;
      case 'u': {
        if (i + 4 >= s.size()) return std::nullopt;
        const unsigned unit = std::stoul(s.substr(i + 1, 4), nullptr, 16);
        i += 4;
        if (unit >= 0xDC80 && unit <= 0xDCFF) {
          out += static_cast<char>(unit & 0xFF);
        } else {
          appendUTF8(out, unit);
        }
        break;
      }
      default:
        return std::nullopt;
    }
  }
  return std::nullopt;
}

std::optional<JSONObject> parseFlatObject(const std::string& s) {
  JSONObject object;
  size_t i = 0;
  if (s.empty() || s[i++] != '{') return std::nullopt;
  while (i < s.size()) {
    auto key = parseString(s, i);
    if (!key || i >= s.size() || s[i++] != ':') return std::nullopt;
    JSONValue value;
    if (s[i] == '"') {
      auto text = parseString(s, i);
      if (!text) return std::nullopt;
      value.kind = JSONValue::Kind::String;
      value.text = *text;
    } else if (s.compare(i, 4, "null") == 0) {
      i += 4;
    } else {
      size_t used = 0;
      value.kind = JSONValue::Kind::Number;
      value.number = std::stol(s.substr(i), &used);
      if (used == 0) return std::nullopt;
      i += used;
    }
    object[*key] = value;
    if (i < s.size() && s[i] == ',') {
      ++i;
      continue;
    }
    if (i < s.size() && s[i] == '}' && i + 1 == s.size()) return object;
    return std::nullopt;
  }
  return std::nullopt;
}

std::vector<std::string> lines(const std::string& text) {
  std::vector<std::string> out;
  std::istringstream in(text);
  for (std::string line; std::getline(in, line);) out.push_back(line);
  return out;
}

// --- Fixture -------------------------------------------------------------------------------

class Transvale : public testing::Test {
 protected:
  void SetUp() override {
    ASSERT_FALSE(buildDirectory().empty()) << "QS_BUILD_DIR is not set";
    ASSERT_TRUE(fs::exists(transvalePath())) << transvalePath();
    root_ = dir_ / "root";
    scratch_ = dir_ / "scratch";
    ASSERT_TRUE(qstest::makeDirs(root_));
    ASSERT_TRUE(qstest::makeDirs(scratch_));
    ASSERT_TRUE(qstest::makeDirs(root_ + "/System/Library/CoreServices"));
    ASSERT_TRUE(qstest::writeFile(root_ + "/System/Library/CoreServices/SystemVersion.plist", kSystemVersion));
  }

  std::string oldApplications() const { return root_ + "/private/var/mobile/Applications"; }
  std::string defaultLog() const { return root_ + "/private/var/mobile/Library/Logs/Transvale/transvale.log"; }

  ProgramResult run(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), {"--root", root_});
    return runTransvale(arguments, scratch_);
  }

  static constexpr char kSystemVersion[] =
      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
      "<key>BuildVersion</key><string>21A100</string><key>ProductVersion</key><string>21.0</string>"
      "</dict></plist>\n";

  qstest::TempDir dir_;
  std::string root_, scratch_;
};

// --- Usage -----------------------------------------------------------------------------------

TEST_F(Transvale, UnknownOptionIsAUsageError) {
  auto result = runTransvale({"--bogus"}, scratch_);
  EXPECT_EQ(result.exitCode, 64);
  EXPECT_NE(result.err.find("--bogus"), std::string::npos) << result.err;
}

TEST_F(Transvale, BadOptionValuesAreUsageErrors) {
  EXPECT_EQ(run({"--progress", "sometimes"}).exitCode, 64);
  EXPECT_EQ(run({"--log-format", "xml"}).exitCode, 64);
  EXPECT_EQ(run({"--system-log-level", "nine"}).exitCode, 64);
  EXPECT_EQ(run({"--system-log-level", "8"}).exitCode, 64);
  EXPECT_EQ(runTransvale({"--root", root_ + "/missing"}, scratch_).exitCode, 64);
  EXPECT_EQ(runTransvale({"extra"}, scratch_).exitCode, 64);
}

TEST_F(Transvale, UnwritableLogIsAUsageError) {
  ASSERT_TRUE(qstest::writeFile(scratch_ + "/file", "x"));
  auto result = run({"--log", scratch_ + "/file/transvale.log"});
  EXPECT_EQ(result.exitCode, 64);
  EXPECT_NE(result.err.find("cannot"), std::string::npos) << result.err;
}

TEST_F(Transvale, HelpAndVersion) {
  auto help = runTransvale({"--help"}, scratch_);
  EXPECT_EQ(help.exitCode, 0);
  for (const char* option : {"--root", "--plugin", "--log", "--log-format", "--system-log-level", "--progress"}) {
    EXPECT_NE(help.out.find(option), std::string::npos) << option;
  }
  auto version = runTransvale({"--version"}, scratch_);
  EXPECT_EQ(version.exitCode, 0);
  EXPECT_NE(version.out.find("transvale 1.0.0"), std::string::npos) << version.out;
}

// --- The plug-in -------------------------------------------------------------------------------

TEST_F(Transvale, MissingPluginIsReported) {
  auto result = run({"--plugin", scratch_ + "/absent.so"});
  EXPECT_EQ(result.exitCode, 2);
  EXPECT_NE(result.err.find("cannot load the plug-in " + scratch_ + "/absent.so"), std::string::npos) << result.err;
  EXPECT_FALSE(fs::exists(root_ + "/private/var/quilld/Library/Quillset/AppMigratorLastSystemVersion.plist"));
}

TEST_F(Transvale, LibraryWithoutEntryPointIsReported) {
  auto result = run({"--plugin", buildDirectory() + "/lib/libQSPlatform.so"});
  EXPECT_EQ(result.exitCode, 2);
  EXPECT_NE(result.err.find("has no entry point QSCreateDataClassMigrator"), std::string::npos) << result.err;
}

TEST_F(Transvale, MigratorThatCannotBeCreatedIsReported) {
  // The old applications directory exists but cannot be listed.
  ASSERT_TRUE(qstest::makeDirs(root_ + "/private/var/mobile"));
  ASSERT_TRUE(qstest::writeFile(oldApplications(), "not a directory"));
  auto result = run({});
  EXPECT_EQ(result.exitCode, 2);
  EXPECT_NE(result.err.find("could not create its migrator"), std::string::npos) << result.err;
  EXPECT_NE(qstest::readFile(defaultLog()).find("QSAppMigrator: Failed to get items at file://" + oldApplications()),
            std::string::npos);
}

// --- Runs ---------------------------------------------------------------------------------------

TEST_F(Transvale, RunWithNothingToMigrateSucceeds) {
  auto result = run({"--progress", "never"});
  EXPECT_EQ(result.exitCode, 0) << result.out << result.err;
  EXPECT_NE(result.out.find("Data class: QSAppMigrator\n"), std::string::npos) << result.out;
  EXPECT_NE(result.out.find("Estimated duration: 20\n"), std::string::npos) << result.out;
  EXPECT_NE(result.out.find("transvale: migration succeeded"), std::string::npos) << result.out;
  EXPECT_EQ(result.out.find("progress:"), std::string::npos) << result.out;
  const std::string log = qstest::readFile(defaultLog());
  EXPECT_NE(log.find("host <5> [Transvaler] -[QSAppMigrator performMigration] (QSAppMigrator.cpp:"),
            std::string::npos)
      << log;
  EXPECT_NE(log.find("QSAppMigrator: Recorded current system version as 21A100"), std::string::npos) << log;
  EXPECT_NE(qstest::readFile(root_ + "/private/var/quilld/Library/Quillset/AppMigratorLastSystemVersion.plist")
                .find("21A100"),
            std::string::npos);
}

TEST_F(Transvale, RunThatLeavesEntriesFailsAndShowsProgressLines) {
  // A container whose application bundle is a symbolic link is never touched.
  ASSERT_TRUE(qstest::makeDirs(oldApplications() + "/A"));
  ASSERT_EQ(symlink("/nowhere", (oldApplications() + "/A/Main.app").c_str()), 0);
  ASSERT_TRUE(qstest::writeFile(oldApplications() + "/WhereDidMyApplicationsGo.txt", "x"));
  auto result = run({"--log", "-"});
  EXPECT_EQ(result.exitCode, 1) << result.out << result.err;
  EXPECT_NE(result.out.find("Estimated duration: 24.5\n"), std::string::npos) << result.out;
  EXPECT_NE(result.out.find("progress: 100% (2/2 entries)\n"), std::string::npos) << result.out;
  EXPECT_NE(result.out.find("transvale: migration failed, 2 of 2 entries finished"), std::string::npos)
      << result.out;
  EXPECT_NE(result.err.find("QSAppMigrator: Skipping container with app symlink at " + oldApplications() +
                            "/A/Main.app"),
            std::string::npos)
      << result.err;
  EXPECT_NE(result.err.find("QSAppMigrator: Returning migration failed."), std::string::npos) << result.err;
  EXPECT_TRUE(fs::is_symlink(oldApplications() + "/A/Main.app"));
}

TEST_F(Transvale, ProgressBarWhenAskedFor) {
  auto result = run({"--progress", "always"});
  EXPECT_EQ(result.exitCode, 0) << result.err;
  EXPECT_NE(result.out.find("\r["), std::string::npos) << result.out;
  EXPECT_NE(result.out.find("0/0 entries"), std::string::npos) << result.out;
}

TEST_F(Transvale, JSONLinesCarryEveryFieldAndAnyBytes) {
  // Names with a quote, a control character and a byte that is not UTF-8.
  const std::string strayName = "stray \"quoted\"\t\xff\xc3\xa9";
  ASSERT_TRUE(qstest::makeDirs(oldApplications()));
  ASSERT_TRUE(qstest::writeFile(oldApplications() + "/" + strayName, "x"));
  const std::string logPath = scratch_ + "/log.jsonl";
  auto result = run({"--log", logPath, "--log-format", "jsonl", "--progress", "never"});
  EXPECT_EQ(result.exitCode, 0) << result.out << result.err;

  const std::string raw = qstest::readFile(logPath);
  EXPECT_NE(raw.find("\\udcff"), std::string::npos) << raw;
  bool sawIntrospection = false, sawRemoval = false;
  for (const std::string& line : lines(raw)) {
    auto object = parseFlatObject(line);
    ASSERT_TRUE(object.has_value()) << "not a JSON object: " << line;
    for (const char* key : {"time", "sink", "level", "category", "function", "file", "line", "message"}) {
      EXPECT_EQ(object->count(key), 1u) << key << " missing in " << line;
    }
    const JSONObject& o = *object;
    if (o.at("sink").text != "host") continue;
    EXPECT_EQ(o.at("category").text, "Transvaler");
    EXPECT_EQ(o.at("level").kind, JSONValue::Kind::Number);
    EXPECT_EQ(o.at("line").kind, JSONValue::Kind::Number);
    if (o.at("message").text == "QSAppMigrator: Introspecting " + oldApplications() + "/" + strayName) {
      sawIntrospection = true;
      EXPECT_EQ(o.at("function").text, "-[QSAppMigrator performMigration]");
      EXPECT_EQ(o.at("level").number, 5);
      EXPECT_NE(o.at("file").text.find("QSAppMigrator.cpp"), std::string::npos);
    }
    if (o.at("message").text ==
        "QSAppMigrator: Found regular file at " + oldApplications() + "/" + strayName + " ; removing") {
      sawRemoval = true;
      EXPECT_EQ(o.at("function").text, "-[QSAppMigrator _introspectContainer:orderResultEarly:]");
      EXPECT_EQ(o.at("level").number, 3);
    }
  }
  EXPECT_TRUE(sawIntrospection) << raw;
  EXPECT_TRUE(sawRemoval) << raw;
}

TEST_F(Transvale, SystemLogLevelFiltersTheFileLayersLines) {
  // A symbolic link among the entries makes the file layer write a level-5 line.
  auto layout = [&] {
    fs::remove_all(oldApplications());
    ASSERT_TRUE(qstest::makeDirs(oldApplications()));
    ASSERT_EQ(symlink("/nowhere", (oldApplications() + "/Link").c_str()), 0);
    ASSERT_TRUE(qstest::writeFile(oldApplications() + "/WhereDidMyApplicationsGo.txt", "x"));
  };
  layout();
  auto plain = run({"--log", scratch_ + "/plain.log", "--progress", "never"});
  EXPECT_EQ(plain.exitCode, 1);
  const std::string plainLog = qstest::readFile(scratch_ + "/plain.log");
  EXPECT_NE(plainLog.find("system <5> "), std::string::npos) << plainLog;

  layout();
  auto quiet = run({"--log", scratch_ + "/quiet.log", "--system-log-level", "3", "--progress", "never"});
  EXPECT_EQ(quiet.exitCode, 1);
  const std::string quietLog = qstest::readFile(scratch_ + "/quiet.log");
  EXPECT_EQ(quietLog.find("system <5> "), std::string::npos) << quietLog;
  EXPECT_NE(quietLog.find("host <3> "), std::string::npos) << quietLog;
}

}  // namespace
