#include "Platform/PropertyList.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cmath>
#include <limits>
#include <tuple>

#include "TestSupport/TestSupport.h"

namespace sl {
namespace {

using test::fileURL;
using test::TempDir;

std::span<const uint8_t> bytesOf(std::string_view s) { return {reinterpret_cast<const uint8_t*>(s.data()), s.size()}; }

void appendBE(std::vector<uint8_t>* out, uint64_t v, int width) {
  for (int k = width - 1; k >= 0; --k) out->push_back(static_cast<uint8_t>(v >> (8 * k)));
}

// Binary lists assembled by hand: each object is given as its raw bytes; the
// offset table and the trailer are added with the widths asked for.
struct BinaryFile {
  std::vector<uint8_t> bytes = std::vector<uint8_t>(bytesOf("bplist00").begin(), bytesOf("bplist00").end());
  std::vector<uint64_t> offsets;

  BinaryFile() = default;
  explicit BinaryFile(const std::vector<std::vector<uint8_t>>& objects) {
    for (const auto& object : objects) add(object);
  }
  // (push_back rather than insert: GCC 12 warns falsely about the latter here.)
  void add(const std::vector<uint8_t>& object) {
    offsets.push_back(bytes.size());
    for (uint8_t b : object) bytes.push_back(b);
  }
  std::vector<uint8_t> finish(uint64_t top, int offsetSize, int refSize) const {
    std::vector<uint8_t> out = bytes;
    for (uint64_t offset : offsets) appendBE(&out, offset, offsetSize);
    appendBE(&out, uint64_t(offsetSize) << 8 | uint64_t(refSize), 8);  // six unused bytes, then the two widths
    for (uint64_t field : {uint64_t{offsets.size()}, top, uint64_t{bytes.size()}}) appendBE(&out, field, 8);
    return out;
  }
};

// Overwrites `width` bytes at `position` counted from the end of the trailer.
std::vector<uint8_t> patchedTrailer(std::vector<uint8_t> file, size_t position, uint64_t value, int width) {
  std::vector<uint8_t> field;
  appendBE(&field, value, width);
  std::copy(field.begin(), field.end(), file.end() - 32 + static_cast<ptrdiff_t>(position));
  return file;
}

// Expects bytes to be refused with EINVAL and a message holding `expected`;
// answers the message.
std::string expectRefused(std::span<const uint8_t> bytes, std::string_view expected) {
  Error error;
  Value value = propertyListFromData(bytes, &error);
  EXPECT_TRUE(value.isNull()) << "read a " << value.typeName();  // (a description may never end)
  EXPECT_TRUE(error.isPOSIX(EINVAL)) << error.description();
  std::string message = error.localizedDescription().str();
  EXPECT_NE(message.find(expected), std::string::npos) << message << "\n  expected to contain: " << expected;
  return message;
}

// A binary array holding the one object `ref`, referenced in two bytes.
std::vector<uint8_t> arrayOf(int ref) { return {0xA1, static_cast<uint8_t>(ref >> 8), static_cast<uint8_t>(ref)}; }

std::string nestedArrays(int depth) {
  std::string open, close;
  for (int k = 0; k < depth; ++k) open += "<array>", close += "</array>";
  return "<plist>" + open + close + "</plist>";
}

TEST(PropertyListTest, RoundTripsEveryKindInBothFormats) {
  Dictionary everything{
      {"", String("")}, {"unicode", String("h\xC3\xA9llo \xE2\x82\xAC \xF0\x9F\x98\x80")},  // 2-, 3-, 4-byte
      {"markup", String("a < b && c > d\r\n\t]]> \"'")}, {"date", Date(-1234567890.0)},
      {"data", Data(std::string_view("\x00\x01\xFE\xFF bytes", 10))}, {"empty data", Data(std::string_view())},
      {"small", Number(int64_t{255})}, {"medium", Number(int64_t{65536})}, {"wide", Number(int64_t{1} << 40)},
      {"int64 min", Number(std::numeric_limits<int64_t>::min())}, {"uint64 max", Number(~uint64_t{0})},
      {"whole real", Number(2.0)}, {"tiny", Number(5e-324)}, {"true", Boolean(true)}, {"false", Boolean(false)},
      {"infinite", Number(-std::numeric_limits<double>::infinity())},
      {"array", Array{Array::create(), Dictionary::create(), Array{Number(1), String("x"), Array{String("deep")}}}},
      {"dict", Dictionary{{"inner", Dictionary{{"plain", String("plain")}, {"list", Array{Boolean(true)}}}}}},
  };
  TempDir dir;
  for (PropertyListFormat format : {PropertyListFormat::XML, PropertyListFormat::Binary}) {
    SCOPED_TRACE(format == PropertyListFormat::XML ? "XML" : "binary");
    std::vector<uint8_t> bytes;
    Error error;
    ASSERT_TRUE(dataFromPropertyList(everything, format, &bytes, &error)) << error.description();
    PropertyListFormat detected{};
    Value back = propertyListFromData(bytes, &error, &detected);
    ASSERT_TRUE(back == everything) << back.description() << "\n" << error.description();
    EXPECT_EQ(detected, format);
    // Equality compares numbers by value; the kinds of number must survive too.
    for (auto [key, type] : {std::pair{"uint64 max", Number::Type::Unsigned}, {"whole real", Number::Type::Real},
                             {"small", Number::Type::Signed}})
      EXPECT_EQ(back.asDictionary().get(key).asNumber().type(), type) << key;

    ASSERT_TRUE(writePropertyListToURL(everything, fileURL(dir / "list.plist"), format, &error)) << error.description();
    EXPECT_TRUE(dictionaryWithContentsOfURL(fileURL(dir / "list.plist")) == everything);
  }
}

TEST(PropertyListTest, XMLTextOfASmallDictionary) {
  Dictionary dict{{"Name", String("a & b")},  {"Count", Number(3)},       {"List", Array{Boolean(true), Number(1.5)}},
                  {"Empty", Dictionary::create()}, {"When", Date(0.0)}, {"Blob", Data(std::string_view("hi"))}};
  std::vector<uint8_t> bytes;
  ASSERT_TRUE(dataFromPropertyList(dict, PropertyListFormat::XML, &bytes));
  EXPECT_EQ(std::string(bytes.begin(), bytes.end()),
            "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">\n<dict>\n"
            "\t<key>Blob</key>\n\t<data>aGk=</data>\n"
            "\t<key>Count</key>\n\t<integer>3</integer>\n"
            "\t<key>Empty</key>\n\t<dict/>\n"
            "\t<key>List</key>\n\t<array>\n\t\t<true/>\n\t\t<real>1.5</real>\n\t</array>\n"
            "\t<key>Name</key>\n\t<string>a &amp; b</string>\n"
            "\t<key>When</key>\n\t<date>2001-01-01T00:00:00Z</date>\n"
            "</dict>\n</plist>\n");
}

TEST(PropertyListTest, ReadsXMLOfOtherWriters) {
  Value value = propertyListFromData(bytesOf(
      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
      "<!DOCTYPE plist PUBLIC \"-//Example//DTD PLIST 1.0//EN\" \"http://example.invalid/PropertyList-1.0.dtd\">\n"
      "<plist version=\"1.0\">\n<!-- a comment -->\n<dict>\n"
      "  <key>Hex</key><integer>0x1F</integer> <key>Signed</key><integer> -0x10 </integer>\n"
      "  <key>Plus</key><integer>+7</integer> <key>Unsigned</key><integer>18446744073709551615</integer>\n"
      "  <key>NaN</key><real>nan</real> <key>Inf</key><real>-inf</real> <key>Exponent</key><real>1e3</real>\n"
      "  <key>Data</key><data>\n    AAEC\n    /w==\n  </data>\n"
      "  <key>CDATA</key><string><![CDATA[<not a tag> & more]]></string>\n"
      "  <key>Entities</key><string>&lt;&amp;&#x41;&#66;&gt;</string> <key>Empty</key><string/>\n"
      "  <key>Date</key><date>2024-02-29T12:34:56Z</date>\n"
      "  <key>Repeated</key><true/> <key>Repeated</key><false/>\n"
      "</dict>\n</plist>\n"));
  Dictionary d = value.asDictionary();
  ASSERT_FALSE(d.isNull()) << value.description();
  EXPECT_TRUE(std::isnan(d.get("NaN").asNumber().doubleValue()));
  EXPECT_EQ(d.get("Unsigned").asNumber().type(), Number::Type::Unsigned);
  Dictionary expected{
      {"Hex", Number(31)}, {"Signed", Number(-16)}, {"Plus", Number(7)}, {"NaN", d.get("NaN")},
      {"Unsigned", Number(~uint64_t{0})}, {"Exponent", Number(1000.0)},
      {"Inf", Number(-std::numeric_limits<double>::infinity())}, {"Data", Data(std::string_view("\0\1\2\xFF", 4))},
      {"CDATA", String("<not a tag> & more")}, {"Entities", String("<&AB>")}, {"Empty", String("")},
      {"Repeated", Boolean(false)},
      {"Date", Date(1709210096.0 - Date::kUnixEpochOffset)},  // Unix time of 2024-02-29T12:34:56Z
  };
  EXPECT_TRUE(value == expected) << value.description();
}

TEST(PropertyListTest, RefusesBadXML) {
  const std::tuple<const char*, std::string, const char*> cases[] = {  // what, document, message
      {"malformed", "<plist><dict></plist>", "mismatched tag"},
      {"unknown element", "<plist><dict><key>a</key><foo/></dict></plist>", "line 1: unknown element <foo>"},
      {"root not plist", "<dict/>", "the root element is <dict>, not <plist>"},
      {"empty plist", "<plist/>", "<plist> holds no value"},
      {"two values", "<plist><true/><false/></plist>", "<plist> holds more than one value"},
      {"key without value", "<plist><dict><key>a</key></dict></plist>", "key \"a\" has no value"},
      {"key after key", "<plist><dict><key>a</key><key>b</key><true/></dict></plist>", "key \"a\" has no value"},
      {"value without key", "<plist><dict><true/></dict></plist>", "<true> in a dictionary without a key"},
      {"key in array", "<plist><array><key>a</key></array></plist>", "<key> outside a dictionary"},
      {"text in container", "<plist><array>stray</array></plist>", "text inside <array>"},
      {"element in leaf", "<plist><string><true/></string></plist>", "<true> inside <string>"},
      {"bad integer", "<plist><integer>12a</integer></plist>", "integer \"12a\""},
      {"integer too large", "<plist><integer>18446744073709551616</integer></plist>", "is not a 64-bit integer"},
      {"integer too small", "<plist><integer>-9223372036854775809</integer></plist>", "is not a 64-bit integer"},
      {"bad real", "<plist><real>1.5x</real></plist>", "real \"1.5x\" is not a number"},
      {"bad date", "<plist><date>2023-02-29T00:00:00Z</date></plist>", "date \"2023-02-29T00:00:00Z\""},
      {"year zero", "<plist><date>0000-01-01T00:00:00Z</date></plist>", "date \"0000-01-01T00:00:00Z\""},
      {"local date", "<plist><date>2023-02-28T00:00:00+01:00</date></plist>", "is not YYYY-MM-DDTHH:MM:SSZ"},
      {"bad base64", "<plist><data>ab!c</data></plist>", "<data> is not valid base64"},
      {"lone base64 character", "<plist><data>abcde</data></plist>", "<data> is not valid base64"},
      {"too deep", nestedArrays(kMaxPropertyListDepth + 1), "containers nested deeper than 512 levels"},
      {"entity bomb",
       "<?xml version=\"1.0\"?><!DOCTYPE plist [<!ENTITY a \"aaaaaaaaaa\"><!ENTITY b \"&a;&a;&a;&a;&a;&a;&a;&a;\">"
       "<!ENTITY c \"&b;&b;&b;&b;&b;&b;&b;&b;\"><!ENTITY d \"&c;&c;&c;&c;&c;&c;&c;&c;\">"
       "<!ENTITY e \"&d;&d;&d;&d;&d;&d;&d;&d;\"><!ENTITY f \"&e;&e;&e;&e;&e;&e;&e;&e;\">]>"
       "<plist><string>&f;&f;&f;&f;&f;&f;&f;&f;&f;&f;&f;&f;</string></plist>",
       "entity declarations are not allowed (\"a\")"},
      {"external entity",
       "<!DOCTYPE plist [<!ENTITY secret SYSTEM \"file:///etc/passwd\">]><plist><string>&secret;</string></plist>",
       "entity declarations are not allowed (\"secret\")"},
      {"entity of an unread external DTD",
       "<!DOCTYPE plist SYSTEM \"file:///etc/passwd\"><plist><string>&secret;</string></plist>",
       "reference to undeclared entity \"secret\""},
  };
  for (const auto& [what, doc, message] : cases)
    EXPECT_EQ(expectRefused(bytesOf(doc), message).rfind("XML property list: line ", 0), 0u) << what;
  EXPECT_FALSE(propertyListFromData(bytesOf(nestedArrays(kMaxPropertyListDepth))).isNull());  // as deep as allowed
}

TEST(PropertyListTest, WritersRefuseWhatTheirFormatCannotCarry) {
  Array tooDeep = Array::create();
  for (int k = 1; k < kMaxPropertyListDepth + 1; ++k) tooDeep = Array{tooDeep};
  // Stray bytes, a non-BMP character, an encoded surrogate, a cut sequence:
  // binary keeps the bytes, in keys and values alike.
  std::string notUTF8("\xFF\xFE" "a\xC3\xA9\xF0\x9F\x98\x80" "\xED\xA0\x80" "\xC3", 14);
  // What, the value, and the errno of the XML and of the binary writer (0:
  // written and read back).
  const std::tuple<const char*, Value, int, int> cases[] = {
      {"not UTF-8", Dictionary{{notUTF8, String(notUTF8)}}, EILSEQ, 0},
      {"control character", Array{String("bell\x07")}, EILSEQ, 0},
      {"control character in key", Dictionary{{"nul\x01", Boolean(true)}}, EILSEQ, 0},
      {"noncharacter", String("\xEF\xBF\xBF"), EILSEQ, 0},
      {"cut sequence", String("a\xE2\x82"), EILSEQ, 0},
      {"overlong, three bytes", String("\xE0\x9F\xBF"), EILSEQ, 0},
      {"overlong, four bytes", String("\xF0\x8F\xBF\xBF"), EILSEQ, 0},
      {"above U+10FFFF", String("\xF4\x90\x80\x80"), EILSEQ, 0},
      {"date past year 9999", Date(1e12), EINVAL, 0},
      {"URL", Array{fileURL("/x")}, EINVAL, EINVAL},
      {"error record", Dictionary{{"e", Error::posix(EIO)}}, EINVAL, EINVAL},
      {"null", Value(), EINVAL, EINVAL},
      {"too deep", tooDeep, EINVAL, EINVAL},
  };
  for (const auto& [what, value, xmlCode, binaryCode] : cases) {
    SCOPED_TRACE(what);
    for (PropertyListFormat format : {PropertyListFormat::XML, PropertyListFormat::Binary}) {
      int expected = format == PropertyListFormat::XML ? xmlCode : binaryCode;
      std::vector<uint8_t> bytes{1, 2, 3};
      Error error;
      EXPECT_EQ(dataFromPropertyList(value, format, &bytes, &error), expected == 0);
      if (expected != 0) {
        EXPECT_TRUE(error.isPOSIX(expected)) << error.description();
        EXPECT_EQ(bytes, (std::vector<uint8_t>{1, 2, 3}));  // untouched on failure
      } else {
        Value back = propertyListFromData(bytes);
        EXPECT_TRUE(back == value) << back.description();
      }
    }
  }
  // One container less than too deep is written and read back.
  std::vector<uint8_t> bytes;
  ASSERT_TRUE(dataFromPropertyList(tooDeep.at(0), PropertyListFormat::Binary, &bytes));
  EXPECT_TRUE(propertyListFromData(bytes) == tooDeep.at(0));
}

TEST(PropertyListTest, ReadsHandAssembledBinary) {
  // One-byte offsets and references, one object of each kind.
  std::vector<uint8_t> u128(17, 0), s128(17, 0xFF);  // UINT64_MAX and -1 in 16 bytes
  u128[0] = s128[0] = 0x14;
  std::fill(u128.begin() + 9, u128.end(), 0xFF);
  BinaryFile f({
      {0xD2, 1, 2, 3, 4}, {0x51, 'a'}, {0x54, 'l', 'i', 's', 't'}, {0x10, 0x01},  // 0-3: {"a": 1, "list": 4}
      {0xAC, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15, 16},                             // 4: 12 elements
      {0x09}, {0x63, 0x00, 0xE9, 0xD8, 0x3D, 0xDE, 0x00},                           // 5: true, 6: UTF-16 "é😀"
      {0x22, 0x3F, 0xC0, 0x00, 0x00}, {0x33, 0x3F, 0xF0, 0, 0, 0, 0, 0, 0},          // 7: 4-byte real 1.5, 8: date 1.0
      {0x42, 0xAB, 0xCD}, {0x11, 0x01, 0x00},                                         // 9: data, 10: 256
      {0x13, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFE}, u128, s128,           // 11: -2, 12, 13
      {0xC2, 5, 3}, {0x62, 0x00, 0x61, 0xDC, 0xFF}, {0x08}});  // 14: a set, 15: "a" + the stray byte 0xFF, 16: false
  Value value = propertyListFromData(f.finish(0, 1, 1));
  Value expected = Dictionary{
      {"a", Number(1)},
      {"list", Array{Boolean(true), String("\xC3\xA9\xF0\x9F\x98\x80"), Number(1.5), Date(1.0),
                     Data(std::string_view("\xAB\xCD")), Number(256), Number(-2),
                     Number(std::numeric_limits<uint64_t>::max()), Number(-1), Array{Boolean(true), Number(1)},
                     String(std::string_view("a\xFF")), Boolean(false)}}};
  EXPECT_TRUE(value == expected) << value.description();

  // More than 255 objects: two-byte references and offsets.
  BinaryFile big;
  std::vector<uint8_t> dict{0xDF, 0x11, 0x01, 0x2C};  // 300 entries
  for (int k = 0; k < 600; ++k) appendBE(&dict, 1 + k, 2);
  big.add(dict);
  for (int k = 0; k < 300; ++k) {
    std::vector<uint8_t> key{0x55};
    for (char c : "k" + std::to_string(1000 + k)) key.push_back(static_cast<uint8_t>(c));
    big.add(key);
  }
  for (int k = 0; k < 300; ++k) big.add({0x11, static_cast<uint8_t>(k >> 8), static_cast<uint8_t>(k)});
  Dictionary d = propertyListFromData(big.finish(0, 2, 2)).asDictionary();
  ASSERT_EQ(d.count(), 300u);
  EXPECT_EQ(d.get("k1000").asNumber().int64Value(), 0);
  EXPECT_EQ(d.get("k1299").asNumber().int64Value(), 299);
  // Needlessly wide fields: eight-byte offsets, four-byte references.
  EXPECT_TRUE(propertyListFromData(BinaryFile({{0xA1, 0, 0, 0, 1}, {0x50}}).finish(0, 8, 4)) == Array{String("")});
}

TEST(PropertyListTest, RefusesBadBinary) {
  const std::vector<uint8_t> good = BinaryFile({{0xA1, 1}, {0x51, 'x'}}).finish(0, 1, 1);
  ASSERT_TRUE(propertyListFromData(good) == Array{String("x")});

  // Every truncation fails cleanly.
  for (size_t n = 0; n < good.size(); ++n) EXPECT_TRUE(propertyListFromData(std::span(good.data(), n)).isNull()) << n;
  expectRefused(std::span(good.data(), 41), "bplist: file of 41 bytes is too short");
  std::vector<uint8_t> version = good;
  version[7] = '1';
  expectRefused(version, "bplist: unsupported version \"01\"");

  // Trailer fields (positions within the 32-byte trailer).
  expectRefused(patchedTrailer(good, 6, 0, 1), "bplist: offset size 0 is invalid");
  expectRefused(patchedTrailer(good, 7, 9, 1), "bplist: object reference size 9 is invalid");
  expectRefused(patchedTrailer(good, 8, 0, 8), "bplist: the file holds no objects");
  expectRefused(patchedTrailer(good, 16, 2, 8), "bplist: top object 2 out of range (2 objects)");
  expectRefused(patchedTrailer(good, 24, 4, 8), "offset table at 4");
  // Object offsets into the offset table itself, and into the header.
  std::vector<uint8_t> bad = good;
  bad[good.size() - 32 - 1] = static_cast<uint8_t>(good.size() - 32 - 2);
  expectRefused(bad, "bplist: offset 12 of object 1 is outside the objects");
  bad[good.size() - 32 - 1] = 3;
  expectRefused(bad, "bplist: offset 3 of object 1 is outside the objects");

  std::vector<uint8_t> hugeUTF16{0x6F, 0x13, 0x80, 0, 0, 0, 0, 0, 0, 0};  // count * 2 overflows
  std::vector<uint8_t> hugeDictionary{0xDF, 0x13, 0x80, 0, 0, 0, 0, 0, 0, 0};
  const std::tuple<const char*, std::vector<std::vector<uint8_t>>, const char*> cases[] = {  // what, objects, message
      {"reference out of range", {{0xA2, 1, 9}, {0x09}}, "bplist: object reference 9 out of range (2 objects)"},
      {"cycle", {{0xA1, 1}, {0xD1, 2, 0}, {0x51, 'k'}}, "bplist: object 0 contains itself"},
      {"huge UTF-16 string", {hugeUTF16}, "runs past the end"},
      {"huge dictionary", {hugeDictionary}, "count 9223372036854775808 runs past the end"},  // count * 2 overflows
      {"count past the objects", {{0x58, 'a', 'b'}}, "bplist: object 0: count 8 runs past the end"},
      {"malformed count", {{0x4F, 0x23, 0, 0, 0, 0, 0, 0, 0, 0}}, "count of object 0 is not an integer"},
      {"non-string key", {{0xD1, 1, 1}, {0x10, 7}}, "key 0 of dictionary object 0 is a Number, not a string"},
      {"UID", {{0xA1, 1}, {0x80, 0x05}}, "object 1 is a UID"},
      {"null object", {{0x00}}, "object 0 (marker 0x00) is not a value"},
      {"17-byte-class integer", {{0x15, 0}}, "invalid size marker 0x15"},
      {"too wide integer", {{0x14, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 0, 0, 0, 0, 0}}, "does not fit in 64 bits"},
      {"unknown type", {{0x70}}, "unknown marker 0x70"},
  };
  for (const auto& [what, objects, message] : cases) {
    SCOPED_TRACE(what);
    expectRefused(BinaryFile(objects).finish(0, 1, 1), message);
  }
}

TEST(PropertyListTest, BinaryFieldsOfSixtyFourBitsCannotOverflow) {
  // Eight-byte offsets and references, so that each field can hold 2^64 - 1.
  const std::vector<uint8_t> good = BinaryFile({{0xA1, 0, 0, 0, 0, 0, 0, 0, 1}, {0x51, 'x'}}).finish(0, 8, 8);
  ASSERT_TRUE(propertyListFromData(good) == Array{String("x")});
  constexpr uint64_t kMax = ~uint64_t{0};
  const std::tuple<const char*, ptrdiff_t, uint64_t, const char*> cases[] = {  // what, position (< 0: from the end)
      {"count times offset size wraps to 8", -24, (uint64_t{1} << 61) + 1,
       "offset table of 2305843009213693953 objects runs past the trailer"},
      {"largest count", -24, kMax, "offset table of 18446744073709551615 objects runs past the trailer"},
      {"one object more than the table holds", -24, 3, "offset table of 3 objects runs past the trailer"},
      {"largest top object", -16, kMax, "top object 18446744073709551615 out of range (2 objects)"},
      {"largest table offset", -8, kMax, "offset table at 18446744073709551615 is outside the file"},
      {"largest object offset", -40, kMax, "offset 18446744073709551615 of object 1 is outside the objects"},
      {"largest reference", 9, kMax, "object reference 18446744073709551615 out of range (2 objects)"},
  };
  for (const auto& [what, position, value, message] : cases) {
    SCOPED_TRACE(what);
    std::vector<uint8_t> bad = good, field;
    appendBE(&field, value, 8);
    std::copy(field.begin(), field.end(), (position < 0 ? bad.end() : bad.begin()) + position);
    expectRefused(bad, message);
  }
}

TEST(PropertyListTest, BinaryNestingAndSharingAreBounded) {
  auto chain = [](int length) {  // array 0 holds array 1 ... holds an empty array
    BinaryFile f;
    for (int k = 1; k < length; ++k) f.add(arrayOf(k));
    f.add({0xA0});
    return f.finish(0, 2, 2);
  };
  EXPECT_FALSE(propertyListFromData(chain(kMaxPropertyListDepth)).isNull());
  expectRefused(chain(kMaxPropertyListDepth + 1), "bplist: containers nested deeper than 512 levels");

  // Top = [X0, Y0]: X0..X299 is a chain parsed first (at depth 1), and
  // Y0..Y299 is a chain whose last link holds X0 again, 300 levels down.
  // Each object alone is shallow enough; their nesting is 601.
  BinaryFile f;
  f.add({0xA2, 0, 1, 0x01, 0x2D});  // 0: [1, 301]
  for (int k = 1; k <= 600; ++k) f.add(k == 300 ? std::vector<uint8_t>{0xA0} : arrayOf(k == 600 ? 1 : k + 1));
  expectRefused(f.finish(0, 2, 2), "bplist: containers nested deeper than 512 levels");

  // Array k holds array k+1 twice, so the tree unfolds to 2^(levels+1)
  // values. A reader that parsed each reference anew would take that long.
  auto doubling = [](int levels) {
    BinaryFile f;
    for (int k = 0; k < levels; ++k) f.add({0xA2, static_cast<uint8_t>(k + 1), static_cast<uint8_t>(k + 1)});
    f.add({0x54, 'l', 'e', 'a', 'f'});
    return f.finish(0, 2, 1);
  };
  Value value = propertyListFromData(doubling(11));  // 4,095 values: read, sharing its nodes
  for (int k = 0; k < 11; ++k) {
    ASSERT_EQ(value.asArray().count(), 2u) << value.description();
    value = value.asArray().at(1);
  }
  EXPECT_EQ(value.asString().str(), "leaf");
  // Past 4,096 + 16 values per byte: anything that walks the result (a
  // description, a write) would take time and memory out of all proportion
  // to the file, so the reader refuses it, 2^23 values as much as 2^101.
  expectRefused(doubling(22), "bplist: object 10 unfolds to more than 6608 values");
  expectRefused(doubling(100), "bplist: object 87 unfolds to more than 12848 values");
}

TEST(PropertyListTest, FilesThatHoldNoDictionary) {
  TempDir dir;
  test::writeFile(dir / "array.plist", "<plist><array><true/></array></plist>");
  test::writeFile(dir / "secret.plist", "<plist><dict/></plist>", 0600);
  test::makeDirs(dir / "directory.plist");
  EXPECT_TRUE(dictionaryWithContentsOfURL(fileURL(dir / "missing.plist")).isNull());
  EXPECT_TRUE(dictionaryWithContentsOfURL(fileURL(dir / "array.plist")).isNull());

  std::vector<uint8_t> bytes;
  Error error;
  EXPECT_FALSE(readFileContents(fileURL(dir / "missing.plist"), &bytes, &error));
  test::expectPOSIXRecord(error, ENOENT, "open of " + (dir / "missing.plist") + " failed: No such file or directory",
                          nullptr);
  EXPECT_FALSE(readFileContents(fileURL(dir / "directory.plist"), &bytes, &error));
  test::expectPOSIXRecord(error, EISDIR, "read of " + (dir / "directory.plist") + " failed: Is a directory", nullptr);
  // A fifo or a device where a file is expected is refused, not read (a
  // hang here is the failure).
  ASSERT_EQ(mkfifo((dir / "fifo.plist").c_str(), 0644), 0);
  for (const std::string& path : {dir / "fifo.plist", std::string("/dev/zero")}) {
    EXPECT_FALSE(readFileContents(fileURL(path), &bytes, &error));
    test::expectPOSIXRecord(error, EINVAL, "read of " + path + " failed: not a regular file", nullptr);
  }
  {
    test::ScopedUnprivileged nobody;
    EXPECT_FALSE(readFileContents(fileURL(dir / "secret.plist"), &bytes, &error));
    EXPECT_TRUE(error.isPOSIX(EACCES));
  }
  // Files the size does not describe are read to their end.
  ASSERT_TRUE(readFileContents(fileURL("/proc/self/status"), &bytes));
  EXPECT_GT(bytes.size(), 0u);

  // A value without a property-list form leaves no file behind.
  EXPECT_FALSE(writePropertyListToURL(Array{fileURL("/", true)}, fileURL(dir / "new.plist"), PropertyListFormat::XML,
                                      &error));
  EXPECT_TRUE(error.isPOSIX(EINVAL));
  EXPECT_FALSE(test::exists(dir / "new.plist"));
}

}  // namespace
}  // namespace sl
