// Holds: taking, the busy check against running plug-ins, release by token
// and release when the client that took them goes away.

#include <gtest/gtest.h>
#include <unistd.h>

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

uint64_t announcements() {
  return platform::notificationCount(registry::kAnnotationChangeNotification);
}

using Holds = DaemonTest;

TEST_F(Holds, RefusedRequestsLeaveNoHold) {
  struct Case {
    uint64_t flags;
    Value paths;
    Expected expected;
  };
  const std::string notAPlugIn = tmp_.file("apps");
  const Case cases[] = {
      {2, Value(), {4, "invalid request format"}},
      {2, Array{"relative"}, {9, "absolute path required: relative"}},
      {2, Array{"/nonexistent"}, {9, "invalid path: /nonexistent"}},
      {2, Array{notAPlugIn}, {9, "no plug-in at path:" + notAPlugIn}},
      {7, Array{plugInPath("widget")}, {4, "invalid request format (unsupported hold flags)"}},
      {2, Array{plugInPath("widget"), "/nonexistent"}, {9, "invalid path: /nonexistent"}},
  };
  for (const Case& c : cases) {
    Dictionary extras{{"flags", u64(c.flags)}};
    if (!c.paths.isNull()) extras = extras.setting("paths", c.paths);
    EXPECT_EQ(errorOf(request("lock", extras)), c.expected) << lmo::describe(c.paths);
  }
  EXPECT_TRUE(server_->holds().empty());
  EXPECT_EQ(announcements(), 0u);
}

TEST_F(Holds, TakenAndReleasedByTokenFromAnyClient) {
  base::LogCapture log;
  // Duplicate paths name the plug-in once.
  const Dictionary taken = request(
      "lock", {{"flags", u64(2)}, {"paths", Array{plugInPath("widget"), plugInPath("widget")}}});
  const base::Uuid* token = taken.get("uuids").getIfUuid();
  ASSERT_NE(token, nullptr) << lmo::describe(taken);
  ASSERT_EQ(server_->holds().size(), 1u);
  EXPECT_EQ(server_->holds().front()->blocked().size(), 1u);
  EXPECT_TRUE(server_->holdOnPlugIn(*plugIn("widget")));
  EXPECT_FALSE(server_->holdOnPlugIn(*plugIn("share")));
  EXPECT_EQ(announcements(), 1u);

  // An empty take succeeds whatever the flags, and blocks nothing.
  const Dictionary empty = request("lock", {{"flags", u64(9)}, {"paths", Array{}}});
  ASSERT_NE(empty.get("uuids").getIfUuid(), nullptr);
  EXPECT_EQ(server_->holds().size(), 2u);

  // Release from another connection; elements that are not UUIDs are ignored.
  EXPECT_TRUE(request("lock", {{"uuids", Array{"junk", *token}}}).empty());
  EXPECT_FALSE(server_->holdOnPlugIn(*plugIn("widget")));
  EXPECT_EQ(log.count("releasing plug-in hold " + token->string() + " at client's request"), 1u);
  EXPECT_EQ(announcements(), 3u);
  // Released already: success, nothing logged, nothing announced.
  EXPECT_TRUE(request("lock", {{"uuids", Array{*token}}}).empty());
  EXPECT_EQ(log.count("releasing plug-in hold " + token->string() + " at client's request"), 1u);
  EXPECT_EQ(announcements(), 3u);
  EXPECT_EQ(server_->holds().size(), 1u);
}

TEST_F(Holds, RunningPlugInsMakeAnApplicationHoldBusy) {
  auto widget = vantrel::testing::PeerProcess::start(plugInPath("widget") + "/peer", {"sleep"});
  auto share = vantrel::testing::PeerProcess::start(plugInPath("share") + "/peer", {"sleep"});
  ASSERT_TRUE(widget && share);
  ASSERT_EQ(widget->readLine(), "ready");
  ASSERT_EQ(share->readLine(), "ready");

  const Dictionary refused = request("lock", {{"flags", u64(1)}, {"paths", Array{hostApp()}}});
  EXPECT_EQ(errorOf(refused), Expected(14, "plug-ins are busy"));
  const Array* conflicts = refused.get("conflicts").getIfArray();
  ASSERT_NE(conflicts, nullptr) << lmo::describe(refused);
  ASSERT_EQ(conflicts->size(), 2u);
  std::set<std::string> running;
  for (const Value& conflict : *conflicts) {
    running.insert(*conflict.getIfDictionary()->get("ExtensionBundleIdentifier").getIfString());
  }
  EXPECT_EQ(running, (std::set<std::string>{kWidget, kShare}));
  EXPECT_TRUE(server_->holds().empty());
  EXPECT_EQ(announcements(), 0u);

  // A hold on one plug-in bundle is granted even while it runs.
  EXPECT_NE(request("lock", {{"flags", u64(2)}, {"paths", Array{plugInPath("widget")}}})
                .get("uuids")
                .getIfUuid(),
            nullptr);

  // Once nothing runs, the application's hold is granted over both.
  widget->kill();
  widget->wait();
  share->kill();
  share->wait();
  const Dictionary granted = request("lock", {{"flags", u64(1)}, {"paths", Array{hostApp()}}});
  ASSERT_NE(granted.get("uuids").getIfUuid(), nullptr) << lmo::describe(granted);
  EXPECT_EQ(server_->holds().back()->blocked().size(), 2u);
}

TEST_F(Holds, ReleasedWhenTheClientGoesAway) {
  base::LogCapture log;
  auto connection = connect();
  for (const char* name : {"widget", "share"}) {
    request("lock", {{"flags", u64(2)}, {"paths", Array{plugInPath(name)}}}, connection);
  }
  const auto other = request("lock", {{"flags", u64(2)}, {"paths", Array{plugInPath("share")}}});
  ASSERT_EQ(server_->holds().size(), 3u);
  const uint64_t before = announcements();

  connection->cancel();
  ASSERT_TRUE(eventually([&] { return server_->holds().size() == 1u; }));
  EXPECT_EQ(server_->holds().front()->uuid(), *other.get("uuids").getIfUuid());
  EXPECT_EQ(announcements(), before + 2);
  size_t released = 0;
  for (const std::string& line : log.lines()) {
    released += line.starts_with("releasing plug-in hold ") &&
                line.ends_with(" for dead client pid " + std::to_string(::getpid()));
  }
  EXPECT_EQ(released, 2u);
  EXPECT_TRUE(server_->holdOnPlugIn(*plugIn("share")));
  EXPECT_FALSE(server_->holdOnPlugIn(*plugIn("widget")));
}

TEST_F(Holds, ReleasedWhenTheClientProcessExits) {
  base::LogCapture log;
  auto peer = vantrel::testing::PeerProcess::start(vantrel::testing::testPeerPath(),
                                                   {"hold", socket_, "2", plugInPath("widget")});
  ASSERT_NE(peer, nullptr);
  const std::optional<std::string> held = peer->readLine();
  ASSERT_TRUE(held && held->starts_with("held ")) << held.value_or("(nothing)");
  ASSERT_EQ(server_->holds().size(), 1u);
  EXPECT_EQ(server_->holds().front()->uuid().string(), held->substr(5));
  EXPECT_TRUE(server_->holdOnPlugIn(*plugIn("widget")));

  peer->closeStdin();
  peer->wait();
  ASSERT_TRUE(eventually([&] { return server_->holds().empty(); }));
  EXPECT_EQ(log.count("releasing plug-in hold " + held->substr(5) + " for dead client pid " +
                      std::to_string(peer->pid())),
            1u);
  EXPECT_FALSE(server_->holdOnPlugIn(*plugIn("widget")));
}

}  // namespace
}  // namespace vantrel::daemon::testing
