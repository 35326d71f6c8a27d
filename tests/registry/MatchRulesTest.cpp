// The rule language: keys, boolean patterns, operators, arrays, types and
// activation rules, against records built by a database.

#include <gtest/gtest.h>

#include "base/Log.h"
#include "tests/registry/RegistryFixtures.h"

namespace vantrel::registry {
namespace {

using lmo::Array;
using lmo::Dictionary;
using lmo::Value;

class MatchRules : public testing::RegistryTest {
 protected:
  void SetUp() override {
    RegistryTest::SetUp();
    auto r = testing::record("com.x.widget", {{"com.x.flag", "yes"}});
    auto extension = r->extensionDictionary;
    Dictionary attributes{{"Version", "2.10"},
                          {"Zero", Value::integer(0)},
                          {"Tags", Array{"x", "b"}},
                          {"Type", "public.jpeg"},
                          {"Activation", Dictionary{{"public.image", Value::integer(1)}}}};
    extension = extension.setting("QXExtensionAttributes", attributes);
    r->extensionDictionary = extension;
    r->infoDictionary =
        r->infoDictionary.setting("QXExtension", extension).setting("InfoOnly", "i");
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
      {"Missing", no, true},
      {"Missing", yes, false},
      {"Missing", "x", false},
      {"Zero", yes, false},
      {"Zero", no, true},
      {"Zero", Value::integer(1), false},
      {"Version", Value::integer(1), true},  // 1 counts as true
      {"Version", ">2.9", true},
      {"Version", ">=2.10", true},
      {"Version", "<>2.1", true},
      {"Version", "2.10", true},
      {"Version", "<2.9", false},
      {"Version", "=2.1", false},
      {"Version", Value::integer(5), false},
      {"Version", Array{"a", "2.10"}, true},
      {"Tags", "b", true},
      {"Tags", "<>x", true},
      {"Tags", "c", false},
      {"InfoOnly", "i", true},
      {"QXExtensionIdentifier", "com.x.widget", true},
      {"QXExtensionIdentifier", "com.x.*", false},
      {"QXExtensionContainingApp", no, false},
      {"ENTITLEMENT:com.x.flag", "yes", true},
      {"ENTITLEMENT:com.x.flag", no, false},
      {"ENTITLEMENT:", no, true},
      {"ENTITLEMENT:Version", yes, false},  // no fallback to the attribute
      {"Type", "?KQ-CONFORMS:public.image", true},
      {"Type", "?KQ-CONFORMS:public.png", false},
      {"Type", "?KQ-IS:public.jpeg", true},
      {"Type", "?KQ-IS:public.image", false},
      {"Activation", items, true},
      {"Activation", Dictionary{{"items", "bad"}}, false},
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
    if (c.election) db_->setAnnotation(testing::election(*c.election), *plugIn_);
    EXPECT_EQ(plugIn_->electionText(), c.text);
    EXPECT_TRUE(matches("QXUserElection", c.text)) << c.text;
  }
}

}  // namespace
}  // namespace vantrel::registry
