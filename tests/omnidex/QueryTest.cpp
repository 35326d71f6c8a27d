#include <set>

#include "platform/PropertyList.h"
#include "tests/omnidex/OmnidexFixtures.h"

namespace vantrel::omnidex {
namespace {

using lmo::Array;
using lmo::Dictionary;
using lmo::Value;
using testing::plugInInfo;
using testing::RegistryTree;
using testing::writeBundle;

constexpr const char* kPoint = "QXExtensionPointIdentifier";
constexpr const char* kId = "QXExtensionIdentifier";

// Registers plug-ins whose extension point a rule would read from different
// places; returns the registry. Identifiers are "id.<name>".
std::shared_ptr<Omnidex> registryWithPoints(const RegistryTree& tree) {
  auto registry = tree.open();
  auto add = [&](const std::string& name, Dictionary extension, Dictionary extras = {}) {
    Dictionary info = plugInInfo("id." + name, "unused", extras);
    Dictionary merged = *info.get("QXExtension").getIfDictionary();
    for (const auto& [key, value] : extension) merged = merged.setting(key, value);
    info = info.setting("QXExtension", Value(merged));
    const std::string path = writeBundle(tree.file("q/" + name), info);
    ASSERT_TRUE(registry->registerPlugIn(path).has_value()) << name;
  };
  add("a", {{kPoint, "com.a"}});
  // An attribute wins over the extension dictionary...
  add("b", {{kPoint, "com.b"}, {"QXExtensionAttributes", Value(Dictionary{{kPoint, "com.a"}})}});
  // ...and the Info dictionary's own entry wins over the extension's.
  add("c", {{kPoint, "com.a"}}, {{kPoint, "com.c"}});
  add("d", {{kPoint, Value(Array{"com.a", "com.d", Value::integer(3)})}});
  add("e", {{kPoint, "com.v01.x0"}});
  add("f", {{kPoint, Value::integer(1)}});
  return registry;
}

std::set<std::string> names(const std::vector<PlugInRecordPtr>& records) {
  std::set<std::string> result;
  for (const PlugInRecordPtr& r : records)
    result.insert(r->bundlePath->substr(r->bundlePath->rfind('/') + 1));
  return result;
}

TEST(OmnidexQuery, PlainPatternsNarrowByExtensionPointAndIdentifier) {
  RegistryTree tree;
  auto registry = registryWithPoints(tree);
  const std::set<std::string> all{"a", "b", "c", "d", "e", "f"};
  const struct {
    const char* name;
    Dictionary query;
    std::set<std::string> expected;
  } cases[] = {
      {"point", {{kPoint, "com.a"}}, {"a", "b", "d"}},
      {"point array", {{kPoint, Value(Array{"com.c", "com.d"})}}, {"c", "d"}},
      {"digits by value", {{kPoint, "com.v1.x000"}}, {"e"}},
      {"no such point", {{kPoint, "com.z"}}, {}},
      {"empty array", {{kPoint, Value(Array{})}}, {}},
      {"operator", {{kPoint, "=com.a"}}, all},
      {"type operator", {{kPoint, "?KQ-IS:com.a"}}, all},
      {"array with operator", {{kPoint, Value(Array{"com.a", "<com.b"})}}, all},
      {"array with number", {{kPoint, Value(Array{"com.a", Value::integer(1)})}}, all},
      {"boolean", {{kPoint, Value::boolean(true)}}, all},
      {"identifier", {{kId, "id.c"}}, {"c"}},
      {"identifier operator", {{kId, ">id.c"}}, all},
      {"both", {{kPoint, "com.a"}, {kId, Value(Array{"id.b", "id.c"})}}, {"b"}},
      {"both, disjoint", {{kPoint, "com.d"}, {kId, "id.a"}}, {}},
      {"both, one open", {{kPoint, "com.d"}, {kId, "<>id.a"}}, {"d"}},
      {"other keys", {{"QXUserElection", "1"}, {"Kind", "x"}}, all},
      {"empty", {}, all},
  };
  for (const auto& c : cases) {
    std::optional<std::vector<PlugInRecordPtr>> found =
        registry->plugInsMatchingQuery(c.query, nullptr);
    ASSERT_TRUE(found.has_value()) << c.name;
    EXPECT_EQ(names(*found), c.expected) << c.name;
  }
}

TEST(OmnidexQuery, FilterSeesEveryCandidateOnceAndMayCallBack) {
  RegistryTree tree;
  auto registry = tree.open();
  const Dictionary entitled{{"com.karvo.developer.replace-plugin", "id.other"}};
  for (const std::string name : {"a", "b", "c"}) {
    const std::string path =
        writeBundle(tree.file("f/" + name), plugInInfo("id." + name, name == "c" ? "q" : "p"));
    if (name == "b") {
      ASSERT_TRUE(
          platform::writePropertyListFile(path + "/Entitlements.plist", Value(entitled), 0644)
              .has_value());
    }
    ASSERT_TRUE(registry->registerPlugIn(path).has_value());
  }
  std::multiset<std::string> seen;
  auto filter = [&](const std::string& identifier, const Dictionary& entitlements) {
    seen.insert(identifier);
    EXPECT_EQ(entitlements, identifier == "id.b" ? entitled : Dictionary()) << identifier;
    // The registry holds no lock while it filters.
    EXPECT_EQ(registry->installedPlugIns()->size(), 3u);
    return identifier != "id.a";
  };
  std::optional<std::vector<PlugInRecordPtr>> found =
      registry->plugInsMatchingQuery(Dictionary{{kPoint, "p"}}, filter);
  ASSERT_TRUE(found.has_value());
  EXPECT_EQ(names(*found), (std::set<std::string>{"b"}));
  EXPECT_EQ(seen, (std::multiset<std::string>{"id.a", "id.b"}));
}

}  // namespace
}  // namespace vantrel::omnidex
