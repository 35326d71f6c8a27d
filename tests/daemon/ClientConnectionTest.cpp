// Client objects: the peer's identity and entitlements, request counting,
// and the end of a client.

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
using lmo::Dictionary;
using lmo::Value;

using ClientConnection = DaemonTest;

TEST_F(ClientConnection, EntitlementsOfARealPeer) {
  // A peer in a bundle with entitlements, connected to a listener of the
  // test's own whose connections become clients of the server.
  const std::string bundle = tmp_.file("Tools/Manager.app");
  omnidex::testing::writeBundle(
      bundle, {{"KBBundleIdentifier", "com.x.manager"}, {"KBBundleExecutable", "peer"}});
  ASSERT_TRUE(vantrel::testing::installTestPeer(bundle + "/peer"));
  const Dictionary entitlements{{std::string(protocol::kManagerEntitlement), Value::boolean(true)},
                                {"string", "yes"},
                                {"off", Value::boolean(false)}};
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
  EXPECT_TRUE(client->hasEntitlement(protocol::kManagerEntitlement));
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
  EXPECT_TRUE(client->hasEntitlement(protocol::kManagerEntitlement));
  EXPECT_TRUE(client->description().ends_with(" NO CONNECTION>"));
}

TEST_F(ClientConnection, EveryThousandthRequestIsReported) {
  server_->setVerbose(1);
  const std::string line = "client " + std::to_string(::getpid()) + " used 1000 requests so far";
  auto connection = connect();
  base::LogCapture log;
  for (int i = 0; i < 999; ++i) {
    request(protocol::kRequestAnnotate, {{protocol::kKeyAnnotations, Dictionary{}}}, connection);
  }
  EXPECT_EQ(log.count(line), 0u);
  request(protocol::kRequestAnnotate, {{protocol::kKeyAnnotations, Dictionary{}}}, connection);
  request(protocol::kRequestAnnotate, {{protocol::kKeyAnnotations, Dictionary{}}}, connection);
  EXPECT_EQ(log.count(line), 1u);
}

}  // namespace
}  // namespace vantrel::daemon::testing
