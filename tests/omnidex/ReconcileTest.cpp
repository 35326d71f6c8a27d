#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <sstream>

#include "base/Log.h"
#include "omnidex/Errors.h"
#include "tests/omnidex/OmnidexFixtures.h"

namespace vantrel::omnidex {
namespace {

namespace fs = std::filesystem;
using lmo::Dictionary;
using lmo::Value;
using testing::observe;
using testing::plugInInfo;
using testing::RegistryTree;
using testing::runSql;
using testing::writeBundle;

std::map<std::string, base::Uuid> uuidsByPath(Workspace& registry) {
  std::map<std::string, base::Uuid> uuids;
  const std::vector<PlugInRecordPtr> installed = registry.installedPlugIns().value();
  for (const PlugInRecordPtr& r : installed) uuids[*r->bundlePath] = r->uuid;
  return uuids;
}

std::string readFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::stringstream s;
  s << in.rdbuf();
  return s.str();
}

// Also: a plug-in registered explicitly, outside the directories scanned,
// survives restarts until its bundle goes.
TEST(OmnidexReconcile, FindsNewVanishedAndChangedBundlesAndKeepsUuids) {
  RegistryTree tree;
  const std::string notes = tree.apps() + "/Notes.app";
  writeBundle(notes, Dictionary{{"KBBundleName", "Notes"}});
  const std::string share = writeBundle(notes + "/PlugIns/Share.appex", plugInInfo("n.share", "p"));
  const std::string widget = writeBundle(notes + "/PlugIns/Widget.appex", plugInInfo("n.w", "p"));
  const std::string tool = writeBundle(tree.plugIns() + "/Tool.plugin", plugInInfo("t", "p"));
  writeBundle(tree.apps() + "/Plain.app/PlugIns/NotAPlugIn", Dictionary{{"KBBundleName", "x"}});
  writeBundle(tree.apps() + "/NotAnApp/PlugIns/Hidden.appex", plugInInfo("hidden", "p"));
  const std::string broken = writeBundle(tree.plugIns() + "/Broken.plugin",
                                         Dictionary{{"QXExtension", Value(Dictionary{})}});
  // Links are not followed, neither for a bundle nor for a PlugIns directory.
  const std::string outside = writeBundle(tree.file("outside/Linked.plugin"), plugInInfo("l", "p"));
  fs::create_symlink(outside, tree.plugIns() + "/Linked.plugin");
  writeBundle(tree.apps() + "/Linky.app", Dictionary{});
  fs::create_symlink(tree.file("outside"), tree.apps() + "/Linky.app/PlugIns");
  const std::string away = writeBundle(tree.file("away/Away.plugin"), plugInInfo("away", "p"));

  std::map<std::string, base::Uuid> before;
  {
    auto registry = tree.open();
    auto observer = observe(*registry);
    base::LogCapture log;
    registry->reconcile();
    // reconcile() returns once its announcements are delivered.
    EXPECT_EQ(observer->log(), (std::vector<std::string>{"+" + share, "+" + widget, "+" + tool}));
    EXPECT_EQ(log.count("skipping bundle: the plug-in at " + broken +
                        " has no identifier (no QXExtensionIdentifier, nor KBBundleIdentifier)"),
              1u);
    ASSERT_TRUE(registry->registerPlugIn(away).has_value());
    before = uuidsByPath(*registry);
  }
  ASSERT_EQ(before.size(), 4u);

  fs::remove_all(widget);
  writeBundle(share, plugInInfo("n.share", "p", Dictionary{{"KBBundleVersion", "2"}}));
  const std::string added = writeBundle(tree.plugIns() + "/New.plugin", plugInInfo("new", "p"));
  // A container removed while no registry ran is made again when it opens.
  fs::remove_all(tree.container(before[tool]));

  auto registry = tree.open();
  // Until it reconciles, the registry answers from its store.
  EXPECT_EQ(uuidsByPath(*registry), before);
  EXPECT_TRUE(fs::is_directory(tree.container(before[tool]) + "/tmp"));
  EXPECT_EQ(registry->plugInForUrl(tool)->dataContainerPath, tree.container(before[tool]));
  EXPECT_EQ(registry->plugInForUrl(away)->dataContainerPath, tree.container(before[away]));
  auto observer = observe(*registry);
  registry->reconcile();
  EXPECT_EQ(observer->log(),
            (std::vector<std::string>{"-" + share, "-" + widget, "+" + share, "+" + added}));
  std::map<std::string, base::Uuid> after = uuidsByPath(*registry);
  EXPECT_EQ(after.count(widget), 0u);
  EXPECT_EQ(after[share], before[share]);
  EXPECT_EQ(after[tool], before[tool]);
  EXPECT_EQ(after[away], before[away]);
  EXPECT_EQ(registry->plugInForUrl(share)->bundleVersion, "2");
  EXPECT_FALSE(fs::exists(tree.container(before[widget])));
  EXPECT_TRUE(fs::exists(tree.container(before[share])));

  observer->clear();
  registry->reconcile();
  EXPECT_TRUE(observer->events().empty());

  fs::remove_all(away);
  registry->reconcile();
  EXPECT_EQ(registry->plugInForUuid(before[away]), nullptr);
  EXPECT_EQ(observer->log(), std::vector<std::string>{"-" + away});
  EXPECT_FALSE(fs::exists(tree.container(before[away])));
}

TEST(OmnidexReconcile, ApplicationChangesReachItsPlugIns) {
  RegistryTree tree;
  const std::string app = tree.apps() + "/Late.app";
  const std::string plugIn = writeBundle(app + "/PlugIns/P.appex", plugInInfo("late.p", "p"));
  auto registry = tree.open();
  auto observer = observe(*registry);
  registry->reconcile();
  const PlugInRecordPtr first = registry->plugInForUrl(plugIn);
  ASSERT_NE(first, nullptr);
  ASSERT_TRUE(first->containingApplication->placeholder);

  // The application's Info.plist arrives after its plug-ins (a copy in
  // progress): the plug-in's record is replaced, under the same UUID.
  writeBundle(app, Dictionary{{"KBBundleDisplayName", "Late Arrival"}});
  observer->clear();
  registry->reconcile();
  const PlugInRecordPtr second = registry->plugInForUrl(plugIn);
  EXPECT_EQ(second->uuid, first->uuid);
  EXPECT_FALSE(second->containingApplication->placeholder);
  EXPECT_EQ(second->containingApplication->localizedName, "Late Arrival");
  EXPECT_EQ(registry->applicationForUrl(app).application, second->containingApplication);
  EXPECT_EQ(observer->log(), (std::vector<std::string>{"-" + plugIn, "+" + plugIn}));

  // Touched but unchanged: nothing to announce.
  writeBundle(app, Dictionary{{"KBBundleDisplayName", "Late Arrival"}});
  observer->clear();
  registry->reconcile();
  EXPECT_TRUE(observer->events().empty());
  EXPECT_EQ(registry->plugInForUrl(plugIn), second);
}

TEST(OmnidexReconcile, RefusesDatabasesItCannotReadAndLeavesThemAlone) {
  const struct {
    const char* name;
    std::string sql;  // empty: the file holds garbage instead
    int64_t code;
    const char* fragment;
  } cases[] = {
      {"newer", "PRAGMA user_version = 2", kOmnidexSchemaMismatch,
       "has schema version 2; this build reads version 1"},
      {"foreign", "CREATE TABLE other (x)", kOmnidexSchemaMismatch,
       "has schema version 0; this build reads version 1"},
      {"garbage", "", kOmnidexStoreFailed, "cannot open the application registry at"},
  };
  for (const auto& c : cases) {
    RegistryTree tree;
    const std::string db =
        tree.write("state/registry.sqlite3", c.sql.empty() ? std::string(4096, 'x') : "");
    if (!c.sql.empty()) runSql(db, c.sql);
    const std::string bytes = readFile(db);
    base::Result<std::shared_ptr<Omnidex>> opened = Omnidex::open(tree.config());
    ASSERT_FALSE(opened.has_value()) << c.name;
    EXPECT_EQ(opened.error().code, c.code) << c.name;
    EXPECT_NE(opened.error().description().find(c.fragment), std::string::npos)
        << c.name << ": " << opened.error().description();
    EXPECT_EQ(readFile(db), bytes) << c.name;
  }
}

TEST(OmnidexReconcile, OneRegistryHoldsTheStateDirectoryAtATime) {
  RegistryTree tree;
  {
    std::shared_ptr<Omnidex> first = tree.open();
    ASSERT_TRUE(first);
    struct stat st {};
    ASSERT_EQ(::stat(tree.state().c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0700u);
    base::Result<std::shared_ptr<Omnidex>> second = Omnidex::open(tree.config());
    ASSERT_FALSE(second.has_value());
    EXPECT_EQ(second.error().code, kOmnidexStateInUse);
    EXPECT_NE(second.error().description().find("in use by another registry (pid " +
                                                std::to_string(::getpid()) + ")"),
              std::string::npos)
        << second.error().description();
  }
  // The lock ends with the registry that held it.
  EXPECT_TRUE(Omnidex::open(tree.config()).has_value());
}

TEST(OmnidexReconcile, AnUnreadableRowIsSkippedAndTheRestLoads) {
  RegistryTree tree;
  const std::string good = writeBundle(tree.file("x/Good.plugin"), plugInInfo("good", "p"));
  const std::string bad = writeBundle(tree.file("x/Bad.plugin"), plugInInfo("bad", "p"));
  {
    auto registry = tree.open();
    ASSERT_TRUE(registry->registerPlugIn(good).has_value());
    ASSERT_TRUE(registry->registerPlugIn(bad).has_value());
  }
  runSql(tree.state() + "/registry.sqlite3",
         "UPDATE plugins SET info = x'3c706c697374' WHERE path = '" + bad + "'");
  base::LogCapture log;
  auto registry = tree.open();
  ASSERT_NE(registry, nullptr);
  EXPECT_NE(registry->plugInForUrl(good), nullptr);
  EXPECT_EQ(registry->plugInForUrl(bad), nullptr);
  EXPECT_TRUE(log.contains("ignoring unreadable registry entry for " + bad + ": "));
  // The bundle is still there, so registering it again repairs the row.
  ASSERT_TRUE(registry->registerPlugIn(bad).has_value());
  registry.reset();
  EXPECT_NE(tree.open()->plugInForUrl(bad), nullptr);
}

TEST(OmnidexReconcile, PlugInsWhoseApplicationRowIsGoneShareTheApplicationReadAgain) {
  RegistryTree tree;
  const std::string app = tree.apps() + "/Notes.app";
  writeBundle(app, Dictionary{{"KBBundleName", "Notes"}});
  const std::string share = writeBundle(app + "/PlugIns/Share.appex", plugInInfo("n.share", "p"));
  const std::string widget = writeBundle(app + "/PlugIns/Widget.appex", plugInInfo("n.w", "p"));
  tree.open()->reconcile();
  runSql(tree.state() + "/registry.sqlite3", "DELETE FROM applications");

  auto registry = tree.open();
  const PlugInRecordPtr first = registry->plugInForUrl(share);
  const PlugInRecordPtr second = registry->plugInForUrl(widget);
  ASSERT_TRUE(first && second && first->containingApplication);
  EXPECT_FALSE(first->containingApplication->placeholder);
  EXPECT_EQ(first->containingApplication->localizedName, "Notes");
  EXPECT_EQ(second->containingApplication, first->containingApplication);
  EXPECT_EQ(registry->applicationForUrl(app).application, first->containingApplication);
}

}  // namespace
}  // namespace vantrel::omnidex
