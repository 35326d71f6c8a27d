#include "platform/PropertyList.h"

#include <gtest/gtest.h>

#include <cmath>

#include "tests/platform/Helpers.h"

namespace vantrel::platform {
namespace {

using lmo::Array;
using lmo::Date;
using lmo::Dictionary;
using lmo::Value;

std::string nested(const char* open, const char* close, int depth) {
  std::string s;
  for (int i = 0; i < depth; ++i) s += open;
  for (int i = 0; i < depth; ++i) s += close;
  return s;
}

// A binary property list from raw objects, the first one its top; each
// object's references are one byte wide (so at most 255 objects).
std::string binary(const std::vector<std::string>& objects) {
  std::string out = "bplist00", table;
  for (const std::string& object : objects) {
    const size_t offset = out.size();
    table += {char(offset >> 24), char(offset >> 16), char(offset >> 8), char(offset)};
    out += object;
  }
  std::string trailer(32, '\0');
  trailer[6] = 4;  // offset size
  trailer[7] = 1;  // reference size
  auto put = [&](size_t at, uint64_t v) {
    for (int i = 7; i >= 0; --i, v >>= 8) trailer[at + i] = char(v & 0xff);
  };
  put(8, objects.size());
  put(24, out.size());  // where the offset table starts
  return out + table + trailer;
}

using Cases = std::vector<std::pair<const char*, std::string>>;

template <typename T>
void expectError(const base::Result<T>& result, int64_t code, const std::string& name) {
  ASSERT_FALSE(result.has_value()) << name;
  EXPECT_EQ(result.error().domain, kPropertyListErrorDomain) << name;
  EXPECT_EQ(result.error().code, code) << name << ": " << result.error().description();
}

// n arrays, each holding the next.
std::vector<std::string> chainOf(int n) {
  std::vector<std::string> links;
  for (int i = 0; i + 1 < n; ++i) links.push_back(std::string("\xA1") + char(i + 1));
  links.push_back("\xA0");
  return links;
}

template <typename... Values>
Value arrayOf(Values... values) {
  return Value(Array{Value(values)...});
}

Value everyType() {
  const Value leaves =
      arrayOf(Value::boolean(true), Value::boolean(false), Value::integer(-42),
              Value::integer(INT64_MIN), Value::integer(INT64_MAX), Value::real(0.1),
              Value::real(-1e300), Value::real(INFINITY), "h\xC3\xA9llo <&> ]]> \"quoted\" \t\n",
              "", Value::data("\x00\xff\x10", 3), Value::data(nullptr, 0),
              Date{1577934245} /* 2020-01-02T03:04:05Z */, Date{0}, Array{}, Dictionary{});
  return Value(Dictionary{{"leaves", leaves},
                          {"nested", Value(Dictionary{{"a", arrayOf("x")}})},
                          {"k\xC3\xA9y <&>", Value::integer(1)}});
}

TEST(PropertyList, RoundTripsEveryTypeThroughXml) {
  const Value value = everyType();
  auto xml = writePropertyListXML(value);
  ASSERT_TRUE(xml.has_value()) << xml.error().description();
  auto back = readPropertyList(xml.value());
  ASSERT_TRUE(back.has_value()) << back.error().description();
  EXPECT_EQ(back.value(), value) << lmo::describe(back.value());

  // XML keeps whole seconds: a fraction is dropped, however close to one.
  for (const double fraction : {0.25, 0.9999999}) {
    const double seconds = 1000000000 + fraction;
    auto date = readPropertyList(writePropertyListXML(Value(lmo::Date{seconds})).value());
    EXPECT_EQ(date.value(), Value(lmo::Date{1000000000})) << fraction;
  }

  // A UUID has no property-list type: it travels as its canonical text.
  const base::Uuid uuid = base::Uuid::random();
  auto uuidBack = readPropertyList(writePropertyListXML(Value(uuid)).value());
  EXPECT_EQ(uuidBack.value(), Value(uuid.string()));
}

TEST(PropertyList, ReadsBinaryPropertyLists) {
  plist_t root = plist_new_dict();
  plist_dict_set_item(root, "n", plist_new_uint(static_cast<uint64_t>(-7)));
  plist_dict_set_item(root, "uid", plist_new_uid(9));
  plist_dict_set_item(root, "date", plist_new_date(1, 500000));
  plist_dict_set_item(root, "s", plist_new_string("\xE2\x82\xAC uro"));  // UTF-16 in binary
  plist_t array = plist_new_array();
  plist_array_append_item(array, plist_new_real(2.5));
  plist_array_append_item(array, plist_new_data("ab", 2));
  plist_array_append_item(array, plist_new_bool(1));
  plist_dict_set_item(root, "a", array);
  auto read = readPropertyList(libplistBinary(root));
  ASSERT_TRUE(read.has_value()) << read.error().description();
  const Value expected(Dictionary{
      {"n", Value::integer(-7)},
      {"uid", Value::unsignedInteger(9)},
      {"date", Value(Date{978307201.5})},
      {"s", Value("\xE2\x82\xAC uro")},
      {"a", Value(Array{Value::real(2.5), Value::data("ab", 2), Value::boolean(true)})}});
  EXPECT_EQ(read.value(), expected);
  EXPECT_TRUE(read.value().getIfDictionary()->get("uid").isUnsignedInteger());

  // A 128-bit binary integer marks an unsigned value; an 8-byte one is signed.
  const std::string ff(8, '\xff');
  auto big =
      readPropertyList(binary({std::string("\xA2\x01\x02", 3),
                               std::string("\x14", 1) + std::string(8, '\0') + ff, "\x13" + ff}));
  ASSERT_TRUE(big.has_value()) << big.error().description();
  const Array& pair = *big->getIfArray();
  EXPECT_TRUE(pair[0].isUnsignedInteger());
  EXPECT_EQ(pair[0].getIfUInt64(), UINT64_MAX);
  EXPECT_EQ(pair[1].getIfInt64(), -1);
}

// What libplist 2.2 cannot do, as PropertyList.h describes it. When one of
// these fails, libplist has changed: update the header.
TEST(PropertyList, PinsLibplistLimits) {
  // An unsigned integer above INT64_MAX is written negative.
  auto xml = writePropertyListXML(Value::unsignedInteger(UINT64_MAX));
  ASSERT_TRUE(xml.has_value());
  EXPECT_NE(xml.value().find("<integer>-1</integer>"), std::string::npos) << xml.value();
  EXPECT_EQ(readPropertyList(xml.value()).value().getIfInt64(), -1);
  // Reading keeps such a value unsigned.
  auto read = readPropertyList(xmlPlist("<integer>18446744073709551615</integer>"));
  EXPECT_EQ(read.value().getIfUInt64(), UINT64_MAX);
  // libplist alone would read leading zeros as octal ("010" as 8, "08" as 0).
  for (const auto& [text, value] :
       {std::pair("010", 10), std::pair("-08", -8), std::pair("000", 0), std::pair("0x010", 16)}) {
    EXPECT_EQ(readPropertyList(xmlPlist("<integer>" + std::string(text) + "</integer>")).value(),
              Value::integer(value))
        << text;
  }

  // Dates beyond int32 seconds from 2001 read correctly but cannot be written.
  for (const auto& [text, seconds] : {std::pair("1900-01-01T00:00:00Z", -2208988800.0),
                                      std::pair("2200-01-01T00:00:00Z", 7258118400.0)}) {
    EXPECT_EQ(readPropertyList(xmlPlist("<date>" + std::string(text) + "</date>")).value(),
              Value(Date{seconds}));
    expectError(writePropertyListXML(Value(Date{seconds})), kPropertyListUnrepresentable, text);
  }

  // XML dates hold whole seconds.
  EXPECT_EQ(readPropertyList(writePropertyListXML(Value(Date{978307201.75})).value()).value(),
            Value(Date{978307201}));
}

TEST(PropertyList, RejectsMalformedInput) {
  const std::string valid = libplistBinary(plist_new_string("a binary property list"));
  std::vector<std::string> dag;  // 40 levels, each holding the next twice: 2^40 values
  for (int i = 0; i < 39; ++i) dag.push_back(std::string("\xA2") + char(i + 1) + char(i + 1));
  dag.push_back("\xA0");
  const Cases malformed = {
      {"truncated XML", xmlPlist("<dict><key>a</key><str")},
      {"two roots", xmlPlist("<true/><false/>")},
      {"empty plist", xmlPlist("")},
      {"text after root", xmlPlist("<true/>") + "junk"},
      {"key without value", xmlPlist("<dict><key>a</key></dict>")},
      {"key in array", xmlPlist("<array><key>a</key></array>")},
      {"key as the root", xmlPlist("<key>a</key>")},
      {"key as a bare root", "<key>a</key>"},
      {"mismatched close", xmlPlist("<array><true/></dict>")},
      {"bad integer", xmlPlist("<integer>12abc</integer>")},
      {"integer overflow", xmlPlist("<integer>18446744073709551616</integer>")},
      {"bad real", xmlPlist("<real>x</real>")},
      {"bad date", xmlPlist("<date>yesterday</date>")},
      {"bad base64", xmlPlist("<data>!!!!</data>")},
      {"bad entity", xmlPlist("<string>&bogus;</string>")},
      {"unknown element", xmlPlist("<foo/>")},
      {"NUL byte", xmlPlist(std::string("<string>a\0b</string>", 20))},
      {"not UTF-8", xmlPlist("<dict><key>k\xE9y</key><true/></dict>")},
      {"binary bad reference", binary({"\xA1\x05"})},
      {"binary huge count", binary({std::string("\xAF\x13\x10\0\0\0\0\0\0\0", 10)})},
      {"binary non-string key", binary({"\xD1\x01\x01", "\x10\x01"})},
      {"binary 128-bit overflow", binary({"\x14\x01" + std::string(15, '\0')})},
      {"binary bad trailer", "bplist00" + std::string(32, '\xff')},
      // libplist aborts on the first, truncates the second, empties the third.
      {"binary UTF-16 NUL", binary({std::string("\x62\0a\0\0", 5)})},
      {"binary ASCII NUL key", binary({"\xD1\x01\x02", std::string("\x53k\0y", 4), "\x09"})},
      {"binary lone surrogate", binary({"\x61\xD8\x00"})},
      {"binary 16-byte UID", binary({"\x8F" + std::string(16, '\0')})},
      // libplist hands these over as text that is not UTF-8.
      {"binary ASCII high byte", binary({"\x53"
                                         "a\xE9"
                                         "b"})},
      {"binary ASCII high byte key", binary({"\xD1\x01\x02", "\x52k\xFF", "\x09"})},
  };
  const Cases tooLarge = {
      {"close hidden in comment",
       xmlPlist("<!-- </array></array> -->" + nested("<array>", "", 130))},
      {"XML 200,000 deep", xmlPlist(nested("<array>", "</array>", 200000))},
      {"XML 129 deep", xmlPlist(nested("<dict><key>k</key>", "</dict>", 129))},
      {"oversized", std::string(kMaxPropertyListBytes + 1, ' ')},
      {"binary 129 deep", binary(chainOf(kMaxPropertyListDepth + 1))},
      {"binary shared expansion", binary(dag)},
      {"binary cycle", binary({"\xA1\x01", std::string("\xA1\x00", 2)})},
  };
  for (const auto& [name, bytes] : malformed)
    expectError(readPropertyList(bytes), kPropertyListMalformed, name);
  for (const auto& [name, bytes] : tooLarge)
    expectError(readPropertyList(bytes), kPropertyListTooLarge, name);
  // Every prefix of a valid list, the empty one too, is refused as malformed,
  // never read past or crashed on.
  for (size_t n = 0; n < valid.size(); ++n) {
    expectError(readPropertyList(valid.substr(0, n)), kPropertyListMalformed,
                "prefix " + std::to_string(n));
  }
  // The depth limit itself is allowed.
  EXPECT_TRUE(
      readPropertyList(xmlPlist(nested("<array>", "</array>", kMaxPropertyListDepth))).has_value());
  EXPECT_TRUE(readPropertyList(binary(chainOf(kMaxPropertyListDepth))).has_value());
}

TEST(PropertyList, WriteRefusesWhatXmlCannotHold) {
  const std::pair<const char*, Value> unrepresentable[] = {
      {"null", Value()},
      {"null inside", Value(Dictionary{{"a", Value(Array{Value::integer(1), Value()})}})},
      {"control character", Value("a\x01z")},
      {"NUL in string", Value(std::string("a\0b", 3))},
      {"invalid UTF-8", Value("\xff\xfe")},
      {"control character in key", Value(Dictionary{{"\x02", Value::integer(1)}})},
  };
  for (const auto& [name, value] : unrepresentable) {
    expectError(writePropertyListXML(value), kPropertyListUnrepresentable, name);
  }
  Value deep = Value(Array{});
  for (int i = 0; i < kMaxPropertyListDepth; ++i) deep = Value(Array{deep});
  expectError(writePropertyListXML(deep), kPropertyListTooLarge, "too deep");
}

TEST(PropertyList, ReadsAndWritesFiles) {
  testing::TempDir dir;
  const std::string path = dir.file("a.plist");
  const Value value(Dictionary{{"version", Value::integer(16)}});
  ASSERT_TRUE(writePropertyListFile(path, value, 0600).has_value());
  EXPECT_EQ(modeOf(path), 0600u);
  EXPECT_EQ(readPropertyListFile(path).value(), value);

  // A failed write leaves the file as it was.
  expectError(writePropertyListFile(path, Value(Dictionary{{"x", Value()}})),
              kPropertyListUnrepresentable, "null");
  EXPECT_EQ(readPropertyListFile(path).value(), value);

  auto missing = readPropertyListFile(dir.file("missing"));
  ASSERT_FALSE(missing.has_value());
  EXPECT_EQ(missing.error().domain, "POSIX");
  EXPECT_EQ(missing.error().code, ENOENT);
  EXPECT_NE(missing.error().description().find(dir.file("missing")), std::string::npos);
  EXPECT_EQ(readPropertyListFile(dir.path().string()).error().code, EISDIR);

  const std::string big = dir.write("big", std::string(kMaxPropertyListBytes + 1, ' '));
  expectError(readPropertyListFile(big), kPropertyListTooLarge, "big");
}

}  // namespace
}  // namespace vantrel::platform
