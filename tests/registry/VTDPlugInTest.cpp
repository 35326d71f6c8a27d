#include "registry/VTDPlugIn.h"

#include <gtest/gtest.h>

#include <limits>

#include "base/Log.h"
#include "tests/registry/RegistryFixtures.h"

namespace vantrel::registry {
namespace {

using lmo::Array;
using lmo::Dictionary;
using lmo::Value;
using testing::election;
using testing::record;

TEST(VTDPlugIn, LastModifiedAndHubProtocolVersion) {
  const std::pair<std::optional<double>, int32_t> dates[] = {
      {std::nullopt, 0}, {-1.5, -1}, {1.9, 1}, {1e12, std::numeric_limits<int32_t>::max()}};
  for (const auto& [seconds, expected] : dates) {
    auto r = record("p");
    if (seconds) r->registrationDate = lmo::Date{*seconds};
    EXPECT_EQ(VTDPlugIn::initWithOXData(r)->lastModified(), expected) << seconds.value_or(0);
  }
  // {declared version (null: none), old-style Info key, expected}
  const std::tuple<Value, bool, uint32_t> hubs[] = {{Value(), false, 2},
                                                    {Value(), true, 1},
                                                    {Value::integer(0), true, 0},
                                                    {Value::integer(7), false, 7}};
  for (const auto& [declared, oldStyle, expected] : hubs) {
    auto r = record("p");
    r->extensionDictionary = r->extensionDictionary.setting("HubProtocolVersion", declared);
    r->infoDictionary = Dictionary{{oldStyle ? "Vantrel" : "QXExtension", r->extensionDictionary}};
    EXPECT_EQ(VTDPlugIn::initWithOXData(r)->hubProtocolVersion(), expected) << oldStyle;
  }
}

TEST(VTDPlugIn, MisconfiguredRecordsAreRefused) {
  const std::string system = "/System/Library/PlugIns/p.plugin";
  struct Case {
    std::string path;
    Value protocol;  // null: none
    bool container, inApp;
    std::string logged;  // empty: accepted
  } cases[] = {
      // Without a container it is refused (the database's tests read that
      // line), unless it is data-only.
      {system, "#Data", false, false, ""},
      {"/Systemic/p.plugin", "P", true, false, "outside containing apps must be in /System"},
      {"/opt/A.app/PlugIns/p.plugin", "P", true, true, ""},
      {system, Value(), false, false,
       "missing \"QXExtensionProtocol\" key"},  // the base's rules come first
  };
  for (const Case& c : cases) {
    auto r = record("p");
    r->bundlePath = c.path;
    r->extensionDictionary =
        c.protocol.isNull() ? r->extensionDictionary.removing("QXExtensionProtocol")
                            : r->extensionDictionary.setting("QXExtensionProtocol", c.protocol);
    if (!c.container) r->dataContainerPath.reset();
    if (c.inApp) r->containingApplication = std::make_shared<omnidex::ApplicationRecord>();
    base::LogCapture log;
    EXPECT_EQ(VTDPlugIn::initWithOXData(r) == nullptr, !c.logged.empty()) << c.path;
    EXPECT_EQ(log.lines().size(), c.logged.empty() ? 0u : 1u);
    EXPECT_TRUE(c.logged.empty() || log.contains(c.logged)) << c.logged;
  }
}

TEST(VTDPlugIn, NamesEntitlementsAndAnnotationKey) {
  auto r = record("own", {{"com.karvo.developer.replace-plugin", Value::boolean(true)}});
  r->localizedName = "Name";
  r->localizedShortName = "N";
  EXPECT_EQ(VTDPlugIn::initWithOXData(r)->localizedContainingName(), std::nullopt);
  r->containingApplication = std::make_shared<omnidex::ApplicationRecord>(
      omnidex::ApplicationRecord{.localizedName = "App"});
  auto p = VTDPlugIn::initWithOXData(r);
  p->setLocalizedShortName("Mine");  // set before the first read: wins
  EXPECT_EQ(p->localizedName(), "Name");
  EXPECT_EQ(p->localizedShortName(), "Mine");
  EXPECT_EQ(p->localizedContainingName(), "App");
  p->setLocalizedName("Other");
  EXPECT_EQ(p->localizedName(), "Other");
  p->setLocalizedName(std::nullopt);  // fetched again
  EXPECT_EQ(p->localizedName(), "Name");
  EXPECT_EQ(p->annotationKey(), "own");  // a replace-plugin value counts only as a string

  // Any number 0 (or false) withholds an entitlement; everything else grants it.
  EXPECT_FALSE(p->hasEntitlement("absent"));
  for (const auto& [value, granted] : {std::pair{Value::integer(0), false},
                                       {Value::real(0.0), false},
                                       {Value::boolean(false), false},
                                       {Value("false"), true},
                                       {Value::integer(2), true}}) {
    EXPECT_EQ(VTDPlugIn::initWithOXData(record("p", {{"e", value}}))->hasEntitlement("e"), granted)
        << describe(value);
  }
}

// ---- The rule language: keys, boolean patterns, operators, arrays, types
// and activation rules, against records built by a database ----

class MatchRules : public testing::RegistryTest {
 protected:
  void SetUp() override {
    auto r = record("com.x.widget", {{"com.x.flag", "yes"}});
    r->extensionDictionary = r->extensionDictionary.setting(
        "QXExtensionAttributes",
        Dictionary{{"Version", "2.10"},
                   {"Zero", Value::integer(0)},
                   {"Tags", Array{"x", "b"}},
                   {"Type", "public.jpeg"},
                   {"Activation", Dictionary{{"public.image", Value::integer(1)}}}});
    r->infoDictionary =
        r->infoDictionary.setting("QXExtension", r->extensionDictionary).setting("InfoOnly", "i");
    workspace_->records = {r};
    db_ = database();
    plugIn_ = db_->findPlugIn(r->uuid);
    ASSERT_NE(plugIn_, nullptr);
  }
  bool matches(const std::string& key, const Value& pattern) {
    return plugIn_->matchKey(key, pattern);
  }

  VTDatabasePtr db_;
  VTDPlugInPtr plugIn_;
};

TEST_F(MatchRules, KeysPatternsAndOperators) {
  const Value yes = Value::boolean(true), no = Value::boolean(false);
  const Value items =
      Dictionary{{"items", Array{Dictionary{{"attachments", Array{"public.png"}}}}}};
  struct Case {
    std::string key;
    Value pattern;
    bool expected;
  };
  const Case cases[] = {
      // clang-format off
      {"Missing", no, true}, {"Missing", yes, false}, {"Missing", "x", false},
      {"Zero", yes, false}, {"Zero", no, true}, {"Zero", Value::integer(1), false},
      {"Version", Value::integer(1), true},  // 1 counts as true
      {"Version", ">2.9", true}, {"Version", ">=2.10", true}, {"Version", "<>2.1", true},
      {"Version", "2.10", true}, {"Version", "<2.9", false}, {"Version", "=2.1", false},
      {"Version", Value::integer(5), false}, {"Version", Array{"a", "2.10"}, true},
      {"Tags", "b", true}, {"Tags", "<>x", true}, {"Tags", "c", false},
      {"InfoOnly", "i", true},
      {"QXExtensionIdentifier", "com.x.widget", true}, {"QXExtensionIdentifier", "com.x.*", false},
      {"QXExtensionContainingApp", no, false},
      {"ENTITLEMENT:com.x.flag", "yes", true}, {"ENTITLEMENT:com.x.flag", no, false},
      {"ENTITLEMENT:", no, true},
      {"ENTITLEMENT:Version", yes, false},  // no fallback to the attribute
      {"Type", "?KQ-CONFORMS:public.image", true}, {"Type", "?KQ-CONFORMS:public.png", false},
      {"Type", "?KQ-IS:public.jpeg", true}, {"Type", "?KQ-IS:public.image", false},
      {"Activation", items, true}, {"Activation", Dictionary{{"items", "bad"}}, false},
      // clang-format on
  };
  for (const Case& c : cases) {
    EXPECT_EQ(matches(c.key, c.pattern), c.expected) << c.key << " " << lmo::describe(c.pattern);
  }
  base::LogCapture log;
  EXPECT_FALSE(matches("Version", "?XYZ"));
  EXPECT_EQ(log.count("unrecognized match operator:?XYZ"), 1u);
  EXPECT_TRUE(plugIn_->match(std::nullopt));
  EXPECT_TRUE(plugIn_->match(Dictionary{}));
  EXPECT_FALSE(plugIn_->match(Dictionary{{"Version", "2.10"}, {"Missing", yes}}));
}

TEST_F(MatchRules, UuidAndElectionTexts) {
  const std::string uuid = plugIn_->uuid()->string();
  std::string lower = uuid;
  for (char& ch : lower) ch = static_cast<char>(std::tolower(static_cast<unsigned char>(ch)));
  EXPECT_TRUE(matches("com.karvo.uuid", uuid));
  EXPECT_FALSE(matches("com.karvo.uuid", lower));
  struct Case {
    std::optional<int64_t> election;
    const char* text;
  };
  for (const Case c :
       {Case{std::nullopt, "0"}, Case{258, "2"}, Case{65538, "65538"}, Case{-1, "-65281"}}) {
    if (c.election) db_->setAnnotation(election(*c.election), *plugIn_);
    EXPECT_EQ(plugIn_->electionText(), c.text);
    EXPECT_TRUE(matches("QXUserElection", c.text)) << c.text;
  }
}

}  // namespace
}  // namespace vantrel::registry
