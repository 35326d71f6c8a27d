#include <gtest/gtest.h>

#include <cstdlib>

#include "base/Log.h"
#include "model/VTPlugInCore.h"
#include "tests/model/PlugInFixtures.h"
#include "tests/support/TempDir.h"

namespace vantrel::model {
namespace {

using lmo::Array;
using lmo::Dictionary;
using lmo::Value;
using testing::bundleInfo;
using testing::I;
using testing::recordAt;

TEST(SdkMerge, MergeRules) {
  // One key per rule; nested "D" repeats the special keys one level down.
  const Dictionary sdk{
      {"CleanTimeout", I(60)},
      {"Shared", Array{"b", "c"}},
      {"SdkOnly", Dictionary{{"Shared", Array{"x"}}, {"CleanTimeout", I(5)}}},
      {"K", "sdk"},
      {"Scalar", Dictionary{{"a", I(1)}}},
      {"BadShared", Dictionary{{"Shared", "sdk"}}},
      {"D", Dictionary{{"a", I(1)}, {"b", I(2)}, {"CleanTimeout", I(60)}, {"Shared", Array{"z"}}}}};
  const Dictionary plugIn{
      {"CleanTimeout", I(30)},
      {"Shared", Array{"a", "b"}},
      {"K", "own"},
      {"Scalar", "own"},
      {"BadShared", Dictionary{{"Shared", Array{"a"}}}},
      {"D", Dictionary{
                {"b", "own"}, {"c", I(3)}, {"CleanTimeout", I(30)}, {"Shared", Array{"z", "y"}}}}};
  const Dictionary merged{{"CleanTimeout", I(60)},
                          {"Shared", Array{"a", "b", "c"}},
                          {"SdkOnly", sdk.get("SdkOnly")},
                          {"K", "own"},
                          {"Scalar", "own"},
                          {"BadShared", plugIn.get("BadShared")},
                          {"D", Dictionary{{"a", I(1)},
                                           {"b", "own"},
                                           {"c", I(3)},
                                           {"CleanTimeout", I(60)},
                                           {"Shared", Array{"y", "z"}}}}};
  EXPECT_EQ(VTPlugInCore::mergeDictionary(sdk, plugIn), merged);
  EXPECT_EQ(VTPlugInCore::mergeDictionary(sdk, {}), sdk);
  EXPECT_FALSE(VTPlugInCore::sdkOverridesKey("cleantimeout"));
  EXPECT_EQ(VTPlugInCore::mergeSharedResources(Array{"b", I(1), "a"}, Array{"b", I(1), "b"}),
            (Array{"a", "b", I(1)}));
}

TEST(SdkMerge, DepthIsBounded) {
  auto nest = [](int depth, Dictionary d) {
    while (depth-- > 0) d = Dictionary{{"n", d}};
    return d;
  };
  for (int depth : {5, VTPlugInCore::kMaxMergeDepth + 50}) {
    Dictionary d = VTPlugInCore::mergeDictionary(nest(depth, {{"sdk", I(1)}}), nest(depth, {}));
    while (const Dictionary* inner = d.get("n").getIfDictionary()) d = Dictionary(*inner);
    EXPECT_EQ(d.contains("sdk"), depth <= VTPlugInCore::kMaxMergeDepth) << depth;
  }
}

class ResolveSdk : public ::testing::Test {
 protected:
  void SetUp() override {
    dir_.write("com.example.share.plist", R"(<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict><key>QXExtension</key><dict>
  <key>QXExtensionProtocol</key><string>Share</string>
  <key>CleanTimeout</key><integer>60</integer>
  <key>QXExtensionAttributes</key><dict><key>QXExtensionVersion</key><string>5</string></dict>
</dict></dict></plist>)");
    setenv("VANTREL_SDK_DIRS", dir_.path().c_str(), 1);
  }
  void TearDown() override { unsetenv("VANTREL_SDK_DIRS"); }

  std::shared_ptr<VTPlugInCore> record(Value point) {
    Dictionary ext{{"QXExtensionPointIdentifier", point}, {"CleanTimeout", I(30)}};
    return recordAt("/a/X.plugin", bundleInfo(ext.setting("PrincipalClass", "Own")));
  }

  vantrel::testing::TempDir dir_;
  base::LogCapture capture_;
};

TEST_F(ResolveSdk, RegisteredSdkIsMergedUnderThePlugIn) {
  auto r = record(Value("com.example.share"));
  r->resolveSDK();
  EXPECT_TRUE(capture_.lines().empty());
  EXPECT_EQ(r->protocolSpec(), Value("Share"));
  EXPECT_EQ(r->pluginKey("CleanTimeout"), I(60));
  EXPECT_EQ(r->principalSpec(), Value("Own"));
  EXPECT_EQ(r->version(), Value("5"));
}

TEST_F(ResolveSdk, UnregisteredOrMissingSdkStillCanonicalizes) {
  auto r = record(Value("com.example.none"));
  r->resolveSDK();
  EXPECT_EQ(capture_.lines(),
            std::vector<std::string>{"plug-in sdk \"com.example.none\" not registered"});
  EXPECT_EQ(r->version(), Value("1"));
  EXPECT_EQ(r->pluginKey("CleanTimeout"), I(30));

  capture_.clear();
  auto plain = recordAt("/a/X.plugin", bundleInfo({}));
  plain->resolveSDK();
  EXPECT_TRUE(capture_.lines().empty());
  EXPECT_EQ(plain->version(), Value("1"));
}

TEST_F(ResolveSdk, NonStringSdkKeyLeavesTheRecordAlone) {
  auto r = record(I(7));
  r->resolveSDK();
  EXPECT_EQ(capture_.lines(), std::vector<std::string>{"invalid SDK key:7"});
  EXPECT_FALSE(r->attributes());
}

TEST(SdkMergeDeathTest, ResolveNeedsBundleInfo) {
  VTPlugInCore r;
  EXPECT_DEATH(r.resolveSDK(), "cannot resolve SDK without materialized Info.plist");
}

}  // namespace
}  // namespace vantrel::model
