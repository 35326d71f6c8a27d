// Discovery end to end: "match" with its rules, filters and duplicate
// resolution, and host authorisation as "match" and "ready" report it.

#include <gtest/gtest.h>

#include <chrono>
#include <filesystem>
#include <thread>

#include "base/Log.h"
#include "platform/DeviceRestrictions.h"
#include "platform/Preferences.h"
#include "registry/VTDUserPrefs.h"
#include "tests/daemon/DiscoveryFixture.h"

namespace vantrel::daemon::testing {
namespace {

using lmo::Array;
using lmo::Dictionary;
using lmo::Value;

constexpr const char* kAllowedPlugIns = "com.karvo.developer.vantrel.allowedplugins";
using protocol::DiscoveryFlags;

TEST_F(Discovery, RulePatterns) {
  base::LogCapture log;
  const Dictionary rule{{"public.image", Value::integer(1)}};
  addPlugIn("Rules", "com.r.a",
            {{"Level", "2.10"},
             {"Tags", Array{"x", "b"}},
             {"Zero", Value::integer(0)},
             {"Type", "public.jpeg"},
             {"Rule", rule}});
  addPlugIn("Rules", "com.r.b", {{"Level", "2.9"}});
  const std::string app = tmp_.file("apps/Rules.app");
  const Dictionary oneJpeg{{"items", Array{Dictionary{{"attachments", Array{"public.jpeg"}}}}}};
  const Dictionary twoJpegs{
      {"items", Array{Dictionary{{"attachments", Array{"public.jpeg", "public.jpeg"}}}}}};
  const Ids a{"com.r.a"}, b{"com.r.b"}, both{"com.r.a", "com.r.b"}, none;
  const std::pair<Dictionary, Ids> cases[] = {
      {{}, both},
      {{{"Level", ">2.9"}}, a},
      {{{"Level", ">=2.10"}}, a},
      {{{"Level", "<>2.1"}}, both},
      {{{"Level", "2.10"}}, a},
      {{{"Level", "<=2.9"}}, b},
      {{{"Level", "<2.9"}}, none},
      {{{"Level", "=2.1"}}, none},
      {{{"Level", Array{"zz", "2.9"}}}, b},
      {{{"Level", Value::integer(5)}}, none},
      {{{"Tags", "b"}}, a},
      {{{"Missing", Value::boolean(false)}}, both},
      {{{"Missing", Value::boolean(true)}}, none},
      {{{"Zero", Value::boolean(true)}}, none},
      {{{"Zero", Value::boolean(false)}}, both},
      {{{"Type", "?KQ-CONFORMS:public.image"}}, a},
      {{{"Type", "?KQ-IS:public.image"}}, none},
      {{{"Type", "?KQ-IS:public.jpeg"}}, a},
      {{{"Type", "?XYZ"}}, none},
      {{{"Rule", oneJpeg}}, a},
      {{{"Rule", twoJpegs}}, none},
      {{{"QXExtensionIdentifier", "com.r.b"}}, b},
  };
  for (const auto& [rules, expected] : cases) {
    // Every case is confined to the Rules application's plug-ins.
    EXPECT_EQ(matching(rules.setting("QXExtensionContainingApp", app)), expected)
        << lmo::describe(rules);
  }
  EXPECT_EQ(log.count("unrecognized match operator:?XYZ"), 1u);
  EXPECT_EQ(matching({{"QXExtensionContainingApp", Value::boolean(false)}}), none);
}

TEST_F(Discovery, SpecialKeysAndReplyForms) {
  const std::string uuid = uuidOf("share").string();
  std::string lower = uuid;
  for (char& c : lower) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  ASSERT_NE(lower, uuid);
  const Ids widget{kWidget}, share{kShare}, both{kWidget, kShare};
  EXPECT_EQ(matching({{"com.karvo.uuid", uuid}}), share);
  EXPECT_EQ(matching({{"com.karvo.uuid", lower}}), Ids{});
  EXPECT_EQ(matching({{"QXUserElection", "0"}}), both);

  // The election's bits 8 to 15 are not seen.
  request(protocol::kRequestAnnotate,
          {{protocol::kKeyUuids, Array{uuidOf("widget")}},
           {protocol::kKeyAnnotations,
            Dictionary{{protocol::kAnnotationElection, Value::integer(258)}}}});
  EXPECT_EQ(matching({{"QXUserElection", "2"}}), widget);
  EXPECT_EQ(matching({{"QXUserElection", "0"}}), share);

  // Every form carries its annotations and, for an app extension, a token
  // for the bundle itself.
  const Array forms = matches({});
  ASSERT_EQ(forms.size(), 2u);
  EXPECT_EQ(formOf(forms, kWidget).get(protocol::kFormAnnotations),
            Value(Dictionary{{protocol::kAnnotationElection, Value::integer(258)}}));
  EXPECT_EQ(formOf(forms, kShare).get(protocol::kFormAnnotations), Value(Dictionary{}));
  for (const Value& form : forms) {
    const Dictionary* extensions =
        form.getIfDictionary()->get(protocol::kKeyExtensions).getIfDictionary();
    ASSERT_NE(extensions, nullptr) << lmo::describe(form);
    EXPECT_NE(extensions->get(".").getIfString(), nullptr) << lmo::describe(form);
  }

  // Version 2: success without "matches".
  const Dictionary old = *send({{protocol::kKeyRequest, protocol::kRequestMatch},
                                {protocol::kKeyVersion, u64(protocol::kOldestVersion)}});
  EXPECT_EQ(errorOf(old), Expected(0, ""));
  EXPECT_FALSE(old.contains(protocol::kKeyMatches)) << lmo::describe(old);
  EXPECT_EQ(errorOf(request(protocol::kRequestMatch, {{protocol::kKeyRules, Array{}}})),
            Expected(protocol::kErrorBadRequest, "invalid request format (bad rules dictionary)"));
}

TEST_F(Discovery, HoldsAndExclusionsHide) {
  const Ids widget{kWidget}, share{kShare}, both{kWidget, kShare};
  const Dictionary held =
      request(protocol::kRequestLock, {{protocol::kKeyFlags, u64(protocol::HoldFlags::kPlugIn)},
                                       {protocol::kKeyPaths, Array{plugInPath("widget")}}});
  ASSERT_NE(held.get(protocol::kKeyUuids).getIfUuid(), nullptr) << lmo::describe(held);
  EXPECT_EQ(matching({}), share);
  request(protocol::kRequestLock,
          {{protocol::kKeyUuids, Array{*held.get(protocol::kKeyUuids).getIfUuid()}}});
  EXPECT_EQ(matching({}), both);

  // Another process replaces the preferences file; entries that are not
  // rule dictionaries are ignored.
  const auto exclusionsFromAnotherProcess = [](const std::string& value) {
    const std::string path = platform::Preferences(registry::kUserPrefsDomain).path();
    auto writer = vantrel::testing::PeerProcess::start(
        "/bin/sh",
        {"-c", R"(mkdir -p "${2%/*}" && printf %s "$1" > "$2.new" && mv "$2.new" "$2")", "sh",
         "<?xml version=\"1.0\" encoding=\"UTF-8\"?><plist version=\"1.0\"><dict>"
         "<key>exclusions</key>" +
             value + "</dict></plist>",
         path});
    ASSERT_NE(writer, nullptr);
    EXPECT_EQ(writer->wait(), 0);
  };
  exclusionsFromAnotherProcess(
      "<array><string>junk</string><dict><key>QXExtensionIdentifier</key><string>" +
      std::string(kShare) + "</string></dict></array>");
  EXPECT_EQ(matching({}), widget);
  exclusionsFromAnotherProcess("<string>not a list</string>");
  EXPECT_EQ(matching({}), both);
}

TEST_F(Discovery, DedicatedPlugInsReachOnlyTheirOwnApplication) {
  addPlugIn("Owner", "com.ded", {}, {{"Dedicated", Value::boolean(true)}});
  // The owning application's executable is a test peer.
  const std::string owner = tmp_.file("apps/Owner.app");
  omnidex::testing::writeBundle(
      owner, {{"KBBundleIdentifier", "com.app.Owner"}, {"KBBundleExecutable", "peer"}});
  ASSERT_TRUE(vantrel::testing::installTestPeer(owner + "/peer"));
  const std::string stranger = peerWith("Stranger", {{"unrelated", Value::boolean(true)}});

  // This test process has no bundle at all.
  EXPECT_EQ(matching({{"QXExtensionIdentifier", "com.ded"}}), Ids{});
  std::string answer;
  auto own = ask(owner + "/peer", protocol::kRequestMatch, 0, {}, &answer);
  EXPECT_NE(answer.find("com.ded"), std::string::npos) << answer;
  auto other = ask(stranger, protocol::kRequestMatch, 0, {}, &answer);
  EXPECT_TRUE(answer.starts_with("ok ")) << answer;
  EXPECT_EQ(answer.find("com.ded"), std::string::npos) << answer;
}

TEST_F(Discovery, DuplicatesResolvedByVersion) {
  addPlugIn("Old", "com.d", {{"QXExtensionVersion", "1.9"}});
  addPlugIn("New", "com.d", {{"QXExtensionVersion", "1.10"}});
  addPlugIn("Copy", "com.d", {{"QXExtensionVersion", "1.10"}});
  const std::pair<DiscoveryFlags, Ids> cases[] = {
      {DiscoveryFlags::kNone, {"1.10"}},
      {DiscoveryFlags::kDuplicates, {"1.10"}},  // duplicates alone change nothing
      {DiscoveryFlags::kVersions, {"1.9", "1.10"}},
      {DiscoveryFlags::kVersions | DiscoveryFlags::kDuplicates, {"1.9", "1.10", "1.10"}},
  };
  for (const auto& [flags, versions] : cases) {
    Ids found;
    for (const Value& form :
         matches({{protocol::kKeyRules, Dictionary{{"QXExtensionIdentifier", "com.d"}}},
                  {protocol::kKeyFlags, u64(flags)}})) {
      found.insert(*form.getIfDictionary()->get(protocol::kFormVersion).getIfString());
    }
    EXPECT_EQ(found, versions) << protocol::bits(flags);
  }
}

// A later duplicate is weighed against the one that has won so far, not one
// that was replaced: visited (in path order) as 1, 2, 1.5, only 2 is left.
TEST_F(Discovery, ALaterDuplicateMeetsTheWinnerSoFar) {
  addPlugIn("E1", "com.e", {{"QXExtensionVersion", "1"}});
  addPlugIn("E2", "com.e", {{"QXExtensionVersion", "2"}});
  addPlugIn("E3", "com.e", {{"QXExtensionVersion", "1.5"}});
  Ids found;
  for (const Value& form :
       matches({{protocol::kKeyRules, Dictionary{{"QXExtensionIdentifier", "com.e"}}},
                {protocol::kKeyFlags, u64(DiscoveryFlags::kNone)}})) {
    found.insert(*form.getIfDictionary()->get(protocol::kFormVersion).getIfString());
  }
  EXPECT_EQ(found, Ids{"2"});
}

// Equal versions are settled by registration time, in whole seconds, except
// that a system plug-in visited after a non-system one always wins. The
// expected winner of each pair is worked out from the visit order, which the
// result list keeps when every registration is kept. The registry visits in
// path order: <tmp>/Early < <tmp>/System < <tmp>/apps, so the pairs below
// meet each step of the rule.
TEST_F(Discovery, DuplicatesResolvedByTimeAndSystemResidence) {
  const std::string systemS = addPlugIn("", "com.s");
  addPlugIn("", "com.r");
  addPlugIn("A", "com.t");
  addPlugIn("C", "com.eq");
  addPlugIn("D", "com.eq");
  // The rest registers early in a later second, so that the com.q pair most
  // likely shares its second: the system rule alone then decides it.
  using Clock = std::chrono::system_clock;
  const auto next = std::chrono::ceil<std::chrono::seconds>(Clock::now());
  std::this_thread::sleep_until(next + std::chrono::milliseconds(20));
  addPlugIn(std::string(kEarlyApps) + "/Q", "com.q");
  addPlugIn("", "com.q");
  addPlugIn(std::string(kEarlyApps) + "/R", "com.r");  // newer, visited before the system one
  const std::string newerT = addPlugIn("B", "com.t");
  addPlugIn("A", "com.s");  // newer, visited after the system one

  const auto pathOf = [](const Value& form) {
    return *form.getIfDictionary()->get(protocol::kFormPath).getIfString();
  };
  const auto reported = [&](const char* identifier, DiscoveryFlags flags) {
    std::vector<std::string> paths;
    for (const Value& form :
         matches({{protocol::kKeyRules, Dictionary{{"QXExtensionIdentifier", identifier}}},
                  {protocol::kKeyFlags, u64(flags)}})) {
      paths.push_back(pathOf(form));
    }
    return paths;
  };
  // What the rule keeps of two registrations visited in this order.
  const auto winner = [&](const Value& first, const Value& second) {
    const Dictionary &e = *first.getIfDictionary(), &p = *second.getIfDictionary();
    const Value yes = Value::boolean(true);
    const bool systemSecond =
        p.get(protocol::kFormSystemResident) == yes && e.get(protocol::kFormSystemResident) != yes;
    return pathOf(systemSecond || p.get(protocol::kFormLastModified).integerValue() >
                                      e.get(protocol::kFormLastModified).integerValue()
                      ? second
                      : first);
  };
  for (const char* id : {"com.s", "com.q", "com.r", "com.t", "com.eq"}) {
    const Array both = matches(
        {{protocol::kKeyRules, Dictionary{{"QXExtensionIdentifier", id}}},
         {protocol::kKeyFlags, u64(DiscoveryFlags::kVersions | DiscoveryFlags::kDuplicates)}});
    ASSERT_EQ(both.size(), 2u) << id;
    const std::vector<std::string> expected{winner(both[0], both[1])};
    EXPECT_EQ(reported(id, DiscoveryFlags::kNone), expected) << id;
    EXPECT_EQ(reported(id, DiscoveryFlags::kVersions), expected) << id;
  }
  EXPECT_EQ(reported("com.t", DiscoveryFlags::kNone), std::vector<std::string>{newerT});

  // Only the system plug-ins are left when the client asks for system ones.
  const Array system = matches({{protocol::kKeyFlags, u64(DiscoveryFlags::kSystemOnly)}});
  ASSERT_EQ(system.size(), 3u);
  for (const Value& form : system) {
    EXPECT_EQ(form.getIfDictionary()->get(protocol::kFormSystemResident), Value::boolean(true));
  }
  EXPECT_EQ(formOf(system, "com.s").get(protocol::kFormPath), Value(systemS));
}

TEST_F(Discovery, ReplacementMarks) {
  const std::string path = addPlugIn(
      "Replacer", "com.rep", {}, {},
      {{"com.karvo.developer.replace-plugin", kWidget}, {"com.x.flag", Value::boolean(true)}});
  EXPECT_EQ(matching({{"ENTITLEMENT:com.x.flag", Value::boolean(true)}}), Ids{"com.rep"});
  const Array forms = matches({});
  ASSERT_EQ(forms.size(), 3u);
  EXPECT_EQ(formOf(forms, kWidget).get(protocol::kKeyOverrider), Value(uuidAt(path).string()));
  EXPECT_EQ(formOf(forms, "com.rep").get(protocol::kKeyOverriding), Value(kWidget));
  EXPECT_FALSE(formOf(forms, kShare).contains(protocol::kKeyOverrider));
  EXPECT_FALSE(formOf(forms, kShare).contains(protocol::kKeyOverriding));
}

TEST_F(Discovery, DiscoverAllNeedsAnUnsandboxedManager) {
  request(protocol::kRequestLock, {{protocol::kKeyFlags, u64(protocol::HoldFlags::kPlugIn)},
                                   {protocol::kKeyPaths, Array{plugInPath("widget")}}});
  const Expected refused(protocol::kErrorAccessDenied,
                         "unauthorized discovery flag (VTDiscoverAll)");
  EXPECT_EQ(
      errorOf(request(protocol::kRequestMatch, {{protocol::kKeyFlags, u64(DiscoveryFlags::kAll)}})),
      refused);
  const std::string manager =
      peerWith("Manager", {{std::string(protocol::kManagerEntitlement), Value::boolean(true)}});
  const uint64_t all = protocol::bits(DiscoveryFlags::kAll);
  std::string answer;
  auto plain = ask(manager, protocol::kRequestMatch, 0, {}, &answer);
  EXPECT_EQ(answer, "ok 1 com.x.share");
  auto unfiltered = ask(manager, protocol::kRequestMatch, all, {}, &answer);
  EXPECT_TRUE(answer.starts_with("ok 2 ") && answer.find(kWidget) != std::string::npos) << answer;
  if (::access("/usr/bin/setpriv", X_OK) != 0) GTEST_SKIP() << "no setpriv to sandbox a peer";
  auto sandboxed = ask(manager, protocol::kRequestMatch, all, {}, &answer, true);
  EXPECT_EQ(answer, peerError(refused.first, refused.second));
}

TEST_F(Discovery, AuthorisationReasons) {
  const std::string guarded =
      addPlugIn("Guard", "com.g.guarded", {}, {{"QXExtensionHostEntitlement", "com.x.may-host"}});
  const base::Uuid guardedUuid = uuidAt(guarded);
  const std::string denied = "access to plugin ";
  EXPECT_EQ(errorOf(request(protocol::kRequestReady, {{protocol::kKeyUuids, Array{guardedUuid}}})),
            Expected(protocol::kErrorAccessDenied,
                     denied + "com.g.guarded denied: the host does not have the "
                              "\"com.x.may-host\" entitlement"));

  struct Case {
    Dictionary entitlements;
    base::Uuid plugIn;
    std::string answer;
  };
  const Case cases[] = {
      {{{"com.x.may-host", Value::boolean(true)}}, guardedUuid, "ok"},
      {{{kAllowedPlugIns, Array{}}},
       uuidOf("widget"),
       peerError(protocol::kErrorAccessDenied,
                 denied + "com.x.widget denied: invalid host restriction entitlement")},
      {{{kAllowedPlugIns, Dictionary{{"QXExtensionIdentifier", kShare}}}},
       uuidOf("widget"),
       peerError(protocol::kErrorAccessDenied,
                 denied + "com.x.widget denied: the host's plug-in entitlement does not allow "
                          "this plug-in")},
      {{{kAllowedPlugIns, Dictionary{{"QXExtensionIdentifier", kShare}}}}, uuidOf("share"), "ok"},
  };
  int n = 0;
  for (const Case& c : cases) {
    std::string answer;
    auto peer = ask(peerWith("Host" + std::to_string(n++), c.entitlements), protocol::kRequestReady,
                    0, {c.plugIn}, &answer);
    EXPECT_EQ(answer, c.answer) << lmo::describe(Value(c.entitlements));
  }

  // Every application here lives in <apps>, their bundle container.
  ASSERT_TRUE(platform::writePropertyListFile(
                  tmp_.file("apps/SonaroMetadata.plist"),
                  Value(Dictionary{{"rating", Dictionary{{"rank", Value::integer(600)}}}}), 0644)
                  .has_value());
  const std::pair<std::optional<int64_t>, Expected> ratings[] = {
      {300,
       {protocol::kErrorAccessDenied,
        denied + "com.x.widget denied: the containing Application is age restricted"}},
      {600, {0, ""}},
      {std::nullopt, {0, ""}},
  };
  for (const auto& [maximum, expected] : ratings) {
    ASSERT_TRUE(platform::setMaximumApplicationRating(maximum).has_value());
    EXPECT_EQ(
        errorOf(request(protocol::kRequestReady, {{protocol::kKeyUuids, Array{uuidOf("widget")}}})),
        expected)
        << maximum.value_or(-1);
  }
}

}  // namespace
}  // namespace vantrel::daemon::testing
