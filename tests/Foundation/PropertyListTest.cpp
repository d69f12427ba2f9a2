#include "Platform/Foundation/PropertyList.h"

#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
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

TEST_P(PropertyListRoundTrip, EveryTypeComesBackEqual) {
  Value original(everyType());
  Error error;
  std::optional<Data> bytes = plist::serialize(original, GetParam(), &error);
  ASSERT_TRUE(bytes) << error.description();
  std::optional<Value> back = plist::parse(bytes->data(), bytes->size(), &error);
  ASSERT_TRUE(back) << error.description();
  EXPECT_EQ(*back, original) << back->description();
}

TEST_P(PropertyListRoundTrip, IntegersKeepTheirSignedness) {
  Value original(Array{Value(-1), Value(std::numeric_limits<uint64_t>::max()), Value(std::numeric_limits<int64_t>::min()),
                       Value(static_cast<uint64_t>(1) << 63)});
  std::optional<Data> bytes = plist::serialize(original, GetParam());
  ASSERT_TRUE(bytes);
  std::optional<Value> back = plist::parse(bytes->data(), bytes->size());
  ASSERT_TRUE(back && back->isArray());
  const Array& items = *back->asArray();
  ASSERT_EQ(items.size(), 4u);
  EXPECT_EQ(items[0].type(), Value::Type::Integer);
  EXPECT_EQ(items[0].int64Value(), -1);
  EXPECT_EQ(items[1].type(), Value::Type::Unsigned);
  EXPECT_EQ(items[1].uint64Value(), UINT64_MAX);
  EXPECT_EQ(items[2].type(), Value::Type::Integer);
  EXPECT_EQ(items[2].int64Value(), INT64_MIN);
  EXPECT_EQ(items[3].type(), Value::Type::Unsigned);
  EXPECT_EQ(items[3].uint64Value(), static_cast<uint64_t>(1) << 63);
}

TEST_P(PropertyListRoundTrip, NotANumberStaysNotANumber) {
  std::optional<Data> bytes = plist::serialize(Value(Array{Value(std::nan(""))}), GetParam());
  ASSERT_TRUE(bytes);
  std::optional<Value> back = plist::parse(bytes->data(), bytes->size());
  ASSERT_TRUE(back && back->isArray() && back->asArray()->size() == 1);
  EXPECT_TRUE(std::isnan(back->asArray()->front().doubleValue()));
}

TEST_P(PropertyListRoundTrip, FileWrittenAndReadBack) {
  qstest::TempDir dir;
  URL url = URL::fileURL(dir / "all.plist");
  Error error;
  ASSERT_TRUE(plist::writeFile(Value(everyType()), url, GetParam(), true, &error)) << error.description();
  std::optional<Dictionary> back = plist::readDictionary(url, &error);
  ASSERT_TRUE(back) << error.description();
  EXPECT_EQ(Value(*back), Value(everyType()));
}

TEST_P(PropertyListRoundTrip, NestedURLIsWrittenAsItsPath) {
  Value original(Dictionary{{"where", Value(URL::fileURL("/private/var/x", true))}});
  std::optional<Data> bytes = plist::serialize(original, GetParam());
  ASSERT_TRUE(bytes);
  std::optional<Value> back = plist::parse(bytes->data(), bytes->size());
  ASSERT_TRUE(back);
  EXPECT_EQ(*back, Value(Dictionary{{"where", Value("/private/var/x")}}));
}

INSTANTIATE_TEST_SUITE_P(BothFormats, PropertyListRoundTrip, testing::Values(plist::Format::XML, plist::Format::Binary),
                         [](const auto& info) { return info.param == plist::Format::XML ? "XML" : "Binary"; });

TEST(PropertyListFormats, LargeUnsignedIsWrittenAsUnsignedText) {
  std::optional<Data> xml = plist::serialize(Value(Array{Value(UINT64_MAX), Value(-1)}), plist::Format::XML);
  ASSERT_TRUE(xml);
  std::string text = asText(*xml);
  EXPECT_NE(text.find("<integer>18446744073709551615</integer>"), std::string::npos) << text;
  EXPECT_NE(text.find("<integer>-1</integer>"), std::string::npos) << text;
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

TEST(PropertyListFormats, XMLDateIsWrittenInUTC) {
  std::optional<Data> xml = plist::serialize(Value(Date{0}), plist::Format::XML);
  ASSERT_TRUE(xml);
  EXPECT_NE(asText(*xml).find("<date>2001-01-01T00:00:00Z</date>"), std::string::npos);
}

TEST(PropertyListFormats, NonUTF8StringSurvivesXMLAndIsRefusedForBinary) {
  Value original(Dictionary{{"name", Value(std::string("caf\xE9\xFF"))}});
  std::optional<Data> xml = plist::serialize(original, plist::Format::XML);
  ASSERT_TRUE(xml);
  std::optional<Value> back = plist::parse(xml->data(), xml->size());
  ASSERT_TRUE(back);
  EXPECT_EQ(*back, original);

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
  const std::string accepted[] = {"\xC2\xA9", "\xE2\x82\xAC", "\xF4\x8F\xBF\xBF", "\x7F", ""};
  for (const std::string& text : accepted) {
    std::optional<Data> bytes = plist::serialize(Value(Dictionary{{text, Value(text)}}), plist::Format::Binary);
    ASSERT_TRUE(bytes) << testing::PrintToString(text);
    std::optional<Value> back = plist::parse(bytes->data(), bytes->size());
    ASSERT_TRUE(back);
    EXPECT_EQ(*back, Value(Dictionary{{text, Value(text)}}));
  }
}

TEST(PropertyListFormats, UnwritableValuesAreRefused) {
  struct Case {
    Value value;
    std::string reason;
  };
  const Case cases[] = {
      {Value(), "null value"},
      {Value(Array{Value(1), Value()}), "null value"},
      {Value(URL::fileURL("/a")), "URL is not a property-list value"},
      {Value(Dictionary{{"e", Value(Error("D", 1))}}), "error record"},
      {Value(std::string("a\0b", 3)), "NUL"},
      {Value(Dictionary{{std::string("k\0", 2), Value(1)}}), "NUL"},
      {Value(Date{1e12}), "outside the range"},
      {Value(Date{std::nan("")}), "outside the range"},
  };
  for (const Case& c : cases) {
    for (plist::Format format : {plist::Format::XML, plist::Format::Binary}) {
      Error error;
      EXPECT_FALSE(plist::serialize(c.value, format, &error)) << c.value.description();
      EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileWriteUnknownError)) << error.description();
      EXPECT_NE(error.localizedDescription().find(c.reason), std::string::npos) << error.description();
    }
  }
}

TEST(PropertyListFormats, TooDeepNestingIsRefusedBothWays) {
  Value deep(Array{});
  for (int i = 0; i < 600; ++i) deep = Value(Array{deep});
  Error error;
  EXPECT_FALSE(plist::serialize(deep, plist::Format::XML, &error));
  EXPECT_NE(error.localizedDescription().find("nesting deeper"), std::string::npos) << error.description();

  std::string text = "<plist>";
  for (int i = 0; i < 100000; ++i) text += "<array>";
  Error readError;
  EXPECT_FALSE(parseText(text, &readError));
  EXPECT_NE(readError.localizedDescription().find("nesting deeper"), std::string::npos) << readError.description();
}

TEST(PropertyListThreads, ConcurrentRoundTripsAgree) {
  const Value original(everyType());
  std::vector<std::thread> threads;
  std::atomic<int> failures{0};
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([&, t] {
      const plist::Format format = t % 2 ? plist::Format::Binary : plist::Format::XML;
      for (int i = 0; i < 100; ++i) {
        std::optional<Data> bytes = plist::serialize(original, format);
        std::optional<Value> back = bytes ? plist::parse(bytes->data(), bytes->size()) : std::nullopt;
        if (!back || *back != original) failures.fetch_add(1);
      }
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(failures.load(), 0);
}

// ---- Leniency of libplist that the reader must not inherit ----

struct MalformedCase {
  const char* name;
  std::string document;
  const char* problem;
};

void PrintTo(const MalformedCase& c, std::ostream* os) { *os << c.name; }

class PropertyListMalformed : public testing::TestWithParam<MalformedCase> {};

TEST_P(PropertyListMalformed, IsRefusedWithTheReason) {
  const MalformedCase& c = GetParam();
  Error error;
  EXPECT_FALSE(parseText(c.document, &error));
  EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadUnknownError)) << error.description();
  EXPECT_NE(error.localizedDescription().find(c.problem), std::string::npos) << error.description();
}

INSTANTIATE_TEST_SUITE_P(
    Documents, PropertyListMalformed,
    testing::Values(
        MalformedCase{"IntegerNotANumber", kHeader + "<plist version=\"1.0\"><integer>abc</integer></plist>",
                      "integer element holds \"abc\""},
        MalformedCase{"IntegerEmpty", kHeader + "<plist><integer></integer></plist>", "integer element"},
        MalformedCase{"IntegerTooLarge", kHeader + "<plist><integer>18446744073709551616</integer></plist>",
                      "integer element"},
        MalformedCase{"IntegerTooSmall", kHeader + "<plist><integer>-9223372036854775809</integer></plist>",
                      "integer element"},
        MalformedCase{"RealNotANumber", kHeader + "<plist><real>1.5x</real></plist>", "real element"},
        MalformedCase{"RealWithTwoSigns", kHeader + "<plist><real>+-1.5</real></plist>", "real element"},
        MalformedCase{"RealWithComma", kHeader + "<plist><real>1,5</real></plist>", "real element"},
        MalformedCase{"RealEmpty", kHeader + "<plist><real/></plist>", "real element"},
        MalformedCase{"DateGarbage", kHeader + "<plist><date>yesterday</date></plist>", "date element"},
        MalformedCase{"DataNotBase64", kHeader + "<plist><data>!!!</data></plist>", "data element"},
        MalformedCase{"KeyWithoutValue",
                      kHeader + "<plist><dict><key>a</key><string>x</string><key>b</key></dict></plist>",
                      "dictionary key \"b\" has no value"},
        MalformedCase{"ValueWithoutKey", kHeader + "<plist><dict><integer>1</integer></dict></plist>",
                      "where <key> was expected"},
        MalformedCase{"KeyOutsideDictionary", kHeader + "<plist><array><key>a</key></array></plist>",
                      "<key> outside a dictionary"},
        MalformedCase{"TrailingGarbage", kHeader + "<plist><dict><key>a</key><true/></dict></plist>xyz",
                      "content after the end"},
        MalformedCase{"SecondRoot", kHeader + "<plist><dict/></plist><dict/>", "content after the end"},
        MalformedCase{"TwoValuesInPlist", kHeader + "<plist><true/><false/></plist>",
                      "<false> where </plist> was expected"},
        MalformedCase{"MissingPlistEnd", kHeader + "<plist version=\"1.0\"><dict><key>a</key><true/></dict>\n",
                      "missing </plist>"},
        MalformedCase{"EmptyPlist", kHeader + "<plist version=\"1.0\"></plist>", "<plist> holds no value"},
        MalformedCase{"EmptyFile", "", "the document is empty"},
        MalformedCase{"OnlyWhitespace", " \n\t ", "the document is empty"},
        MalformedCase{"OnlyByteOrderMark", "\xEF\xBB\xBF", "the document is empty"},
        MalformedCase{"TruncatedInString", kHeader + "<plist><dict><key>a</key><string>abc",
                      "unexpected end of the document"},
        MalformedCase{"MismatchedEnd", kHeader + "<plist><dict></array></plist>", "</array> where </dict> was expected"},
        MalformedCase{"UnknownElement", kHeader + "<plist><foo/></plist>", "unknown element <foo>"},
        MalformedCase{"NestedPlist", kHeader + "<plist><plist><true/></plist></plist>", "unknown element <plist>"},
        MalformedCase{"TextInArray", kHeader + "<plist><array>abc<true/></array></plist>",
                      "text where an element was expected"},
        MalformedCase{"BooleanWithContent", kHeader + "<plist><true>x</true></plist>", "<true> with content"},
        MalformedCase{"RawAmpersand", kHeader + "<plist><string>a & b</string></plist>", "'&'"},
        MalformedCase{"UnknownEntity", kHeader + "<plist><string>&nbsp;</string></plist>", "&nbsp;"},
        MalformedCase{"UnterminatedComment", kHeader + "<plist><!-- <true/></plist>", "unterminated comment"},
        MalformedCase{"NULInKey", kHeader + std::string("<plist><dict><key>a\0b</key><true/></dict></plist>", 49),
                      "a NUL character"},
        MalformedCase{"NotXMLAtAll", "hello world", "text where an element was expected"},
        MalformedCase{"BadBinary", "bplist00garbage", "malformed binary property list"}),
    [](const auto& info) { return std::string(info.param.name); });

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
      {kHeader + "<plist><integer>0x0F</integer></plist>", Value(15)},
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
      {kHeader + "<plist><real>-2</real></plist>", Value(-2.0)},
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

TEST(PropertyListHostileBinary, WellFormedHandMadeDocumentIsRead) {
  // {"ab": true}
  Data doc = binaryDocument({ref(0xD1, {1, 2}), Data{0x52, 'a', 'b'}, Data{kTrueObject}});
  std::optional<Value> value = plist::parse(doc.data(), doc.size());
  ASSERT_TRUE(value);
  EXPECT_EQ(*value, Value(Dictionary{{"ab", Value(true)}}));
}

TEST(PropertyListHostileBinary, StringWithNULIsRefused) {
  // As a key libplist would abort on it; as a value it would cut it short.
  const Data strings[] = {Data{0x53, 'a', 0, 'b'}, Data{0x62, 0, 'a', 0, 0}};
  for (const Data& string : strings) {
    for (const Data& container : {ref(0xD1, {1, 2}), ref(0xA1, {1})}) {
      Data doc = binaryDocument({container, string, Data{kTrueObject}});
      Error error;
      EXPECT_FALSE(plist::parse(doc.data(), doc.size(), &error));
      EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadUnknownError));
      EXPECT_NE(error.localizedDescription().find("a string holds a NUL character"), std::string::npos)
          << error.description();
    }
  }
}

TEST(PropertyListHostileBinary, DeepNestingIsRefused) {
  std::vector<Data> objects;
  const uint32_t levels = 100000;
  for (uint32_t i = 0; i + 1 < levels; ++i) objects.push_back(ref(0xA1, {i + 1}));
  objects.push_back(Data{0xA0});
  Data doc = binaryDocument(objects);
  Error error;
  EXPECT_FALSE(plist::parse(doc.data(), doc.size(), &error));
  EXPECT_NE(error.localizedDescription().find("nesting deeper than 512 levels"), std::string::npos)
      << error.description();
}

TEST(PropertyListHostileBinary, NestingAtTheLimitIsRead) {
  std::vector<Data> objects;
  for (uint32_t i = 0; i < 512; ++i) objects.push_back(ref(0xA1, {i + 1}));
  objects.push_back(Data{0xA0});
  Data doc = binaryDocument(objects);
  Error error;
  EXPECT_TRUE(plist::parse(doc.data(), doc.size(), &error)) << error.description();
}

TEST(PropertyListHostileBinary, SelfContainingArrayIsRefused) {
  Data doc = binaryDocument({ref(0xA1, {0})});
  Error error;
  EXPECT_FALSE(plist::parse(doc.data(), doc.size(), &error));
  EXPECT_NE(error.localizedDescription().find("contains itself"), std::string::npos) << error.description();
}

TEST(PropertyListHostileBinary, ExponentiallySharedObjectsAreRefused) {
  std::vector<Data> objects;
  const uint32_t levels = 64;
  for (uint32_t i = 0; i < levels; ++i) objects.push_back(ref(0xA2, {i + 1, i + 1}));
  objects.push_back(Data{kTrueObject});
  Data doc = binaryDocument(objects);
  Error error;
  EXPECT_FALSE(plist::parse(doc.data(), doc.size(), &error));
  EXPECT_NE(error.localizedDescription().find("expand to more than"), std::string::npos) << error.description();
}

TEST(PropertyListHostileBinary, ModeratelySharedObjectsAreRead) {
  std::vector<Data> objects;
  for (uint32_t i = 0; i < 10; ++i) objects.push_back(ref(0xA2, {i + 1, i + 1}));
  objects.push_back(Data{kTrueObject});
  Data doc = binaryDocument(objects);
  std::optional<Value> value = plist::parse(doc.data(), doc.size());
  ASSERT_TRUE(value && value->isArray());
  EXPECT_EQ(value->asArray()->size(), 2u);
}

// ---- Damaged input never crashes ----

TEST(PropertyListDamagedInput, EveryTruncationOfXMLIsRefusedUntilTheEndTag) {
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
}

TEST(PropertyListDamagedInput, EveryTruncationOfBinaryIsRefused) {
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
      std::optional<Value> value = plist::parse(mutated.data(), mutated.size(), &error);
      if (!value) {
        EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadUnknownError));
      }
    }
  }
}

TEST(PropertyListDamagedInput, NullBufferReadsAsEmpty) {
  Error error;
  EXPECT_FALSE(plist::parse(nullptr, 10, &error));
  EXPECT_NE(error.localizedDescription().find("empty"), std::string::npos);
}

// ---- Files ----

class PropertyListFile : public testing::Test {
 protected:
  std::string pathOf(const std::string& name) const { return dir_ / name; }
  URL urlOf(const std::string& name) const { return URL::fileURL(pathOf(name)); }
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
  const Value* path = error.userInfo().count(platform::kFilePathErrorKey)
                          ? &error.userInfo().find(platform::kFilePathErrorKey)->second
                          : nullptr;
  ASSERT_NE(path, nullptr);
  EXPECT_EQ(*path, Value(pathOf("absent.plist")));
}

TEST_F(PropertyListFile, DirectoryIsAReadFailureWithEISDIR) {
  ASSERT_TRUE(qstest::makeDirs(pathOf("dir.plist")));
  Error error;
  EXPECT_FALSE(plist::readFileBytes(urlOf("dir.plist"), &error));
  EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadUnknownError)) << error.description();
  ASSERT_NE(error.underlyingError(), nullptr);
  EXPECT_TRUE(error.underlyingError()->isPOSIX(EISDIR));
}

TEST_F(PropertyListFile, FIFOIsRefusedWithoutBlocking) {
  ASSERT_EQ(mkfifo(pathOf("pipe").c_str(), 0644), 0);
  Error error;
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

TEST_F(PropertyListFile, ReadsAFileThatStartsWithAByteOrderMark) {
  ASSERT_TRUE(qstest::writeFile(pathOf("bom.plist"), "\xEF\xBB\xBF<plist><dict><key>k</key><true/></dict></plist>"));
  std::optional<Dictionary> d = plist::readDictionary(urlOf("bom.plist"));
  ASSERT_TRUE(d);
  EXPECT_EQ(Value(*d), Value(Dictionary{{"k", Value(true)}}));
}

TEST_F(PropertyListFile, ReadDictionaryRefusesAnotherRoot) {
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
}

TEST_F(PropertyListFile, MalformedFileNamesThePathAndTheProblem) {
  ASSERT_TRUE(qstest::writeFile(pathOf("bad.plist"), kHeader + "<plist><integer>abc</integer></plist>"));
  Error error;
  EXPECT_FALSE(plist::readFile(urlOf("bad.plist"), &error));
  EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadUnknownError));
  EXPECT_EQ(error.localizedDescription().rfind("Could not read \"" + pathOf("bad.plist") +
                                                    "\": not a valid property list: integer element holds \"abc\"",
                                                0),
            0u)
      << error.localizedDescription();
}

TEST_F(PropertyListFile, EmptyFileIsRefused) {
  ASSERT_TRUE(qstest::writeFile(pathOf("empty.plist"), ""));
  Error error;
  EXPECT_FALSE(plist::readDictionary(urlOf("empty.plist"), &error));
  EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileReadUnknownError));
  EXPECT_NE(error.localizedDescription().find("the document is empty"), std::string::npos);
}

TEST_F(PropertyListFile, BytesRoundTripBothWays) {
  Data bytes;
  for (int i = 0; i < 200000; ++i) bytes.push_back(static_cast<uint8_t>(i * 7));
  for (bool atomically : {true, false}) {
    ASSERT_TRUE(plist::writeFileBytes(bytes, urlOf("blob"), atomically));
    std::optional<Data> back = plist::readFileBytes(urlOf("blob"));
    ASSERT_TRUE(back);
    EXPECT_EQ(*back, bytes);
  }
  ASSERT_TRUE(plist::writeFileBytes(Data{}, urlOf("blob"), true));
  std::optional<Data> empty = plist::readFileBytes(urlOf("blob"));
  ASSERT_TRUE(empty);
  EXPECT_TRUE(empty->empty());
}

TEST_F(PropertyListFile, AtomicWriteReplacesAndLeavesNoTemporaryFile) {
  ASSERT_TRUE(plist::writeFile(Value(Dictionary{{"v", Value(1)}}), urlOf("m.plist")));
  ASSERT_TRUE(plist::writeFile(Value(Dictionary{{"v", Value(2)}}), urlOf("m.plist")));
  std::optional<Dictionary> d = plist::readDictionary(urlOf("m.plist"));
  ASSERT_TRUE(d);
  EXPECT_EQ(Value(*d), Value(Dictionary{{"v", Value(2)}}));
  EXPECT_EQ(directoryNames(dir_.path()), std::vector<std::string>{"m.plist"});
}

TEST_F(PropertyListFile, AtomicWriteKeepsOldFileWhenTheRenameIsRefused) {
  ASSERT_TRUE(plist::writeFile(Value(Dictionary{{"v", Value("old")}}), urlOf("m.plist")));
  const std::string before = qstest::readFile(pathOf("m.plist"));
  ASSERT_TRUE(qstest::setImmutable(pathOf("m.plist"), true));

  Error error;
  EXPECT_FALSE(plist::writeFile(Value(Dictionary{{"v", Value("new")}}), urlOf("m.plist"), plist::Format::XML, true,
                                &error));
  ASSERT_TRUE(qstest::setImmutable(pathOf("m.plist"), false));

  EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileWriteUnknownError)) << error.description();
  ASSERT_NE(error.underlyingError(), nullptr);
  EXPECT_TRUE(error.underlyingError()->isPOSIX(EPERM)) << error.description();
  EXPECT_NE(error.localizedDescription().find("rename failed"), std::string::npos) << error.description();
  EXPECT_NE(error.localizedDescription().find(pathOf("m.plist")), std::string::npos);
  EXPECT_EQ(qstest::readFile(pathOf("m.plist")), before);
  EXPECT_EQ(directoryNames(dir_.path()), std::vector<std::string>{"m.plist"});
}

TEST_F(PropertyListFile, AtomicWriteIntoImmutableDirectoryFailsAndKeepsOldFile) {
  ASSERT_TRUE(qstest::makeDirs(pathOf("locked")));
  ASSERT_TRUE(plist::writeFile(Value(Dictionary{{"v", Value("old")}}), urlOf("locked/m.plist")));
  const std::string before = qstest::readFile(pathOf("locked/m.plist"));
  ASSERT_TRUE(qstest::setImmutable(pathOf("locked"), true));

  Error error;
  EXPECT_FALSE(plist::writeFile(Value(Dictionary{{"v", Value("new")}}), urlOf("locked/m.plist"), plist::Format::XML,
                                true, &error));
  ASSERT_TRUE(qstest::setImmutable(pathOf("locked"), false));

  EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileWriteUnknownError)) << error.description();
  ASSERT_NE(error.underlyingError(), nullptr);
  EXPECT_TRUE(error.underlyingError()->isPOSIX(EPERM));
  EXPECT_EQ(qstest::readFile(pathOf("locked/m.plist")), before);
  EXPECT_EQ(directoryNames(pathOf("locked")), std::vector<std::string>{"m.plist"});
}

TEST_F(PropertyListFile, AtomicWriteOverADirectoryFailsAndLeavesNoTemporaryFile) {
  ASSERT_TRUE(qstest::makeDirs(pathOf("d.plist")));
  Error error;
  EXPECT_FALSE(plist::writeFileBytes(Data{1, 2, 3}, urlOf("d.plist"), true, &error));
  EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileWriteUnknownError));
  ASSERT_NE(error.underlyingError(), nullptr);
  EXPECT_TRUE(error.underlyingError()->isPOSIX(EISDIR)) << error.description();
  EXPECT_EQ(directoryNames(dir_.path()), std::vector<std::string>{"d.plist"});
}

TEST_F(PropertyListFile, WriteIntoMissingDirectoryFailsWithENOENT) {
  for (bool atomically : {true, false}) {
    Error error;
    EXPECT_FALSE(plist::writeFile(Value(Dictionary{}), urlOf("none/m.plist"), plist::Format::XML, atomically, &error));
    EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileWriteUnknownError)) << error.description();
    ASSERT_NE(error.underlyingError(), nullptr);
    EXPECT_TRUE(error.underlyingError()->isPOSIX(ENOENT));
  }
}

TEST_F(PropertyListFile, InPlaceWriteReportsAFullDevice) {
  Error error;
  EXPECT_FALSE(plist::writeFileBytes(Data(4096, 7), URL::fileURL("/dev/full"), false, &error));
  EXPECT_TRUE(error.is(platform::kFileErrorDomain, platform::kFileWriteUnknownError)) << error.description();
  ASSERT_NE(error.underlyingError(), nullptr);
  EXPECT_TRUE(error.underlyingError()->isPOSIX(ENOSPC));
  EXPECT_NE(error.localizedDescription().find("write failed"), std::string::npos);
}

TEST_F(PropertyListFile, InPlaceWriteToImmutableFileFailsWithEPERM) {
  ASSERT_TRUE(qstest::writeFile(pathOf("f"), "keep"));
  ASSERT_TRUE(qstest::setImmutable(pathOf("f"), true));
  Error error;
  bool written = plist::writeFileBytes(Data{1}, urlOf("f"), false, &error);
  ASSERT_TRUE(qstest::setImmutable(pathOf("f"), false));
  EXPECT_FALSE(written);
  ASSERT_NE(error.underlyingError(), nullptr);
  EXPECT_TRUE(error.underlyingError()->isPOSIX(EPERM));
  EXPECT_EQ(qstest::readFile(pathOf("f")), "keep");
}

TEST_F(PropertyListFile, AtomicWriteKeepsThePermissionsOfTheReplacedFile) {
  ASSERT_TRUE(plist::writeFileBytes(Data{1}, urlOf("new"), true));
  struct stat st;
  ASSERT_EQ(stat(pathOf("new").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0644u);

  ASSERT_TRUE(qstest::writeFile(pathOf("private"), "x"));
  ASSERT_EQ(chmod(pathOf("private").c_str(), 0600), 0);
  ASSERT_TRUE(plist::writeFileBytes(Data{2}, urlOf("private"), true));
  ASSERT_EQ(stat(pathOf("private").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0600u);
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

}  // namespace
