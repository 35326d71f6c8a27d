#include <gtest/gtest.h>

#include <set>
#include <thread>

#include "base/Log.h"
#include "base/Uuid.h"

namespace vantrel::base {
namespace {

TEST(Uuid, TextIsCanonicalUpperCaseAndRoundTrips) {
  auto u = Uuid::parse("0a1b2c3d-4e5f-6071-8293-a4b5c6d7e8f9");
  ASSERT_TRUE(u);
  EXPECT_EQ(u->string(), "0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F9");
  EXPECT_EQ(Uuid::parse(u->string()), u);
  for (const char* bad :
       {"", "not-a-uuid", "0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F",
        "0A1B2C3D-4E5F-6071-8293-A4B5C6D7E8F9X", "0A1B2C3D4E5F60718293A4B5C6D7E8F9"}) {
    EXPECT_FALSE(Uuid::parse(bad)) << bad;
  }
  std::set<Uuid> seen;
  for (int i = 0; i < 100; ++i) seen.insert(Uuid::random());
  EXPECT_EQ(seen.size(), 100u);
  EXPECT_TRUE(Uuid().isNil());
  uint8_t raw[16] = {1};
  EXPECT_TRUE(Uuid::fromBytes(raw, 16));
  EXPECT_FALSE(Uuid::fromBytes(raw, 15));
}

TEST(Log, CaptureSeesExactLinesFromAnyThread) {
  LogCapture capture;
  vtlog("multiplexed plug-ins (%@ key) obsolete and ignored", std::string("Multiple"));
  std::thread([] { vtlog("from %s", "elsewhere"); }).join();
  EXPECT_EQ(capture.count("multiplexed plug-ins (Multiple key) obsolete and ignored"), 1u);
  EXPECT_TRUE(capture.contains("elsewhere"));
  EXPECT_EQ(capture.lines().size(), 2u);
}

}  // namespace
}  // namespace vantrel::base
