#include <sys/stat.h>

#include <filesystem>

#include "omnidex/BundlePaths.h"
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
using testing::writeBundle;

bool isPrivateDirectory(const std::string& path) {
  struct stat st;
  return ::lstat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode) && (st.st_mode & 07777) == 0700;
}

TEST(OmnidexRegistration, RegisterReadsTheBundleAndUnregisterForgetsIt) {
  RegistryTree tree;
  auto registry = tree.open();
  auto observer = observe(*registry);
  const Dictionary extras{
      {"KBBundleDisplayName", "Sharing"}, {"KBBundleName", "Share"}, {"KBBundleVersion", "7"}};
  Dictionary info = plugInInfo("com.example.share", "com.karvo.share", extras);
  // The extension's own identifier wins over the bundle's.
  info = info.setting("QXExtension",
                      Value(info.get("QXExtension")
                                .getIfDictionary()
                                ->setting("QXExtensionIdentifier", "com.example.share.ext")));
  const std::string path = writeBundle(tree.file("elsewhere/Share.plugin"), info);
  const double before = testing::secondsNow();

  ASSERT_TRUE(registry->registerPlugIn(path + "/").has_value());
  PlugInRecordPtr record = registry->plugInForUrl(tree.file("elsewhere/./Share.plugin"));
  ASSERT_NE(record, nullptr);
  EXPECT_EQ(record->bundlePath, path);
  EXPECT_EQ(record->identifier, "com.example.share.ext");
  EXPECT_EQ(record->originalIdentifier, "com.example.share.ext");
  EXPECT_EQ(record->bundleIdentifier, "com.example.share");
  EXPECT_EQ(record->bundleVersion, "7");
  EXPECT_EQ(record->localizedName, "Sharing");
  EXPECT_EQ(record->localizedShortName, "Share");
  EXPECT_FALSE(record->onSystemPartition);
  EXPECT_EQ(record->containingApplication, nullptr);
  EXPECT_EQ(record->infoDictionary, info);
  ASSERT_TRUE(record->registrationDate.has_value());
  EXPECT_GE(record->registrationDate->secondsSince1970, before - 1);
  EXPECT_EQ(record->dataContainerPath, tree.container(record->uuid));
  EXPECT_TRUE(isPrivateDirectory(tree.container(record->uuid)));
  EXPECT_TRUE(isPrivateDirectory(tree.container(record->uuid) + "/tmp"));
  EXPECT_EQ(registry->plugInForUuid(record->uuid), record);
  EXPECT_EQ(observer->waitForInstalled(path), record);

  ASSERT_TRUE(registry->unregisterPlugIn(path).has_value());
  EXPECT_EQ(registry->plugInForUuid(record->uuid), nullptr);
  EXPECT_EQ(registry->plugInForUrl(path), nullptr);
  EXPECT_FALSE(fs::exists(tree.container(record->uuid)));
  PlugInRecordPtr gone = observer->waitForUninstalled(path);
  ASSERT_NE(gone, nullptr);
  EXPECT_EQ(gone->uuid, record->uuid);

  base::Result<void> again = registry->unregisterPlugIn(path);
  ASSERT_FALSE(again.has_value());
  EXPECT_EQ(again.error().code, kOmnidexNotRegistered);
}

TEST(OmnidexRegistration, RefusesWhatIsNotAPlugInAndKeepsNothing) {
  RegistryTree tree;
  auto registry = tree.open();
  writeBundle(tree.file("app-only"), Dictionary{{"KBBundleIdentifier", "com.example.app"}});
  writeBundle(tree.file("no-identifier"), Dictionary{{"QXExtension", Value(Dictionary{})}});
  writeBundle(tree.file("empty-identifier"),
              Dictionary{{"KBBundleIdentifier", ""}, {"QXExtension", Value(Dictionary{})}});
  writeBundle(tree.file("extension-not-dict"),
              Dictionary{{"KBBundleIdentifier", "x"}, {"QXExtension", "text"}});
  fs::create_directories(tree.file("no-info"));
  fs::create_directories(tree.file("info-is-dir/Info.plist"));
  tree.write("array-info/Info.plist",
             "<?xml version=\"1.0\"?><plist version=\"1.0\"><array/></plist>");
  tree.write("garbage-info/Info.plist", "<plist><dict><key>x");
  tree.write("plain-file", "x");
  tree.write("huge-info/Info.plist", std::string(2 * 1024 * 1024, ' '));

  const struct {
    std::string path;
    int64_t code;
  } cases[] = {
      {tree.file("missing"), kOmnidexNotABundle},
      {tree.file("plain-file"), kOmnidexNotABundle},
      {tree.file("no-info"), kOmnidexNotABundle},
      {tree.file("app-only"), kOmnidexNotAPlugIn},
      {tree.file("extension-not-dict"), kOmnidexNotAPlugIn},
      {tree.file("no-identifier"), kOmnidexNoIdentifier},
      {tree.file("empty-identifier"), kOmnidexNoIdentifier},
      {tree.file("array-info"), kOmnidexMalformedBundle},
      {tree.file("garbage-info"), kOmnidexMalformedBundle},
      {tree.file("info-is-dir"), kOmnidexMalformedBundle},
      {tree.file("huge-info"), kOmnidexMalformedBundle},
      {"", kOmnidexBadPath},
      {std::string("/tmp/a\0b", 8), kOmnidexBadPath},
      {"/" + std::string(5000, 'x'), kOmnidexBadPath},
  };
  for (const auto& c : cases) {
    base::Result<void> registered = registry->registerPlugIn(c.path);
    ASSERT_FALSE(registered.has_value()) << c.path;
    EXPECT_EQ(registered.error().domain, kOmnidexErrorDomain);
    EXPECT_EQ(registered.error().code, c.code)
        << c.path << ": " << registered.error().description();
  }
  EXPECT_TRUE(registry->installedPlugIns()->empty());
  EXPECT_TRUE(fs::is_empty(tree.state() + "/containers"));
}

TEST(OmnidexRegistration, UuidFollowsThePathWhileTheIdentifierStays) {
  RegistryTree tree;
  auto registry = tree.open();
  auto observer = observe(*registry);
  const std::string path = writeBundle(tree.file("x/Tool.plugin"), plugInInfo("com.t", "p"));
  ASSERT_TRUE(registry->registerPlugIn(path).has_value());
  const PlugInRecordPtr first = registry->plugInForUrl(path);
  ASSERT_NE(first, nullptr);

  // Registering an unchanged bundle again re-dates it and announces it as
  // installed, nothing more.
  ASSERT_TRUE(registry->registerPlugIn(path).has_value());
  const PlugInRecordPtr same = registry->plugInForUrl(path);
  EXPECT_EQ(same->uuid, first->uuid);
  EXPECT_GE(same->registrationDate, first->registrationDate);

  // New content, same identifier: same UUID and container, announced as a
  // replacement.
  writeBundle(path, plugInInfo("com.t", "p", Dictionary{{"KBBundleName", "Renamed"}}));
  ASSERT_TRUE(registry->registerPlugIn(path).has_value());
  const PlugInRecordPtr renamed = registry->plugInForUrl(path);
  EXPECT_EQ(renamed->uuid, first->uuid);
  EXPECT_EQ(renamed->localizedName, "Renamed");
  EXPECT_EQ(renamed->dataContainerPath, first->dataContainerPath);

  // Another identifier at the path is another plug-in.
  writeBundle(path, plugInInfo("com.other", "p"));
  ASSERT_TRUE(registry->registerPlugIn(path).has_value());
  const PlugInRecordPtr other = registry->plugInForUrl(path);
  EXPECT_NE(other->uuid, first->uuid);
  EXPECT_EQ(other->originalIdentifier, "com.other");
  EXPECT_FALSE(fs::exists(tree.container(first->uuid)));
  EXPECT_TRUE(fs::is_directory(tree.container(other->uuid)));
  EXPECT_EQ(registry->plugInForUuid(first->uuid), nullptr);

  ASSERT_NE(observer->waitForInstalled(path), nullptr);
  registry.reset();  // drains the announcements
  EXPECT_EQ(observer->log(), (std::vector<std::string>{"+" + path, "+" + path, "-" + path,
                                                       "+" + path, "-" + path, "+" + path}));
}

TEST(OmnidexRegistration, PlugInsDirectlyInAnApplicationBelongToIt) {
  RegistryTree tree;
  auto registry = tree.open();
  writeBundle(tree.file("A/Notes.app"),
              Dictionary{{"KBBundleName", "Notes"}, {"KBBundleIdentifier", "com.notes"}});
  const std::string inApp =
      writeBundle(tree.file("A/Notes.app/PlugIns/Share.appex"), plugInInfo("n.share", "p"));
  const std::string sibling =
      writeBundle(tree.file("A/Notes.app/PlugIns/Sync.appex"), plugInInfo("n.sync", "p"));
  const std::string nested =
      writeBundle(tree.file("A/Notes.app/Other/Deep.appex"), plugInInfo("n.deep", "p"));
  const std::string inBroken =
      writeBundle(tree.file("B/Broken.app/PlugIns/Lone.appex"), plugInInfo("b.lone", "p"));
  for (const std::string& path : {inApp, sibling, nested, inBroken}) {
    ASSERT_TRUE(registry->registerPlugIn(path).has_value()) << path;
  }

  const ApplicationRecordPtr notes = registry->plugInForUrl(inApp)->containingApplication;
  ASSERT_NE(notes, nullptr);
  EXPECT_EQ(notes->bundlePath, tree.file("A/Notes.app"));
  EXPECT_EQ(notes->bundleContainerPath, tree.file("A"));
  EXPECT_EQ(notes->localizedName, "Notes");
  EXPECT_EQ(notes->bundleIdentifier, "com.notes");
  EXPECT_FALSE(notes->placeholder);
  EXPECT_EQ(registry->plugInForUrl(sibling)->containingApplication, notes);
  EXPECT_EQ(registry->plugInForUrl(nested)->containingApplication, nullptr);
  const ApplicationRecordPtr broken = registry->plugInForUrl(inBroken)->containingApplication;
  ASSERT_NE(broken, nullptr);
  EXPECT_TRUE(broken->placeholder);
  EXPECT_EQ(broken->localizedName, "Broken");

  Workspace::ApplicationLookup lookup = registry->applicationForUrl(tree.file("A/Notes.app/"));
  EXPECT_EQ(lookup.application, notes);
  ASSERT_EQ(lookup.plugIns.size(), 2u);
  EXPECT_EQ(lookup.plugIns[0]->bundlePath, inApp);
  EXPECT_EQ(lookup.plugIns[1]->bundlePath, sibling);

  ASSERT_TRUE(registry->unregisterPlugIn(inBroken).has_value());
  EXPECT_EQ(registry->applicationForUrl(tree.file("B/Broken.app")).application, nullptr);
}

TEST(OmnidexRegistration, ContainingApplicationPathIsLexical) {
  const struct {
    const char* path;
    const char* app;  // null: none
  } cases[] = {
      // clang-format off
      {"/a/X.app/PlugIns/P.appex", "/a/X.app"}, {"/X.app/PlugIns/P", "/X.app"},
      {"/a/X.app/PlugIns", nullptr}, {"/a/.app/PlugIns/P", nullptr},
      {"/a/X.appx/PlugIns/P", nullptr}, {"/a/X.app/plugins/P", nullptr},
      {"/a/X.app/PlugIns/P/PlugIns/Q", nullptr}, {"PlugIns/P", nullptr}, {"/", nullptr},
      // clang-format on
  };
  for (const auto& c : cases) {
    std::optional<std::string> app = containingApplicationPath(c.path);
    if (c.app == nullptr) {
      EXPECT_FALSE(app.has_value()) << c.path;
    } else {
      EXPECT_EQ(app, c.app) << c.path;
    }
  }
}

}  // namespace
}  // namespace vantrel::omnidex
