// Holds: taking, the busy check against running plug-ins, release by token
// and release when the client that took them goes away.

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <future>
#include <set>

#include "base/Log.h"
#include "daemon/VTDPlugInHold.h"
#include "platform/NotificationCenter.h"
#include "registry/VTDatabase.h"
#include "tests/daemon/DaemonFixture.h"
#include "tests/support/PeerProcess.h"

namespace vantrel::daemon::testing {
namespace {

using lmo::Array;
using lmo::Dictionary;
using lmo::Value;
using protocol::HoldFlags;
using vantrel::testing::PeerProcess;

uint64_t announcements() {
  return platform::notificationCount(protocol::kAnnotationChangeNotification);
}

class Holds : public DaemonTest {
 protected:
  // A "lock" request that takes a hold (paths null: none given).
  Dictionary take(HoldFlags flags, const Value& paths,
                  const std::shared_ptr<lmo::Connection>& connection = nullptr) {
    return request(
        protocol::kRequestLock,
        Dictionary{{protocol::kKeyFlags, u64(flags)}}.setting(protocol::kKeyPaths, paths),
        connection);
  }
  // The token of the hold reply grants, as log lines write it; fails the test
  // when the hold was refused.
  static std::string granted(const Dictionary& reply) {
    const base::Uuid* uuid = reply.get(protocol::kKeyUuids).getIfUuid();
    EXPECT_NE(uuid, nullptr) << lmo::describe(reply);
    return uuid ? uuid->string() : "(refused)";
  }
};

TEST_F(Holds, RefusedRequestsLeaveNoHold) {
  const std::string notAPlugIn = tmp_.file("apps");
  const std::pair<Dictionary, Expected> cases[] = {
      {take(HoldFlags::kPlugIn, Value()), {protocol::kErrorBadRequest, "invalid request format"}},
      {take(HoldFlags::kPlugIn, Array{"relative"}),
       {protocol::kErrorBadPath, "absolute path required: relative"}},
      {take(HoldFlags::kPlugIn, Array{"/nonexistent"}),
       {protocol::kErrorBadPath, "invalid path: /nonexistent"}},
      {take(HoldFlags::kPlugIn, Array{notAPlugIn}),
       {protocol::kErrorBadPath, "no plug-in at path:" + notAPlugIn}},
      // A bit beyond kApplication and kPlugIn.
      {take(static_cast<HoldFlags>(7), Array{plugInPath("widget")}),
       {protocol::kErrorBadRequest, "invalid request format (unsupported hold flags)"}},
      {take(HoldFlags::kPlugIn, Array{plugInPath("widget"), "/nonexistent"}),
       {protocol::kErrorBadPath, "invalid path: /nonexistent"}},
  };
  for (const auto& [reply, expected] : cases) EXPECT_EQ(errorOf(reply), expected);
  EXPECT_TRUE(server_->holds().empty());
  EXPECT_EQ(announcements(), 0u);
}

TEST_F(Holds, TakenAndReleasedByTokenFromAnyClient) {
  base::LogCapture log;
  // Duplicate paths name the plug-in once.
  const Dictionary taken =
      take(HoldFlags::kPlugIn, Array{plugInPath("widget"), plugInPath("widget")});
  const std::string released = "releasing plug-in hold " + granted(taken) + " at client's request";
  ASSERT_EQ(server_->holds().size(), 1u);
  EXPECT_EQ(server_->holds().front()->blocked().size(), 1u);
  EXPECT_TRUE(server_->holdOnPlugIn(*plugIn("widget")));
  EXPECT_FALSE(server_->holdOnPlugIn(*plugIn("share")));
  EXPECT_EQ(announcements(), 1u);

  // An empty take succeeds whatever the flags, and blocks nothing.
  granted(take(static_cast<HoldFlags>(9), Array{}));
  EXPECT_EQ(server_->holds().size(), 2u);

  // Release from another connection; elements that are not UUIDs are ignored.
  EXPECT_TRUE(request(protocol::kRequestLock,
                      {{protocol::kKeyUuids, Array{"junk", taken.get(protocol::kKeyUuids)}}})
                  .empty());
  EXPECT_FALSE(server_->holdOnPlugIn(*plugIn("widget")));
  EXPECT_EQ(log.count(released), 1u);
  EXPECT_EQ(announcements(), 3u);
  // Released already: success, nothing logged, nothing announced.
  EXPECT_TRUE(request(protocol::kRequestLock,
                      {{protocol::kKeyUuids, Array{taken.get(protocol::kKeyUuids)}}})
                  .empty());
  EXPECT_EQ(log.count(released), 1u);
  EXPECT_EQ(announcements(), 3u);
  EXPECT_EQ(server_->holds().size(), 1u);
}

TEST_F(Holds, RunningPlugInsMakeAnApplicationHoldBusy) {
  auto widget = PeerProcess::start(plugInPath("widget") + "/peer", {"sleep"});
  auto share = PeerProcess::start(plugInPath("share") + "/peer", {"sleep"});
  ASSERT_TRUE(widget && share);
  ASSERT_EQ(widget->readLine(), "ready");
  ASSERT_EQ(share->readLine(), "ready");

  const Dictionary refused = take(HoldFlags::kApplication, Array{hostApp()});
  EXPECT_EQ(errorOf(refused), Expected(protocol::kErrorBusy, "plug-ins are busy"));
  const Array* conflicts = refused.get(protocol::kKeyConflicts).getIfArray();
  ASSERT_NE(conflicts, nullptr) << lmo::describe(refused);
  std::multiset<std::string> running;
  for (const Value& conflict : *conflicts) {
    const Dictionary* entry = conflict.getIfDictionary();
    running.insert(
        lmo::describe(entry ? entry->get(protocol::kKeyConflictBundleIdentifier) : conflict));
  }
  EXPECT_EQ(running, (std::multiset<std::string>{kShare, kWidget}));
  EXPECT_TRUE(server_->holds().empty());
  EXPECT_EQ(announcements(), 0u);

  // A hold on one plug-in bundle is granted even while it runs.
  granted(take(HoldFlags::kPlugIn, Array{plugInPath("widget")}));

  // Once nothing runs, the application's hold is granted over both.
  widget.reset();
  share.reset();
  granted(take(HoldFlags::kApplication, Array{hostApp()}));
  EXPECT_EQ(server_->holds().back()->blocked().size(), 2u);
}

TEST_F(Holds, ReleasedWhenTheClientGoesAwayBeforeItIsDeclaredDead) {
  server_->setVerbose(1);
  base::LogCapture log;
  auto connection = connect();
  const std::string widget =
      granted(take(HoldFlags::kPlugIn, Array{plugInPath("widget")}, connection));
  const std::string share =
      granted(take(HoldFlags::kPlugIn, Array{plugInPath("share")}, connection));
  const std::string other = granted(take(HoldFlags::kPlugIn, Array{plugInPath("share")}));
  ASSERT_EQ(server_->holds().size(), 3u);
  const uint64_t before = announcements();

  // A request queued behind a blocked service queue reaches it only after
  // the client is dead: it must then do nothing, not even reply.
  std::promise<void> release;
  server_->mainQueue()->async([released = release.get_future().share()] { released.wait(); });
  (void)connection->send(Dictionary{
      {protocol::kKeyRequest, protocol::kRequestAnnotate},
      {protocol::kKeyVersion, u64(protocol::kCurrentVersion)},
      {protocol::kKeyUuids, Array{uuidOf("share")}},
      {protocol::kKeyAnnotations, Dictionary{{protocol::kAnnotationElection, Value::integer(1)}}}});
  connection->cancel();
  const std::string pid = std::to_string(::getpid());
  ASSERT_TRUE(eventually([&] { return log.count("client " + pid + " is dead") == 1; }));
  release.set_value();
  server_->mainQueue()->sync([] {});
  EXPECT_EQ(server_->annotationForPlugIn(*plugIn("share")), std::nullopt);

  // Its own holds, and only those, went first.
  ASSERT_EQ(server_->holds().size(), 1u);
  EXPECT_EQ(server_->holds().front()->uuid().string(), other);
  EXPECT_EQ(announcements(), before + 2);
  EXPECT_TRUE(server_->holdOnPlugIn(*plugIn("share")));
  EXPECT_FALSE(server_->holdOnPlugIn(*plugIn("widget")));
  const std::vector<std::string> lines = log.lines();
  const auto dead = std::find(lines.begin(), lines.end(), "client " + pid + " is dead");
  for (const std::string& released : {widget, share}) {
    const std::string line = "releasing plug-in hold " + released + " for dead client pid " + pid;
    EXPECT_EQ(log.count(line), 1u);
    EXPECT_LT(std::find(lines.begin(), lines.end(), line), dead);
  }
}

TEST_F(Holds, ReleasedWhenTheClientProcessExits) {
  base::LogCapture log;
  auto peer = PeerProcess::start(
      vantrel::testing::testPeerPath(),
      {"hold", socket_, std::to_string(protocol::bits(HoldFlags::kPlugIn)), plugInPath("widget")});
  ASSERT_NE(peer, nullptr);
  const std::string held = peer->readLine().value_or("(nothing)");
  ASSERT_TRUE(held.starts_with("held ")) << held;
  ASSERT_EQ(server_->holds().size(), 1u);
  EXPECT_EQ(server_->holds().front()->uuid().string(), held.substr(5));
  EXPECT_TRUE(server_->holdOnPlugIn(*plugIn("widget")));

  peer->closeStdin();
  peer->wait();
  ASSERT_TRUE(eventually([&] { return server_->holds().empty(); }));
  EXPECT_EQ(log.count("releasing plug-in hold " + held.substr(5) + " for dead client pid " +
                      std::to_string(peer->pid())),
            1u);
  EXPECT_FALSE(server_->holdOnPlugIn(*plugIn("widget")));
}

}  // namespace
}  // namespace vantrel::daemon::testing
