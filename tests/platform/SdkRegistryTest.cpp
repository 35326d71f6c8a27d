#include "platform/SdkRegistry.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <optional>
#include <string>

#include "tests/support/TempDir.h"

namespace vantrel::platform {
namespace {

std::string sdkPlist(const char* origin) {
  return std::string("<plist version=\"1.0\"><dict><key>origin</key><string>") + origin +
         "</string></dict></plist>";
}

// Points VANTREL_SDK_DIRS at a value for the lifetime of the object.
class ScopedSdkDirs {
 public:
  explicit ScopedSdkDirs(const std::string& value) {
    if (const char* old = ::getenv(kVariable)) previous_ = old;
    ::setenv(kVariable, value.c_str(), 1);
  }
  ~ScopedSdkDirs() {
    if (previous_) {
      ::setenv(kVariable, previous_->c_str(), 1);
    } else {
      ::unsetenv(kVariable);
    }
  }

 private:
  static constexpr const char* kVariable = "VANTREL_SDK_DIRS";
  std::optional<std::string> previous_;
};

// What the lookup found: the "origin" string of the dictionary, "" for none.
std::string origin(const std::string& name) {
  std::optional<lmo::Dictionary> sdk = lookupExtensionSdk(name);
  if (!sdk) return "";
  const std::string* s = sdk->get("origin").getIfString();
  return s ? *s : "(no origin)";
}

TEST(SdkRegistry, FirstDirectoryHoldingADictionaryWins) {
  testing::TempDir tmp;
  ScopedSdkDirs dirs(tmp.file("first") + ":" + tmp.file("second"));
  tmp.write("first/both.plist", sdkPlist("first"));
  tmp.write("second/both.plist", sdkPlist("second"));
  tmp.write("second/later.plist", sdkPlist("second"));
  tmp.write("first/malformed.plist", "<plist><dict><key>x</key>");
  tmp.write("second/malformed.plist", sdkPlist("second"));
  tmp.write("first/array.plist", "<plist version=\"1.0\"><array/></plist>");
  tmp.write("second/array.plist", sdkPlist("second"));
  tmp.write("first/only-array.plist", "<plist version=\"1.0\"><array/></plist>");
  std::filesystem::create_directories(tmp.path() / "first/dir.plist");
  tmp.write("second/dir.plist", sdkPlist("second"));
  tmp.write("first/com.example.point.plist", sdkPlist("first"));

  struct Case {
    const char* name;
    const char* origin;
  } cases[] = {
      {"both", "first"},  {"later", "second"}, {"malformed", "second"},        {"array", "second"},
      {"only-array", ""}, {"dir", "second"},   {"com.example.point", "first"}, {"missing", ""},
  };
  for (const Case& c : cases) EXPECT_EQ(origin(c.name), c.origin) << c.name;
}

TEST(SdkRegistry, NamesThatCouldLeaveTheDirectoryAreNeverLookedUp) {
  testing::TempDir tmp;
  ScopedSdkDirs dirs(tmp.file("sdks/inner"));
  // Every file here would be found if its name were looked up as given.
  tmp.write("sdks/inner/.plist", sdkPlist("empty"));
  tmp.write("sdks/inner/..plist", sdkPlist("dot"));
  tmp.write("sdks/inner/...plist", sdkPlist("dotdot"));
  tmp.write("sdks/secret.plist", sdkPlist("secret"));
  tmp.write("sdks/inner/sub/x.plist", sdkPlist("sub"));
  tmp.write("sdks/inner/cut", sdkPlist("cut"));

  const std::string refused[] = {
      "",
      ".",
      "..",
      "../secret",
      "sub/x",
      "/etc/passwd",
      std::string("cut\0x", 5),
      std::string(kMaxSdkNameLength + 1, 'n'),
  };
  for (const std::string& name : refused) EXPECT_EQ(origin(name), "") << name;
  // The longest accepted name still works.
  tmp.write("sdks/inner/" + std::string(kMaxSdkNameLength, 'n') + ".plist", sdkPlist("max"));
  EXPECT_EQ(origin(std::string(kMaxSdkNameLength, 'n')), "max");
}

}  // namespace
}  // namespace vantrel::platform
