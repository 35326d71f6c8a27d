#include "lmo/Value.h"

#include <gtest/gtest.h>

#include <cmath>

#include "base/Format.h"
#include "lmo/Message.h"
#include "lmo/Protocol.h"

namespace vantrel::lmo {
namespace {

TEST(Value, EqualityFollowsPropertyListRules) {
  const Value t = Value::boolean(true), f = Value::boolean(false);
  struct Case {
    Value a, b;
    bool equal;
  } cases[] = {
      // clang-format off
      {t, Value::integer(1), true}, {f, Value::integer(0), true}, {t, Value::real(1.0), true},
      {t, Value::integer(2), false}, {Value::integer(5), Value::unsignedInteger(5), true},
      {Value::integer(-1), Value::unsignedInteger(UINT64_MAX), false},
      {Value::unsignedInteger(UINT64_MAX), Value::real(18446744073709551615.0), false},
      {Value::integer(INT64_MAX), Value::real(9223372036854775807.0), false},
      {Value::integer(2), Value::real(2.0), true}, {Value::integer(2), Value::real(2.5), false},
      {Value::real(NAN), Value::real(NAN), false}, {Value("1"), Value::integer(1), false},
      {Value("a"), Value("a"), true}, {Value(), Value(), true}, {Value(), Value(""), false},
      {Value::data("ab", 2), Value::data("ab", 2), true},
      {Value::data("ab", 2), Value("ab"), false},
      // clang-format on
      {Value(Array{Value("x"), t}), Value(Array{Value("x"), Value::integer(1)}), true},
      {Value(Array{Value("x")}), Value(Array{Value("x"), Value("y")}), false},
      {Value(Dictionary{{"k", t}}), Value(Dictionary{{"k", Value::real(1)}}), true},
      {Value(Dictionary{{"k", t}}), Value(Dictionary{{"j", t}}), false},
      {Value(Date{10}), Value(Date{10}), true},
      {Value(Date{10}), Value::integer(10), false},
  };
  for (size_t i = 0; i < std::size(cases); ++i) {
    EXPECT_EQ(cases[i].a == cases[i].b, cases[i].equal) << "case " << i;
    EXPECT_EQ(cases[i].b == cases[i].a, cases[i].equal) << "case " << i << " reversed";
  }
}

TEST(Value, TypedReadsYieldNullOnMismatch) {
  Value s("text");
  EXPECT_NE(s.getIfString(), nullptr);
  EXPECT_EQ(Value::data("x", 1).getIfString(), nullptr);
  EXPECT_FALSE(s.getIfInt64());
  EXPECT_FALSE(Value::real(3).getIfInt64());
  EXPECT_FALSE(Value::boolean(true).getIfUInt64());
  EXPECT_EQ(Value::unsignedInteger(7).getIfInt64(), 7);
  EXPECT_FALSE(Value::unsignedInteger(UINT64_MAX).getIfInt64());
  EXPECT_FALSE(Value::integer(-3).getIfUInt64());
  EXPECT_TRUE(Value::unsignedInteger(3).isUnsignedInteger());
  EXPECT_FALSE(Value::integer(3).isUnsignedInteger());
  EXPECT_TRUE(Value(static_cast<const char*>(nullptr)).isNull());
}

TEST(Value, LooseConversionsNeverInvokeUndefinedBehaviour) {
  EXPECT_EQ(Value::real(-1.5).integerValue(), -1);
  EXPECT_EQ(Value::real(1e300).unsignedValue(), UINT64_MAX);
  EXPECT_EQ(Value::real(NAN).integerValue(), 0);
  EXPECT_EQ(Value::integer(-1).unsignedValue(), UINT64_MAX);
  EXPECT_EQ(Value::boolean(true).unsignedValue(), 1u);
  EXPECT_EQ(Value("12").integerValue(), 0);
  EXPECT_DOUBLE_EQ(Value::unsignedInteger(UINT64_MAX).doubleValue(), 18446744073709551615.0);

  struct Case {
    Value v;
    bool want;
  } cases[] = {
      {Value::boolean(true), true}, {Value::boolean(false), false},
      {Value::integer(1), true},    {Value::integer(0), false},
      {Value::real(0.5), true},     {Value("YES"), true},
      {Value("true"), true},        {Value("  +7"), true},
      {Value("007"), true},         {Value("false"), false},
      {Value("no"), false},         {Value("0"), false},
      {Value(""), false},           {Value(), false},
      {Value(Array{}), false},
  };
  for (const Case& c : cases) EXPECT_EQ(c.v.boolValue(), c.want) << describe(c.v);
}

TEST(Dictionary, FromEntriesKeepsOneEntryPerKeyInKeyOrder) {
  using Entries = std::vector<Dictionary::Entry>;
  const struct {
    const char* name;
    Entries given;
    Entries want;
  } cases[] = {
      {"in order", {{"a", Value("1")}, {"b", Value("2")}}, {{"a", Value("1")}, {"b", Value("2")}}},
      {"in order with a duplicate",
       {{"a", Value("1")}, {"b", Value("2")}, {"b", Value("3")}},
       {{"a", Value("1")}, {"b", Value("3")}}},
      {"out of order",
       {{"c", Value("3")}, {"a", Value("1")}, {"c", Value("4")}},
       {{"a", Value("1")}, {"c", Value("4")}}},
  };
  for (const auto& c : cases) {
    const Dictionary d = Dictionary::fromEntries(c.given);
    EXPECT_EQ(Entries(d.begin(), d.end()), c.want) << c.name;
  }
}

TEST(Dictionary, ChangesReturnNewDictionariesAndLeaveTheReceiver) {
  Dictionary d{{"b", Value("2")}, {"a", Value("1")}, {"b", Value("3")}};
  EXPECT_EQ(d.size(), 2u);
  EXPECT_EQ(d.get("b"), Value("3"));  // the later duplicate wins
  EXPECT_EQ(d.keys(), (std::vector<std::string>{"a", "b"}));

  Dictionary added = d.setting("c", Value::integer(4));
  Dictionary replaced = d.setting("a", Value("x"));
  Dictionary removed = d.removing("a");
  Dictionary removedByNull = d.setting("b", Value());
  EXPECT_EQ(d.size(), 2u);
  EXPECT_EQ(d.get("a"), Value("1"));
  EXPECT_EQ(added.size(), 3u);
  EXPECT_EQ(replaced.get("a"), Value("x"));
  EXPECT_FALSE(removed.contains("a"));
  EXPECT_FALSE(removedByNull.contains("b"));
  EXPECT_EQ(d.removing("zz"), d);
  EXPECT_TRUE(d.get("missing").isNull());
  EXPECT_EQ(d.find("missing"), nullptr);
  EXPECT_TRUE(Dictionary{}.removing("a").empty());

  Array a{Value("x")};
  Array longer = a.appending(Value("y"));
  EXPECT_EQ(a.size(), 1u);
  EXPECT_EQ(longer.size(), 2u);
  EXPECT_TRUE(a.at(5).isNull());
}

TEST(Value, DescriptionsAreReadableOneLiners) {
  Dictionary d{{"identifier", Value("com.example.a")},
               {"name", Value("Two words")},
               {"n", Value::integer(-3)},
               {"list", Value(Array{Value::boolean(true), Value::real(0.25), Value()})},
               {"blob", Value::data("\x01\xff", 2)},
               {"when", Value(Date{0})}};
  EXPECT_EQ(describe(d),
            "{blob = <01ff>; identifier = com.example.a; list = (true, 0.25, <null>); n = -3; "
            "name = \"Two words\"; when = 1970-01-01T00:00:00Z}");
  EXPECT_EQ(describe(Value("Two words")), "Two words");
  EXPECT_EQ(describe(Value()), "(null)");
  EXPECT_EQ(base::format("at %@", Value("/x y")), "at /x y");
  EXPECT_EQ(describe(Value(Dictionary{{"q", Value("a\"b\n")}})), "{q = \"a\\\"b\\n\"}");
}

TEST(Message, TypedReadsOfMessageDictionaries) {
  Dictionary m{{protocol::kKeyPaths, Value(Array{})},
               {protocol::kKeyRules, Value(Dictionary{{"k", Value("v")}})},
               {"name", Value("x")}};
  ASSERT_TRUE(lmo_dictionary_get_array(m, protocol::kKeyPaths));
  EXPECT_TRUE(lmo_dictionary_get_array(m, protocol::kKeyPaths)->empty());
  EXPECT_FALSE(lmo_dictionary_get_array(m, protocol::kKeyRules));
  EXPECT_FALSE(lmo_dictionary_get_array(m, "name"));
  EXPECT_FALSE(lmo_dictionary_get_array(m, "missing"));
  EXPECT_FALSE(lmo_dictionary_get_array(m, nullptr));
  EXPECT_TRUE(lmo_dictionary_get_dictionary(m, protocol::kKeyRules));
  EXPECT_FALSE(lmo_dictionary_get_dictionary(m, protocol::kKeyPaths));
  EXPECT_TRUE(messageFromPropertyList(Value(m)));
  EXPECT_FALSE(messageFromPropertyList(Value("not a dictionary")));
}

}  // namespace
}  // namespace vantrel::lmo
