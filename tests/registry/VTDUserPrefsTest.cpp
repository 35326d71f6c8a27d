#include "registry/VTDUserPrefs.h"

#include <gtest/gtest.h>

#include <cstdlib>

#include "platform/Preferences.h"
#include "tests/support/TempDir.h"

namespace vantrel::registry {
namespace {

lmo::Value rules(const char* extensionPoint) {
  return lmo::Array{lmo::Dictionary{{"QXExtensionPointIdentifier", extensionPoint}}};
}

class VTDUserPrefsTest : public ::testing::Test {
 protected:
  void SetUp() override { ::setenv("VANTREL_PREFERENCES_DIR", dir_.path().c_str(), 1); }
  void TearDown() override { ::unsetenv("VANTREL_PREFERENCES_DIR"); }
  testing::TempDir dir_;
};

TEST_F(VTDUserPrefsTest, ExclusionsAreReadFreshAndReturnedAsStored) {
  VTDUserPrefs prefs;
  // Another process: a tool writing the same domain through its own object.
  platform::Preferences tool(kUserPrefsDomain);
  EXPECT_TRUE(prefs.exclusions().isNull());

  ASSERT_TRUE(tool.setValue(kExclusionsKey, rules("com.example.one")).has_value());
  EXPECT_EQ(prefs.exclusions(), rules("com.example.one"));
  ASSERT_TRUE(tool.setValue(kExclusionsKey, rules("com.example.two")).has_value());
  EXPECT_EQ(prefs.exclusions(), rules("com.example.two"));
  // Whatever is stored comes back; judging it is the caller's business.
  ASSERT_TRUE(tool.setValue(kExclusionsKey, lmo::Value("not rules")).has_value());
  EXPECT_EQ(prefs.exclusions(), lmo::Value("not rules"));
  ASSERT_TRUE(tool.setValue(kExclusionsKey, lmo::Value()).has_value());
  EXPECT_TRUE(prefs.exclusions().isNull());
}

}  // namespace
}  // namespace vantrel::registry
