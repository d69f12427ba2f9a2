// The utilities: Info.plist loading and its failures, the SHA-256 digest and
// the chunked reader beneath it, and the helpers that normalise values read
// from property lists.
#include <unistd.h>

#include <cstdio>

#include <gtest/gtest.h>

#include "Shared/Support/QSUtilities.h"
#include "Support/SupportFixtures.h"

using platform::Array;
using platform::Dictionary;
using platform::URL;
using platform::Value;
using Type = platform::Value::Type;

namespace {

class LoadInfoPlist : public ::testing::Test {
 protected:
  URL bundleAt(const std::string& name, const Value& info) {
    EXPECT_TRUE(qstest::makeDirs(dir_ / name));
    EXPECT_TRUE(platform::plist::writeFile(info, URL::fileURL(dir_ / (name + "/Info.plist"))));
    return URL::fileURL(dir_ / name, true);
  }
  const std::set<std::string> keys_{"RkBundleIdentifier", "RkBundleVersion"};
  qstest::TempDir dir_{"infoplist"};
  qstest::LogCapture log_;
};

// Every call opens the bundle afresh: a changed Info.plist is read as it is now.
TEST_F(LoadInfoPlist, WholeDictionaryDropsTheURLEntryAFilterKeepsItNothingIsCachedAndFailuresAreReported) {
  URL bundle = bundleAt("B.app", Value(Dictionary{{"RkBundleIdentifier", Value("b")},
                                                  {"RkBundleVersion", Value("1")},
                                                  {"RkBundleInfoPlistURL", Value("/kept")}}));
  EXPECT_EQ(QSLoadInfoPlist(bundle), (Dictionary{{"RkBundleIdentifier", Value("b")}, {"RkBundleVersion", Value("1")}}));
  const std::set<std::string> keys{"RkBundleIdentifier", "RkBundleInfoPlistURL"};
  EXPECT_EQ(QSLoadInfoPlist(bundle, &keys),
            (Dictionary{{"RkBundleIdentifier", Value("b")}, {"RkBundleInfoPlistURL", Value("/kept")}}));
  bundleAt("B.app", Value(Dictionary{{"RkBundleIdentifier", Value("changed")}}));
  EXPECT_EQ(QSLoadInfoPlist(bundle, &keys_), (Dictionary{{"RkBundleIdentifier", Value("changed")}}));

  ASSERT_TRUE(qstest::makeDirs(dir_ / "Empty.app"));
  EXPECT_EQ(QSLoadInfoPlist(URL::fileURL(dir_ / "Empty.app", true)), std::nullopt);
  EXPECT_TRUE(log_.systemLines().empty()) << "a missing Info.plist is a debug line, not worth opening the bundle for";

  URL array = bundleAt("Array.app", Value(Array{Value("a")}));
  ASSERT_TRUE(qstest::makeDirs(dir_ / "Garbage.app") && qstest::writeFile(dir_ / "Garbage.app/Info.plist", "<dict>"));
  URL garbage = URL::fileURL(dir_ / "Garbage.app", true);
  ASSERT_TRUE(qstest::writeFile(dir_ / "File.app", "a file cannot be opened as a bundle"));
  URL file = URL::fileURL(dir_ / "File.app", true);
  for (auto [url, filter] : {std::pair{array, &keys_}, {garbage, nullptr}, {garbage, &keys_}, {file, nullptr}}) {
    EXPECT_EQ(QSLoadInfoPlist(url, filter), std::nullopt);
  }
  std::vector<std::string> messages = log_.systemMessages();
  ASSERT_EQ(messages.size(), 5u);
  messages.erase(messages.begin() + 3);  // the file manager's own line about the file in the way
  EXPECT_EQ(messages,
            (std::vector<std::string>{
                "Object returned from _RkBundleCreateFilteredInfoPlist was not a dictionary, was type array",
                "RkBundleGetInfoDictionary failed for bundle " + garbage.description(),
                "Failed to get filtered Info.plist with keys (RkBundleIdentifier, RkBundleVersion) from bundle " +
                    platform::Bundle(garbage, std::nullopt).description(),
                "Failed to create RkBundle from URL " + file.description()}));
}

// --- Digest ----------------------------------------------------------------------------

class Digest : public ::testing::Test {
 protected:
  std::string file(const std::string& name, size_t size) {
    std::string bytes(size, '\0');
    for (size_t i = 0; i < size; ++i) bytes[i] = static_cast<char>((i * 2654435761u) >> 13);
    EXPECT_TRUE(qstest::writeFile(dir_ / name, bytes));
    return dir_ / name;
  }
  qstest::TempDir dir_{"digest"};
  qstest::LogCapture log_;
};

// What coreutils says about the file; the reader holds at most 65536 bytes at once.
TEST_F(Digest, MatchesCoreutilsAroundTheChunkSize) {
  for (size_t size : {0, 65536, 65537, 200000}) {
    const std::string path = file("f" + std::to_string(size), size);
    char expected[65] = {};
    FILE* pipe = popen(("sha256sum '" + path + "'").c_str(), "r");
    ASSERT_TRUE(pipe && fread(expected, 1, 64, pipe) == 64);
    pclose(pipe);
    EXPECT_EQ(QSCreateSHA256Digest(platform::URL::fileURL(path)), std::optional<std::string>(expected)) << size;
    size_t largest = 0;
    EXPECT_TRUE(
        _ReadFile(path.c_str(), [&largest](const uint8_t*, size_t n) { return (largest = std::max(largest, n)); }));
    EXPECT_LE(largest, 65536u);
  }
  EXPECT_TRUE(log_.systemLines().empty());
}

// The digest's line reports the reader's errno even when writing the reader's line changes it, as syslog may.
TEST_F(Digest, MissingFileWritesTheReaderLineThenTheDigestLine) {
  std::vector<platform::SystemLogLine> lines;
  platform::SystemLogSink previous = platform::setSystemLogSink([&lines](const platform::SystemLogLine& line) {
    lines.push_back(line);
    errno = EBADF;
  });
  EXPECT_EQ(QSCreateSHA256Digest(dir_ / "missing"), std::nullopt);
  platform::setSystemLogSink(previous);
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_EQ(lines[0].message, "failed to open " + dir_ / "missing" + " : No such file or directory");
  EXPECT_EQ(lines[1].message, "Failed to read file://" + dir_ / "missing" + " : No such file or directory");
}

TEST_F(Digest, ReaderStopsWhenTheConsumerRefusesAndAtTheSizeTakenAtOpening) {
  const std::string path = file("f", 150000);
  int calls = 0;
  EXPECT_FALSE(_ReadFile(path.c_str(), [&calls](const uint8_t*, size_t) { return ++calls > 1; }));
  EXPECT_EQ(calls, 1);
  EXPECT_TRUE(log_.systemLines().empty());
  size_t total = 0;
  EXPECT_TRUE(_ReadFile(path.c_str(), [&](const uint8_t*, size_t length) {
    if (total == 0) qstest::writeFile(path, std::string(200000, 'x'));
    return (total += length) > 0;
  }));
  EXPECT_EQ(total, 150000u);
  // A file cut short while read ends in a zero-byte read.
  EXPECT_FALSE(_ReadFile(path.c_str(), [&path](const uint8_t*, size_t) { return truncate(path.c_str(), 65536) == 0; }));
  EXPECT_EQ(log_.systemMessages(), std::vector<std::string>{"read failed for " + path + ", got 0 bytes"});
  ASSERT_TRUE(qstest::makeDirs(dir_ / "sub") && qstest::writeFile(dir_ / "sub/x", "x"));
  EXPECT_EQ(QSCreateSHA256Digest(dir_ / "sub"), std::nullopt);
}

// --- Type helpers ----------------------------------------------------------------------

TEST(TypeHelpers, OnlyNumbersAreBooleansIntegerKindsAreOneClassAndNothingElseIsArrayified) {
  EXPECT_EQ(QSStringifyObject(Value()), std::nullopt);
  EXPECT_EQ(QSStringifyObject(Value("a \"q\"")), std::optional<std::string>("a \"q\""));
  EXPECT_EQ(QSStringifyObject(Value(Array{Value("x"), Value(1)})), std::optional<std::string>("(x, 1)"));
  EXPECT_FALSE(QSBooleanValue(Value(0), true));
  EXPECT_TRUE(QSBooleanValue(Value("NO"), true));
  EXPECT_FALSE(QSBooleanValue(Value("YES"), false));
  const Value integers(Array{Value(-1), Value(UINT64_MAX)});
  EXPECT_TRUE(QSArrayContainsOnlyClass(integers, Type::Integer));
  EXPECT_TRUE(QSArrayContainsOnlyClass(integers, Type::Unsigned));
  EXPECT_FALSE(QSArrayContainsOnlyClass(Value(Array{Value(true)}), Type::Integer));
  EXPECT_TRUE(QSArrayContainsOnlyClass(Value(Dictionary{{"a", Value(1)}}), Type::String));
  EXPECT_FALSE(QSArrayContainsOnlyClass(Value("text"), Type::String));
  EXPECT_EQ(QSArrayifyThing(Value("only"), Type::String), Array{Value("only")});
  EXPECT_EQ(QSArrayifyThing(Value(Array{Value(1u)}), Type::Integer), Array{Value(1u)});
  EXPECT_EQ(QSArrayifyThing(Value(Array{Value("a"), Value(2)}), Type::String), std::nullopt);
  EXPECT_EQ(QSArrayifyThing(Value(3), Type::String), std::nullopt);
  EXPECT_EQ(QSArrayifyThing(std::set<std::string>{"zeta", "alpha"}, Type::String),
            (Array{Value("alpha"), Value("zeta")}));
}

}  // namespace
