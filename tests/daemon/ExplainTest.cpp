// "explain": each reason a plug-in is not offered, as discovery itself
// decides it, and the daemon's status.

#include <gtest/gtest.h>

#include "lmo/Protocol.h"
#include "platform/Preferences.h"
#include "platform/PropertyList.h"
#include "registry/VTDUserPrefs.h"
#include "tests/daemon/DiscoveryFixture.h"

namespace vantrel::daemon::testing {
namespace {

using lmo::Array;
using lmo::Dictionary;
using lmo::Value;
namespace protocol = vantrel::protocol;

class Explain : public Discovery {
 protected:
  Dictionary explain(Dictionary extras) {
    return request(protocol::kRequestExplain, std::move(extras));
  }
  // The one explanation of a plug-in named by path.
  Dictionary explainPath(const std::string& path, Dictionary extras = {}) {
    const Dictionary reply = explain(extras.setting(protocol::kKeyPath, path));
    const Array* plugIns = reply.get(protocol::kKeyPlugIns).getIfArray();
    if (plugIns == nullptr || plugIns->size() != 1) {
      ADD_FAILURE() << lmo::describe(reply);
      return reply;
    }
    return *(*plugIns)[0].getIfDictionary();
  }
  static std::string text(const Dictionary& d, const char* key) {
    const std::string* s = d.get(key).getIfString();
    return s ? *s : "(" + lmo::describe(d.get(key)) + ")";
  }
  // The filters an explanation reports as failed, in order.
  static std::vector<std::string> failedFilters(const Dictionary& explanation) {
    std::vector<std::string> failed;
    if (const Array* steps = explanation.get(protocol::kKeySteps).getIfArray()) {
      for (const Value& step : *steps) {
        const Dictionary& s = *step.getIfDictionary();
        if (s.get(protocol::kKeyPassed) == Value::boolean(false))
          failed.push_back(text(s, protocol::kKeyFilter));
      }
    }
    return failed;
  }
};

TEST_F(Explain, EachReasonAsMatchDecidesIt) {
  const std::string dedicated =
      addPlugIn("Owner", "com.ded", {}, {{"Dedicated", Value::boolean(true)}});
  const std::string guarded =
      addPlugIn("Guard", "com.g", {}, {{"QXExtensionHostEntitlement", "com.x.may-host"}});
  const std::string older = addPlugIn("Old", "com.d", {{"QXExtensionVersion", "1.9"}});
  const std::string newer = addPlugIn("New", "com.d", {{"QXExtensionVersion", "1.10"}});
  const std::string excluded = addPlugIn("Ex", "com.ex");
  ASSERT_TRUE(platform::Preferences(registry::kUserPrefsDomain)
                  .setValue(registry::kExclusionsKey,
                            Value(Array{Dictionary{{"QXExtensionIdentifier", "com.ex"}}}))
                  .has_value());
  const Dictionary held =
      request(protocol::kRequestLock,
              {{protocol::kKeyFlags, u64(protocol::bits(protocol::HoldFlags::kPlugIn))},
               {protocol::kKeyPaths, Array{plugInPath("widget")}}});
  const base::Uuid* token = held.get(protocol::kKeyUuids).getIfUuid();
  ASSERT_NE(token, nullptr) << lmo::describe(held);

  struct Case {
    std::string path;
    Dictionary extras;
    const char* reason;
    std::vector<std::string> failed;
    std::string textHas;
  };
  const Dictionary electedOnly{{"QXUserElection", "1"}};
  const Case cases[] = {
      {plugInPath("share"), {}, protocol::kReasonOffered, {}, "offered"},
      {plugInPath("share"),
       {{protocol::kKeyFlags, u64(protocol::bits(protocol::DiscoveryFlags::kSystemOnly))}},
       protocol::kReasonLocation,
       {protocol::kFilterLocation},
       "only system plug-ins"},
      {dedicated, {}, protocol::kReasonDedicated, {protocol::kFilterDedication}, "dedicated to"},
      {plugInPath("widget"), {}, protocol::kReasonOnHold, {protocol::kFilterHold}, token->string()},
      {plugInPath("share"),
       {{protocol::kKeyRules, electedOnly}},
       protocol::kReasonElection,
       {protocol::kFilterElection, protocol::kFilterRules},
       "election 0"},
      {plugInPath("share"),
       {{protocol::kKeyRules, Dictionary{{"QXExtensionIdentifier", "com.other"}}}},
       protocol::kReasonRules,
       {protocol::kFilterRules},
       "does not match"},
      {excluded, {}, protocol::kReasonExcluded, {protocol::kFilterExclusions}, "com.ex"},
      {guarded,
       {},
       protocol::kReasonHostAuthorisation,
       {protocol::kFilterAuthorisation},
       "the host does not have the \"com.x.may-host\" entitlement"},
      {older, {}, protocol::kReasonDuplicate, {protocol::kFilterDuplicates}, newer},
      {newer, {}, protocol::kReasonOffered, {}, "offered"},
  };
  for (const Case& c : cases) {
    const Dictionary e = explainPath(c.path, c.extras);
    EXPECT_EQ(text(e, protocol::kKeyReason), c.reason) << c.path << lmo::describe(Value(e));
    EXPECT_EQ(e.get(protocol::kKeyOffered), Value::boolean(c.failed.empty())) << c.path;
    EXPECT_EQ(failedFilters(e), c.failed) << c.path;
    EXPECT_NE(text(e, protocol::kKeyText).find(c.textHas), std::string::npos)
        << c.path << ": " << text(e, protocol::kKeyText);
    // What explain says agrees with what match reports to this host.
    const Array forms = matches(
        c.extras.setting(protocol::kKeyRules, c.extras.get(protocol::kKeyRules).getIfDictionary()
                                                  ? c.extras.get(protocol::kKeyRules)
                                                  : Value(Dictionary{})));
    bool found = false;
    for (const Value& form : forms) {
      found = found || form.getIfDictionary()->get(protocol::kFormPath) == Value(c.path);
    }
    EXPECT_EQ(found, c.failed.empty()) << c.path;
  }

  // The hold and the winning duplicate are named.
  const Dictionary onHold = explainPath(plugInPath("widget"));
  EXPECT_EQ(onHold.get(protocol::kKeyHold).getIfDictionary()->get(protocol::kKeyToken),
            Value(*token));
  EXPECT_EQ(onHold.get(protocol::kKeyHold).getIfDictionary()->get(protocol::kKeyPid),
            u64(static_cast<uint64_t>(::getpid())));
  const Dictionary beaten = *explainPath(older).get(protocol::kKeyBeatenBy).getIfDictionary();
  EXPECT_EQ(beaten.get(protocol::kKeyPath), Value(newer));
  EXPECT_EQ(beaten.get(protocol::kKeyRule), Value(protocol::kRuleHigherVersion));

  // Naming the identifier explains every registration of it.
  const Dictionary both = explain({{protocol::kKeyIdentifier, "com.d"}});
  EXPECT_EQ(both.get(protocol::kKeyPlugIns).getIfArray()->size(), 2u) << lmo::describe(both);
}

TEST_F(Explain, WhatIsNotARecord) {
  // A plug-in the model refuses still has a registry record.
  const std::string bad = omnidex::testing::writeBundle(
      hostApp() + "/PlugIns/bad.appex",
      plugInInfo("com.x.bad")
          .setting("QXExtension", plugInInfo("com.x.bad")
                                      .get("QXExtension")
                                      .getIfDictionary()
                                      ->setting("PassProxy", Value::boolean(true))));
  registry_->reconcile();
  ASSERT_TRUE(eventually([&] { return registry_->plugInForUrl(bad) != nullptr; }));
  const std::string loose =
      omnidex::testing::writeBundle(tmp_.file("Loose.appex"), plugInInfo("com.x.loose"));

  const Dictionary misconfigured = explainPath(bad);
  EXPECT_EQ(text(misconfigured, protocol::kKeyReason), protocol::kReasonMisconfigured);
  EXPECT_EQ(text(misconfigured, protocol::kKeyText),
            "mis-configured: the \"PassProxy\" key is not supported on this platform");

  const std::pair<Dictionary, const char*> none[] = {
      {{{protocol::kKeyPath, loose}}, protocol::kReasonNotRegistered},
      {{{protocol::kKeyPath, tmp_.file("nowhere")}}, protocol::kReasonNotInstalled},
      {{{protocol::kKeyIdentifier, "com.nobody"}}, protocol::kReasonNotInstalled},
      {{{protocol::kKeyUuid, base::Uuid::random()}}, protocol::kReasonNotInstalled},
  };
  for (const auto& [selector, reason] : none) {
    const Dictionary reply = explain(selector);
    EXPECT_EQ(reply.get(protocol::kKeyPlugIns), Value(Array())) << lmo::describe(reply);
    EXPECT_EQ(text(reply, protocol::kKeyReason), reason) << lmo::describe(reply);
  }
}

TEST_F(Explain, StatusAndWhoMayAsk) {
  request(protocol::kRequestLock,
          {{protocol::kKeyFlags, u64(protocol::bits(protocol::HoldFlags::kPlugIn))},
           {protocol::kKeyPaths, Array{plugInPath("widget")}}});
  const Dictionary status = *explain({}).get(protocol::kKeyStatus).getIfDictionary();
  EXPECT_EQ(status.get(protocol::kKeyVersion), u64(protocol::kCurrentVersion));
  EXPECT_EQ(status.get(protocol::kKeyInstalled), u64(2));
  const Array& holds = *status.get(protocol::kKeyHolds).getIfArray();
  ASSERT_EQ(holds.size(), 1u);
  EXPECT_EQ(holds[0].getIfDictionary()->get(protocol::kKeyPlugInCount), u64(1));
  // The test runs as the daemon's own user, who sees the token.
  EXPECT_NE(holds[0].getIfDictionary()->get(protocol::kKeyToken).getIfUuid(), nullptr);

  const std::pair<Dictionary, Expected> refused[] = {
      {{{protocol::kKeyPath, plugInPath("share")}, {protocol::kKeyPid, u64(1)}},
       {11,
        "explaining for another host requires the \"com.karvo.private.vantrel.manager\" "
        "entitlement"}},
      {{{protocol::kKeyPath, plugInPath("share")}, {protocol::kKeyHostPath, hostApp()}},
       {11,
        "explaining for another host requires the \"com.karvo.private.vantrel.manager\" "
        "entitlement"}},
      {{{protocol::kKeyPath, plugInPath("share")}, {protocol::kKeyIdentifier, kShare}},
       {4, "invalid request format (name one plug-in by uuid, path or identifier)"}},
      {{{protocol::kKeyPath, u64(3)}},
       {4, "invalid request format (name one plug-in by uuid, path or identifier)"}},
      {{{protocol::kKeyIdentifier, kShare}, {protocol::kKeyPid, "me"}},
       {4, "invalid request format (name the host by pid or by hostpath)"}},
  };
  for (const auto& [extras, expected] : refused) {
    EXPECT_EQ(errorOf(explain(extras)), expected) << lmo::describe(Value(extras));
  }
  // Naming oneself by pid needs nothing.
  EXPECT_EQ(errorOf(explain({{protocol::kKeyIdentifier, kShare},
                             {protocol::kKeyPid, u64(static_cast<uint64_t>(::getpid()))}})),
            Expected(0, ""));
}

}  // namespace
}  // namespace vantrel::daemon::testing
