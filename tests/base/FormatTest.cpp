#include "base/Format.h"

#include <gtest/gtest.h>

#include "base/Error.h"
#include "base/Result.h"
#include "lmo/Protocol.h"

namespace vantrel::base {
namespace {

struct Thing {
  int n;
};
std::string describe(const Thing& t) {
  return "<thing " + std::to_string(t.n) + ">";
}

TEST(Format, ConversionsFillPlaceholdersExactly) {
  const char* nullText = nullptr;
  struct Case {
    std::string got;
    std::string want;
  } cases[] = {
      {format("client %d plugin %@ excluded", 42, std::string("com.x")),
       "client 42 plugin com.x excluded"},
      {format("unsupported protocol version %d (current %d)", 0, 3),
       "unsupported protocol version 0 (current 3)"},
      {format("client %d used %u requests so far", -1, 2000u),
       "client -1 used 2000 requests so far"},
      {format("absolute path required: %s", "tmp/x"), "absolute path required: tmp/x"},
      {format("%s and %@", nullText, std::optional<std::string>()), "(null) and (null)"},
      {format("flags %lx", uint64_t{0xdeadbeef}), "flags deadbeef"},
      {format("100%% sure"), "100% sure"},
      {format("%@", Thing{7}), "<thing 7>"},
      {format("%d %d", 1), "1 (missing)"},
      {format("%q stays, %5d stays"), "%q stays, %5d stays"},
      {format("trailing %"), "trailing %"},
      {format("%@ is %@", true, 2.5), "YES is 2.5"},
      {format("%d", INT64_MIN), "-9223372036854775808"},
      {format("%u", UINT64_MAX), "18446744073709551615"},
  };
  for (const Case& c : cases) EXPECT_EQ(c.got, c.want);
  EXPECT_EQ(format("%p", reinterpret_cast<const void*>(0x1000)), "0x1000");
}

TEST(Format, PercentInArgumentIsNotAFormatAgain) {
  EXPECT_EQ(format("%@", std::string("50%d%@")), "50%d%@");
}

TEST(Error, CodesAndDescriptions) {
  Error plain = error_with_code(protocol::kErrorBadRequest, "unrecognized request");
  EXPECT_EQ(plain.domain, "Vantrel");
  EXPECT_EQ(plain.code, protocol::kErrorBadRequest);
  EXPECT_EQ(plain.localizedDescription, "unrecognized request");

  Error bare = error_with_code(protocol::kErrorBusy, nullptr);
  EXPECT_EQ(bare.domain, VTErrorDomain);
  EXPECT_EQ(bare.code, protocol::kErrorBusy);
  EXPECT_FALSE(bare.localizedDescription.has_value());
  EXPECT_EQ(bare.description(), "Vantrel error 14");

  Error formatted =
      error_with_code_and_format(protocol::kErrorBadPath, "no plugin at %@", std::string("/a b"));
  EXPECT_EQ(formatted.localizedDescription, "no plugin at /a b");
  EXPECT_FALSE(error_with_code_and_format(protocol::kErrorBadPath, nullptr).localizedDescription);
}

Result<int> half(int n) {
  if (n % 2 != 0) return error_with_code_and_format(protocol::kErrorBadRequest, "odd: %d", n);
  return n / 2;
}

Result<int> quarter(int n) {
  int h = VT_TRY(half(n));
  return VT_TRY(half(h));
}

TEST(Result, TryPropagatesTheFirstError) {
  EXPECT_EQ(quarter(8).value(), 2);
  Result<int> r = quarter(6);
  ASSERT_FALSE(r.has_value());
  EXPECT_EQ(r.error().localizedDescription, "odd: 3");
  EXPECT_TRUE(Result<void>::success().has_value());
  EXPECT_FALSE(Result<void>(error_with_code(2, nullptr)).has_value());
}

TEST(ResultDeathTest, ValueOfAnErrorStopsTheProcess) {
  EXPECT_DEATH((void)half(1).value(), "internal inconsistency: Result::value\\(\\) on an error");
}

}  // namespace
}  // namespace vantrel::base
