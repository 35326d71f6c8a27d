#include <gtest/gtest.h>

#include "base/Log.h"
#include "model/VTBundle.h"
#include "tests/support/TempDir.h"

namespace vantrel::model {
namespace {

const char* kAppInfo = R"(<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
  <key>KBBundleIdentifier</key><string>com.example.app</string>
  <key>KBBundleExecutable</key><string>App</string>
</dict></plist>)";

class VTBundleTest : public ::testing::Test {
 protected:
  VTBundleTest() {
    app_ = dir_.file("App.app");
    dir_.write("App.app/Info.plist", kAppInfo);
    dir_.write("App.app/App", "#!/bin/sh\n");
    dir_.write("App.app/PlugIns/Bare.plugin/Info.plist", "<plist><dict/></plist>");
    dir_.write("NoInfo/readme", "");
  }
  vantrel::testing::TempDir dir_;
  std::string app_;
};

TEST_F(VTBundleTest, ExecutableFindsItsBundleOrFallsBackToADirectory) {
  auto fromExecutable = VTBundle::initWithExecutablePath(app_ + "/App");
  ASSERT_NE(fromExecutable, nullptr);
  EXPECT_EQ(fromExecutable->path(), app_);
  EXPECT_EQ(fromExecutable->executablePath(), app_ + "/App");
  EXPECT_EQ(fromExecutable->url(), FileUrl::fromPath(app_));
  EXPECT_EQ(fromExecutable->bundleIdentifier(), "com.example.app");

  auto viaUrl = VTBundle::initWithExecutableURL(FileUrl::fromPath(app_));  // a directory
  ASSERT_NE(viaUrl, nullptr);
  EXPECT_EQ(viaUrl->path(), app_);

  EXPECT_EQ(VTBundle::initWithExecutablePath(dir_.file("missing")), nullptr);
  EXPECT_EQ(VTBundle::initWithPath(app_ + "/App"), nullptr);  // a file is not a bundle
  EXPECT_EQ(VTBundle::initWithLMOBundle(nullptr), nullptr);
}

TEST_F(VTBundleTest, DirectoriesAndExecutable) {
  auto app = VTBundle::initWithURL(FileUrl::fromPath(app_ + "/"));
  ASSERT_NE(app, nullptr);
  EXPECT_EQ(app->supportPath(), app_);
  EXPECT_EQ(app->plugInsPath(), app_ + "/PlugIns");
  EXPECT_EQ(app->bundleDirectory("/Frameworks"), app_ + "/Frameworks");

  auto bare = VTBundle::initWithPath(app_ + "/PlugIns/Bare.plugin");
  ASSERT_NE(bare, nullptr);
  EXPECT_EQ(bare->executablePath(), bare->path());
  EXPECT_EQ(bare->infoDictionary(), lmo::Dictionary{});
  EXPECT_FALSE(bare->bundleIdentifier());

  auto main = VTBundle::initForMainBundle();  // the test program's directory
  ASSERT_NE(main, nullptr);
  EXPECT_EQ(main->executablePath(), main->path());
}

TEST_F(VTBundleTest, MissingInfoPlistLogsTwoLines) {
  auto b = VTBundle::initWithPath(dir_.file("NoInfo"));
  ASSERT_NE(b, nullptr);
  base::LogCapture capture;
  EXPECT_FALSE(b->infoDictionary());
  const std::string path = dir_.file("NoInfo");
  EXPECT_EQ(
      capture.lines(),
      (std::vector<std::string>{
          "failed to retrieve Info.plist for " + path + " through <BundleObject " + path + ">",
          "failed to convert Info.plist to dictionary: " + path + " source=(null)"}));
  capture.clear();
  EXPECT_FALSE(b->bundleIdentifier());
  EXPECT_TRUE(capture.lines().empty());
}

}  // namespace
}  // namespace vantrel::model
