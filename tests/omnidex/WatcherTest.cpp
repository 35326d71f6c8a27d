#include <atomic>
#include <filesystem>
#include <fstream>
#include <thread>

#include "platform/PropertyList.h"
#include "tests/omnidex/OmnidexFixtures.h"

namespace vantrel::omnidex {
namespace {

namespace fs = std::filesystem;
using lmo::Dictionary;
using lmo::Value;
using testing::observe;
using testing::plugInInfo;
using testing::RecordingObserver;
using testing::RegistryTree;
using testing::writeBundle;
using namespace std::chrono_literals;

// Changes are announced within a second; the tests allow twice that, for
// sanitizer builds on a busy machine.
constexpr auto kAnnounceDeadline = 2s;

// An application with one plug-in, built outside the watched tree.
std::string stageApplication(const RegistryTree& tree, const std::string& name,
                             const std::string& plugIn) {
  const std::string app = tree.file("staging/" + name + ".app");
  writeBundle(app, Dictionary{{"KBBundleName", Value(name)}});
  writeBundle(app + "/PlugIns/" + plugIn + ".appex", plugInInfo(name + "." + plugIn, "p"));
  return app;
}

// Writes text in pieces with pauses, as a slow copy does.
void writeSlowly(const std::string& path, const std::string& text) {
  std::ofstream out(path, std::ios::binary);
  const size_t half = text.size() / 2;
  out << text.substr(0, half) << std::flush;
  std::this_thread::sleep_for(150ms);
  out << text.substr(half);
}

template <typename Predicate>
bool eventually(Predicate predicate, std::chrono::milliseconds timeout = kAnnounceDeadline) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (!predicate()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(10ms);
  }
  return true;
}

// Watches put in by startMonitoring(), or at open beside the load.
class OmnidexWatcherOpened : public ::testing::TestWithParam<bool> {};

INSTANTIATE_TEST_SUITE_P(WatchesFrom, OmnidexWatcherOpened, ::testing::Bool(),
                         [](const auto& param) {
                           return param.param ? "Open" : "StartMonitoring";
                         });

TEST_P(OmnidexWatcherOpened, ApplicationsCopiedInAndDeletedAreAnnounced) {
  RegistryTree tree;
  OmnidexConfig config = tree.config();
  config.followChanges = GetParam();
  auto registry = Omnidex::open(config).value();
  auto observer = observe(*registry);
  registry->startMonitoring();

  // Moved into place in one rename.
  const std::string staged = stageApplication(tree, "Photos", "Edit");
  const std::string photos = tree.apps() + "/Photos.app";
  fs::rename(staged, photos);
  const PlugInRecordPtr edit =
      observer->waitForInstalled(photos + "/PlugIns/Edit.appex", kAnnounceDeadline);
  ASSERT_NE(edit, nullptr);
  EXPECT_EQ(edit->containingApplication->localizedName, "Photos");

  // Copied piece by piece, the application's Info.plist last.
  const std::string mail = tree.apps() + "/Mail.app";
  const std::string compose = mail + "/PlugIns/Compose.appex";
  fs::create_directories(compose);
  std::this_thread::sleep_for(100ms);
  base::Result<std::string> xml =
      platform::writePropertyListXML(Value(plugInInfo("mail.compose", "p")));
  ASSERT_TRUE(xml.has_value());
  writeSlowly(compose + "/Info.plist", xml.value());
  writeSlowly(mail + "/Info.plist",
              platform::writePropertyListXML(Value(Dictionary{{"KBBundleName", "Mail"}})).value());
  ASSERT_NE(observer->waitForInstalled(compose, kAnnounceDeadline), nullptr);
  EXPECT_TRUE(eventually([&] {
    PlugInRecordPtr r = registry->plugInForUrl(compose);
    return r && r->containingApplication && !r->containingApplication->placeholder;
  }));

  fs::remove_all(photos);
  const PlugInRecordPtr gone =
      observer->waitForUninstalled(photos + "/PlugIns/Edit.appex", kAnnounceDeadline);
  ASSERT_NE(gone, nullptr);
  EXPECT_EQ(gone->uuid, edit->uuid);
  EXPECT_EQ(registry->plugInForUuid(edit->uuid), nullptr);
  EXPECT_FALSE(fs::exists(tree.container(edit->uuid)));
}

TEST(OmnidexWatcher, StandAlonePlugInChangesAndLateRootsAreFollowed) {
  RegistryTree tree;
  OmnidexConfig config = tree.config();
  const std::string lateRoot = tree.file("late-apps");  // does not exist yet
  config.applicationDirectories.push_back(lateRoot);
  auto registry = Omnidex::open(config).value();
  auto observer = observe(*registry);
  registry->startMonitoring();

  const std::string tool = writeBundle(tree.plugIns() + "/Tool.plugin", plugInInfo("tool", "p"));
  const PlugInRecordPtr first = observer->waitForInstalled(tool, kAnnounceDeadline);
  ASSERT_NE(first, nullptr);
  observer->clear();
  writeBundle(tool, plugInInfo("tool", "p", Dictionary{{"KBBundleVersion", "2"}}));
  ASSERT_NE(observer->waitForUninstalled(tool, kAnnounceDeadline), nullptr);
  const PlugInRecordPtr second = observer->waitForInstalled(tool, kAnnounceDeadline);
  ASSERT_NE(second, nullptr);
  EXPECT_EQ(second->uuid, first->uuid);
  EXPECT_EQ(second->bundleVersion, "2");

  fs::create_directories(lateRoot);
  std::this_thread::sleep_for(50ms);
  fs::rename(stageApplication(tree, "Late", "P"), lateRoot + "/Late.app");
  EXPECT_NE(observer->waitForInstalled(lateRoot + "/Late.app/PlugIns/P.appex", kAnnounceDeadline),
            nullptr);
}

// Lookups from several threads, and from the observer itself, while the
// watcher registers and drops applications (a ThreadSanitizer target).
TEST(OmnidexWatcher, LookupsRaceAnnouncements) {
  RegistryTree tree;
  auto registry = tree.open();

  class LookingObserver : public RecordingObserver {
   public:
    explicit LookingObserver(Omnidex* registry) : registry_(registry) {}
    void pluginsDidInstall(const std::vector<PlugInRecordPtr>& records) override {
      for (const PlugInRecordPtr& r : records)
        lookedUp_ += registry_->plugInForUuid(r->uuid) ? 1 : 0;
      RecordingObserver::pluginsDidInstall(records);
    }
    std::atomic<int> lookedUp_{0};

   private:
    Omnidex* registry_;
  };
  auto observer = std::make_shared<LookingObserver>(registry.get());
  registry->addObserver(observer);
  registry->startMonitoring();

  std::atomic<bool> stop{false};
  std::vector<std::thread> readers;
  for (int i = 0; i < 3; ++i) {
    readers.emplace_back([&] {
      while (!stop.load()) {
        const std::vector<PlugInRecordPtr> installed = registry->installedPlugIns().value();
        for (const PlugInRecordPtr& r : installed) {
          PlugInRecordPtr same = registry->plugInForUuid(r->uuid);
          if (same) {
            EXPECT_EQ(same->uuid, r->uuid);
          }
          (void)registry->applicationForUrl(
              r->containingApplication ? r->containingApplication->bundlePath : std::string("/"));
        }
        (void)registry->plugInsMatchingQuery(
            Dictionary{{"QXExtensionPointIdentifier", "p"}},
            [](const std::string&, const Dictionary&) { return true; });
      }
    });
  }
  constexpr int kApps = 8;
  for (int i = 0; i < kApps; ++i) {
    const std::string name = "App" + std::to_string(i);
    fs::rename(stageApplication(tree, name, "P"), tree.apps() + "/" + name + ".app");
  }
  for (int i = 0; i < kApps; i += 2)
    fs::remove_all(tree.apps() + "/App" + std::to_string(i) + ".app");
  for (int i = 1; i < kApps; i += 2) {
    EXPECT_NE(
        observer->waitForInstalled(
            tree.apps() + "/App" + std::to_string(i) + ".app/PlugIns/P.appex", kAnnounceDeadline),
        nullptr);
  }
  EXPECT_TRUE(eventually([&] { return registry->installedPlugIns()->size() == kApps / 2; }));
  stop = true;
  for (std::thread& t : readers) t.join();
  EXPECT_GE(observer->lookedUp_.load(), 1);
}

}  // namespace
}  // namespace vantrel::omnidex
