#include "tools/inspect/Inspection.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <iterator>

#include "lmo/Protocol.h"
#include "model/MetadataKeys.h"
#include "tests/support/TempDir.h"

namespace vantrel::tools {
namespace {

class InspectionTest : public ::testing::Test {
 protected:
  void SetUp() override {
    // Fixed at build time, so the binary runs from any working directory.
    examples_ = VANTREL_EXAMPLES_DIR;
    setenv("VANTREL_SDK_DIRS", (examples_ + "/sdks").c_str(), 1);
  }
  void TearDown() override { unsetenv("VANTREL_SDK_DIRS"); }
  Inspection inspect(const std::string& relative) {
    return inspectBundle(examples_ + "/bundles/" + relative);
  }
  std::string examples_;
};

TEST_F(InspectionTest, EverySampleGetsItsVerdict) {
  struct Case {
    const char* bundle;
    bool built;
    const char* message;  // nullptr: valid
  } cases[] = {
      // The story scripts/demo tells: Notes.app and Journal.app.
      {"Notes.app/PlugIns/NotesShare.appex", true, nullptr},
      {"Notes.app/PlugIns/NotesWidget.appex", true, nullptr},
      {"Notes.app/PlugIns/Markdown.appex", true, nullptr},
      {"Journal.app/PlugIns/Markdown.appex", true, nullptr},
      {"Journal.app/PlugIns/JournalShare.appex", true,
       "Application Extensions may not use the \"PrincipalClass\" key"},
      // One bundle per mistake (Toolbox.app), and an old-style plug-in.
      {"Toolbox.app/PlugIns/Sync.appex", true, nullptr},
      {"Legacy.plugin", true, nullptr},
      {"Toolbox.app/PlugIns/Speller.plugin", true,
       "missing \"QXExtensionProtocol\" key in Info.plist or SDK"},
      {"Toolbox.app/PlugIns/Linter.plugin", true,
       "missing \"QXExtensionAttributes\" key in Info.plist or SDK"},
      {"Toolbox.app/PlugIns/Proxy.appex", true,
       "the \"PassProxy\" key is not supported on this platform"},
      {"Toolbox.app/PlugIns/Bridge.plugin", true,
       "hybrid plug-ins are not supported on this platform"},
      {"Toolbox.app/PlugIns/Nameless.plugin", false, nullptr},
  };
  // A sample added without an expectation fails here.
  EXPECT_EQ(findPlugInBundles(examples_ + "/bundles").size(), std::size(cases));
  for (const Case& c : cases) {
    Inspection in = inspect(c.bundle);
    EXPECT_EQ(in.built, c.built) << c.bundle << ": " << in.failure;
    if (!c.built) continue;
    if (c.message == nullptr) {
      EXPECT_FALSE(in.verdict) << c.bundle << ": " << in.verdict->description();
    } else {
      ASSERT_TRUE(in.verdict) << c.bundle;
      EXPECT_EQ(in.verdict->code, 12);
      EXPECT_EQ(in.verdict->description(), c.message);
    }
  }
}

TEST_F(InspectionTest, RecordsShowMergedSdkOldStyleAndLogLines) {
  Inspection widget = inspect("Notes.app/PlugIns/NotesWidget.appex");
  EXPECT_EQ(widget.protocol, "WidgetProviding");  // supplied by the SDK
  EXPECT_EQ(widget.version, "1.0");               // SDK's attributes fill the gap
  const lmo::Dictionary* info = widget.form.get(protocol::kFormInfo).getIfDictionary();
  ASSERT_NE(info, nullptr);
  EXPECT_EQ(info->get(model::kCleanTimeoutKey), lmo::Value::integer(60));  // the SDK wins this key
  EXPECT_EQ(info->get(model::kSharedKey),
            lmo::Value(lmo::Array{lmo::Value("Resources/Common"), lmo::Value("Resources/Widget")}));
  EXPECT_EQ(widget.form.get(protocol::kFormHubProtocolVersion), lmo::Value::integer(2));
  EXPECT_EQ(widget.containingApp, examples_ + "/bundles/Notes.app");

  Inspection legacy = inspect("Legacy.plugin");
  EXPECT_EQ(legacy.style, "old-style plug-in");
  EXPECT_EQ(legacy.version, "7.0.2");
  EXPECT_EQ(legacy.form.get(protocol::kFormHubProtocolVersion), lmo::Value::integer(1));
  EXPECT_TRUE(legacy.containingApp.empty());

  Inspection sync = inspect("Toolbox.app/PlugIns/Sync.appex");
  EXPECT_EQ(sync.log,
            (std::vector<std::string>{"multiplexed plug-ins (Multiple key) obsolete and ignored",
                                      "plug-in sdk \"com.karvo.file-provider\" not registered"}));

  Inspection nameless = inspect("Toolbox.app/PlugIns/Nameless.plugin");
  ASSERT_EQ(nameless.log.size(), 1u);
  EXPECT_EQ(nameless.log[0], "missing identifier in plug-in at " + examples_ +
                                 "/bundles/Toolbox.app/PlugIns/Nameless.plugin");
}

TEST_F(InspectionTest, NonBundlesAreReportedNotCrashedOn) {
  testing::TempDir dir;
  dir.write("garbage.plugin/Info.plist", "<plist><dict><key>x</key>");
  dir.write("array.plugin/Info.plist",
            "<?xml version=\"1.0\"?><plist version=\"1.0\"><array/></plist>");
  dir.write("plain.plugin/Info.plist",
            "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict><key>KBBundleIdentifier</key>"
            "<string>x</string></dict></plist>");
  for (const char* name : {"garbage.plugin", "array.plugin", "plain.plugin", "missing.plugin"}) {
    Inspection in = inspectBundle(dir.file(name));
    EXPECT_FALSE(in.built) << name;
    EXPECT_FALSE(in.failure.empty()) << name;
  }
  EXPECT_EQ(findPlugInBundles(dir.path().string()).size(), 3u);
  EXPECT_TRUE(findPlugInBundles(dir.file("nowhere")).empty());
}

}  // namespace
}  // namespace vantrel::tools
