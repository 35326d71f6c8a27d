#include <stdlib.h>

#include <filesystem>

#include "omnidex/RecordFactory.h"
#include "platform/Paths.h"
#include "tests/omnidex/OmnidexFixtures.h"
#include "tests/support/ScopedEnvironment.h"

namespace vantrel::omnidex {
namespace {

using testing::plugInInfo;
using testing::writeBundle;

using vantrel::testing::ScopedEnvironment;

TEST(OmnidexConfig, DirectoryListsComeFromTheEnvironment) {
  const std::vector<std::string> defaultApps{"/Applications", "/System/Applications"};
  const std::vector<std::string> defaultPlugIns{"/System/Library/PlugIns"};
  const struct {
    const char* apps;  // null: unset
    const char* plugIns;
    std::vector<std::string> expectedApps;
    std::vector<std::string> expectedPlugIns;
    const char* system = nullptr;
  } cases[] = {
      {nullptr, nullptr, defaultApps, defaultPlugIns},
      {"/a::/b:", "/p", {"/a", "/b"}, {"/p"}},
      {"", ":", {}, {}},
      {nullptr, nullptr, {"/Applications", "/img/Applications"}, {"/img/Library/PlugIns"}, "/img/"},
      // Only an absolute directory other than "/" may stand for the volume.
      {nullptr, nullptr, defaultApps, defaultPlugIns, "img"},
      {nullptr, nullptr, defaultApps, defaultPlugIns, "/"},
  };
  for (const auto& c : cases) {
    ScopedEnvironment system("VANTREL_SYSTEM_DIR", c.system);
    ScopedEnvironment apps("VANTREL_APP_DIRS", c.apps);
    ScopedEnvironment plugIns("VANTREL_PLUGIN_DIRS", c.plugIns);
    ScopedEnvironment state("VANTREL_STATE_DIR", "/somewhere/state");
    const OmnidexConfig config = OmnidexConfig::fromEnvironment();
    EXPECT_EQ(config.stateDirectory, "/somewhere/state");
    EXPECT_EQ(config.applicationDirectories, c.expectedApps);
    EXPECT_EQ(config.plugInDirectories, c.expectedPlugIns);
  }
}

TEST(OmnidexConfig, SystemResidenceFollowsTheSystemVolume) {
  const struct {
    const char* system;  // null: unset
    const char* path;
    bool resident;
  } cases[] = {
      // clang-format off
      {nullptr, "/System/Library/PlugIns/p.appex", true}, {nullptr, "/System", false},
      {nullptr, "/System/", false}, {nullptr, "/Systemic/p.appex", false},
      {"/img/System", "/img/System/p.appex", true}, {"/img/System", "/System/p.appex", false},
      {"/img/System/", "/img/System/p.appex", true},
      // clang-format on
  };
  for (const auto& c : cases) {
    ScopedEnvironment system("VANTREL_SYSTEM_DIR", c.system);
    EXPECT_EQ(platform::isOnSystemVolume(c.path), c.resident) << c.path;
    const PlugInRecordPtr record =
        makePlugInRecord(c.path, PlugInInfo{}, {}, PlugInIdentity{}, nullptr, {});
    EXPECT_EQ(record->onSystemPartition, c.resident) << c.path;
  }
}

TEST(OmnidexConfig, DefaultWorkspaceIsOpenedOnceFromTheEnvironment) {
  // The process's registry outlives the test, and so must its directory.
  static vantrel::testing::TempDir temp;
  ScopedEnvironment state("VANTREL_STATE_DIR", temp.file("state").c_str());
  ScopedEnvironment apps("VANTREL_APP_DIRS", temp.file("apps").c_str());
  ScopedEnvironment plugIns("VANTREL_PLUGIN_DIRS", "");
  std::shared_ptr<Workspace> workspace = Omnidex::defaultWorkspace();
  ASSERT_NE(workspace, nullptr);
  EXPECT_EQ(Omnidex::defaultWorkspace(), workspace);
  EXPECT_TRUE(std::filesystem::exists(temp.file("state/registry.sqlite3")));
  const std::string app = temp.file("apps/A.app");
  writeBundle(app + "/PlugIns/P.appex", plugInInfo("a.p", "p"));
  static_cast<Omnidex&>(*workspace).reconcile();
  EXPECT_NE(workspace->plugInForUrl(app + "/PlugIns/P.appex"), nullptr);
}

}  // namespace
}  // namespace vantrel::omnidex
