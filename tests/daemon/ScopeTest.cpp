// Whose daemon it is: a peer of another user may discover and use plug-ins
// but not change what the daemon keeps for its own user.

#include <gtest/gtest.h>
#include <sys/stat.h>

#include "lmo/Protocol.h"
#include "tests/daemon/DiscoveryFixture.h"

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

}  // namespace
}  // namespace vantrel::daemon::testing
