#include "registry/VTDUserPrefs.h"

#include <gtest/gtest.h>

#include "platform/Preferences.h"
#include "tests/support/ScopedEnvironment.h"
#include "tests/support/TempDir.h"

namespace vantrel::registry {
namespace {

lmo::Value rules(const char* extensionPoint) {
  return lmo::Array{lmo::Dictionary{{"QXExtensionPointIdentifier", extensionPoint}}};
}

TEST(VTDUserPrefsTest, ExclusionsAreReadFreshAndReturnedAsStored) {
  testing::TempDir dir;
  testing::ScopedEnvironment prefsDir("VANTREL_PREFERENCES_DIR", dir.path().string());
  VTDUserPrefs prefs;
  // Another process: a tool writing the same domain through its own object.
  platform::Preferences tool(kUserPrefsDomain);
  EXPECT_TRUE(prefs.exclusions().isNull());
  // Whatever is stored comes back, "not rules" included: judging it is the
  // caller's business. Null removes the key.
  for (const lmo::Value& stored : {rules("com.example.one"), rules("com.example.two"),
                                   lmo::Value("not rules"), lmo::Value()}) {
    ASSERT_TRUE(tool.setValue(kExclusionsKey, stored).has_value());
    EXPECT_EQ(prefs.exclusions(), stored);
  }
}

}  // namespace
}  // namespace vantrel::registry
