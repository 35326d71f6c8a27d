// Whose daemon it is: a peer of another user may discover and use plug-ins
// but not change what the daemon keeps for its own user.

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include "base/Log.h"
#include "lmo/Protocol.h"
#include "tests/daemon/DiscoveryFixture.h"
#include "tests/support/RawClient.h"

namespace vantrel::daemon::testing {
namespace {

namespace protocol = vantrel::protocol;

constexpr const char* kOtherUid = "65534";

class Scope : public Discovery {
 protected:
  // The answer line of a test peer in mode (with args) as another user.
  std::string askAsOtherUser(const std::string& peer, const char* mode,
                             const std::vector<std::string>& args) {
    std::vector<std::string> argv{std::string("--reuid=") + kOtherUid,
                                  std::string("--regid=") + kOtherUid,
                                  "--clear-groups",
                                  peer,
                                  mode,
                                  socket_};
    argv.insert(argv.end(), args.begin(), args.end());
    auto process = vantrel::testing::PeerProcess::start("/usr/bin/setpriv", argv);
    EXPECT_NE(process, nullptr);
    return process ? process->readLine().value_or("(nothing)") : "(not started)";
  }
};

TEST_F(Scope, AnotherUserMayDiscoverButNotChangeState) {
  // The other user must reach the socket and run the peer.
  for (std::string dir = tmp_.file("Tools/x"); dir.size() > 1;
       dir = dir.substr(0, dir.rfind('/'))) {
    if (dir.starts_with("/tmp/") || dir.starts_with(tmp_.file(""))) ::chmod(dir.c_str(), 0755);
  }
  const std::string peer = peerWith("Other", {{"unrelated", lmo::Value::boolean(true)}});
  const std::string refusedTail = "\" refused: it changes what this daemon keeps for uid " +
                                  std::to_string(::geteuid()) + ", and uid " + kOtherUid +
                                  " is not that user, root or a manager";
  const std::pair<const char*, std::string> cases[] = {
      {protocol::kRequestMatch, "ok 2"},
      {protocol::kRequestExplain, "ok"},
      {protocol::kRequestAdd,
       peerError(protocol::kErrorAccessDenied, "request \"add" + refusedTail)},
      {protocol::kRequestRemove,
       peerError(protocol::kErrorAccessDenied, "request \"remove" + refusedTail)},
      {protocol::kRequestAnnotate,
       peerError(protocol::kErrorAccessDenied, "request \"annotate" + refusedTail)},
  };
  for (const auto& [type, expected] : cases) {
    const std::string answer = askAsOtherUser(peer, "request", {type, "0"});
    EXPECT_TRUE(answer.starts_with(expected)) << type << ": " << answer;
  }
  const std::string hold = askAsOtherUser(
      peer, "hold",
      {std::to_string(protocol::bits(protocol::HoldFlags::kPlugIn)), plugInPath("widget")});
  EXPECT_EQ(hold, peerError(protocol::kErrorAccessDenied, "request \"lock" + refusedTail));
  EXPECT_EQ(server_->holds().size(), 0u);

  // Paths are looked up with the other user's rights: behind a directory it
  // may not search, a registered bundle and nothing at all answer alike.
  const std::string bundle = plugInPath("widget");
  const std::string parent = bundle.substr(0, bundle.rfind('/'));
  ASSERT_EQ(::chmod(parent.c_str(), 0700), 0);
  for (const std::string& path : {bundle, parent + "/Nothing.appex"}) {
    EXPECT_EQ(
        askAsOtherUser(peer, "explain", {path}),
        "ok " + std::string(protocol::kReasonNotInstalled) + " nothing is installed at " + path)
        << path;
  }
  // Once it may look, it finds the registration.
  ASSERT_EQ(::chmod(parent.c_str(), 0755), 0);
  const std::string found = askAsOtherUser(peer, "explain", {bundle});
  EXPECT_TRUE(found.starts_with("ok ")) << found;
  EXPECT_EQ(found.find(protocol::kReasonNotInstalled), std::string::npos) << found;
}

TEST_F(Scope, RequestsAndEntitlementsBelongToTheProcessThatConnected) {
  const uint64_t all = protocol::bits(protocol::DiscoveryFlags::kAll);
  const std::string manager = peerWith(
      "Manager", {{std::string(protocol::kManagerEntitlement), lmo::Value::boolean(true)}});
  std::string answer;
  const auto direct = ask(manager, protocol::kRequestMatch, all, {}, &answer);
  EXPECT_TRUE(answer.starts_with("ok ")) << "the manager itself is served: " << answer;

  // A process that connected and then exec'd keeps its connection, but the
  // entitlements go with the program that was identified: neither the
  // manager's for the program it runs next, nor the program it exec's for
  // one without them.
  const std::string plain = vantrel::testing::testPeerPath();
  const std::pair<std::string, std::string> execs[] = {{manager, plain}, {plain, manager}};
  for (const auto& [first, then] : execs) {
    base::LogCapture log;
    const auto execed = vantrel::testing::PeerProcess::start(
        first, {"exec", socket_, then, "inherited", protocol::kRequestMatch, std::to_string(all)});
    ASSERT_NE(execed, nullptr);
    EXPECT_EQ(
        execed->readLine().value_or("(nothing)"),
        peerError(protocol::kErrorAccessDenied, "unauthorized discovery flag (VTDiscoverAll)"))
        << first << " then " << then;
    EXPECT_TRUE(
        log.contains(base::format("pid %d no longer runs the executable it connected with; "
                                  "its entitlements are not honoured",
                                  execed->pid())))
        << first << " then " << then;
  }

  // The race: connect, fork a child that asks with the connection, exec the
  // manager's program at once. However the daemon's identification falls
  // between the two, the child's request is not the peer's.
  constexpr int kTries = 20;
  for (int i = 0; i < kTries; ++i) {
    const auto racer = vantrel::testing::PeerProcess::start(
        plain, {"race", socket_, protocol::kRequestMatch, std::to_string(all), manager, "sleep"});
    ASSERT_NE(racer, nullptr);
    std::optional<std::string> line;
    while ((line = racer->readLine()) && *line == "ready") {
    }
    EXPECT_EQ(line.value_or("(nothing)"),
              peerError(protocol::kErrorAccessDenied,
                        base::format("request \"match\" refused: it was not written by pid %d, "
                                     "the process this connection belongs to",
                                     racer->pid())))
        << "try " << i;
  }

  // A child that inherited a connection speaks for nobody: what it writes is
  // refused, and the connection goes on serving the process that made it.
  vantrel::testing::RawClient connection(socket_);
  ASSERT_TRUE(connection.call(protocol::kRequestMatch).has_value());
  const lmo::Dictionary match =
      lmo::Dictionary()
          .setting(protocol::kKeyRequest, protocol::kRequestMatch)
          .setting(protocol::kKeyVersion, lmo::Value::unsignedInteger(protocol::kCurrentVersion));
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) ::_exit(connection.send(lmo::FrameKind::kRequest, 99, match) ? 0 : 1);
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_EQ(status, 0);
  const auto refused = connection.readFrame();
  ASSERT_TRUE(refused && refused->has_value());
  EXPECT_EQ(refused->value().body.get(protocol::kKeyErrorCode).getIfUInt64(),
            uint64_t{protocol::kErrorAccessDenied});
  const std::string* text = refused->value().body.get(protocol::kKeyError).getIfString();
  EXPECT_EQ(text ? *text : "(none)",
            base::format("request \"match\" refused: it was not written by pid %d, the process "
                         "this connection belongs to",
                         ::getpid()));
  const auto served = connection.call(protocol::kRequestMatch);
  ASSERT_TRUE(served.has_value());
  EXPECT_FALSE(served->get(protocol::kKeyErrorCode).getIfUInt64().has_value());
}

}  // namespace
}  // namespace vantrel::daemon::testing
