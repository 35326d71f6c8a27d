#pragma once
// A daemon served in the test's own process: a real registry over a bundle
// tree in a temporary directory, a real socket, and connections that send
// requests and wait for their replies.

#include <gtest/gtest.h>

#include <map>
#include <memory>
#include <optional>
#include <string>

#include "daemon/VTDServer.h"
#include "lmo/Connection.h"
#include "lmo/Protocol.h"
#include "lmo/Value.h"
#include "omnidex/Omnidex.h"
#include "tests/support/TempDir.h"

namespace vantrel::daemon::testing {

// The application every test starts with: <apps>/Host.app holding the
// plug-ins "com.x.widget" and "com.x.share", each with the test peer as
// its executable.
inline constexpr const char* kWidget = "com.x.widget";
inline constexpr const char* kShare = "com.x.share";

// A second applications directory, whose path sorts before the system
// volume's while "apps" sorts after it: the registry visits plug-ins in path
// order, and some rules depend on who comes first.
inline constexpr const char* kEarlyApps = "Early";

class DaemonTest : public ::testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;

  // A plug-in bundle's Info.plist text for identifier, naming the test peer
  // ("peer") as its executable.
  static lmo::Dictionary plugInInfo(const std::string& identifier);
  // Writes a plug-in bundle at the temporary-directory-relative path, with
  // the test peer installed as its executable; returns its absolute path.
  std::string writePlugIn(const std::string& relative, const std::string& identifier);
  // The system volume's stand-alone plug-ins (the volume is
  // VANTREL_SYSTEM_DIR, a directory of the test's own).
  std::string systemPlugIns() const { return tmp_.file("System/Library/PlugIns"); }
  std::string hostApp() const { return tmp_.file("apps/Host.app"); }
  std::string plugInPath(const char* name) const {
    return hostApp() + "/PlugIns/" + name + ".appex";
  }
  registry::VTDPlugInPtr plugIn(const char* name) const;
  base::Uuid uuidOf(const char* name) const { return *plugIn(name)->uuid(); }

  std::shared_ptr<lmo::Connection> connect();
  // Sends message on connection (a fresh one when null) and waits for the
  // reply: its body, or nullopt (after a test failure) when none came.
  std::optional<lmo::Dictionary> send(const lmo::Dictionary& message,
                                      const std::shared_ptr<lmo::Connection>& connection = nullptr);
  // {"request": type, "version": protocol::kCurrentVersion} plus extras, sent
  // and answered.
  lmo::Dictionary request(const char* type, lmo::Dictionary extras = {},
                          const std::shared_ptr<lmo::Connection>& connection = nullptr);
  // The directory of platform::ServiceManager::shared() (launch descriptions
  // go under it): one for the whole test process, since the manager binds to
  // the runtime directory at its first use while every test has a runtime
  // directory of its own. Bound at the first set-up.
  static const std::string& serviceManagerDirectory();
  // Polls until condition holds or five seconds pass; whether it held.
  static bool eventually(const std::function<bool()>& condition);

  vantrel::testing::TempDir tmp_;
  std::string socket_;
  std::string annotations_;
  std::shared_ptr<omnidex::Omnidex> registry_;
  VTDServerPtr server_;

 private:
  std::map<std::string, std::optional<std::string>> savedEnvironment_;
  lmo::QueuePtr replyQueue_ = std::make_shared<base::SerialQueue>("test-replies");
  std::vector<std::shared_ptr<lmo::Connection>> connections_;
};

// An error reply's (code, message); (0, "") for a success.
using Expected = std::pair<int64_t, std::string>;
Expected errorOf(const lmo::Dictionary& reply);

// The unsigned integers the protocol's "version" and "flags" are.
inline lmo::Value u64(uint64_t v) {
  return lmo::Value::unsignedInteger(v);
}
template <protocol::FlagEnum Flags>
lmo::Value u64(Flags flags) {
  return u64(protocol::bits(flags));
}

}  // namespace vantrel::daemon::testing
