#include "platform/SdkRegistry.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <optional>
#include <string>

#include "tests/platform/Helpers.h"

namespace vantrel::platform {
namespace {

std::string sdkPlist(const char* origin) {
  return stringsPlist({{"origin", origin}});
}

// What the lookup found: the "origin" string of the dictionary, "" for none.
std::string origin(const std::string& name) {
  std::optional<lmo::Dictionary> sdk = lookupExtensionSdk(name);
  if (!sdk) return "";
  const std::string* s = sdk->get("origin").getIfString();
  return s ? *s : "(no origin)";
}

TEST(SdkRegistry, FirstDirectoryHoldingADictionaryWins) {
  testing::TempDir tmp;
  ScopedEnvironment dirs("VANTREL_SDK_DIRS", tmp.file("first") + ":" + tmp.file("second"));
  tmp.write("first/both.plist", sdkPlist("first"));
  tmp.write("second/both.plist", sdkPlist("second"));
  tmp.write("second/later.plist", sdkPlist("second"));
  tmp.write("first/malformed.plist", "<plist><dict><key>x</key>");
  tmp.write("second/malformed.plist", sdkPlist("second"));
  tmp.write("first/array.plist", xmlPlist("<array/>"));
  tmp.write("second/array.plist", sdkPlist("second"));
  tmp.write("first/only-array.plist", xmlPlist("<array/>"));
  std::filesystem::create_directories(tmp.path() / "first/dir.plist");
  tmp.write("second/dir.plist", sdkPlist("second"));
  tmp.write("first/com.example.point.plist", sdkPlist("first"));

  const std::pair<const char*, const char*> cases[] = {
      {"both", "first"},  {"later", "second"}, {"malformed", "second"},        {"array", "second"},
      {"only-array", ""}, {"dir", "second"},   {"com.example.point", "first"}, {"missing", ""},
  };
  for (const auto& [name, from] : cases) EXPECT_EQ(origin(name), from) << name;
}

TEST(SdkRegistry, NamesThatCouldLeaveTheDirectoryAreNeverLookedUp) {
  testing::TempDir tmp;
  ScopedEnvironment dirs("VANTREL_SDK_DIRS", tmp.file("sdks/inner"));
  // Every file here would be found if its name were looked up as given.
  tmp.write("sdks/inner/.plist", sdkPlist("empty"));
  tmp.write("sdks/inner/..plist", sdkPlist("dot"));
  tmp.write("sdks/inner/...plist", sdkPlist("dotdot"));
  tmp.write("sdks/secret.plist", sdkPlist("secret"));
  tmp.write("sdks/inner/sub/x.plist", sdkPlist("sub"));
  tmp.write("sdks/inner/cut", sdkPlist("cut"));
  for (const std::string& name :
       {std::string(), std::string("."), std::string(".."), std::string("../secret"),
        std::string("sub/x"), std::string("cut\0x", 5)}) {
    EXPECT_EQ(origin(name), "") << name;
  }
  // The longest name there can be a file for is looked up.
  tmp.write("sdks/inner/" + std::string(kMaxSdkNameLength, 'n') + ".plist", sdkPlist("max"));
  EXPECT_EQ(origin(std::string(kMaxSdkNameLength, 'n')), "max");
}

}  // namespace
}  // namespace vantrel::platform
