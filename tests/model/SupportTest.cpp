#include <gtest/gtest.h>

#include <cstdlib>

#include "model/Collections.h"
#include "model/SandboxExtensionIssue.h"
#include "model/VTDPlugInSignature.h"
#include "model/VTSandboxExtension.h"
#include "model/VersionComparison.h"
#include "platform/SandboxExtensionService.h"
#include "tests/model/PlugInFixtures.h"
#include "tests/support/TempDir.h"

namespace vantrel::model {
namespace {

using lmo::Array;
using lmo::Dictionary;
using lmo::Value;
using testing::I;

TEST(VersionComparison, DigitRunsNumericallyOtherBytesLiterally) {
  struct Case {
    const char* a;
    const char* b;
    int order;
  };
  const Case cases[] = {
      // clang-format off
      {"1.10", "1.9", 1}, {"2", "10", -1}, {"1.2.3", "1.2.3", 0}, {"1.0b", "1.0", 1},
      {"1.0", "1.0.0", -1}, {"1.01", "1.1", 0}, {"007", "7", 0}, {"1a2", "1a10", -1},
      {"1.0a", "1.0B", 1},  // case-sensitive: 'a' > 'B'
      {"", "", 0}, {"", "0", -1},
      {"99999999999999999999999999", "100000000000000000000000000", -1},
      {"1.99999999999999999999999999", "1.99999999999999999999999998", 1},
      // clang-format on
  };
  for (const Case& c : cases) {
    EXPECT_EQ(compareVersionString(c.a, c.b), c.order) << c.a << " vs " << c.b;
    EXPECT_EQ(compareVersionString(c.b, c.a), -c.order) << c.b << " vs " << c.a;
  }
}

TEST(Collections, ComprehensionDropsNullsAndChangesCopy) {
  auto evenOnly = [](const Value& v) { return v.integerValue() % 2 ? Value() : v; };
  EXPECT_EQ(arrayWithValues(Array{I(1), I(2), I(3), I(4)}, evenOnly), (Array{I(2), I(4)}));
  const Dictionary d{{"a", "1"}};
  EXPECT_EQ(dictionaryChanging(dictionaryChanging(d, "b", "2"), "a", Value()),
            (Dictionary{{"b", "2"}}));
  EXPECT_EQ(d, (Dictionary{{"a", "1"}}));
}

TEST(Signature, RandomHashFixedRequirement) {
  auto a = VTDPlugInSignature::initWithURL(FileUrl::fromPath("/a"), nullptr);
  auto b = VTDPlugInSignature::initWithURL(FileUrl::fromPath("/a"), nullptr);
  ASSERT_TRUE(a->cdhash().getIfData());
  EXPECT_EQ(a->cdhash().getIfData()->size(), 20u);
  EXPECT_NE(a->cdhash(), b->cdhash());
  EXPECT_EQ(a->requirement(), "dummy requirement");
}

class SandboxExtensionTest : public ::testing::Test {
 protected:
  void SetUp() override {
    setenv("VANTREL_STATE_DIR", state_.path().c_str(), 1);
    file_ = files_.write("resource.txt", "hello");
  }
  void TearDown() override { unsetenv("VANTREL_STATE_DIR"); }
  vantrel::testing::TempDir state_, files_;
  std::string file_;
};

TEST_F(SandboxExtensionTest, ConsumeOnceExpelAndDestroy) {
  std::optional<std::string> token = issue_read_extension(FileUrl::fromPath(file_));
  ASSERT_TRUE(token);
  EXPECT_FALSE(issue_read_extension(FileUrl::fromPath(files_.file("missing"))));

  auto holder = VTSandboxExtension::initWithExtension(*token);
  EXPECT_EQ(holder->token(), *token);
  holder->expel();  // never consumed: nothing to do
  EXPECT_EQ(holder->handle(), 0);
  holder->consume();
  int64_t handle = holder->handle();
  ASSERT_GT(handle, 0);
  EXPECT_GE(platform::sandbox_extension_descriptor(handle), 0);
  holder->consume();
  EXPECT_EQ(holder->handle(), handle);
  holder->expel();
  EXPECT_EQ(holder->handle(), 0);
  EXPECT_EQ(platform::sandbox_extension_descriptor(handle), -1);

  {
    VTSandboxExtension scoped(*token);
    scoped.consume();
    handle = scoped.handle();
    ASSERT_GT(handle, 0);
  }
  EXPECT_EQ(platform::sandbox_extension_descriptor(handle), -1);

  VTSandboxExtension forged("not a token");
  forged.consume();
  EXPECT_EQ(forged.handle(), -1);  // refused, and not retried
}

}  // namespace
}  // namespace vantrel::model
