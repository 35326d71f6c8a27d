#include "tests/daemon/DaemonFixture.h"

#include <chrono>
#include <cstdlib>
#include <future>
#include <thread>

#include "platform/PropertyList.h"
#include "platform/ServiceManager.h"
#include "tests/omnidex/OmnidexFixtures.h"
#include "tests/support/PeerProcess.h"

namespace vantrel::daemon::testing {

using namespace std::chrono_literals;

void DaemonTest::SetUp() {
  // Bound while the runtime directory is not yet this test's own.
  serviceManagerDirectory();
  for (const char* name : {"VANTREL_RUNTIME_DIR", "VANTREL_STATE_DIR", "XDG_STATE_HOME",
                           "VANTREL_PREFERENCES_DIR", "VANTREL_SYSTEM_DIR"}) {
    const char* value = std::getenv(name);
    savedEnvironment_[name] = value ? std::optional<std::string>(value) : std::nullopt;
  }
  ::setenv("VANTREL_RUNTIME_DIR", tmp_.file("run").c_str(), 1);
  ::setenv("VANTREL_STATE_DIR", tmp_.file("state").c_str(), 1);
  ::setenv("XDG_STATE_HOME", tmp_.file("xdg").c_str(), 1);
  ::setenv("VANTREL_PREFERENCES_DIR", tmp_.file("prefs").c_str(), 1);
  ::setenv("VANTREL_SYSTEM_DIR", tmp_.file("System").c_str(), 1);

  omnidex::testing::writeBundle(hostApp(), {{"KBBundleIdentifier", "com.x.host"}});
  writePlugIn("apps/Host.app/PlugIns/widget.appex", kWidget);
  writePlugIn("apps/Host.app/PlugIns/share.appex", kShare);
  omnidex::OmnidexConfig config;
  config.stateDirectory = tmp_.file("state");
  config.applicationDirectories = {tmp_.file("apps"), tmp_.file(kEarlyApps)};
  config.plugInDirectories = {systemPlugIns()};
  auto registry = omnidex::Omnidex::open(config);
  ASSERT_TRUE(registry.has_value()) << registry.error().description();
  registry_ = registry.value();

  socket_ = tmp_.file("vantreld.socket");
  annotations_ = tmp_.file("Annotations");
  server_ = VTDServer::initForService(socket_.c_str(), annotations_.c_str(), registry_);
  ASSERT_NE(server_, nullptr);
  server_->resume();
}

void DaemonTest::TearDown() {
  for (auto& connection : connections_) connection->cancel();
  connections_.clear();
  if (server_) {
    server_->cancelListenerForTest();
    EXPECT_TRUE(eventually([] { return lmo::Connection::openCount() == 0; }));
    // Connections' last events and the transactions they queued finish
    // before the server goes, so nothing of it is released on its queues.
    server_->lmoQueue()->sync([] {});
    server_->mainQueue()->sync([] {});
    VTDServer::resetForTest();
    server_.reset();
  }
  for (const auto& [name, value] : savedEnvironment_) {
    value ? ::setenv(name.c_str(), value->c_str(), 1) : ::unsetenv(name.c_str());
  }
}

lmo::Dictionary DaemonTest::plugInInfo(const std::string& identifier) {
  const lmo::Dictionary extension{{"QXExtensionPointIdentifier", "com.karvo.widget"},
                                  {"QXExtensionProtocol", "P"},
                                  {"QXExtensionAttributes", lmo::Dictionary{}}};
  return {{"KBBundleIdentifier", identifier},
          {"KBBundleVersion", "1"},
          {"KBBundleExecutable", "peer"},
          {"QXExtension", extension}};
}

std::string DaemonTest::writePlugIn(const std::string& relative, const std::string& identifier) {
  const std::string path =
      omnidex::testing::writeBundle(tmp_.file(relative), plugInInfo(identifier));
  EXPECT_TRUE(vantrel::testing::installTestPeer(path + "/peer"));
  return path;
}

registry::VTDPlugInPtr DaemonTest::plugIn(const char* name) const {
  auto found = server_->findPlugInAtPath(model::FileUrl::fromPath(plugInPath(name)));
  EXPECT_NE(found, nullptr) << name;
  return found;
}

std::shared_ptr<lmo::Connection> DaemonTest::connect() {
  auto connection = lmo::Connection::connectToService(socket_, replyQueue_);
  connection->setEventHandler([](const lmo::Event&) {});
  connection->resume();
  connections_.push_back(connection);
  return connection;
}

std::optional<lmo::Dictionary> DaemonTest::send(
    const lmo::Dictionary& message, const std::shared_ptr<lmo::Connection>& connection) {
  auto peer = connection ? connection : connect();
  auto promise = std::make_shared<std::promise<std::optional<lmo::Dictionary>>>();
  auto reply = promise->get_future();
  auto sent = peer->sendWithReply(message, replyQueue_, [promise](const lmo::Event& event) {
    promise->set_value(event.message() ? std::optional(event.message()->body()) : std::nullopt);
  });
  EXPECT_TRUE(sent.has_value());
  if (reply.wait_for(10s) != std::future_status::ready) {
    ADD_FAILURE() << "no reply to " << lmo::describe(message);
    return std::nullopt;
  }
  auto body = reply.get();
  EXPECT_TRUE(body.has_value()) << "connection ended instead of replying to "
                                << lmo::describe(message);
  return body;
}

lmo::Dictionary DaemonTest::request(const char* type, lmo::Dictionary extras,
                                    const std::shared_ptr<lmo::Connection>& connection) {
  lmo::Dictionary message = extras.setting(protocol::kKeyRequest, type)
                                .setting(protocol::kKeyVersion, u64(protocol::kCurrentVersion));
  return send(message, connection)
      .value_or(lmo::Dictionary{{"no reply", lmo::Value::boolean(true)}});
}

const std::string& DaemonTest::serviceManagerDirectory() {
  static vantrel::testing::TempDir directory;
  static const std::string bound = [] {
    const char* saved = std::getenv("VANTREL_RUNTIME_DIR");
    const std::optional<std::string> previous = saved ? std::optional(saved) : std::nullopt;
    ::setenv("VANTREL_RUNTIME_DIR", directory.path().c_str(), 1);
    std::string used = platform::ServiceManager::shared().directory();
    previous ? ::setenv("VANTREL_RUNTIME_DIR", previous->c_str(), 1)
             : ::unsetenv("VANTREL_RUNTIME_DIR");
    return used;
  }();
  return bound;
}

bool DaemonTest::eventually(const std::function<bool()>& condition) {
  const auto deadline = std::chrono::steady_clock::now() + 5s;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(5ms);
  }
  return true;
}

Expected errorOf(const lmo::Dictionary& reply) {
  const std::string* message = reply.get(protocol::kKeyError).getIfString();
  return {reply.get(protocol::kKeyErrorCode).integerValue(), message ? *message : ""};
}

}  // namespace vantrel::daemon::testing
