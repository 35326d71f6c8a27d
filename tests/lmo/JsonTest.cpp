#include "lmo/Json.h"

#include <gtest/gtest.h>

#include <cmath>

namespace vantrel::lmo {
namespace {

TEST(Json, EveryTypeMapsToValidJson) {
  struct Case {
    Value v;
    std::string want;
  } cases[] = {
      // clang-format off
      {Value(), "null"}, {Value::boolean(false), "false"}, {Value::integer(-5), "-5"},
      {Value::unsignedInteger(UINT64_MAX), "18446744073709551615"},
      {Value::real(2), "2.0"}, {Value::real(0.5), "0.5"}, {Value::real(INFINITY), "null"},
      {Value("a\"b\\c\n\x01"), "\"a\\\"b\\\\c\\n\\u0001\""},
      {Value("caf\xC3\xA9"), "\"caf\xC3\xA9\""},
      {Value("bad\xC3"), "\"bad\xEF\xBF\xBD\""},
      {Value("\xED\xA0\x80"), "\"\xEF\xBF\xBD\xEF\xBF\xBD\xEF\xBF\xBD\""},  // surrogate
      {Value::data("", 0), "\"\""}, {Value::data("f", 1), "\"Zg==\""},
      {Value::data("fo", 2), "\"Zm8=\""}, {Value::data("foo", 3), "\"Zm9v\""},
      {Value(Date{86400}), "\"1970-01-02T00:00:00Z\""},
      {Value(Array{}), "[]"}, {Value(Dictionary{}), "{}"},
      {Value(Dictionary{{"b", Value(Array{Value::integer(1), Value("x")})}, {"a", Value()}}),
       "{\"a\":null,\"b\":[1,\"x\"]}"},
      // clang-format on
  };
  for (const Case& c : cases) EXPECT_EQ(toJson(c.v), c.want) << describe(c.v);
}

TEST(Json, PrettyOutputIndentsFromTheGivenColumn) {
  Value v(Dictionary{{"k", Value(Array{Value::integer(1)})}});
  EXPECT_EQ(toJson(v, JsonStyle::kPretty), "{\n  \"k\": [\n    1\n  ]\n}");
  EXPECT_EQ(toJson(v, JsonStyle::kPretty, 4), "{\n      \"k\": [\n        1\n      ]\n    }");
}

}  // namespace
}  // namespace vantrel::lmo
