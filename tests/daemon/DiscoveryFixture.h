#pragma once
// Discovery and use tests' fixture: plug-ins added to the daemon's registry
// tree with chosen keys and entitlements, match replies taken apart, and test
// peers with entitlements of their own that send requests as real clients.

#include <gtest/gtest.h>

#include <memory>
#include <set>
#include <string>
#include <vector>

#include "platform/PropertyList.h"
#include "platform/ServiceManager.h"
#include "tests/daemon/DaemonFixture.h"
#include "tests/omnidex/OmnidexFixtures.h"
#include "tests/support/PeerProcess.h"

namespace vantrel::daemon::testing {

using Ids = std::multiset<std::string>;

class Discovery : public DaemonTest {
 protected:
  // Writes <apps>/<app>.app/PlugIns/<identifier>.appex (for an app holding a
  // '/', <temporary directory>/<app>.app/...; for an empty app, the
  // stand-alone <systemPlugIns()>/<identifier>.appex) with those extension
  // attributes and extension keys (without an executable unless
  // withExecutable), top-level Info keys and, when not empty, a trusted (root's,
  // 0644) Entitlements.plist; rescans; returns the bundle's path.
  std::string addPlugIn(const std::string& app, const std::string& identifier,
                        const lmo::Dictionary& attributes = {}, lmo::Dictionary extension = {},
                        const lmo::Dictionary& entitlements = {}, const lmo::Dictionary& top = {},
                        bool withExecutable = true) {
    const std::string appPath =
        tmp_.file((app.find('/') == std::string::npos ? "apps/" : "") + app + ".app");
    if (!app.empty()) {
      omnidex::testing::writeBundle(appPath, {{"KBBundleIdentifier", "com.app." + app}});
    }
    lmo::Dictionary info = plugInInfo(identifier);
    if (!withExecutable) info = info.removing("KBBundleExecutable");
    for (const auto& [key, value] : top) info = info.setting(key, value);
    for (const auto& [key, value] : *info.get("QXExtension").getIfDictionary()) {
      if (!extension.contains(key)) extension = extension.setting(key, value);
    }
    info = info.setting("QXExtension", extension.setting("QXExtensionAttributes", attributes));
    const std::string path = omnidex::testing::writeBundle(
        (app.empty() ? systemPlugIns() : appPath + "/PlugIns") + "/" + identifier + ".appex", info);
    if (withExecutable) {
      EXPECT_TRUE(vantrel::testing::installTestPeer(path + "/peer"));
    }
    if (!entitlements.empty()) {
      EXPECT_TRUE(platform::writePropertyListFile(path + "/Entitlements.plist",
                                                  lmo::Value(entitlements), 0644)
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

  lmo::Array matches(const lmo::Dictionary& extras) {
    const lmo::Dictionary reply = request(protocol::kRequestMatch, extras);
    const lmo::Array* forms = reply.get(protocol::kKeyMatches).getIfArray();
    EXPECT_NE(forms, nullptr) << lmo::describe(reply);
    return forms ? *forms : lmo::Array{};
  }
  Ids matching(const lmo::Dictionary& rules,
               protocol::DiscoveryFlags flags = protocol::DiscoveryFlags::kNone) {
    Ids ids;
    for (const lmo::Value& form :
         matches({{protocol::kKeyRules, rules}, {protocol::kKeyFlags, u64(flags)}})) {
      ids.insert(*form.getIfDictionary()->get(protocol::kFormIdentifier).getIfString());
    }
    return ids;
  }
  static lmo::Dictionary formOf(const lmo::Array& forms, const std::string& identifier) {
    for (const lmo::Value& form : forms) {
      if (form.getIfDictionary()->get(protocol::kFormIdentifier) == lmo::Value(identifier)) {
        return *form.getIfDictionary();
      }
    }
    ADD_FAILURE() << "no form for " << identifier;
    return {};
  }

  // A test peer in a bundle of its own with those entitlements.
  std::string peerWith(const std::string& name, const lmo::Dictionary& entitlements) {
    const std::string bundle = tmp_.file("Tools/" + name + ".app");
    omnidex::testing::writeBundle(
        bundle, {{"KBBundleIdentifier", "com.peer." + name}, {"KBBundleExecutable", "peer"}});
    EXPECT_TRUE(vantrel::testing::installTestPeer(bundle + "/peer"));
    EXPECT_TRUE(platform::writePropertyListFile(bundle + "/Entitlements.plist",
                                                lmo::Value(entitlements), 0644)
                    .has_value());
    return bundle + "/peer";
  }
  // The line a test peer writes for an error reply.
  static std::string peerError(int64_t code, const std::string& message) {
    return "error " + std::to_string(code) + " " + message;
  }
  // Starts peer with the "request" mode, through setpriv --no-new-privs when
  // sandboxed; its answer line is *answer. The peer runs until destroyed.
  std::unique_ptr<vantrel::testing::PeerProcess> ask(const std::string& peer, const char* type,
                                                     uint64_t flags,
                                                     const std::vector<base::Uuid>& uuids,
                                                     std::string* answer, bool sandboxed = false) {
    std::vector<std::string> args{"request", socket_, type, std::to_string(flags)};
    for (const base::Uuid& uuid : uuids) args.push_back(uuid.string());
    if (sandboxed) args.insert(args.begin(), {"--no-new-privs", peer});
    auto process =
        vantrel::testing::PeerProcess::start(sandboxed ? "/usr/bin/setpriv" : peer, args);
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

}  // namespace vantrel::daemon::testing
