// Discovery and use of plug-ins end to end: "match" with its rules, filters
// and duplicate resolution, host authorisation as "ready" reports it, the
// launch descriptions "ready" leaves, and the read tokens of "access".

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <memory>
#include <set>

#include "base/Log.h"
#include "platform/DeviceRestrictions.h"
#include "platform/Preferences.h"
#include "platform/PropertyList.h"
#include "platform/SandboxExtensionService.h"
#include "platform/ServiceManager.h"
#include "registry/VTDUserPrefs.h"
#include "tests/daemon/DaemonFixture.h"
#include "tests/omnidex/OmnidexFixtures.h"
#include "tests/support/PeerProcess.h"

namespace vantrel::daemon::testing {
namespace {

using lmo::Array;
using lmo::Dictionary;
using lmo::Value;
using Ids = std::multiset<std::string>;
using vantrel::testing::PeerProcess;

constexpr const char* kManager = "com.karvo.private.vantrel.manager";
constexpr const char* kAllowedPlugIns = "com.karvo.developer.vantrel.allowedplugins";
constexpr uint64_t kDiscoverAll = 0x200;

class Discovery : public DaemonTest {
 protected:
  // Writes <apps>/<app>.app/PlugIns/<identifier>.appex with those extension
  // attributes and extension keys (without an executable unless
  // withExecutable), top-level Info keys and, when not empty, a trusted (root's,
  // 0644) Entitlements.plist; rescans; returns the bundle's path.
  std::string addPlugIn(const std::string& app, const std::string& identifier,
                        const Dictionary& attributes = {}, Dictionary extension = {},
                        const Dictionary& entitlements = {}, const Dictionary& top = {},
                        bool withExecutable = true) {
    const std::string appPath = tmp_.file("apps/" + app + ".app");
    omnidex::testing::writeBundle(appPath, {{"KBBundleIdentifier", "com.app." + app}});
    Dictionary info = plugInInfo(identifier);
    if (!withExecutable) info = info.removing("KBBundleExecutable");
    for (const auto& [key, value] : top) info = info.setting(key, value);
    for (const auto& [key, value] : *info.get("QXExtension").getIfDictionary()) {
      if (!extension.contains(key)) extension = extension.setting(key, value);
    }
    info = info.setting("QXExtension", extension.setting("QXExtensionAttributes", attributes));
    const std::string path =
        omnidex::testing::writeBundle(appPath + "/PlugIns/" + identifier + ".appex", info);
    if (withExecutable) {
      EXPECT_TRUE(vantrel::testing::installTestPeer(path + "/peer"));
    }
    if (!entitlements.empty()) {
      EXPECT_TRUE(
          platform::writePropertyListFile(path + "/Entitlements.plist", Value(entitlements), 0644)
              .has_value());
    }
    registry_->reconcile();
    EXPECT_TRUE(eventually([&] {
      return server_->findPlugInAtPath(model::FileUrl::fromPath(path)) != nullptr;
    })) << path;
    return path;
  }
  base::Uuid uuidAt(const std::string& path) const {
    return *server_->findPlugInAtPath(model::FileUrl::fromPath(path))->uuid();
  }

  Array matches(const Dictionary& extras) {
    const Dictionary reply = request("match", extras);
    const Array* forms = reply.get("matches").getIfArray();
    EXPECT_NE(forms, nullptr) << lmo::describe(reply);
    return forms ? *forms : Array{};
  }
  Ids matching(const Dictionary& rules, uint64_t flags = 0) {
    Ids ids;
    for (const Value& form : matches({{"rules", rules}, {"flags", u64(flags)}})) {
      ids.insert(*form.getIfDictionary()->get("identifier").getIfString());
    }
    return ids;
  }
  static Dictionary formOf(const Array& forms, const std::string& identifier) {
    for (const Value& form : forms) {
      if (form.getIfDictionary()->get("identifier") == Value(identifier)) {
        return *form.getIfDictionary();
      }
    }
    ADD_FAILURE() << "no form for " << identifier;
    return {};
  }

  // A test peer in a bundle of its own with those entitlements.
  std::string peerWith(const std::string& name, const Dictionary& entitlements) {
    const std::string bundle = tmp_.file("Tools/" + name + ".app");
    omnidex::testing::writeBundle(
        bundle, {{"KBBundleIdentifier", "com.peer." + name}, {"KBBundleExecutable", "peer"}});
    EXPECT_TRUE(vantrel::testing::installTestPeer(bundle + "/peer"));
    EXPECT_TRUE(
        platform::writePropertyListFile(bundle + "/Entitlements.plist", Value(entitlements), 0644)
            .has_value());
    return bundle + "/peer";
  }
  // Starts peer with the "request" mode, through setpriv --no-new-privs when
  // sandboxed; its answer line is *answer. The peer runs until destroyed.
  std::unique_ptr<PeerProcess> ask(const std::string& peer, const char* type, uint64_t flags,
                                   const std::vector<base::Uuid>& uuids, std::string* answer,
                                   bool sandboxed = false) {
    std::vector<std::string> args{"request", socket_, type, std::to_string(flags)};
    for (const base::Uuid& uuid : uuids) args.push_back(uuid.string());
    if (sandboxed) args.insert(args.begin(), {"--no-new-privs", peer});
    auto process = PeerProcess::start(sandboxed ? "/usr/bin/setpriv" : peer, args);
    EXPECT_NE(process, nullptr);
    *answer = process ? process->readLine().value_or("(nothing)") : "(not started)";
    return process;
  }

  std::string container(const base::Uuid& uuid) const {
    return tmp_.file("state") + "/containers/" + uuid.string();
  }
  std::string launchFile(pid_t pid, const std::string& identifier) const {
    return platform::launchDescriptionPath(serviceManagerDirectory(), pid, identifier);
  }
};

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
  request("annotate", {{"uuids", Array{uuidOf("widget")}},
                       {"annotations", Dictionary{{"election", Value::integer(258)}}}});
  EXPECT_EQ(matching({{"QXUserElection", "2"}}), widget);
  EXPECT_EQ(matching({{"QXUserElection", "0"}}), share);

  // Every form carries its annotations and, for an app extension, a token
  // for the bundle itself.
  const Array forms = matches({});
  ASSERT_EQ(forms.size(), 2u);
  EXPECT_EQ(formOf(forms, kWidget).get("annotations"),
            Value(Dictionary{{"election", Value::integer(258)}}));
  EXPECT_EQ(formOf(forms, kShare).get("annotations"), Value(Dictionary{}));
  for (const Value& form : forms) {
    const Dictionary* extensions = form.getIfDictionary()->get("extensions").getIfDictionary();
    ASSERT_NE(extensions, nullptr) << lmo::describe(form);
    EXPECT_NE(extensions->get(".").getIfString(), nullptr) << lmo::describe(form);
  }

  // Version 2: success without "matches".
  const Dictionary old = *send({{"request", "match"}, {"version", u64(2)}});
  EXPECT_EQ(errorOf(old), Expected(0, ""));
  EXPECT_FALSE(old.contains("matches")) << lmo::describe(old);
  EXPECT_EQ(errorOf(request("match", {{"rules", Array{}}})),
            Expected(4, "invalid request format (bad rules dictionary)"));
}

TEST_F(Discovery, HoldsAndExclusionsHide) {
  const Ids widget{kWidget}, share{kShare}, both{kWidget, kShare};
  const Dictionary held =
      request("lock", {{"flags", u64(2)}, {"paths", Array{plugInPath("widget")}}});
  ASSERT_NE(held.get("uuids").getIfUuid(), nullptr) << lmo::describe(held);
  EXPECT_EQ(matching({}), share);
  request("lock", {{"uuids", Array{*held.get("uuids").getIfUuid()}}});
  EXPECT_EQ(matching({}), both);

  // Written as another process writes it; entries that are not rule
  // dictionaries are ignored.
  platform::Preferences prefs(registry::kUserPrefsDomain);
  ASSERT_TRUE(prefs
                  .setValue(registry::kExclusionsKey,
                            Array{"junk", Dictionary{{"QXExtensionIdentifier", kShare}}})
                  .has_value());
  EXPECT_EQ(matching({}), widget);
  ASSERT_TRUE(prefs.setValue(registry::kExclusionsKey, Value("not a list")).has_value());
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
  auto own = ask(owner + "/peer", "match", 0, {}, &answer);
  EXPECT_NE(answer.find("com.ded"), std::string::npos) << answer;
  auto other = ask(stranger, "match", 0, {}, &answer);
  EXPECT_TRUE(answer.starts_with("ok ")) << answer;
  EXPECT_EQ(answer.find("com.ded"), std::string::npos) << answer;
}

TEST_F(Discovery, DuplicatesResolvedByVersion) {
  addPlugIn("Old", "com.d", {{"QXExtensionVersion", "1.9"}});
  addPlugIn("New", "com.d", {{"QXExtensionVersion", "1.10"}});
  addPlugIn("Copy", "com.d", {{"QXExtensionVersion", "1.10"}});
  const std::pair<uint64_t, Ids> cases[] = {
      {0x0, {"1.10"}},
      {0x4, {"1.10"}},  // duplicates alone change nothing
      {0x1, {"1.9", "1.10"}},
      {0x1 | 0x4, {"1.9", "1.10", "1.10"}},
  };
  for (const auto& [flags, versions] : cases) {
    Ids found;
    for (const Value& form : matches(
             {{"rules", Dictionary{{"QXExtensionIdentifier", "com.d"}}}, {"flags", u64(flags)}})) {
      found.insert(*form.getIfDictionary()->get("version").getIfString());
    }
    EXPECT_EQ(found, versions) << flags;
  }
}

TEST_F(Discovery, ReplacementMarks) {
  const std::string path = addPlugIn(
      "Replacer", "com.rep", {}, {},
      {{"com.karvo.developer.replace-plugin", kWidget}, {"com.x.flag", Value::boolean(true)}});
  EXPECT_EQ(matching({{"ENTITLEMENT:com.x.flag", Value::boolean(true)}}), Ids{"com.rep"});
  const Array forms = matches({});
  ASSERT_EQ(forms.size(), 3u);
  EXPECT_EQ(formOf(forms, kWidget).get("overrider"), Value(uuidAt(path).string()));
  EXPECT_EQ(formOf(forms, "com.rep").get("overriding"), Value(kWidget));
  EXPECT_FALSE(formOf(forms, kShare).contains("overrider"));
  EXPECT_FALSE(formOf(forms, kShare).contains("overriding"));
}

TEST_F(Discovery, DiscoverAllNeedsAnUnsandboxedManager) {
  request("lock", {{"flags", u64(2)}, {"paths", Array{plugInPath("widget")}}});
  const std::string refused = "error 11 unauthorized discovery flag (VTDiscoverAll)";
  EXPECT_EQ(errorOf(request("match", {{"flags", u64(kDiscoverAll)}})),
            Expected(11, "unauthorized discovery flag (VTDiscoverAll)"));
  const std::string manager = peerWith("Manager", {{kManager, Value::boolean(true)}});
  std::string answer;
  auto plain = ask(manager, "match", 0, {}, &answer);
  EXPECT_EQ(answer, "ok 1 com.x.share");
  auto all = ask(manager, "match", kDiscoverAll, {}, &answer);
  EXPECT_TRUE(answer.starts_with("ok 2 ") && answer.find(kWidget) != std::string::npos) << answer;
  if (::access("/usr/bin/setpriv", X_OK) != 0) GTEST_SKIP() << "no setpriv to sandbox a peer";
  auto sandboxed = ask(manager, "match", kDiscoverAll, {}, &answer, true);
  EXPECT_EQ(answer, refused);
}

TEST_F(Discovery, AuthorisationReasons) {
  const std::string guarded =
      addPlugIn("Guard", "com.g.guarded", {}, {{"QXExtensionHostEntitlement", "com.x.may-host"}});
  const base::Uuid guardedUuid = uuidAt(guarded);
  const std::string denied = "access to plugin ";
  EXPECT_EQ(errorOf(request("ready", {{"uuids", Array{guardedUuid}}})),
            Expected(11, denied + "com.g.guarded denied: the host does not have the "
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
       "error 11 " + denied + "com.x.widget denied: invalid host restriction entitlement"},
      {{{kAllowedPlugIns, Dictionary{{"QXExtensionIdentifier", kShare}}}},
       uuidOf("widget"),
       "error 11 " + denied +
           "com.x.widget denied: the host's plug-in entitlement does not allow this plug-in"},
      {{{kAllowedPlugIns, Dictionary{{"QXExtensionIdentifier", kShare}}}}, uuidOf("share"), "ok"},
  };
  int n = 0;
  for (const Case& c : cases) {
    std::string answer;
    auto peer = ask(peerWith("Host" + std::to_string(n++), c.entitlements), "ready", 0, {c.plugIn},
                    &answer);
    EXPECT_EQ(answer, c.answer) << lmo::describe(Value(c.entitlements));
  }

  // Every application here lives in <apps>, their bundle container.
  ASSERT_TRUE(platform::writePropertyListFile(
                  tmp_.file("apps/SonaroMetadata.plist"),
                  Value(Dictionary{{"rating", Dictionary{{"rank", Value::integer(600)}}}}), 0644)
                  .has_value());
  const std::pair<std::optional<int64_t>, Expected> ratings[] = {
      {300, {11, denied + "com.x.widget denied: the containing Application is age restricted"}},
      {600, {0, ""}},
      {std::nullopt, {0, ""}},
  };
  for (const auto& [maximum, expected] : ratings) {
    ASSERT_TRUE(platform::setMaximumApplicationRating(maximum).has_value());
    EXPECT_EQ(errorOf(request("ready", {{"uuids", Array{uuidOf("widget")}}})), expected)
        << maximum.value_or(-1);
  }
}

TEST_F(Discovery, ReadyEnablesOnlyWhenEveryPlugInPasses) {
  base::LogCapture log;
  const pid_t self = ::getpid();
  const std::string share = launchFile(self, kShare);
  std::error_code ignored;
  std::filesystem::remove(share, ignored);  // left by an earlier test of this process
  request("lock", {{"flags", u64(2)}, {"paths", Array{plugInPath("widget")}}});
  EXPECT_EQ(errorOf(request("ready", {{"uuids", Array{uuidOf("share"), uuidOf("widget")}}})),
            Expected(11, "access to plugin com.x.widget denied: the plug-in is on hold"));
  EXPECT_FALSE(std::filesystem::exists(share));

  // The same plug-in twice is checked twice and enabled once.
  EXPECT_EQ(errorOf(request("ready", {{"uuids", Array{uuidOf("share"), uuidOf("share")}}})),
            Expected(0, ""));
  const std::string enabling = base::format("enabling pid=%d for plug-in com.x.share(", self);
  const std::vector<std::string> lines = log.lines();
  EXPECT_EQ(
      std::count_if(lines.begin(), lines.end(),
                    [&](const std::string& line) {
                      return line.starts_with(enabling) &&
                             line.ends_with(uuidOf("share").string() + " " + plugInPath("share"));
                    }),
      1);
  EXPECT_TRUE(std::filesystem::exists(share));

  // The bundle's own environment wins over the data container.
  const Dictionary service{{"EnvironmentVariables", Dictionary{{"HOME", "/own"}}}};
  const std::string own = addPlugIn("Own", "com.o.own", {}, {}, {}, {{"LMOService", service}});
  EXPECT_EQ(errorOf(request("ready", {{"uuids", Array{uuidAt(own)}}})), Expected(0, ""));
  auto file = platform::readPropertyListFile(launchFile(self, "com.o.own"));
  ASSERT_TRUE(file.has_value()) << file.error().description();
  auto description = platform::decodeLaunchDescription(file.value());
  ASSERT_TRUE(description.has_value()) << description.error().description();
  const std::vector<std::string>& environment = description.value().environment;
  EXPECT_NE(std::find(environment.begin(), environment.end(), "HOME=/own"), environment.end());

  const std::string bare = addPlugIn("Bare", "com.n.bare", {}, {}, {}, {}, false);
  EXPECT_EQ(errorOf(request("ready", {{"uuids", Array{uuidAt(bare)}}})),
            Expected(4, "cannot obtain executable path for plug-in com.n.bare(" +
                            uuidAt(bare).string() + ")"));
}

TEST_F(Discovery, LaunchDescriptionLastsAsLongAsTheHost) {
  std::string answer;
  auto host = ask(peerWith("Host", {}), "ready", 0, {uuidOf("widget")}, &answer);
  ASSERT_EQ(answer, "ok");
  const std::string file = launchFile(host->pid(), kWidget);
  auto value = platform::readPropertyListFile(file);
  ASSERT_TRUE(value.has_value()) << value.error().description();
  auto description = platform::decodeLaunchDescription(value.value());
  ASSERT_TRUE(description.has_value()) << description.error().description();
  const std::string home = container(uuidOf("widget"));
  const std::vector<std::string>& environment = description.value().environment;
  for (const std::string& entry : {"HOME=" + home, "TMPDIR=" + home + "/tmp"}) {
    EXPECT_NE(std::find(environment.begin(), environment.end(), entry), environment.end()) << entry;
  }
  EXPECT_EQ(description.value().sandboxProfile, "plugin");

  host->closeStdin();
  host->wait();
  EXPECT_TRUE(eventually([&] { return !std::filesystem::exists(file); }));
}

TEST_F(Discovery, AccessGivesATokenPerPlugIn) {
  const Dictionary empty = request("access", {{"uuids", Array{}}});
  EXPECT_EQ(empty.get("extensions"), Value(Array{})) << lmo::describe(empty);

  const Value widget = uuidOf("widget"), share = uuidOf("share");
  const Dictionary reply = request("access", {{"uuids", Array{share, widget}}});
  const Array* tokens = reply.get("extensions").getIfArray();
  ASSERT_TRUE(tokens != nullptr && tokens->size() == 2) << lmo::describe(reply);
  // In request order: the first opens the share bundle, whose Info.plist
  // can be read through it.
  const int64_t handle = platform::sandbox_extension_consume(*(*tokens)[0].getIfString());
  ASSERT_GT(handle, 0);
  const int info = ::openat(platform::sandbox_extension_descriptor(handle), "Info.plist", O_RDONLY);
  ASSERT_GE(info, 0);
  std::string text(4096, '\0');
  text.resize(static_cast<size_t>(std::max<ssize_t>(0, ::read(info, text.data(), text.size()))));
  ::close(info);
  EXPECT_NE(text.find(kShare), std::string::npos) << text;
  EXPECT_EQ(platform::sandbox_extension_release(handle), 0);

  std::filesystem::remove_all(plugInPath("share"));
  const Dictionary failed = request("access", {{"uuids", Array{widget, share}}});
  EXPECT_EQ(errorOf(failed),
            Expected(4, "cannot create extension to " + plugInPath("share") + ": 2"));
  EXPECT_FALSE(failed.contains("extensions"));
}

}  // namespace
}  // namespace vantrel::daemon::testing
