#include "platform/BundleService.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <string>

#include "tests/platform/Helpers.h"

namespace vantrel::platform {
namespace {

namespace fs = std::filesystem;
using Kind = BundleObject::Kind;

std::string exeInfo(const char* executable) {
  return stringsPlist(
      {{"KBBundleExecutable", executable}, {"KBBundleIdentifier", "com.example.b"}});
}

std::string binaryExeInfo(const char* executable) {
  plist_t dict = plist_new_dict();
  plist_dict_set_item(dict, "KBBundleExecutable", plist_new_string(executable));
  return libplistBinary(dict);
}

// The bundle of the executable at tmp/relative, relative to tmp; "" for none.
std::string bundleOf(const testing::TempDir& tmp, const std::string& relative) {
  auto bundle = BundleObject::create(tmp.file(relative), Kind::kExecutable);
  if (!bundle) return "";
  const fs::path path = bundle->stringProperty(kBundlePathProperty).value_or("?");
  return path.lexically_relative(tmp.path()).string();
}

TEST(BundleService, ExecutableKindFindsNearestBundleNamingTheExecutable) {
  testing::TempDir tmp;
  tmp.write("App.app/Info.plist", exeInfo("App"));
  tmp.write("App.app/App", "");
  tmp.write("App.app/PlugIns/P.appex/Info.plist", exeInfo("P"));
  tmp.write("App.app/PlugIns/P.appex/P", "");
  tmp.write("App.app/PlugIns/P.appex/Helpers/tool", "");
  // The nearest Info.plist names another file; the outer one names this one.
  tmp.write("Outer.app/Info.plist", exeInfo("sub/run"));
  tmp.write("Outer.app/sub/Info.plist", exeInfo("elsewhere"));
  tmp.write("Outer.app/sub/run", "");
  // A malformed Info.plist on the way is passed over, not fatal.
  tmp.write("Bad.app/Info.plist", exeInfo("x/run"));
  tmp.write("Bad.app/x/Info.plist", "<plist><dict><key>unterminated");
  tmp.write("Bad.app/x/run", "");
  // Info names a symbolic link to the executable: compared canonically.
  tmp.write("Link.app/Info.plist", exeInfo("Link"));
  tmp.write("Link.app/real", "");
  fs::create_symlink("real", tmp.path() / "Link.app/Link");
  tmp.write("Bin.app/Info.plist", binaryExeInfo("Bin"));
  tmp.write("Bin.app/Bin", "");
  tmp.write("loose/tool", "");
  fs::create_directories(tmp.path() / "Dir.app/Dir");
  tmp.write("Dir.app/Info.plist", exeInfo("Dir"));

  // The executable, and the bundle found for it ("" for none).
  const std::pair<const char*, const char*> cases[] = {
      {"App.app/App", "App.app"},
      {"App.app/PlugIns/P.appex/P", "App.app/PlugIns/P.appex"},
      {"App.app/PlugIns/P.appex/Helpers/tool", ""},
      {"Outer.app/sub/run", "Outer.app"},
      {"Bad.app/x/run", "Bad.app"},
      {"Link.app/real", "Link.app"},
      {"Link.app/Link", "Link.app"},
      {"Bin.app/Bin", "Bin.app"},
      {"loose/tool", ""},
      {"App.app/missing", ""},
      {"Dir.app/Dir", ""},  // a directory is not an executable
  };
  for (const auto& [executable, bundle] : cases) {
    EXPECT_EQ(bundleOf(tmp, executable), bundle) << executable;
  }
  // A path that is not lexically normal finds the same bundle, reported normal.
  auto app = BundleObject::create(tmp.file("App.app/PlugIns/../App"), Kind::kExecutable);
  ASSERT_TRUE(app);
  EXPECT_EQ(app->stringProperty(kBundlePathProperty), tmp.file("App.app"));
  EXPECT_EQ(app->stringProperty(kBundleExecutableProperty), tmp.file("App.app/App"));
}

TEST(BundleService, DirectoryKindNeedsAnExistingDirectoryAndKeepsThePathAsGiven) {
  testing::TempDir tmp;
  tmp.write("A.app/Info.plist", exeInfo("A"));
  tmp.write("file", "");
  fs::create_symlink("A.app", tmp.path() / "Alias.app");
  fs::create_symlink("loop", tmp.path() / "loop");

  // The path given, and the bundle path of what it creates ("" for null).
  const std::pair<std::string, std::string> cases[] = {
      {tmp.file("A.app"), tmp.file("A.app")},
      {tmp.file("A.app") + "/", tmp.file("A.app")},
      {tmp.file("A.app/./x/.."), tmp.file("A.app")},
      {tmp.file("Alias.app"), tmp.file("Alias.app")},  // not resolved
      {"/", "/"},
      {tmp.file("file"), ""},
      {tmp.file("missing"), ""},
      {tmp.file("loop"), ""},
      {"", ""},
      {tmp.file("A.app") + std::string(1, '\0') + "x", ""},
      {"/" + std::string(kMaxBundlePathLength, 'a'), ""},
  };
  for (const auto& [path, expected] : cases) {
    auto bundle = BundleObject::create(path, Kind::kBundleDirectory);
    EXPECT_EQ(bundle ? bundle->stringProperty(kBundlePathProperty).value_or("?") : "", expected)
        << path;
  }
}

TEST(BundleService, ExecutablePropertyNeedsARegularFileInsideTheBundle) {
  testing::TempDir tmp;
  tmp.write("outside", "");
  struct Case {
    const char* info;  // nullptr = no Info.plist
    const char* executable;
    const char* expected;  // relative to the bundle; nullptr = none
  } cases[] = {
      {"Tool", "Tool", "Tool"},         {"./bin//tool", "bin/tool", "bin/tool"},
      {"Tool", nullptr, nullptr},                                       // named but missing
      {"bin", "bin/x", nullptr},                                        // names a directory
      {"../outside", nullptr, nullptr}, {"/bin/sh", nullptr, nullptr},  // absolute
      {"", nullptr, nullptr},           {nullptr, "Tool", nullptr},
  };
  int n = 0;
  for (const Case& c : cases) {
    std::string dir = "B" + std::to_string(n++) + ".app";
    fs::create_directories(tmp.path() / dir);
    if (c.info) tmp.write(dir + "/Info.plist", exeInfo(c.info));
    if (c.executable) tmp.write(dir + "/" + c.executable, "");
    auto bundle = BundleObject::create(tmp.file(dir), Kind::kBundleDirectory);
    ASSERT_TRUE(bundle) << dir;
    std::optional<std::string> expected;
    if (c.expected) expected = tmp.file(dir) + "/" + c.expected;
    EXPECT_EQ(bundle->stringProperty(kBundleExecutableProperty), expected) << dir;
    EXPECT_EQ(bundle->copySupportDirectory(), tmp.file(dir));
    for (int other : {-1, 0, 1, 4, kBundleSupportDirectoryProperty}) {
      EXPECT_FALSE(bundle->stringProperty(other)) << other;
    }
  }
}

TEST(BundleService, InfoDictionaryIsAbsentWhenInfoPlistIsNotAReadableDictionary) {
  testing::TempDir tmp;
  tmp.write("Xml.app/Info.plist",
            xmlPlist("<dict><key>KBBundleIdentifier</key><string>com.example.xml</string>"
                     "<key>Number</key><integer>3</integer></dict>"));
  tmp.write("Malformed.app/Info.plist", "<plist version=\"1.0\"><dict><key>a</key>");
  tmp.write("Array.app/Info.plist", xmlPlist("<array/>"));
  fs::create_directories(tmp.path() / "DirInfo.app/Info.plist");
  fs::create_directories(tmp.path() / "Fifo.app");
  // A FIFO would block a reader for ever; it must be passed over, not opened.
  ASSERT_EQ(::mkfifo(tmp.file("Fifo.app/Info.plist").c_str(), 0600), 0);
  fs::create_directories(tmp.path() / "None.app");

  auto xml = BundleObject::create(tmp.file("Xml.app"), Kind::kBundleDirectory);
  ASSERT_TRUE(xml && xml->infoDictionary());
  EXPECT_EQ(xml->infoString("KBBundleIdentifier"), "com.example.xml");
  EXPECT_FALSE(xml->infoString("KBBundleExecutable"));
  EXPECT_FALSE(xml->infoString("Number"));
  EXPECT_NE(xml->description().find(tmp.file("Xml.app")), std::string::npos);

  for (const char* dir : {"Malformed.app", "Array.app", "DirInfo.app", "Fifo.app", "None.app"}) {
    auto bundle = BundleObject::create(tmp.file(dir), Kind::kBundleDirectory);
    ASSERT_TRUE(bundle) << dir;
    EXPECT_FALSE(bundle->infoDictionary()) << dir;
  }
}

TEST(BundleService, MainBundleFallsBackToTheExecutablesDirectory) {
  // The test binary lies in no bundle, so the main bundle is its directory.
  auto main = BundleObject::mainBundle();
  ASSERT_TRUE(main);
  std::error_code ec;
  fs::path self = fs::read_symlink("/proc/self/exe", ec);
  ASSERT_FALSE(ec);
  EXPECT_EQ(main->stringProperty(kBundlePathProperty), self.parent_path().string());
}

}  // namespace
}  // namespace vantrel::platform
