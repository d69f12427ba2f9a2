#include "Platform/Foundation/PropertyList.h"

#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cmath>
#include <filesystem>
#include <functional>
#include <random>
#include <thread>

#include <gtest/gtest.h>

#include "support/TestSupport.h"

namespace {

using namespace platform;
constexpr plist::Format kXML = plist::Format::XML;
constexpr plist::Format kBinary = plist::Format::Binary;
const std::string kHeader =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
    "<!DOCTYPE plist PUBLIC \"-//Apple//DTD PLIST 1.0//EN\" \"http://www.apple.com/DTDs/PropertyList-1.0.dtd\">\n";

std::optional<Value> parseText(const std::string& text, Error* error = nullptr) {
  return plist::parse(text.data(), text.size(), error);
}

std::optional<Value> roundTrip(const Value& value, plist::Format format) {
  std::optional<Data> bytes = plist::serialize(value, format);
  return bytes ? plist::parse(bytes->data(), bytes->size()) : std::nullopt;
}

// Expects a failure record: domain and code, a phrase of the reason, and the POSIX error beneath when given.
void expectFileError(const Error& error, int code, const std::string& phrase, int posix = 0) {
  EXPECT_TRUE(error.is(kFileErrorDomain, code)) << error.description();
  EXPECT_NE(error.localizedDescription().find(phrase), std::string::npos) << error.description();
  if (posix) {
    EXPECT_TRUE(error.underlyingError() && error.underlyingError()->isPOSIX(posix)) << error.description();
  }
}

// Every type a property list holds, with the integer edges libplist gets wrong
// when left alone. Dates are whole seconds: the XML form keeps no fraction.
Value everyType() {
  return Value(Dictionary{
      {"ints",
       Value(Array{Value(-1), Value(INT64_MIN), Value(INT64_MAX), Value(UINT64_MAX), Value(uint64_t{1} << 63)})},
      {"reals", Value(Array{Value(0.1), Value(-2.5e-300), Value(HUGE_VAL)})},
      {"string", Value("h\xC3\xA9llo <&> \"q\" 'single' \xF0\x9F\x98\x80  a\tb\r\nc ")},
      {"data", Value(Data{0, 0xff, '<', '&', 0x80})},
      {"dates", Value(Array{Value(Date{-31536000.0}), Value(Date{700000000.0})})},
      {"nested", Value(Dictionary{{"inner", Value(Array{Value(true), Value(false), Value(""), Value(Data())})}})},
      {"empties", Value(Array{Value(Array{}), Value(Dictionary{})})},
      {"key with spaces & <markup>", Value("v")},
  });
}

TEST(PropertyListFormats, EveryTypeComesBackEqualWithItsSignednessAndANestedURLAsItsPath) {
  for (plist::Format format : {kXML, kBinary}) {
    std::optional<Value> back = roundTrip(everyType(), format);
    ASSERT_TRUE(back);
    EXPECT_EQ(*back, everyType()) << back->description();
    EXPECT_EQ(roundTrip(Value(Dictionary{{"at", Value(URL::fileURL("/p/x", true))}}), format),
              Value(Dictionary{{"at", Value("/p/x")}}));
  }
  Value dates(Array{Value(Date{12.25}), Value(Date{-4.5}), Value(Date{-978307200.0})});
  EXPECT_EQ(roundTrip(dates, kBinary), dates);
}

TEST(PropertyListFormats, UnwritableValuesAreRefusedWithTheReason) {
  Value deep(Array{});
  for (int i = 0; i < 600; ++i) deep = Value(Array{deep});
  const std::pair<Value, std::string> cases[] = {
      {Value(Array{Value(1), Value()}), "null value"},
      {Value(URL::fileURL("/a")), "URL is not a property-list value"},
      {Value(std::string("a\0b", 3)), "NUL"},
      {Value(Date{std::nan("")}), "outside the range"},
      {deep, "nesting deeper"},
      {Value(Dictionary{{"e", Value(Error("D", 1))}}), "error record"},
  };
  for (const auto& [value, reason] : cases) {
    for (plist::Format format : {kXML, kBinary}) {
      Error error;
      EXPECT_FALSE(plist::serialize(value, format, &error)) << reason;
      expectFileError(error, kFileWriteUnknownError, reason);
    }
  }
  // The binary form needs UTF-8, the XML form keeps any bytes: Latin-1, overlong, surrogate, truncated, > U+10FFFF.
  for (const std::string bad : {"caf\xE9\xFF", "\xC0\xAF", "\xED\xA0\x80", "\xE2\x82", "\xF4\x90\x80\x80"}) {
    Error error;
    EXPECT_EQ(roundTrip(Value(Dictionary{{bad, Value(bad)}}), kXML), Value(Dictionary{{bad, Value(bad)}}));
    EXPECT_FALSE(plist::serialize(Value(Dictionary{{"k", Value(bad)}}), kBinary, &error));
    expectFileError(error, kFileWriteUnknownError, "not UTF-8");
  }
}

// The checks in front of libplist: what it lets through is refused with the reason, the forms other
// writers produce are read. Each case: the document, its value (none: refused), a phrase of the reason.
TEST(PropertyListXMLCheck, RefusesWhatLibplistLetsThroughAndReadsTheFormsOtherWritersProduce) {
  const std::string p = kHeader + "<plist>";
  std::string deep = "<plist>";
  for (int i = 0; i < 100000; ++i) deep += "<array>";
  const std::tuple<std::string, std::optional<Value>, const char*> cases[] = {
      {p + "<integer>abc</integer></plist>", std::nullopt, "integer element holds \"abc\""},
      {p + "<integer>18446744073709551616</integer></plist>", std::nullopt, "integer element"},
      {p + "<dict><key>a</key><string>x</string><key>b</key></dict></plist>", std::nullopt,
       "dictionary key \"b\" has no value"},
      {p + "<dict><key>a</key><true/></dict></plist>xyz", std::nullopt, "content after the end"},
      {kHeader + "<key>a</key>", std::nullopt, "<key> outside a dictionary"},
      {p + "<dict><key>a</key><true/></dict>\n", std::nullopt, "missing </plist>"},
      {"\xEF\xBB\xBF", std::nullopt, "the document is empty"},
      {p + "<dict><key>a</key><string>abc", std::nullopt, "unexpected end of the document"},
      {p + "<string>&nbsp;</string></plist>", std::nullopt, "&nbsp;"},
      {p + "<dict><key>a" + std::string(1, '\0') + "b</key><true/></dict></plist>", std::nullopt, "a NUL character"},
      {"bplist00garbage", std::nullopt, "malformed binary property list"},
      {deep, std::nullopt, "nesting deeper"},
      {"\xEF\xBB\xBF<?xml version=\"1.0\"?><!DOCTYPE plist [ <!ENTITY x \"y\"> ]><!-- c --><plist><!-- c --><string>"
       "<![CDATA[a<b&c]]>&amp;&lt;&quot;&#65;&#x42;</string></plist><!-- c -->\n",
       Value("a<b&c&<\"AB"), ""},
      // Leading zeros are decimal, not libplist's octal.
      {p + "<array><integer>010</integer><integer>-007</integer><integer> +09 </integer><integer>0x10</integer>"
           "<string>010</string></array></plist>",
       Value(Array{Value(10), Value(-7), Value(9), Value(16), Value("010")}), ""},
      {p + "<array><real>-1.5e3</real><real>-inf</real><real>0x1.8p1</real><date>2001-01-01T00:01:40.5Z</date>"
           "<data>AAEC\n\tAwQ=</data></array></plist>",
       Value(Array{Value(-1500.0), Value(-HUGE_VAL), Value(3.0), Value(Date{100}), Value(Data{0, 1, 2, 3, 4})}), ""},
      {"<dict><key>a</key><integer>1</integer><key>a</key><integer>2</integer></dict>",
       Value(Dictionary{{"a", Value(2)}}), ""},
      // Entities are never expanded nor fetched; a comment in the internal subset may hold quotes and brackets.
      {"<!DOCTYPE plist [ <!ENTITY x \"y\"> ]><plist><string>&x;</string></plist>", std::nullopt, "&x;"},
      {"<!DOCTYPE plist [ <!ENTITY x SYSTEM \"/etc/hostname\"> ]><string>&x;</string>", std::nullopt, "external"},
      {"<!DOCTYPE plist [ <!-- don't ] --> ]><string>a</string>", Value("a"), ""},
      // Text is what the references name, raw bytes stay bytes; libplist reads numbers as this check read them.
      {"<dict><key>&#xE9;t\xE9&#xF7E9;</key></dict>", std::nullopt, "key \"\xC3\xA9t\xE9\xEF\x9F\xA9\" has no"},
      {"<array><integer>&#x31;0</integer><real>1<!-- c -->.5</real><real><![CDATA[2.5]]></real></array>",
       Value(Array{Value(10), Value(1.5), Value(2.5)}), ""},
  };
  for (const auto& [document, expected, problem] : cases) {
    Error error;
    EXPECT_EQ(parseText(document, &error), expected) << document.substr(0, 200) << "\n" << error.description();
    if (!expected) expectFileError(error, kFileReadUnknownError, problem);
  }
}

// A binary document of the given objects (4-byte offsets and references); the first is the root.
Data binaryDocument(const std::vector<Data>& objects) {
  auto bigEndian = [](Data& out, uint64_t v, int width) {
    for (int i = width - 1; i >= 0; --i) out.push_back(static_cast<uint8_t>(v >> (8 * i)));
  };
  Data out{'b', 'p', 'l', 'i', 's', 't', '0', '0'}, table;
  for (const Data& object : objects) {
    bigEndian(table, out.size(), 4);
    out.insert(out.end(), object.begin(), object.end());
  }
  const uint64_t tableOffset = out.size();
  out.insert(out.end(), table.begin(), table.end());
  out.insert(out.end(), {0, 0, 0, 0, 0, 0, 4, 4});  // offset and reference widths
  for (uint64_t v : {uint64_t{objects.size()}, uint64_t{0}, tableOffset}) bigEndian(out, v, 8);
  return out;
}

// A container object (`marker`) referring to `refs`.
Data ref(uint8_t marker, std::initializer_list<uint32_t> refs) {
  Data out{marker};
  for (uint32_t r : refs) out.insert(out.end(), {uint8_t(r >> 24), uint8_t(r >> 16), uint8_t(r >> 8), uint8_t(r)});
  return out;
}

// A chain of `levels` arrays, each holding the next once (or twice, shared), ending in an empty array.
Data chainDocument(uint32_t levels, bool twice) {
  std::vector<Data> objects;
  for (uint32_t i = 1; i <= levels; ++i) objects.push_back(twice ? ref(0xA2, {i, i}) : ref(0xA1, {i}));
  objects.push_back(Data{0xA0});
  return binaryDocument(objects);
}

// Documents that abort, overflow or explode libplist are refused first.
TEST(PropertyListHostileBinary, DangerousDocumentsAreRefusedAndThoseWithinTheLimitsRead) {
  const std::pair<Data, std::string> refused[] = {
      {chainDocument(99999, false), "nesting deeper than 512 levels"},
      {binaryDocument({ref(0xA1, {0})}), "contains itself"},
      {chainDocument(64, true), "expand to more than"},
      // As a key libplist aborts on a NUL; as a value it cuts the string short.
      {binaryDocument({ref(0xD1, {1, 2}), Data{0x53, 'a', 0, 'b'}, Data{0x09}}), "a string holds a NUL character"},
      {binaryDocument({ref(0xA1, {1}), Data{0x62, 0, 'a', 0, 0}}), "a string holds a NUL character"},
  };
  for (const auto& [doc, problem] : refused) {
    Error error;
    EXPECT_FALSE(plist::parse(doc.data(), doc.size(), &error)) << problem;
    expectFileError(error, kFileReadUnknownError, problem);
  }
  for (const Data& doc : {chainDocument(512, false), chainDocument(10, true)}) {
    Error error;
    EXPECT_TRUE(plist::parse(doc.data(), doc.size(), &error)) << error.description();
  }
}

TEST(PropertyListDamagedInput, TruncationsAreRefusedUntilTheEndTagAndMutationsNeverCrash) {
  const Data xml = plist::serialize(everyType(), kXML).value(), bin = plist::serialize(everyType(), kBinary).value();
  const std::string text(xml.begin(), xml.end());
  const size_t complete = text.rfind("</plist>") + 8;
  for (size_t n = 0; n < text.size(); ++n) EXPECT_EQ(parseText(text.substr(0, n)).has_value(), n >= complete) << n;
  for (size_t n = 0; n < bin.size(); ++n) EXPECT_FALSE(plist::parse(bin.data(), n)) << n;
  std::mt19937 random(20261122);
  for (const Data* original : {&xml, &bin}) {
    std::uniform_int_distribution<size_t> position(0, original->size() - 1);
    for (int round = 0; round < 300; ++round) {
      Data mutated = *original;
      for (int k = 0; k < 1 + round % 4; ++k) mutated[position(random)] = static_cast<uint8_t>(random());
      Error error;
      EXPECT_TRUE(plist::parse(mutated.data(), mutated.size(), &error) || error.is(kFileErrorDomain, 256));
    }
  }
}

class PropertyListFile : public testing::Test {
 protected:
  std::string pathOf(const std::string& name) const { return dir_ / name; }
  URL urlOf(const std::string& name) const { return URL::fileURL(pathOf(name)); }
  qstest::TempDir dir_;
};

// Each case makes the file at `path` in its own way; the read must end at once with a record that names the
// path and says why, the POSIX error beneath when there is one, having allocated nothing near a claimed size
// and waited on nothing.
TEST_F(PropertyListFile, ReadFailuresSayWhyAndNeitherExhaustMemoryNorBlock) {
  const std::string plist = "<plist><dict/></plist>";
  using Make = std::function<bool(const std::string&)>;
  const Make fifo = [](const std::string& p) { return mkfifo(p.c_str(), 0644) == 0; };
  const struct {
    const char* name;
    Make make;
    plist::ReadOptions options;
    int code;
    std::string reason;
    int posix;
  } kCases[] = {
      {"absent", [](auto) { return true; }, {}, kFileReadNoSuchFileError, "no such file", ENOENT},
      {"directory", [](auto p) { return qstest::makeDirs(p); }, {}, kFileReadUnknownError, "", EISDIR},
      {"not a property list",
       [](auto p) { return qstest::writeFile(p, kHeader + "<plist><integer>abc</integer></plist>"); },
       {},
       kFileReadUnknownError,
       "not a valid property list: integer element holds",
       0},
      {"sparse 40 GiB",
       [](auto p) { return qstest::writeFile(p, "") && truncate(p.c_str(), 40LL << 30) == 0; },
       {},
       kFileReadUnknownError,
       "the file holds at least 42949672960 bytes, more than the 33554432 this reader takes",
       0},
      {"one byte over a small limit",
       [&](auto p) { return qstest::writeFile(p, plist); },
       {.sizeLimit = plist.size() - 1},
       kFileReadUnknownError,
       "the file holds at least 22 bytes, more than the 21 this reader takes",
       0},
      {"fifo", fifo, {}, kFileReadUnknownError, "not a regular file", 0},
      {"link to a fifo",
       [&](auto p) { return fifo(p + ".fifo") && symlink((p + ".fifo").c_str(), p.c_str()) == 0; },
       {},
       kFileReadUnknownError,
       "not a regular file",
       0},
      {"character device",
       [](auto p) { return symlink("/dev/zero", p.c_str()) == 0; },
       {},
       kFileReadUnknownError,
       "not a regular file",
       0},
      {"refused link",
       [&](auto p) { return qstest::writeFile(p + ".real", plist) && symlink((p + ".real").c_str(), p.c_str()) == 0; },
       {.finalLink = plist::FinalLink::Refuse},
       kFileReadUnknownError,
       "a symbolic link, which this reader does not follow",
       0},
  };
  int n = 0;
  for (const auto& c : kCases) {
    SCOPED_TRACE(c.name);
    const std::string path = pathOf("case" + std::to_string(++n));
    ASSERT_TRUE(c.make(path));
    Error error;
    EXPECT_FALSE(plist::readDictionary(URL::fileURL(path), c.options, &error));
    expectFileError(error, c.code, "Could not read \"" + path + "\": " + c.reason, c.posix);
    EXPECT_EQ(error.userInfo().at(kFilePathErrorKey), Value(path));
  }
  // The same files within their limits, links followed, read as before.
  ASSERT_TRUE(qstest::writeFile(pathOf("fits"), plist));
  ASSERT_EQ(symlink(pathOf("fits").c_str(), pathOf("linked").c_str()), 0);
  EXPECT_TRUE(plist::readDictionary(urlOf("fits"), {.sizeLimit = plist.size()}));
  EXPECT_TRUE(plist::readDictionary(urlOf("linked")));
}

TEST_F(PropertyListFile, WritesRoundTripAndAtomicReplaceKeepsPermissionsAndLeavesNoTemporaryFile) {
  Data bytes(200000, 0);
  for (size_t i = 0; i < bytes.size(); ++i) bytes[i] = static_cast<uint8_t>(i * 7);
  ASSERT_TRUE(plist::writeFileBytes(bytes, urlOf("blob"), false));
  EXPECT_EQ(plist::readFileBytes(urlOf("blob")), bytes);
  auto mode = [this] { return std::filesystem::status(pathOf("m.plist")).permissions(); };
  ASSERT_TRUE(plist::writeFile(Value(Dictionary{{"v", Value(1)}}), urlOf("m.plist")));
  EXPECT_EQ(mode(), std::filesystem::perms(0644));
  ASSERT_EQ(chmod(pathOf("m.plist").c_str(), 0600), 0);
  ASSERT_TRUE(plist::writeFile(Value(Dictionary{{"v", Value(2)}}), urlOf("m.plist")));
  EXPECT_EQ(plist::readDictionary(urlOf("m.plist")), (Dictionary{{"v", Value(2)}}));
  EXPECT_EQ(mode(), std::filesystem::perms(0600));
  // Replacing a long name needs a temporary name within the name limit.
  const std::string longName(250, 'n');
  for (int i = 0; i < 2; ++i) EXPECT_TRUE(plist::writeFile(Value(Dictionary{}), urlOf(longName), kBinary, true));
  EXPECT_EQ(qstest::entries(dir_.path()), (std::vector<std::string>{"blob", "m.plist", longName}));
}

// The temporary file is linked beside the target, then the rename over the immutable target is refused.
TEST_F(PropertyListFile, RefusedWritesKeepTheOldFileAndLeaveNothingBeside) {
  ASSERT_TRUE(plist::writeFile(Value(Dictionary{{"v", Value(1)}}), urlOf("m.plist")));
  ASSERT_TRUE(qstest::setImmutable(pathOf("m.plist"), true));
  Error error;
  EXPECT_FALSE(plist::writeFile(Value(Dictionary{{"v", Value(2)}}), urlOf("m.plist"), kXML, true, &error));
  ASSERT_TRUE(qstest::setImmutable(pathOf("m.plist"), false));
  expectFileError(error, kFileWriteUnknownError, "Could not write \"" + pathOf("m.plist") + "\": rename failed", EPERM);
  EXPECT_EQ(plist::readDictionary(urlOf("m.plist")), (Dictionary{{"v", Value(1)}}));
  ASSERT_TRUE(qstest::writeFile(pathOf("o.plist"), "before"));
  EXPECT_FALSE(plist::writeFile(Value(Array{Value()}), urlOf("o.plist"), kXML, true, &error));
  expectFileError(error, kFileWriteUnknownError, "Could not write \"" + pathOf("o.plist") + "\": a null value");
  EXPECT_EQ(qstest::readFile(pathOf("o.plist")), "before");

  ASSERT_TRUE(qstest::makeDirs(pathOf("d.plist/child")));
  const std::tuple<URL, bool, int> failures[] = {{urlOf("d.plist"), true, EISDIR},
                                                 {urlOf("none/m.plist"), true, ENOENT},
                                                 {urlOf("none/m.plist"), false, ENOENT},
                                                 {URL::fileURL("/dev/full"), false, ENOSPC}};
  for (const auto& [url, atomically, code] : failures) {
    EXPECT_FALSE(plist::writeFileBytes(Data(4096, 7), url, atomically, &error)) << url.path();
    expectFileError(error, kFileWriteUnknownError, code == ENOSPC ? "write failed" : "", code);
  }
  EXPECT_EQ(qstest::entries(pathOf("d.plist")), std::vector<std::string>{"child"});
  EXPECT_EQ(qstest::entries(dir_.path()), (std::vector<std::string>{"d.plist", "m.plist", "o.plist"}));
}

// A writer killed at any instant leaves the old file or the new one, and no temporary file beside it.
TEST_F(PropertyListFile, WriterKilledWhileWritingLeavesNoTemporaryFile) {
  const URL target = urlOf("record.plist");
  ASSERT_TRUE(plist::writeFileBytes(Data{'o', 'l', 'd'}, target, true));
  const Data big(32 << 20, 'n');
  for (int delayMs : {1, 5, 20}) {
    const pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      for (;;) (void)plist::writeFileBytes(big, target, true);
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(delayMs));
    kill(child, SIGKILL);
    ASSERT_EQ(waitpid(child, nullptr, 0), child);
    EXPECT_EQ(qstest::entries(dir_.path()), std::vector<std::string>{"record.plist"}) << "after " << delayMs << " ms";
    const size_t size = std::filesystem::file_size(pathOf("record.plist"));
    EXPECT_TRUE(size == 3 || size == big.size()) << size;
  }
}

}  // namespace
