// Client objects: the peer's identity and entitlements, the server's
// logging by verbosity, request counting, and the end of a client.

#include <gtest/gtest.h>
#include <unistd.h>

#include <future>

#include "base/Log.h"
#include "daemon/VTDLmoClient.h"
#include "lmo/Listener.h"
#include "platform/PropertyList.h"
#include "tests/daemon/DaemonFixture.h"
#include "tests/omnidex/OmnidexFixtures.h"
#include "tests/support/PeerProcess.h"

namespace vantrel::daemon::testing {
namespace {

using namespace std::chrono_literals;
using lmo::Array;
using lmo::Dictionary;
using lmo::Value;

constexpr const char* kManager = "com.karvo.private.vantrel.manager";

using ClientConnection = DaemonTest;

TEST_F(ClientConnection, EntitlementsOfARealPeer) {
  // A peer in a bundle with entitlements, connected to a listener of the
  // test's own whose connections become clients of the server.
  const std::string bundle = tmp_.file("Tools/Manager.app");
  omnidex::testing::writeBundle(
      bundle, {{"KBBundleIdentifier", "com.x.manager"}, {"KBBundleExecutable", "peer"}});
  ASSERT_TRUE(vantrel::testing::installTestPeer(bundle + "/peer"));
  const Dictionary entitlements{
      {kManager, Value::boolean(true)}, {"string", "yes"}, {"off", Value::boolean(false)}};
  ASSERT_TRUE(
      platform::writePropertyListFile(bundle + "/Entitlements.plist", Value(entitlements), 0644)
          .has_value());

  auto queue = std::make_shared<base::SerialQueue>("test-listener");
  auto listener = lmo::Listener::create(tmp_.file("peer.socket"), queue);
  ASSERT_TRUE(listener.has_value());
  auto accepted = std::make_shared<std::promise<VTDLmoClientPtr>>();
  listener.value()->setConnectionHandler([this, accepted](std::shared_ptr<lmo::Connection> c) {
    accepted->set_value(VTDLmoClient::initWithConnection(c, server_));
  });
  listener.value()->resume();
  auto peer =
      vantrel::testing::PeerProcess::start(bundle + "/peer", {"connect", tmp_.file("peer.socket")});
  ASSERT_NE(peer, nullptr);
  auto future = accepted->get_future();
  ASSERT_EQ(future.wait_for(10s), std::future_status::ready);
  const VTDLmoClientPtr client = future.get();
  ASSERT_EQ(peer->readLine(), "connected");
  listener.value()->cancel();

  EXPECT_EQ(client->pid(), peer->pid());
  ASSERT_NE(client->bundle(), nullptr);
  EXPECT_TRUE(client->hasEntitlement(kManager));
  EXPECT_TRUE(client->hasEntitlement("string"));
  EXPECT_FALSE(client->hasEntitlement("off"));
  EXPECT_FALSE(client->hasEntitlement("missing"));
  EXPECT_EQ(client->entitlementValueForKey("string"), Value("yes"));
  EXPECT_TRUE(client->description().starts_with("<VTDLmoClient 0x"));
  EXPECT_NE(client->description().find(" pid=" + std::to_string(peer->pid()) + " con="),
            std::string::npos);

  // The peer exits: the client stops accepting work, and its identity
  // stays answerable.
  peer->closeStdin();
  peer->wait();
  ASSERT_TRUE(eventually([&] { return !client->acceptWork(); }));
  EXPECT_EQ(client->pid(), peer->pid());
  EXPECT_TRUE(client->hasEntitlement(kManager));
  EXPECT_TRUE(client->description().ends_with(" NO CONNECTION>"));
}

TEST_F(ClientConnection, VerbosityDecidesWhatIsLogged) {
  const std::string pid = std::to_string(::getpid());
  struct Case {
    uint32_t verbose;
    bool debugLines;
    bool dumps;
  };
  for (const Case c : {Case{0, false, false}, Case{1, true, false}, Case{2, true, true}}) {
    server_->setVerbose(c.verbose);
    base::LogCapture log;
    request("bulk");
    EXPECT_EQ(log.count("client " + pid + " request bulk"), c.debugLines ? 1u : 0u) << c.verbose;
    EXPECT_EQ(log.contains("incoming request "), c.dumps) << c.verbose;
    EXPECT_EQ(log.contains("Replying "), c.dumps) << c.verbose;
    EXPECT_EQ(log.count("bulk options 0x0 not supported"), 1u) << c.verbose;
  }
}

TEST_F(ClientConnection, EveryThousandthRequestIsReported) {
  server_->setVerbose(1);
  const std::string line = "client " + std::to_string(::getpid()) + " used 1000 requests so far";
  auto connection = connect();
  base::LogCapture log;
  for (int i = 0; i < 999; ++i) request("annotate", {{"annotations", Dictionary{}}}, connection);
  EXPECT_EQ(log.count(line), 0u);
  request("annotate", {{"annotations", Dictionary{}}}, connection);
  request("annotate", {{"annotations", Dictionary{}}}, connection);
  EXPECT_EQ(log.count(line), 1u);
}

TEST_F(ClientConnection, ADeadClientsHoldsGoBeforeItIsDeclaredDead) {
  server_->setVerbose(1);
  base::LogCapture log;
  auto connection = connect();
  request("lock", {{"flags", Value::unsignedInteger(2)}, {"paths", Array{plugInPath("widget")}}},
          connection);
  // A request queued behind a blocked service queue reaches it only after
  // the client is dead: it must then do nothing, not even reply.
  std::promise<void> release;
  std::shared_future<void> released = release.get_future().share();
  server_->submitWork([released] { released.wait(); });
  (void)connection->send(Dictionary{{"request", "annotate"},
                                    {"version", Value::unsignedInteger(3)},
                                    {"uuids", Array{uuidOf("share")}},
                                    {"annotations", Dictionary{{"election", Value::integer(1)}}}});
  connection->cancel();
  const std::string dead = "client " + std::to_string(::getpid()) + " is dead";
  ASSERT_TRUE(eventually([&] { return log.count(dead) == 1; }));
  release.set_value();
  server_->mainQueue()->sync([] {});
  EXPECT_EQ(server_->annotationForPlugIn(*plugIn("share")), std::nullopt);
  const auto lines = log.lines();
  const auto releasedAt = std::find_if(lines.begin(), lines.end(), [](const std::string& l) {
    return l.starts_with("releasing plug-in hold ");
  });
  const auto deadAt = std::find(lines.begin(), lines.end(), dead);
  ASSERT_NE(releasedAt, lines.end());
  EXPECT_LT(releasedAt, deadAt);
  EXPECT_TRUE(server_->holds().empty());
}

}  // namespace
}  // namespace vantrel::daemon::testing
