#include "lmo/Cbor.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <limits>
#include <string>
#include <vector>

#include "lmo/Protocol.h"

namespace vantrel::lmo {
namespace {

using Bytes = std::vector<uint8_t>;

Value decodeOk(const Bytes& bytes) {
  auto r = decodeCbor(bytes.data(), bytes.size());
  EXPECT_TRUE(r.has_value()) << (r.has_value() ? "" : r.error().description());
  return r.has_value() ? r.value() : Value();
}

Bytes encodeOk(const Value& v) {
  auto r = encodeCbor(v);
  EXPECT_TRUE(r.has_value());
  return r.has_value() ? r.value() : Bytes();
}

Value nested(int depth) {
  Value v = Value::integer(1);
  for (int i = 0; i < depth; ++i) v = Value(Array{v});
  return v;
}

TEST(CborTest, RoundTripsEveryKindOfValue) {
  base::Uuid uuid = base::Uuid::random();
  const Value values[] = {
      Value(), Value::boolean(true), Value::boolean(false),
      // Each width of the argument, at its edges.
      Value::unsignedInteger(0), Value::unsignedInteger(23), Value::unsignedInteger(24),
      Value::unsignedInteger(255), Value::unsignedInteger(256), Value::unsignedInteger(65536),
      Value::unsignedInteger(uint64_t{1} << 32),
      Value::unsignedInteger(std::numeric_limits<uint64_t>::max()), Value::integer(-1),
      Value::integer(-24), Value::integer(-25), Value::integer(std::numeric_limits<int64_t>::min()),
      Value::integer(std::numeric_limits<int64_t>::max()), Value::real(1.5), Value::real(-0.0),
      Value::real(1e300), Value(""), Value("h\xC3\xA9llo \xF0\x9F\x98\x80"),
      Value(std::string(300, 'x')), Value::data(Bytes{}), Value::data(Bytes{0, 1, 2, 0xFF}),
      Value(Date{1363896240.5}), Value(Date{-1.0}), Value(uuid), Value(Array{}),
      Value(Array{Value::integer(1), Value("two"), Value(Array{Value()})}),
      Value(Dictionary{{protocol::kKeyRequest, Value(protocol::kRequestMatch)},
                       {protocol::kKeyVersion, Value::unsignedInteger(protocol::kCurrentVersion)},
                       {protocol::kKeyRules, Value(Dictionary{{"a", Value(Array{Value(uuid)})}})}}),
      nested(kMaxCborDepth)};
  for (const Value& v : values) {
    Value back = decodeOk(encodeOk(v));
    EXPECT_EQ(back, v) << describe(v);
    EXPECT_EQ(back.type(), v.type()) << describe(v);
  }
  // Non-negative integers come back unsigned, negative ones signed.
  EXPECT_TRUE(decodeOk(encodeOk(Value::integer(5))).isUnsignedInteger());
  EXPECT_FALSE(decodeOk(encodeOk(Value::integer(-5))).isUnsignedInteger());
  EXPECT_TRUE(std::isnan(*decodeOk(encodeOk(Value::real(NAN))).getIfReal()));
}

TEST(CborTest, EncodesShortestDefiniteForms) {
  struct Case {
    Value value;
    Bytes bytes;
  };
  // Built entry by entry: a braced list of Values here trips GCC 12's
  // maybe-uninitialized warning at -O2.
  std::vector<Dictionary::Entry> entries;
  entries.emplace_back("b", Value::boolean(true));
  entries.emplace_back("a", Value());
  const Case cases[] = {
      {Value::unsignedInteger(23), {0x17}},
      {Value::unsignedInteger(24), {0x18, 0x18}},
      {Value::unsignedInteger(1000), {0x19, 0x03, 0xE8}},
      {Value::unsignedInteger(1000000), {0x1A, 0x00, 0x0F, 0x42, 0x40}},
      {Value::integer(-1000), {0x39, 0x03, 0xE7}},
      {Value::real(1.0), {0xFB, 0x3F, 0xF0, 0, 0, 0, 0, 0, 0}},
      {Value(Dictionary::fromEntries(entries)), {0xA2, 0x61, 'a', 0xF6, 0x61, 'b', 0xF5}},
      {Value(Date{0}), {0xC1, 0xFB, 0, 0, 0, 0, 0, 0, 0, 0}},
  };
  for (const Case& c : cases) EXPECT_EQ(encodeOk(c.value), c.bytes) << describe(c.value);
  EXPECT_FALSE(encodeCbor(nested(kMaxCborDepth + 1)).has_value());
}

TEST(CborTest, DecodesOtherFormsPeersMayWrite) {
  struct Case {
    Bytes bytes;
    Value value;
  };
  const Case cases[] = {
      {{0xF9, 0x3C, 0x00}, Value::real(1.0)},
      {{0xF9, 0x7B, 0xFF}, Value::real(65504.0)},
      {{0xF9, 0x00, 0x01}, Value::real(5.960464477539063e-8)},
      {{0xF9, 0xC4, 0x00}, Value::real(-4.0)},
      {{0xFA, 0x47, 0xC3, 0x50, 0x00}, Value::real(100000.0)},
      {{0x18, 0x05}, Value::unsignedInteger(5)},  // not shortest, still valid
      {{0x5F, 0x42, 1, 2, 0x43, 3, 4, 5, 0xFF}, Value::data(Bytes{1, 2, 3, 4, 5})},
      {{0x7F, 0x62, 's', 't', 0x61, 'r', 0xFF}, Value("str")},
      {{0x9F, 0x01, 0x82, 0x02, 0x03, 0x9F, 0xFF, 0xFF},
       Value(Array{Value::integer(1), Value(Array{Value::integer(2), Value::integer(3)}),
                   Value(Array{})})},
      {{0xBF, 0x61, 'a', 0x01, 0x7F, 0x61, 'b', 0xFF, 0x02, 0xFF},
       Value(Dictionary{{"a", Value::integer(1)}, {"b", Value::integer(2)}})},
      {{0xC1, 0x1A, 0x51, 0x4B, 0x67, 0xB0}, Value(Date{1363896240})},
      {{0xC1, 0x20}, Value(Date{-1})},
  };
  for (const Case& c : cases) EXPECT_EQ(decodeOk(c.bytes), c.value) << describe(c.value);
}

TEST(CborTest, RefusesMalformedInputWithAReason) {
  struct Case {
    const char* name;
    Bytes bytes;
    const char* reason;
  };
  Bytes deep(kMaxCborDepth, 0x81);
  deep.push_back(0x80);  // one level more than allowed
  const Case cases[] = {
      {"empty", {}, "truncated"},
      {"cut argument", {0x19, 0x01}, "truncated"},
      {"cut text", {0x63, 'a', 'b'}, "truncated"},
      {"cut array", {0x82, 0x01}, "longer than"},
      {"open indefinite array", {0x9F, 0x01}, "truncated"},
      {"trailing bytes", {0x01, 0x02}, "1 trailing bytes"},
      {"unknown tag", {0xC2, 0x41, 0x00}, "unknown tag 2"},
      {"integer key", {0xA1, 0x01, 0x02}, "not a text string"},
      {"duplicate key", {0xA2, 0x61, 'k', 0x01, 0x61, 'k', 0x02}, "duplicate map key"},
      {"invalid UTF-8", {0x62, 0xC3, 0x28}, "invalid UTF-8"},
      {"surrogate in UTF-8", {0x63, 0xED, 0xA0, 0x80}, "invalid UTF-8"},
      {"invalid UTF-8 split over chunks", {0x7F, 0x61, 0xC3, 0x61, 0xA9, 0xFF}, "invalid UTF-8"},
      {"invalid UTF-8 key", {0xA1, 0x61, 0xFF, 0x01}, "invalid UTF-8"},
      {"too deep", deep, "deeper than 64"},
      {"huge array count", {0x9B, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}, "longer than"},
      {"huge map count", {0xBA, 0x00, 0x10, 0x00, 0x00, 0x61, 'a', 0x01}, "longer than"},
      {"huge byte string", {0x5B, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}, "truncated"},
      {"lone break", {0xFF}, "unexpected break"},
      {"reserved info", {0x1C}, "reserved"},
      {"indefinite integer", {0x1F}, "indefinite length"},
      {"undefined", {0xF7}, "unsupported simple value 23"},
      {"simple value 255", {0xF8, 0xFF}, "unsupported simple value 255"},
      {"short UUID", {0xD8, 0x25, 0x41, 0x00}, "UUID of 1 bytes"},
      {"UUID over text", {0xD8, 0x25, 0x60}, "non-byte string"},
      {"date over text", {0xC1, 0x61, 'a'}, "not a number"},
      {"negative overflow", {0x3B, 0x80, 0, 0, 0, 0, 0, 0, 0}, "below -2^63"},
      {"wrong chunk type", {0x5F, 0x61, 'a', 0xFF}, "bad chunk"},
      {"nested indefinite chunk", {0x5F, 0x5F, 0xFF, 0xFF}, "bad chunk"},
  };
  for (const Case& c : cases) {
    auto r = decodeCbor(c.bytes.data(), c.bytes.size());
    ASSERT_FALSE(r.has_value()) << c.name;
    EXPECT_NE(r.error().description().find(c.reason), std::string::npos)
        << c.name << ": " << r.error().description();
  }
  Bytes array{0x80};
  auto notMap = decodeCborMessage(array.data(), array.size());
  ASSERT_FALSE(notMap.has_value());
  EXPECT_NE(notMap.error().description().find("not a map"), std::string::npos);
}

}  // namespace
}  // namespace vantrel::lmo
