#include "platform/BundleService.h"

#include <gtest/gtest.h>
#include <plist/plist.h>
#include <sys/stat.h>

#include <filesystem>
#include <string>

#include "tests/support/TempDir.h"

namespace vantrel::platform {
namespace {

namespace fs = std::filesystem;
using Kind = BundleObject::Kind;

// An XML Info.plist whose dictionary holds the given string entries.
std::string infoPlist(std::initializer_list<std::pair<const char*, const char*>> entries) {
  std::string xml =
      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
      "<plist version=\"1.0\"><dict>\n";
  for (const auto& [key, value] : entries) {
    xml += std::string("<key>") + key + "</key><string>" + value + "</string>\n";
  }
  return xml + "</dict></plist>\n";
}

std::string exeInfo(const char* executable) {
  return infoPlist({{"KBBundleExecutable", executable}, {"KBBundleIdentifier", "com.example.b"}});
}

std::string binaryExeInfo(const char* executable) {
  plist_t dict = plist_new_dict();
  plist_dict_set_item(dict, "KBBundleExecutable", plist_new_string(executable));
  char* bytes = nullptr;
  uint32_t length = 0;
  plist_to_bin(dict, &bytes, &length);
  std::string out(bytes, length);
  plist_to_bin_free(bytes);
  plist_free(dict);
  return out;
}

// The bundle path a creation found, relative to the temp dir; "" for null.
std::string relativeBundlePath(const testing::TempDir& tmp,
                               const std::shared_ptr<BundleObject>& b) {
  if (!b) return "";
  std::optional<std::string> path = b->stringProperty(kBundlePathProperty);
  if (!path) return "(no path)";
  return fs::path(*path).lexically_relative(tmp.path()).string();
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

  struct Case {
    const char* executable;
    const char* bundle;  // "" = no bundle
  } cases[] = {
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
  for (const Case& c : cases) {
    auto bundle = BundleObject::create(tmp.file(c.executable), Kind::kExecutable);
    EXPECT_EQ(relativeBundlePath(tmp, bundle), c.bundle) << c.executable;
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

  struct Case {
    std::string path;
    std::string expected;  // "" = null
  } cases[] = {
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
  for (const Case& c : cases) {
    auto bundle = BundleObject::create(c.path, Kind::kBundleDirectory);
    std::string got = bundle ? bundle->stringProperty(kBundlePathProperty).value_or("?") : "";
    EXPECT_EQ(got, c.expected) << c.path;
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
      {"Tool", "Tool", "Tool"},
      {"bin/tool", "bin/tool", "bin/tool"},
      {"./bin//tool", "bin/tool", "bin/tool"},
      {"Tool", nullptr, nullptr},  // named but missing
      {"bin", "bin/x", nullptr},   // names a directory
      {"../outside", nullptr, nullptr},
      {"/bin/sh", nullptr, nullptr},  // absolute
      {"", nullptr, nullptr},
      {nullptr, "Tool", nullptr},
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
    EXPECT_EQ(bundle->stringProperty(kBundlePathProperty), tmp.file(dir));
    EXPECT_EQ(bundle->copySupportDirectory(), tmp.file(dir));
    for (int other : {-1, 0, 1, 4, kBundleSupportDirectoryProperty}) {
      EXPECT_FALSE(bundle->stringProperty(other)) << other;
    }
  }
}

TEST(BundleService, InfoDictionaryIsAbsentWhenInfoPlistIsNotAReadableDictionary) {
  testing::TempDir tmp;
  tmp.write("Xml.app/Info.plist",
            "<plist version=\"1.0\"><dict><key>KBBundleIdentifier</key><string>com.example.xml"
            "</string><key>Number</key><integer>3</integer></dict></plist>");
  tmp.write("Malformed.app/Info.plist", "<plist version=\"1.0\"><dict><key>a</key>");
  tmp.write("Array.app/Info.plist", "<plist version=\"1.0\"><array/></plist>");
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
    EXPECT_FALSE(bundle->infoString("KBBundleIdentifier")) << dir;
    EXPECT_FALSE(bundle->stringProperty(kBundleExecutableProperty)) << dir;
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
