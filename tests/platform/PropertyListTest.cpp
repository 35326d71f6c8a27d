#include "platform/PropertyList.h"

#include <gtest/gtest.h>
#include <plist/plist.h>
#include <sys/stat.h>

#include <cmath>

#include "base/Format.h"
#include "tests/support/TempDir.h"

namespace vantrel::platform {
namespace {

using lmo::Array;
using lmo::Date;
using lmo::Dictionary;
using lmo::Value;

std::string xmlDocument(const std::string& body) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">" + body + "</plist>";
}

std::string nested(const char* open, const char* close, int depth) {
  std::string s;
  for (int i = 0; i < depth; ++i) s += open;
  for (int i = 0; i < depth; ++i) s += close;
  return s;
}

// A binary property list from raw objects; each object's references are
// one byte wide (so at most 255 objects).
std::string binary(const std::vector<std::string>& objects, uint64_t top = 0) {
  std::string out = "bplist00";
  std::vector<size_t> offsets;
  for (const std::string& object : objects) {
    offsets.push_back(out.size());
    out += object;
  }
  const size_t table = out.size();
  for (size_t offset : offsets)
    out += {char(offset >> 24), char(offset >> 16), char(offset >> 8), char(offset)};
  std::string trailer(32, '\0');
  trailer[6] = 4;  // offset size
  trailer[7] = 1;  // reference size
  auto put = [&](size_t at, uint64_t v) {
    for (int i = 7; i >= 0; --i, v >>= 8) trailer[at + i] = char(v & 0xff);
  };
  put(8, objects.size());
  put(16, top);
  put(24, table);
  return out + trailer;
}

// n arrays, each holding the next.
std::vector<std::string> chainOf(int n) {
  std::vector<std::string> links;
  for (int i = 0; i + 1 < n; ++i) links.push_back(std::string("\xA1") + char(i + 1));
  links.push_back("\xA0");
  return links;
}

std::string libplistBinary(plist_t root) {
  char* bytes = nullptr;
  uint32_t length = 0;
  plist_to_bin(root, &bytes, &length);
  std::string out(bytes, length);
  plist_to_bin_free(bytes);
  plist_free(root);
  return out;
}

Value everyType() {
  const Value leaves[] = {Value::boolean(true),
                          Value::boolean(false),
                          Value::integer(-42),
                          Value::integer(INT64_MIN),
                          Value::integer(INT64_MAX),
                          Value::real(0.1),
                          Value::real(-1e300),
                          Value::real(INFINITY),
                          Value("h\xC3\xA9llo <&> ]]> \"quoted\" \t\n"),
                          Value(""),
                          Value::data("\x00\xff\x10", 3),
                          Value::data(nullptr, 0),
                          Value(Date{1577934245}),  // 2020-01-02T03:04:05Z
                          Value(Date{0}),
                          Value(Array{}),
                          Value(Dictionary{})};
  std::vector<Value> items(std::begin(leaves), std::end(leaves));
  return Value(Dictionary{{"leaves", Value(Array(items))},
                          {"nested", Value(Dictionary{{"a", Value(Array{Value("x")})}})},
                          {"k\xC3\xA9y <&>", Value::integer(1)}});
}

TEST(PropertyList, RoundTripsEveryTypeThroughXml) {
  const Value value = everyType();
  auto xml = writePropertyListXML(value);
  ASSERT_TRUE(xml.has_value()) << xml.error().description();
  auto back = readPropertyList(xml.value());
  ASSERT_TRUE(back.has_value()) << back.error().description();
  EXPECT_EQ(back.value(), value) << lmo::describe(back.value());

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
  EXPECT_TRUE(big.value().getIfArray()->at(0).isUnsignedInteger());
  EXPECT_EQ(big.value().getIfArray()->at(0).getIfUInt64(), UINT64_MAX);
  EXPECT_EQ(big.value().getIfArray()->at(1).getIfInt64(), -1);
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
  auto read = readPropertyList(xmlDocument("<integer>18446744073709551615</integer>"));
  EXPECT_EQ(read.value().getIfUInt64(), UINT64_MAX);

  // Dates beyond int32 seconds from 2001 read correctly but cannot be written.
  for (double seconds : {-2208988800.0, 7258118400.0}) {  // 1900, 2200
    const Value date(Date{seconds});
    EXPECT_EQ(writePropertyListXML(date).error().code, kPropertyListUnrepresentable);
  }
  EXPECT_EQ(readPropertyList(xmlDocument("<date>1900-01-01T00:00:00Z</date>")).value(),
            Value(Date{-2208988800}));
  EXPECT_EQ(readPropertyList(xmlDocument("<date>2200-01-01T00:00:00Z</date>")).value(),
            Value(Date{7258118400}));

  // XML dates hold whole seconds.
  EXPECT_EQ(readPropertyList(writePropertyListXML(Value(Date{978307201.75})).value()).value(),
            Value(Date{978307201}));
}

TEST(PropertyList, RejectsMalformedInput) {
  const std::string valid = libplistBinary(plist_new_string("a binary property list"));
  std::vector<std::string> dag;  // 40 levels, each holding the next twice: 2^40 values
  for (int i = 0; i < 39; ++i) dag.push_back(std::string("\xA2") + char(i + 1) + char(i + 1));
  dag.push_back("\xA0");
  struct Case {
    const char* name;
    std::string bytes;
    int64_t code;
  } cases[] = {
      {"empty", "", kPropertyListMalformed},
      {"garbage", "hello, world", kPropertyListMalformed},
      {"truncated XML", xmlDocument("<dict><key>a</key><str"), kPropertyListMalformed},
      {"truncated binary", valid.substr(0, valid.size() - 5), kPropertyListMalformed},
      {"wrong root", "<html><body>x</body></html>", kPropertyListMalformed},
      {"two roots", xmlDocument("<true/><false/>"), kPropertyListMalformed},
      {"empty plist", xmlDocument(""), kPropertyListMalformed},
      {"text after root", xmlDocument("<true/>") + "junk", kPropertyListMalformed},
      {"key without value", xmlDocument("<dict><key>a</key></dict>"), kPropertyListMalformed},
      {"key in array", xmlDocument("<array><key>a</key></array>"), kPropertyListMalformed},
      {"mismatched close", xmlDocument("<array><true/></dict>"), kPropertyListMalformed},
      {"bad integer", xmlDocument("<integer>12abc</integer>"), kPropertyListMalformed},
      {"integer overflow", xmlDocument("<integer>18446744073709551616</integer>"),
       kPropertyListMalformed},
      {"bad real", xmlDocument("<real>x</real>"), kPropertyListMalformed},
      {"bad date", xmlDocument("<date>yesterday</date>"), kPropertyListMalformed},
      {"bad base64", xmlDocument("<data>!!!!</data>"), kPropertyListMalformed},
      {"bad entity", xmlDocument("<string>&bogus;</string>"), kPropertyListMalformed},
      {"unknown element", xmlDocument("<foo/>"), kPropertyListMalformed},
      {"NUL byte", xmlDocument(std::string("<string>a\0b</string>", 20)), kPropertyListMalformed},
      {"close hidden in comment",
       xmlDocument("<!-- </array></array> -->" + nested("<array>", "", 130)),
       kPropertyListTooLarge},
      {"XML 200,000 deep", xmlDocument(nested("<array>", "</array>", 200000)),
       kPropertyListTooLarge},
      {"XML 129 deep", xmlDocument(nested("<dict><key>k</key>", "</dict>", 129)),
       kPropertyListTooLarge},
      {"oversized", std::string(kMaxPropertyListBytes + 1, ' '), kPropertyListTooLarge},
      {"binary 129 deep", binary(chainOf(kMaxPropertyListDepth + 1)), kPropertyListTooLarge},
      {"binary shared expansion", binary(dag), kPropertyListTooLarge},
      {"binary cycle", binary({"\xA1\x01", std::string("\xA1\x00", 2)}), kPropertyListTooLarge},
      {"binary bad reference", binary({"\xA1\x05"}), kPropertyListMalformed},
      {"binary huge count", binary({std::string("\xAF\x13\x10\0\0\0\0\0\0\0", 10)}),
       kPropertyListMalformed},
      {"binary non-string key", binary({"\xD1\x01\x01", "\x10\x01"}), kPropertyListMalformed},
      {"binary 128-bit overflow", binary({"\x14\x01" + std::string(15, '\0')}),
       kPropertyListMalformed},
      {"binary bad trailer", "bplist00" + std::string(32, '\xff'), kPropertyListMalformed},
      // libplist aborts on the first, truncates the second, empties the third.
      {"binary UTF-16 NUL", binary({std::string("\x62\0a\0\0", 5)}), kPropertyListMalformed},
      {"binary ASCII NUL key", binary({"\xD1\x01\x02", std::string("\x53k\0y", 4), "\x09"}),
       kPropertyListMalformed},
      {"binary lone surrogate", binary({"\x61\xD8\x00"}), kPropertyListMalformed},
      {"binary 16-byte UID", binary({"\x8F" + std::string(16, '\0')}), kPropertyListMalformed},
  };
  for (const Case& c : cases) {
    auto result = readPropertyList(c.bytes);
    ASSERT_FALSE(result.has_value()) << c.name;
    EXPECT_EQ(result.error().domain, "PropertyList") << c.name;
    EXPECT_EQ(result.error().code, c.code) << c.name << ": " << result.error().description();
  }
  // Every prefix of a valid list is refused, never read past or crashed on.
  for (size_t n = 0; n < valid.size(); ++n)
    EXPECT_FALSE(readPropertyList(valid.substr(0, n)).has_value());
  // The depth limit itself is allowed.
  EXPECT_TRUE(readPropertyList(xmlDocument(nested("<array>", "</array>", kMaxPropertyListDepth)))
                  .has_value());
  EXPECT_TRUE(readPropertyList(binary(chainOf(kMaxPropertyListDepth))).has_value());
}

TEST(PropertyList, WriteRefusesWhatXmlCannotHold) {
  Value deep = Value(Array{});
  for (int i = 0; i < kMaxPropertyListDepth; ++i) deep = Value(Array{deep});
  struct Case {
    const char* name;
    Value value;
    int64_t code;
  } cases[] = {
      {"null", Value(), kPropertyListUnrepresentable},
      {"null inside", Value(Dictionary{{"a", Value(Array{Value::integer(1), Value()})}}),
       kPropertyListUnrepresentable},
      {"control character", Value("a\x01z"), kPropertyListUnrepresentable},
      {"NUL in string", Value(std::string("a\0b", 3)), kPropertyListUnrepresentable},
      {"invalid UTF-8", Value("\xff\xfe"), kPropertyListUnrepresentable},
      {"control character in key", Value(Dictionary{{"\x02", Value::integer(1)}}),
       kPropertyListUnrepresentable},
      {"date beyond int32 seconds", Value(Date{1e12}), kPropertyListUnrepresentable},
      {"too deep", deep, kPropertyListTooLarge},
  };
  for (const Case& c : cases) {
    auto result = writePropertyListXML(c.value);
    ASSERT_FALSE(result.has_value()) << c.name;
    EXPECT_EQ(result.error().code, c.code) << c.name;
  }
}

TEST(PropertyList, ReadsAndWritesFiles) {
  testing::TempDir dir;
  const std::string path = dir.file("a.plist");
  const Value value(Dictionary{{"version", Value::integer(16)}});
  ASSERT_TRUE(writePropertyListFile(path, value, 0600).has_value());
  struct stat st;
  ASSERT_EQ(::stat(path.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  EXPECT_EQ(readPropertyListFile(path).value(), value);

  // A failed write leaves the file as it was.
  EXPECT_FALSE(writePropertyListFile(path, Value(Dictionary{{"x", Value()}})).has_value());
  EXPECT_EQ(readPropertyListFile(path).value(), value);

  auto missing = readPropertyListFile(dir.file("missing"));
  ASSERT_FALSE(missing.has_value());
  EXPECT_EQ(missing.error().domain, "POSIX");
  EXPECT_EQ(missing.error().code, ENOENT);
  EXPECT_NE(missing.error().description().find(dir.file("missing")), std::string::npos);
  EXPECT_EQ(readPropertyListFile(dir.path().string()).error().code, EISDIR);

  const std::string big = dir.write("big", std::string(kMaxPropertyListBytes + 1, ' '));
  EXPECT_EQ(readPropertyListFile(big).error().code, kPropertyListTooLarge);
}

}  // namespace
}  // namespace vantrel::platform
