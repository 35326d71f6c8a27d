#include "platform/DeviceRestrictions.h"

#include <gtest/gtest.h>

#include <limits>
#include <optional>
#include <thread>

#include "platform/Preferences.h"
#include "tests/platform/Helpers.h"

namespace vantrel::platform {
namespace {

using lmo::Value;

TEST(DeviceRestrictions, OnlyANumberRestrictsAndEveryReadSeesTheLatestWrite) {
  testing::TempDir dir, other;
  ScopedEnvironment preferences("VANTREL_PREFERENCES_DIR", dir.path().string());
  EXPECT_EQ(maximumApplicationRating(), std::nullopt) << "no file";
  // Another writer with a domain object of its own, as another process has.
  Preferences writer(kRestrictionsDomain);
  const struct {
    Value stored;
    std::optional<int64_t> expected;
  } cases[] = {
      {Value::integer(300), 300},
      {Value::integer(600), 600},
      {Value("300"), std::nullopt},
      {Value::boolean(true), std::nullopt},
      {Value::real(299.9), 299},
      {Value::real(-1.5), -1},
      {Value::real(1e300), std::numeric_limits<int64_t>::max()},
      {Value(), std::nullopt},
      {Value::integer(17), 17},
  };
  for (const auto& c : cases) {
    ASSERT_TRUE(writer.setValue(kMaxApplicationRatingKey, c.stored).has_value());
    EXPECT_EQ(maximumApplicationRating(), c.expected) << describe(c.stored);
  }

  // The process's own writer, and a switch to another store location.
  {
    ScopedEnvironment elsewhere("VANTREL_PREFERENCES_DIR", other.path().string());
    EXPECT_EQ(maximumApplicationRating(), std::nullopt);
    ASSERT_TRUE(setMaximumApplicationRating(9).has_value());
    EXPECT_EQ(maximumApplicationRating(), 9);
  }
  EXPECT_EQ(maximumApplicationRating(), 17);
  ASSERT_TRUE(setMaximumApplicationRating(std::nullopt).has_value());
  writer.synchronize();
  EXPECT_TRUE(writer.valueForKey(kMaxApplicationRatingKey).isNull());

  // One request is one check: inside a scope the first answer stands, on
  // this thread only, until the outermost scope ends.
  ASSERT_TRUE(writer.setValue(kMaxApplicationRatingKey, Value::integer(4)).has_value());
  {
    DeviceRestrictionsReadOnce once;
    EXPECT_EQ(maximumApplicationRating(), 4);
    ASSERT_TRUE(writer.setValue(kMaxApplicationRatingKey, Value::integer(12)).has_value());
    {
      DeviceRestrictionsReadOnce nested;
      EXPECT_EQ(maximumApplicationRating(), 4);
    }
    EXPECT_EQ(maximumApplicationRating(), 4);
    std::optional<int64_t> elsewhere;
    std::thread([&] { elsewhere = maximumApplicationRating(); }).join();
    EXPECT_EQ(elsewhere, 12);
  }
  EXPECT_EQ(maximumApplicationRating(), 12);
}

}  // namespace
}  // namespace vantrel::platform
