#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "base/Log.h"
#include "lmo/Protocol.h"
#include "platform/PropertyList.h"
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

TEST(OmnidexMetadata, KeyedLookupReadsEachScopeAndInfoFallsBackToTheExtension) {
  RegistryTree tree;
  auto registry = tree.open();
  const Dictionary extension{
      {"QXExtensionPointIdentifier", "com.karvo.share"},
      {"Shared", "extension"},
      {"QXExtensionAttributes", Value(Dictionary{{"Kind", "k"}, {"Shared", "attribute"}})}};
  const std::string path =
      writeBundle(tree.file("x/K.plugin"), Dictionary{{"KBBundleIdentifier", "k"},
                                                      {"Shared", "info"},
                                                      {"QXExtension", Value(extension)}});
  const std::string old = writeBundle(
      tree.file("x/Old.plugin"),
      Dictionary{{"KBBundleIdentifier", "old"},
                 {"Vantrel", Value(Dictionary{{"QXExtensionAttributes", "not a dictionary"}})}});
  ASSERT_TRUE(registry->registerPlugIn(path).has_value());
  ASSERT_TRUE(registry->registerPlugIn(old).has_value());
  const PlugInRecordPtr record = registry->plugInForUrl(path);
  const PlugInRecordPtr oldStyle = registry->plugInForUrl(old);

  const PlugInRecord *k = record.get(), *o = oldStyle.get();
  constexpr LookupScope kAttributes = LookupScope::kAttributes, kInfo = LookupScope::kInfo;
  const struct {
    const PlugInRecord* record;
    LookupScope scope;
    const char* key;
    Value expected;
  } cases[] = {
      // clang-format off
      {k, kAttributes, "Kind", "k"}, {k, kAttributes, "Shared", "attribute"},
      {k, kAttributes, "QXExtensionPointIdentifier", Value()},
      {k, LookupScope::kExtension, "Shared", "extension"},
      {k, LookupScope::kExtension, "KBBundleIdentifier", Value()},
      {k, kInfo, "Shared", "info"}, {k, kInfo, "Absent", Value()},
      {k, kInfo, "QXExtensionPointIdentifier", "com.karvo.share"},
      {k, static_cast<LookupScope>(7), "Shared", Value()},
      {o, kAttributes, "anything", Value()},
      {o, kInfo, "QXExtensionAttributes", "not a dictionary"},
      // clang-format on
  };
  for (const auto& c : cases) {
    EXPECT_EQ(c.record->keyed(c.key, c.scope), c.expected)
        << c.key << " in scope " << static_cast<int>(c.scope);
  }
  // The old style's names fall back to the bundle's directory name.
  EXPECT_EQ(oldStyle->identifier, "old");
  EXPECT_EQ(oldStyle->localizedName, "Old");
  EXPECT_EQ(oldStyle->localizedShortName, "Old");
}

TEST(OmnidexMetadata, EntitlementsAreTrustedOnlyFromFilesNoOneElseCouldWrite) {
  const Dictionary granted{{"com.karvo.developer.auto-elect-plugin", Value::boolean(true)}};
  const std::string ignoring = "ignoring entitlements of plug-in at ";
  struct Case {
    const char* name;
    std::function<void(const std::string& file)> prepare;
    const char* reason;  // null: trusted (or absent) without a log line
    bool trusted;
  };
  auto write = [&](const std::string& file, mode_t mode) {
    ASSERT_TRUE(platform::writePropertyListFile(file, Value(granted), mode).has_value());
  };
  const Case cases[] = {
      {"owned-by-root", [&](const std::string& f) { write(f, 0644); }, nullptr, true},
      {"absent", [](const std::string&) {}, nullptr, false},
      {"group-writable", [&](const std::string& f) { write(f, 0664); },
       "it is writable by group or others", false},
      {"world-writable", [&](const std::string& f) { write(f, 0606); },
       "it is writable by group or others", false},
      {"other-owner",
       [&](const std::string& f) {
         write(f, 0644);
         ASSERT_EQ(::chown(f.c_str(), 12345, 12345), 0);
       },
       "it is owned by uid 12345", false},
      {"symbolic-link",
       [&](const std::string& f) {
         write(f + ".real", 0644);
         fs::create_symlink(f + ".real", f);
       },
       "it is a symbolic link", false},
      {"directory", [](const std::string& f) { fs::create_directories(f); },
       "it is not a regular file", false},
      {"array",
       [](const std::string& f) {
         ASSERT_TRUE(platform::writePropertyListFile(f, Value(lmo::Array{"x"})).has_value());
       },
       "it is not a dictionary", false},
  };
  ASSERT_EQ(::geteuid(), 0u) << "the ownership cases need root";
  RegistryTree tree;
  auto registry = tree.open();
  for (const Case& c : cases) {
    const std::string path =
        writeBundle(tree.file(std::string("x/") + c.name), plugInInfo(c.name, "p"));
    c.prepare(path + "/Entitlements.plist");
    base::LogCapture log;
    ASSERT_TRUE(registry->registerPlugIn(path).has_value()) << c.name;
    const PlugInRecordPtr record = registry->plugInForUrl(path);
    EXPECT_EQ(record->entitlements, c.trusted ? granted : Dictionary()) << c.name;
    if (c.reason == nullptr) {
      EXPECT_FALSE(log.contains(ignoring)) << c.name;
    } else {
      EXPECT_EQ(log.count(ignoring + path + ": " + c.reason), 1u) << c.name;
    }
  }
}

TEST(OmnidexMetadata, EntitlementsThatBecomeUntrustedAreDroppedAtTheNextReconcile) {
  RegistryTree tree;
  const std::string path = writeBundle(tree.plugIns() + "/E.plugin", plugInInfo("e", "p"));
  const std::string file = path + "/Entitlements.plist";
  const Dictionary granted{{std::string(protocol::kManagerEntitlement), Value::boolean(true)}};
  ASSERT_TRUE(platform::writePropertyListFile(file, Value(granted), 0644).has_value());
  auto registry = tree.open();
  auto observer = observe(*registry);
  registry->reconcile();
  const PlugInRecordPtr first = registry->plugInForUrl(path);
  ASSERT_EQ(first->entitlements, granted);

  // Only the mode changes: neither the Info.plist nor the entitlements'
  // bytes, so only the fingerprint can tell.
  ASSERT_EQ(::chmod(file.c_str(), 0666), 0);
  observer->clear();
  registry->reconcile();
  const PlugInRecordPtr second = registry->plugInForUrl(path);
  EXPECT_EQ(second->uuid, first->uuid);
  EXPECT_TRUE(second->entitlements.empty());
  EXPECT_EQ(observer->log(), (std::vector<std::string>{"-" + path, "+" + path}));
}

}  // namespace
}  // namespace vantrel::omnidex
