#include "Platform/Foundation/PropertyList.h"

#include <dirent.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstdint>
#include <limits>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "Platform/Foundation/FileErrors.h"
#include "support/TestSupport.h"

using platform::Array;
using platform::Data;
using platform::Date;
using platform::Dictionary;
using platform::Error;
using platform::URL;
using platform::Value;
namespace plist = platform::plist;

namespace {

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

std::string asText(const Data& d) { return std::string(d.begin(), d.end()); }

std::vector<std::string> directoryNames(const std::string& dir) {
  std::vector<std::string> names;
  DIR* d = opendir(dir.c_str());
  if (!d) return names;
  while (dirent* e = readdir(d)) {
    std::string n = e->d_name;
    if (n != "." && n != "..") names.push_back(n);
  }
  closedir(d);
  return names;
}

// Every type a property list holds, with the integer edges libplist gets
// wrong when left alone. Dates are whole seconds: the XML form keeps no
// fraction.
Dictionary everyType() {
  Data bytes;
  for (int i = 0; i < 256; ++i) bytes.push_back(static_cast<uint8_t>(i));
  return Dictionary{
      {"true", Value(true)},
      {"false", Value(false)},
      {"minusOne", Value(-1)},
      {"int64Min", Value(std::numeric_limits<int64_t>::min())},
      {"int64Max", Value(std::numeric_limits<int64_t>::max())},
      {"uint64Max", Value(std::numeric_limits<uint64_t>::max())},
      {"aboveInt64Max", Value(static_cast<uint64_t>(std::numeric_limits<int64_t>::max()) + 1)},
      {"zero", Value(0)},
      {"real", Value(0.1)},
      {"tinyReal", Value(-2.5e-300)},
      {"infinity", Value(std::numeric_limits<double>::infinity())},
      {"string", Value("h\xC3\xA9llo <&> \"quoted\" 'single' \xF0\x9F\x98\x80")},
      {"emptyString", Value("")},
      {"whitespace", Value("  a\tb\nc\r\nd  ")},
      {"data", Value(bytes)},
      {"emptyData", Value(Data())},
      {"date", Value(Date{-31536000.0})},
      {"laterDate", Value(Date{700000000.0})},
      {"array", Value(Array{Value(1), Value("two"), Value(Array{}), Value(Dictionary{})})},
      {"nested", Value(Dictionary{{"inner", Value(Dictionary{{"deep", Value(Array{Value(true)})}})}})},
      {"emptyArray", Value(Array{})},
      {"emptyDictionary", Value(Dictionary{})},
      {"key with spaces & <markup>", Value("v")},
  };
}

class PropertyListRoundTrip : public testing::TestWithParam<plist::Format> {};

TEST_P(PropertyListRoundTrip, EveryTypeComesBackEqualInMemoryAndThroughAFile) {
  Value original(everyType());
  Error error;
  std::optional<Data> bytes = plist::serialize(original, GetParam(), &error);
  ASSERT_TRUE(bytes) << error.description();
  std::optional<Value> back = plist::parse(bytes->data(), bytes->size(), &error);
  ASSERT_TRUE(back) << error.description();
  EXPECT_EQ(*back, original) << back->description();

  qstest::TempDir dir;
  URL url = URL::fileURL(dir / "all.plist");
  ASSERT_TRUE(plist::writeFile(original, url, GetParam(), true, &error)) << error.description();
  std::optional<Dictionary> read = plist::readDictionary(url, &error);
  ASSERT_TRUE(read) << error.description();
  EXPECT_EQ(Value(*read), original);
}

TEST_P(PropertyListRoundTrip, IntegersKeepTheirSignednessAndNaNStaysNaN) {
  const Value original(Array{Value(-1), Value(UINT64_MAX), Value(INT64_MIN), Value(static_cast<uint64_t>(1) << 63)});
  const Value::Type types[] = {Value::Type::Integer, Value::Type::Unsigned, Value::Type::Integer,
                               Value::Type::Unsigned};
  std::optional<Value> back = roundTrip(original, GetParam());
  ASSERT_TRUE(back && back->isArray() && back->asArray()->size() == 4u);
  EXPECT_EQ(*back, original);
  for (size_t i = 0; i < 4; ++i) EXPECT_EQ((*back->asArray())[i].type(), types[i]) << i;

  std::optional<Value> nan = roundTrip(Value(Array{Value(std::nan(""))}), GetParam());
  ASSERT_TRUE(nan && nan->isArray() && nan->asArray()->size() == 1);
  EXPECT_TRUE(std::isnan(nan->asArray()->front().doubleValue()));
}

TEST_P(PropertyListRoundTrip, NestedURLIsWrittenAsItsPath) {
  std::optional<Value> back = roundTrip(Value(Dictionary{{"where", Value(URL::fileURL("/private/var/x", true))}}),
                                        GetParam());
  ASSERT_TRUE(back);
  EXPECT_EQ(*back, Value(Dictionary{{"where", Value("/private/var/x")}}));
}

INSTANTIATE_TEST_SUITE_P(BothFormats, PropertyListRoundTrip, testing::Values(plist::Format::XML, plist::Format::Binary),
                         [](const auto& info) { return info.param == plist::Format::XML ? "XML" : "Binary"; });

TEST(PropertyListFormats, XMLWritesUnsignedTextAndUTCDates) {
  std::optional<Data> xml = plist::serialize(Value(Array{Value(UINT64_MAX), Value(-1), Value(Date{0})}),
                                             plist::Format::XML);
  ASSERT_TRUE(xml);
  std::string text = asText(*xml);
  for (const char* element : {"<integer>18446744073709551615</integer>", "<integer>-1</integer>",
                              "<date>2001-01-01T00:00:00Z</date>"}) {
    EXPECT_NE(text.find(element), std::string::npos) << text;
  }
}

TEST(PropertyListFormats, BinaryStartsWithMagicAndKeepsFractionalDates) {
  Value original(Array{Value(Date{12.25}), Value(Date{-4.5}), Value(Date{-978307200.0})});
  std::optional<Data> bin = plist::serialize(original, plist::Format::Binary);
  ASSERT_TRUE(bin);
  EXPECT_EQ(asText(*bin).substr(0, 8), "bplist00");
  std::optional<Value> back = plist::parse(bin->data(), bin->size());
  ASSERT_TRUE(back);
  EXPECT_EQ(*back, original);
}

TEST(PropertyListFormats, NonUTF8StringSurvivesXMLAndIsRefusedForBinary) {
  Value original(Dictionary{{"name", Value(std::string("caf\xE9\xFF"))}});
  EXPECT_EQ(roundTrip(original, plist::Format::XML), original);
  Error error;
  EXPECT_FALSE(plist::serialize(original, plist::Format::Binary, &error));
  EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileWriteUnknownError));
  EXPECT_NE(error.localizedDescription().find("not UTF-8"), std::string::npos) << error.description();
}

TEST(PropertyListFormats, BinaryFormAcceptsOnlyWellFormedUTF8) {
  const std::string refused[] = {"\xC0\xAF", "\xED\xA0\x80", "\xE2\x82", "\xF4\x90\x80\x80", "\x80", "\xF8\x88\x80\x80\x80"};
  for (const std::string& text : refused) {
    EXPECT_FALSE(plist::serialize(Value(text), plist::Format::Binary)) << testing::PrintToString(text);
    EXPECT_FALSE(plist::serialize(Value(Dictionary{{text, Value(1)}}), plist::Format::Binary));
  }
  for (const std::string text : {"\xC2\xA9", "\xE2\x82\xAC", "\xF4\x8F\xBF\xBF", "\x7F", ""}) {
    EXPECT_EQ(roundTrip(Value(Dictionary{{text, Value(text)}}), plist::Format::Binary),
              Value(Dictionary{{text, Value(text)}}))
        << testing::PrintToString(text);
  }
}

TEST(PropertyListFormats, UnwritableValuesAreRefused) {
  Value deep(Array{});
  for (int i = 0; i < 600; ++i) deep = Value(Array{deep});
  const std::pair<Value, std::string> cases[] = {
      {Value(), "null value"},
      {Value(Array{Value(1), Value()}), "null value"},
      {Value(URL::fileURL("/a")), "URL is not a property-list value"},
      {Value(Dictionary{{"e", Value(Error("D", 1))}}), "error record"},
      {Value(std::string("a\0b", 3)), "NUL"},
      {Value(Dictionary{{std::string("k\0", 2), Value(1)}}), "NUL"},
      {Value(Date{1e12}), "outside the range"},
      {Value(Date{std::nan("")}), "outside the range"},
      {deep, "nesting deeper"},
  };
  for (const auto& [value, reason] : cases) {
    for (plist::Format format : {plist::Format::XML, plist::Format::Binary}) {
      Error error;
      EXPECT_FALSE(plist::serialize(value, format, &error)) << reason;
      EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileWriteUnknownError)) << error.description();
      EXPECT_NE(error.localizedDescription().find(reason), std::string::npos) << error.description();
    }
  }
}

TEST(PropertyListThreads, ConcurrentRoundTripsAgree) {
  const Value original(everyType());
  std::vector<std::thread> threads;
  std::atomic<int> failures{0};
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      for (int i = 0; i < 100; ++i) {
        if (roundTrip(original, t % 2 ? plist::Format::Binary : plist::Format::XML) != original) failures++;
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(failures.load(), 0);
}

// ---- Leniency of libplist that the reader must not inherit ----

TEST(PropertyListMalformed, IsRefusedWithTheReason) {
  std::string deep = "<plist>";
  for (int i = 0; i < 100000; ++i) deep += "<array>";
  const std::pair<std::string, const char*> cases[] = {
      {kHeader + "<plist version=\"1.0\"><integer>abc</integer></plist>", "integer element holds \"abc\""},
      {kHeader + "<plist><integer>18446744073709551616</integer></plist>", "integer element"},
      {kHeader + "<plist><integer>-9223372036854775809</integer></plist>", "integer element"},
      {kHeader + "<plist><real>1.5x</real></plist>", "real element"},
      {kHeader + "<plist><real>+-1.5</real></plist>", "real element"},
      {kHeader + "<plist><real/></plist>", "real element"},
      {kHeader + "<plist><date>yesterday</date></plist>", "date element"},
      {kHeader + "<plist><data>!!!</data></plist>", "data element"},
      {kHeader + "<plist><dict><key>a</key><string>x</string><key>b</key></dict></plist>",
       "dictionary key \"b\" has no value"},
      {kHeader + "<plist><dict><integer>1</integer></dict></plist>", "where <key> was expected"},
      {kHeader + "<plist><array><key>a</key></array></plist>", "<key> outside a dictionary"},
      {kHeader + "<plist><dict><key>a</key><true/></dict></plist>xyz", "content after the end"},
      {kHeader + "<plist><true/><false/></plist>", "<false> where </plist> was expected"},
      {kHeader + "<plist version=\"1.0\"><dict><key>a</key><true/></dict>\n", "missing </plist>"},
      {kHeader + "<plist version=\"1.0\"></plist>", "<plist> holds no value"},
      {"", "the document is empty"},
      {"\xEF\xBB\xBF", "the document is empty"},
      {kHeader + "<plist><dict><key>a</key><string>abc", "unexpected end of the document"},
      {kHeader + "<plist><dict></array></plist>", "</array> where </dict> was expected"},
      {kHeader + "<plist><foo/></plist>", "unknown element <foo>"},
      {kHeader + "<plist><plist><true/></plist></plist>", "unknown element <plist>"},
      {kHeader + "<plist><array>abc<true/></array></plist>", "text where an element was expected"},
      {kHeader + "<plist><true>x</true></plist>", "<true> with content"},
      {kHeader + "<plist><string>a & b</string></plist>", "'&'"},
      {kHeader + "<plist><string>&nbsp;</string></plist>", "&nbsp;"},
      {kHeader + "<plist><!-- <true/></plist>", "unterminated comment"},
      {kHeader + std::string("<plist><dict><key>a\0b</key><true/></dict></plist>", 49), "a NUL character"},
      {"hello world", "text where an element was expected"},
      {"bplist00garbage", "malformed binary property list"},
      {deep, "nesting deeper"},
  };
  for (const auto& [document, problem] : cases) {
    Error error;
    EXPECT_FALSE(parseText(document, &error)) << document.substr(0, 200);
    EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadUnknownError)) << error.description();
    EXPECT_NE(error.localizedDescription().find(problem), std::string::npos) << error.description();
  }
  Error error;
  EXPECT_FALSE(plist::parse(nullptr, 10, &error));
  EXPECT_NE(error.localizedDescription().find("empty"), std::string::npos);
}

// ---- Valid documents in the forms other writers produce ----

TEST(PropertyListValidForms, AreReadWithTheirValues) {
  struct Case {
    std::string document;
    Value expected;
  };
  const Case cases[] = {
      {"\xEF\xBB\xBF" + kHeader + "<plist version=\"1.0\"><true/></plist>", Value(true)},
      {"<dict><key>a</key><integer>1</integer></dict>", Value(Dictionary{{"a", Value(1)}})},
      {"<?xml version=\"1.0\"?><!DOCTYPE plist [ <!ENTITY x \"y\"> ]><plist><false/></plist>", Value(false)},
      {kHeader + "<!-- c --><plist><!-- c --><dict><!-- c --><key>k</key><!-- c --><string>v</string></dict>"
                 "<!-- c --></plist><!-- c -->\n",
       Value(Dictionary{{"k", Value("v")}})},
      {kHeader + "<plist><string><![CDATA[a<b&c]]></string></plist>", Value("a<b&c")},
      {kHeader + "<plist><string>&amp;&lt;&gt;&quot;&apos;&#65;&#x42;</string></plist>", Value("&<>\"'AB")},
      {kHeader + "<plist><array><string/><dict/><array/><data/><true></true></array></plist>",
       Value(Array{Value(""), Value(Dictionary{}), Value(Array{}), Value(Data{}), Value(true)})},
      {kHeader + "<plist version=\"1>0\" ><integer> 42 </integer></plist >", Value(42)},
      {kHeader + "<plist><integer>0x10</integer></plist>", Value(16)},
      // Leading zeros are decimal, not octal.
      {kHeader + "<plist><array><integer>010</integer><integer>-007</integer><integer>08</integer>"
                 "<integer>00</integer><integer> +09 </integer><integer>0</integer><string>010</string></array>"
                 "</plist>",
       Value(Array{Value(10), Value(-7), Value(8), Value(0), Value(9), Value(0), Value("010")})},
      {kHeader + "<plist><dict><key>a</key><integer>0010</integer><key>b</key><string>x</string>"
                 "<key>c</key><integer>\n0009\n</integer></dict></plist>",
       Value(Dictionary{{"a", Value(10)}, {"b", Value("x")}, {"c", Value(9)}})},
      {kHeader + "<plist><integer>-9223372036854775808</integer></plist>", Value(INT64_MIN)},
      {kHeader + "<plist><real>-1.5e3</real></plist>", Value(-1500.0)},
      {kHeader + "<plist><real>+infinity</real></plist>", Value(std::numeric_limits<double>::infinity())},
      {kHeader + "<plist><real>-inf</real></plist>", Value(-std::numeric_limits<double>::infinity())},
      {kHeader + "<plist><real>1e400</real></plist>", Value(std::numeric_limits<double>::infinity())},
      {kHeader + "<plist><real>0x1.8p1</real></plist>", Value(3.0)},
      {kHeader + "<plist><real>.5</real></plist>", Value(0.5)},
      {kHeader + "<plist><date>2001-01-01T00:01:40.5Z</date></plist>", Value(Date{100})},
      {kHeader + "<plist><data>AAEC\n\tAwQ=</data></plist>", Value(Data{0, 1, 2, 3, 4})},
      {kHeader + "<plist><dict><key>a</key><integer>1</integer><key>a</key><integer>2</integer></dict></plist>",
       Value(Dictionary{{"a", Value(2)}})},
  };
  for (const Case& c : cases) {
    Error error;
    std::optional<Value> value = parseText(c.document, &error);
    ASSERT_TRUE(value) << c.document << "\n" << error.description();
    EXPECT_EQ(*value, c.expected) << c.document << "\n" << value->description();
  }
}

// ---- Binary documents that would bring libplist down ----

// A binary document of the given objects (4-byte offsets and references).
Data binaryDocument(const std::vector<Data>& objects, uint64_t top = 0) {
  auto appendBigEndian = [](Data& out, uint64_t v, int width) {
    for (int i = width - 1; i >= 0; --i) out.push_back(static_cast<uint8_t>(v >> (8 * i)));
  };
  Data out{'b', 'p', 'l', 'i', 's', 't', '0', '0'};
  std::vector<uint64_t> offsets;
  for (const Data& object : objects) {
    offsets.push_back(out.size());
    out.insert(out.end(), object.begin(), object.end());
  }
  uint64_t table = out.size();
  for (uint64_t offset : offsets) appendBigEndian(out, offset, 4);
  out.insert(out.end(), 6, 0);
  out.push_back(4);  // offset width
  out.push_back(4);  // reference width
  appendBigEndian(out, objects.size(), 8);
  appendBigEndian(out, top, 8);
  appendBigEndian(out, table, 8);
  return out;
}

Data ref(uint8_t marker, std::initializer_list<uint32_t> refs) {
  Data out{marker};
  for (uint32_t r : refs) {
    for (int i = 3; i >= 0; --i) out.push_back(static_cast<uint8_t>(r >> (8 * i)));
  }
  return out;
}

constexpr uint8_t kTrueObject = 0x09;

// A chain of `levels` arrays, each holding the next `width` times, ending in `last`.
Data chainDocument(uint32_t levels, uint8_t marker, size_t width, Data last) {
  std::vector<Data> objects;
  for (uint32_t i = 0; i < levels; ++i) objects.push_back(width == 1 ? ref(marker, {i + 1}) : ref(marker, {i + 1, i + 1}));
  objects.push_back(last);
  return binaryDocument(objects);
}

TEST(PropertyListHostileBinary, HandMadeDocumentsWithinTheLimitsAreRead) {
  // {"ab": true}
  Data doc = binaryDocument({ref(0xD1, {1, 2}), Data{0x52, 'a', 'b'}, Data{kTrueObject}});
  EXPECT_EQ(plist::parse(doc.data(), doc.size()), Value(Dictionary{{"ab", Value(true)}}));
  Data atLimit = chainDocument(512, 0xA1, 1, Data{0xA0});
  Error error;
  EXPECT_TRUE(plist::parse(atLimit.data(), atLimit.size(), &error)) << error.description();
  Data shared = chainDocument(10, 0xA2, 2, Data{kTrueObject});
  std::optional<Value> value = plist::parse(shared.data(), shared.size());
  ASSERT_TRUE(value && value->isArray());
  EXPECT_EQ(value->asArray()->size(), 2u);
}

TEST(PropertyListHostileBinary, DangerousDocumentsAreRefused) {
  std::vector<std::pair<Data, std::string>> cases = {
      {chainDocument(99999, 0xA1, 1, Data{0xA0}), "nesting deeper than 512 levels"},
      {binaryDocument({ref(0xA1, {0})}), "contains itself"},
      {chainDocument(64, 0xA2, 2, Data{kTrueObject}), "expand to more than"},
  };
  // As a key libplist would abort on a NUL; as a value it would cut the string short.
  for (const Data& string : {Data{0x53, 'a', 0, 'b'}, Data{0x62, 0, 'a', 0, 0}}) {
    for (const Data& container : {ref(0xD1, {1, 2}), ref(0xA1, {1})}) {
      cases.push_back({binaryDocument({container, string, Data{kTrueObject}}), "a string holds a NUL character"});
    }
  }
  for (const auto& [doc, problem] : cases) {
    Error error;
    EXPECT_FALSE(plist::parse(doc.data(), doc.size(), &error)) << problem;
    EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadUnknownError));
    EXPECT_NE(error.localizedDescription().find(problem), std::string::npos) << error.description();
  }
}

// ---- Damaged input never crashes ----

TEST(PropertyListDamagedInput, EveryTruncationIsRefusedUntilTheEndTag) {
  std::optional<Data> xml = plist::serialize(Value(everyType()), plist::Format::XML);
  ASSERT_TRUE(xml);
  const std::string text = asText(*xml);
  const size_t complete = text.rfind("</plist>") + std::string("</plist>").size();
  for (size_t n = 0; n < text.size(); ++n) {
    std::optional<Value> value = parseText(text.substr(0, n));
    if (n < complete) {
      EXPECT_FALSE(value) << "prefix of " << n << " bytes was accepted";
    } else {
      EXPECT_TRUE(value && *value == Value(everyType())) << "prefix of " << n << " bytes";
    }
  }
  std::optional<Data> bin = plist::serialize(Value(everyType()), plist::Format::Binary);
  ASSERT_TRUE(bin);
  for (size_t n = 0; n < bin->size(); ++n) {
    Error error;
    EXPECT_FALSE(plist::parse(bin->data(), n, &error)) << "prefix of " << n << " bytes was accepted";
    EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadUnknownError));
  }
}

TEST(PropertyListDamagedInput, MutatedDocumentsNeverCrash) {
  std::mt19937 random(20261122);
  for (plist::Format format : {plist::Format::XML, plist::Format::Binary}) {
    std::optional<Data> original = plist::serialize(Value(everyType()), format);
    ASSERT_TRUE(original);
    for (int round = 0; round < 3000; ++round) {
      Data mutated = *original;
      std::uniform_int_distribution<size_t> position(0, mutated.size() - 1);
      for (int k = 0; k < 1 + round % 4; ++k) mutated[position(random)] = static_cast<uint8_t>(random());
      Error error;
      if (!plist::parse(mutated.data(), mutated.size(), &error)) {
        EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadUnknownError));
      }
    }
  }
}

// ---- Files ----

class PropertyListFile : public testing::Test {
 protected:
  std::string pathOf(const std::string& name) const { return dir_ / name; }
  URL urlOf(const std::string& name) const { return URL::fileURL(pathOf(name)); }
  // Writes "new" over `target` with `locked` immutable; expects EPERM, the old contents kept and, when
  // given, `phrase` and the path in the message.
  void expectRefusedWhileImmutable(const std::string& locked, const std::string& target, bool atomically,
                                   const char* phrase = nullptr) {
    ASSERT_TRUE(plist::writeFile(Value(Dictionary{{"v", Value("old")}}), urlOf(target)));
    const std::string before = qstest::readFile(pathOf(target));
    ASSERT_TRUE(qstest::setImmutable(pathOf(locked), true));
    Error error;
    bool written = plist::writeFile(Value(Dictionary{{"v", Value("new")}}), urlOf(target), plist::Format::XML,
                                    atomically, &error);
    ASSERT_TRUE(qstest::setImmutable(pathOf(locked), false));
    EXPECT_FALSE(written);
    EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileWriteUnknownError)) << error.description();
    ASSERT_NE(error.underlyingError(), nullptr);
    EXPECT_TRUE(error.underlyingError()->isPOSIX(EPERM)) << error.description();
    EXPECT_EQ(qstest::readFile(pathOf(target)), before);
    const std::string directory = pathOf(target).substr(0, pathOf(target).rfind('/'));
    EXPECT_EQ(directoryNames(directory), std::vector<std::string>{pathOf(target).substr(directory.size() + 1)});
    if (phrase) {
      EXPECT_NE(error.localizedDescription().find(phrase), std::string::npos) << error.description();
      EXPECT_NE(error.localizedDescription().find(pathOf(target)), std::string::npos);
    }
  }
  qstest::TempDir dir_;
};

TEST_F(PropertyListFile, MissingFileIsNoSuchFileWithPOSIXUnderlyingError) {
  Error error;
  EXPECT_FALSE(plist::readFile(urlOf("absent.plist"), &error));
  EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadNoSuchFileError)) << error.description();
  ASSERT_NE(error.underlyingError(), nullptr);
  EXPECT_TRUE(error.underlyingError()->isPOSIX(ENOENT));
  EXPECT_NE(error.underlyingError()->localizedDescription().find(pathOf("absent.plist")), std::string::npos);
  EXPECT_EQ(error.localizedDescription(), "Could not read \"" + pathOf("absent.plist") + "\": no such file");
  ASSERT_EQ(error.userInfo().count(platform::kFilePathErrorKey), 1u);
  EXPECT_EQ(error.userInfo().at(platform::kFilePathErrorKey), Value(pathOf("absent.plist")));
}

TEST_F(PropertyListFile, DirectoryAndFIFOAreReadFailures) {
  ASSERT_TRUE(qstest::makeDirs(pathOf("dir.plist")));
  Error error;
  EXPECT_FALSE(plist::readFileBytes(urlOf("dir.plist"), &error));
  EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadUnknownError)) << error.description();
  ASSERT_NE(error.underlyingError(), nullptr);
  EXPECT_TRUE(error.underlyingError()->isPOSIX(EISDIR));

  ASSERT_EQ(mkfifo(pathOf("pipe").c_str(), 0644), 0);
  EXPECT_FALSE(plist::readFileBytes(urlOf("pipe"), &error));
  EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadUnknownError));
  EXPECT_NE(error.localizedDescription().find("not a regular file"), std::string::npos);
}

TEST_F(PropertyListFile, UnreadableFileIsAReadFailureWithEACCES) {
  ASSERT_TRUE(qstest::writeFile(pathOf("secret.plist"), "<plist><true/></plist>"));
  ASSERT_EQ(chmod(pathOf("secret.plist").c_str(), 0600), 0);
  const URL url = urlOf("secret.plist");
  int status = qstest::runAsNobody([&] {
    Error error;
    if (plist::readFile(url, &error)) return 1;
    if (!error.is(platform::kFileErrorDomain, platform::kFileReadUnknownError)) return 2;
    if (!error.underlyingError() || !error.underlyingError()->isPOSIX(EACCES)) return 3;
    return 0;
  });
  EXPECT_EQ(status, 0);
}

TEST_F(PropertyListFile, WrongRootOrMalformedFileNamesThePathAndTheProblem) {
  ASSERT_TRUE(plist::writeFile(Value(Array{Value(1)}), urlOf("array.plist")));
  Error error;
  EXPECT_FALSE(plist::readDictionary(urlOf("array.plist"), &error));
  EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadUnknownError)) << error.description();
  EXPECT_EQ(error.localizedDescription(), "Could not read \"" + pathOf("array.plist") +
                                              "\": the property list's root is an array, not a dictionary");
  EXPECT_EQ(error.underlyingError(), nullptr);
  ASSERT_TRUE(plist::writeFile(Value("text"), urlOf("string.plist")));
  EXPECT_FALSE(plist::readDictionary(urlOf("string.plist"), &error));
  EXPECT_NE(error.localizedDescription().find("root is a string, not a dictionary"), std::string::npos);

  ASSERT_TRUE(qstest::writeFile(pathOf("bad.plist"), kHeader + "<plist><integer>abc</integer></plist>"));
  EXPECT_FALSE(plist::readFile(urlOf("bad.plist"), &error));
  EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadUnknownError));
  EXPECT_EQ(error.localizedDescription().rfind("Could not read \"" + pathOf("bad.plist") +
                                                    "\": not a valid property list: integer element holds \"abc\"",
                                                0),
            0u)
      << error.localizedDescription();
}

TEST_F(PropertyListFile, BytesRoundTripBothWays) {
  Data bytes;
  for (int i = 0; i < 200000; ++i) bytes.push_back(static_cast<uint8_t>(i * 7));
  for (const Data& contents : {bytes, Data{}}) {
    for (bool atomically : {true, false}) {
      ASSERT_TRUE(plist::writeFileBytes(contents, urlOf("blob"), atomically));
      EXPECT_EQ(plist::readFileBytes(urlOf("blob")), contents);
    }
  }
}

TEST_F(PropertyListFile, AtomicWriteReplacesKeepsPermissionsAndLeavesNoTemporaryFile) {
  ASSERT_TRUE(plist::writeFile(Value(Dictionary{{"v", Value(1)}}), urlOf("m.plist")));
  struct stat st;
  ASSERT_EQ(stat(pathOf("m.plist").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0644u);
  ASSERT_EQ(chmod(pathOf("m.plist").c_str(), 0600), 0);
  ASSERT_TRUE(plist::writeFile(Value(Dictionary{{"v", Value(2)}}), urlOf("m.plist")));
  EXPECT_EQ(plist::readDictionary(urlOf("m.plist")), (Dictionary{{"v", Value(2)}}));
  ASSERT_EQ(stat(pathOf("m.plist").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0600u);
  EXPECT_EQ(directoryNames(dir_.path()), std::vector<std::string>{"m.plist"});
}

TEST_F(PropertyListFile, AtomicWriteKeepsOldFileWhenTheRenameIsRefused) {
  expectRefusedWhileImmutable("m.plist", "m.plist", true, "rename failed");
}

TEST_F(PropertyListFile, AtomicWriteIntoImmutableDirectoryKeepsOldFile) {
  ASSERT_TRUE(qstest::makeDirs(pathOf("locked")));
  expectRefusedWhileImmutable("locked", "locked/m.plist", true);
}

TEST_F(PropertyListFile, InPlaceWriteToImmutableFileFailsWithEPERM) {
  expectRefusedWhileImmutable("m.plist", "m.plist", false);
}

TEST_F(PropertyListFile, WriteFailuresCarryThePOSIXError) {
  ASSERT_TRUE(qstest::makeDirs(pathOf("d.plist/child")));
  const struct {
    URL url;
    bool atomically;
    int code;
  } cases[] = {{urlOf("d.plist"), true, EISDIR},
               {urlOf("none/m.plist"), true, ENOENT},
               {urlOf("none/m.plist"), false, ENOENT},
               {URL::fileURL("/dev/full"), false, ENOSPC}};
  for (const auto& c : cases) {
    Error error;
    EXPECT_FALSE(plist::writeFileBytes(Data(4096, 7), c.url, c.atomically, &error)) << c.url.path();
    EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileWriteUnknownError)) << error.description();
    ASSERT_NE(error.underlyingError(), nullptr);
    EXPECT_TRUE(error.underlyingError()->isPOSIX(c.code)) << error.description();
    if (c.code == ENOSPC) {
      EXPECT_NE(error.localizedDescription().find("write failed"), std::string::npos);
    }
  }
  EXPECT_EQ(directoryNames(dir_.path()), std::vector<std::string>{"d.plist"});
  EXPECT_EQ(directoryNames(pathOf("d.plist")), std::vector<std::string>{"child"});
}

TEST_F(PropertyListFile, AtomicWriteOfALongNameStaysWithinNameLimits) {
  const std::string name(250, 'n');
  Error error;
  ASSERT_TRUE(plist::writeFile(Value(Dictionary{}), urlOf(name), plist::Format::Binary, true, &error))
      << error.description();
  EXPECT_EQ(directoryNames(dir_.path()), std::vector<std::string>{name});
}

TEST_F(PropertyListFile, UnwritableValueLeavesTheFileAlone) {
  ASSERT_TRUE(qstest::writeFile(pathOf("m.plist"), "before"));
  Error error;
  EXPECT_FALSE(plist::writeFile(Value(Array{Value()}), urlOf("m.plist"), plist::Format::XML, true, &error));
  EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileWriteUnknownError));
  EXPECT_EQ(error.localizedDescription(),
            "Could not write \"" + pathOf("m.plist") + "\": a null value cannot be written");
  EXPECT_EQ(qstest::readFile(pathOf("m.plist")), "before");
}

// A writer killed at any instant leaves the old file or the new one, and no
// temporary file beside it.
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
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    EXPECT_EQ(directoryNames(dir_.path()), std::vector<std::string>{"record.plist"}) << "after " << delayMs << " ms";
    struct stat st;
    ASSERT_EQ(stat(pathOf("record.plist").c_str(), &st), 0);
    EXPECT_TRUE(st.st_size == 3 || static_cast<size_t>(st.st_size) == big.size()) << st.st_size;
  }
}

}  // namespace
