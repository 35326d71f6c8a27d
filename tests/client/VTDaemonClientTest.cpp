// The daemon client proxy against a stand-in daemon on a real socket: the
// messages it builds, how replies and transport failures reach handlers, the
// synchronous helper and error decoding.

#include "client/VTDaemonClient.h"

#include <gtest/gtest.h>

#include <condition_variable>
#include <cstdlib>
#include <deque>
#include <thread>
#include <utility>

#include "base/Log.h"
#include "lmo/IoLoop.h"
#include "lmo/Listener.h"
#include "lmo/Protocol.h"
#include "tests/support/TempDir.h"

namespace vantrel::client {
namespace {

using namespace std::chrono_literals;
using lmo::Array;
using lmo::Dictionary;
using lmo::Event;
using lmo::Value;

Value u(uint64_t v) {
  return Value::unsignedInteger(v);
}

// Items added on one thread and awaited on another.
template <class T>
class Recorded {
 public:
  void add(T item) {
    std::lock_guard lock(mutex_);
    items_.push_back(std::move(item));
    changed_.notify_all();
  }
  // The items so far, once there are at least count (10 s at most).
  std::vector<T> waitFor(size_t count) {
    std::unique_lock lock(mutex_);
    changed_.wait_for(lock, 10s, [&] { return items_.size() >= count; });
    return items_;
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<T> items_;  // Guarded by mutex_.
};

// What the stand-in daemon does with a request: reply with body, close the
// connection, or keep the request unanswered until answerHeld().
enum class Answer { kReply, kClose, kHold };
struct Scripted {
  Answer answer = Answer::kReply;
  Dictionary body;
};

// Records every request and answers each with the next scripted entry (an
// empty reply once the script has run out). Handlers share State, never this
// object, so a late event touches nothing that is gone.
class FakeDaemon {
 public:
  explicit FakeDaemon(const std::string& name) {
    listener_ = lmo::Listener::create(name, std::make_shared<base::SerialQueue>("fake")).value();
    listener_->setConnectionHandler([state = state_](std::shared_ptr<lmo::Connection> c) {
      std::weak_ptr<lmo::Connection> weak = c;
      c->setEventHandler([state, weak](const Event& e) { state->handle(weak.lock(), e); });
      std::lock_guard lock(state->mutex);
      state->connections.push_back(c);
      c->resume();
    });
    listener_->resume();
  }
  ~FakeDaemon() {
    listener_->cancel();
    std::lock_guard lock(state_->mutex);
    for (auto& c : state_->connections) c->cancel();
  }
  void script(std::vector<Scripted> entries) {
    std::lock_guard lock(state_->mutex);
    state_->script.insert(state_->script.end(), entries.begin(), entries.end());
  }
  std::vector<Dictionary> received(size_t count) { return state_->received.waitFor(count); }
  void answerHeld(const Dictionary& body) {
    std::lock_guard lock(state_->mutex);
    for (auto& [connection, reply] : state_->held) {
      reply.body = body;
      (void)connection->sendReply(reply);
    }
    state_->held.clear();
  }

 private:
  struct State {
    Recorded<Dictionary> received;
    std::mutex mutex;
    // Guarded by mutex.
    std::deque<Scripted> script;
    std::vector<std::shared_ptr<lmo::Connection>> connections;
    std::vector<std::pair<std::shared_ptr<lmo::Connection>, lmo::Reply>> held;

    void handle(const std::shared_ptr<lmo::Connection>& c, const Event& e) {
      const lmo::IncomingMessage* m = e.message();
      if (c == nullptr || m == nullptr) return;
      std::lock_guard lock(mutex);
      received.add(m->body());
      Scripted next;
      if (!script.empty()) {
        next = script.front();
        script.pop_front();
      }
      lmo::Reply reply = createReply(*m).value();
      reply.body = next.body;
      if (next.answer == Answer::kClose) return c->cancel();
      if (next.answer == Answer::kHold) return (void)held.emplace_back(c, reply);
      (void)c->sendReply(reply);
    }
  };
  std::shared_ptr<State> state_ = std::make_shared<State>();
  std::shared_ptr<lmo::Listener> listener_;
};

// Handler calls, each with whether it ran on the expected queue.
using Replies = Recorded<std::pair<Event, bool>>;

VTDaemonClient::ReplyHandler recordInto(const std::shared_ptr<Replies>& replies,
                                        const lmo::QueuePtr& queue) {
  const base::SerialQueue* expected = queue.get();  // compared, never dereferenced
  return [replies, expected](const Event& e) {
    replies->add({e, base::SerialQueue::current() == expected});
  };
}

Event replyWith(const Dictionary& body) {
  return Event(lmo::IncomingMessage(body, 1, false));
}

TEST(VTDaemonClient, EveryRequestSendsExactlyItsMessage) {
  testing::TempDir dir;
  // The default service name, found in the runtime directory.
  ASSERT_EQ(::setenv("VANTREL_RUNTIME_DIR", dir.path().c_str(), 1), 0);
  FakeDaemon daemon(protocol::kDefaultServiceName);
  auto client = VTDaemonClient::initWithServiceName(nullptr);
  ::unsetenv("VANTREL_RUNTIME_DIR");

  const base::Uuid a = base::Uuid::random(), b = base::Uuid::random();
  const std::vector<base::Uuid> ab{a, b}, ba{b, a};
  const Dictionary rules{{"QXExtensionPoint", "com.x.share"},
                         {"nested", Dictionary{{"list", Array{u(1), "two"}}}}};
  const Dictionary annotations{{protocol::kAnnotationElection, u(1)}};
  const std::vector<std::string> list{"/A.app/PlugIns/x.qxt", "/B"};
  const Array paths{"/A.app/PlugIns/x.qxt", "/B"};
  const std::vector<std::pair<VTDaemonClient::RequestStarter, Dictionary>> cases = {
      {[&](auto h) { return client->addPlugIns(list, h); },
       {{protocol::kKeyRequest, protocol::kRequestAdd}, {protocol::kKeyPaths, paths}}},
      {[&](auto h) { return client->removePlugIns({}, h); },
       {{protocol::kKeyRequest, protocol::kRequestRemove}, {protocol::kKeyPaths, Array{}}}},
      {[&](auto h) { return client->bulkPlugins(0x8000000000000001, h); },
       {{protocol::kKeyRequest, protocol::kRequestBulk},
        {protocol::kKeyFlags, u(0x8000000000000001)}}},
      {[&](auto h) { return client->readyPlugIns(ba, 2, h); },
       {{protocol::kKeyRequest, protocol::kRequestReady},
        {protocol::kKeyFlags, u(2)},
        {protocol::kKeyUuids, Array{b, a}}}},
      {[&](auto h) { return client->accessPlugIns({a}, 0, h); },
       {{protocol::kKeyRequest, protocol::kRequestAccess},
        {protocol::kKeyFlags, u(0)},
        {protocol::kKeyUuids, Array{a}}}},
      {[&](auto h) {
         return client->matchPlugIns(rules, protocol::DiscoveryFlags::kDuplicates, h);
       },
       {{protocol::kKeyRequest, protocol::kRequestMatch},
        {protocol::kKeyRules, rules},
        {protocol::kKeyFlags, u(protocol::bits(protocol::DiscoveryFlags::kDuplicates))}}},
      {[&](auto h) { return client->setPluginAnnotations(ab, annotations, h); },
       {{protocol::kKeyRequest, protocol::kRequestAnnotate},
        {protocol::kKeyUuids, Array{a, b}},
        {protocol::kKeyAnnotations, annotations}}},
      {[&](auto h) { return client->holdPlugins(list, protocol::HoldFlags::kApplication, h); },
       {{protocol::kKeyRequest, protocol::kRequestLock},
        {protocol::kKeyPaths, paths},
        {protocol::kKeyFlags, u(protocol::bits(protocol::HoldFlags::kApplication))}}},
      {[&](auto h) { return client->releaseHold(b, h); },
       {{protocol::kKeyRequest, protocol::kRequestLock}, {protocol::kKeyUuids, Array{b}}}},
      {[&](auto h) {
         return client->explainPlugIn({{protocol::kKeyIdentifier, "com.x"}}, h);
       },
       {{protocol::kKeyRequest, protocol::kRequestExplain}, {protocol::kKeyIdentifier, "com.x"}}},
  };
  for (size_t i = 0; i < cases.size(); ++i) {
    auto outcome = client->sendSyncWith(cases[i].first, 10s);
    ASSERT_TRUE(outcome.has_value());
    EXPECT_EQ(VTDaemonClient::errorInReply(outcome.value()), std::nullopt);
    const Dictionary sent = daemon.received(i + 1).at(i);
    // Equality is numeric and the wire keeps no sign for small numbers: a
    // flags value with the top bit set shows that flags travel unsigned.
    EXPECT_EQ(sent, cases[i].second.setting(protocol::kKeyVersion, u(protocol::kCurrentVersion)))
        << describe(sent);
  }
}

TEST(VTDaemonClient, ProtocolVersionGovernsMessagesAndConversions) {
  testing::TempDir dir;
  FakeDaemon daemon(dir.file("svc"));
  auto client = VTDaemonClient::initWithServiceName(dir.file("svc").c_str());
  const Dictionary reply{{protocol::kKeyMatches, Array{Dictionary{{"id", "x"}}}}};
  EXPECT_EQ(client->convertFromLMO(reply), Value(reply));
  EXPECT_EQ(VTDaemonClient::convertToLMO(Value(reply), protocol::kCurrentVersion), Value(reply));
  EXPECT_EQ(VTDaemonClient::convertToLMO(Value(reply), protocol::kOldestVersion), std::nullopt);
  EXPECT_EQ(VTDaemonClient::convertToLMO(Value(lmo::Array{"form"}), protocol::kCurrentVersion),
            Value(lmo::Array{"form"}));

  client->setProtocolVersion(protocol::kOldestVersion);
  const Dictionary bulk = client->request(protocol::kRequestBulk);
  EXPECT_TRUE(bulk.get(protocol::kKeyVersion).isUnsignedInteger());
  ASSERT_TRUE(client->sendSync(bulk, 10s).has_value());
  EXPECT_EQ(daemon.received(1).at(0).get(protocol::kKeyVersion), u(protocol::kOldestVersion));
  EXPECT_EQ(client->convertFromLMO(reply), std::nullopt);
}

TEST(VTDaemonClient, ErrorInReplyDecodesEveryReplyShape) {
  const auto error = static_cast<base::Error (*)(int64_t, const char*)>(base::error_with_code);
  const std::vector<std::pair<Event, std::optional<base::Error>>> cases = {
      {replyWith({}), std::nullopt},
      {replyWith({{protocol::kKeyMatches, Array{}}, {protocol::kKeyErrorCode, u(0)}}),
       std::nullopt},
      {replyWith({{protocol::kKeyErrorCode, u(protocol::kErrorBusy)},
                  {protocol::kKeyError, "plug-ins are busy"}}),
       error(protocol::kErrorBusy, "plug-ins are busy")},
      {replyWith({{protocol::kKeyErrorCode, u(protocol::kErrorBadPath)}}),
       error(protocol::kErrorBadPath, "unknown error returned by Vantrel subsystem")},
      {replyWith(
           {{protocol::kKeyErrorCode, u(protocol::kErrorBadPath)}, {protocol::kKeyError, u(5)}}),
       error(protocol::kErrorBadPath, "unknown error returned by Vantrel subsystem")},
      {replyWith({{protocol::kKeyErrorCode, u(0xFFFFFFFF)}, {protocol::kKeyError, "x"}}),
       error(-1, "x")},
      {replyWith({{protocol::kKeyErrorCode, u(0xFFFFFFFFFFFFFFF2)}, {protocol::kKeyError, "x"}}),
       error(-14, "x")},
      {replyWith({{protocol::kKeyErrorCode, Value::integer(-7)}, {protocol::kKeyError, "x"}}),
       error(-7, "x")},
      {replyWith({{protocol::kKeyErrorCode, u(0x100000007)}, {protocol::kKeyError, "x"}}),
       error(7, "x")},
      {Event(lmo::ErrorEvent::kConnectionInvalid),
       error(protocol::kErrorBadRequest, "connection invalid")},
  };
  for (const auto& [reply, expected] : cases) {
    EXPECT_EQ(VTDaemonClient::errorInReply(reply), expected) << describe(reply);
  }
  // A code whose low half is 0 is no code: with a message, the protocol is broken.
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(VTDaemonClient::errorInReply(replyWith(
                   {{protocol::kKeyErrorCode, u(1ull << 32)}, {protocol::kKeyError, "hi"}})),
               "vantreld reported error without a code: hi");
}

TEST(VTDaemonClient, EachHandlerRunsOnceOnTheReplyQueue) {
  testing::TempDir dir;
  FakeDaemon daemon(dir.file("svc"));
  daemon.script({{Answer::kReply, {{protocol::kKeyMatches, Array{}}}}, {Answer::kClose, {}}});
  base::LogCapture log;
  auto client = VTDaemonClient::initWithServiceName(dir.file("svc").c_str());
  const lmo::QueuePtr queue = client->replyQueue();
  EXPECT_EQ(queue->label(), "vantreld_client");
  auto replies = std::make_shared<Replies>();
  ASSERT_TRUE(client->matchPlugIns({}, protocol::DiscoveryFlags::kNone, recordInto(replies, queue))
                  .has_value());
  ASSERT_EQ(replies->waitFor(1).size(), 1u);
  // The daemon closes the connection instead of answering; later requests
  // on the dead connection are answered the same way.
  ASSERT_TRUE(client->bulkPlugins(0, recordInto(replies, queue)).has_value());
  ASSERT_EQ(replies->waitFor(2).size(), 2u);
  const std::string ended = "Communications error: connection invalid";
  for (int i = 0; i < 1000 && log.count(ended) == 0; ++i) std::this_thread::sleep_for(10ms);
  ASSERT_TRUE(client->bulkPlugins(0, recordInto(replies, queue)).has_value());
  // A message the codec refuses is not sent, and its handler never runs.
  Dictionary deep;
  for (int i = 0; i < 100; ++i) deep = Dictionary{{"d", deep}};
  EXPECT_FALSE(
      client->matchPlugIns(deep, protocol::DiscoveryFlags::kNone, recordInto(replies, queue))
          .has_value());

  const auto events = replies->waitFor(3);
  ASSERT_EQ(events.size(), 3u);
  queue->sync([] {});  // anything queued before now has run
  EXPECT_EQ(replies->waitFor(0).size(), 3u);
  for (const auto& [event, onQueue] : events) EXPECT_TRUE(onQueue) << describe(event);
  EXPECT_EQ(events[0].first.message()->body(), Dictionary({{protocol::kKeyMatches, Array{}}}));
  for (size_t i : {1, 2}) {
    EXPECT_EQ(VTDaemonClient::errorInReply(events[i].first),
              base::error_with_code(protocol::kErrorBadRequest, "connection invalid"));
  }
  EXPECT_EQ(log.count(ended), 1u);

  // A request still waiting when its proxy goes, and one to nobody: each
  // handler runs once, with the error event, holding only what it owns.
  daemon.script({{Answer::kHold, {}}});
  for (const std::string& name : {dir.file("svc"), dir.file("nobody")}) {
    auto gone = VTDaemonClient::initWithServiceName(name.c_str());
    auto pending = std::make_shared<Replies>();
    ASSERT_TRUE(gone->bulkPlugins(0, recordInto(pending, gone->replyQueue())).has_value());
    if (name == dir.file("svc")) daemon.received(3);
    gone.reset();
    daemon.answerHeld({});
    const auto late = pending->waitFor(1);
    ASSERT_EQ(late.size(), 1u) << name;
    EXPECT_EQ(late[0].first.error(), lmo::ErrorEvent::kConnectionInvalid) << name;
  }
}

TEST(VTDaemonClient, AProxyThatGoesAfterItsAnswerLogsNoError) {
  testing::TempDir dir;
  FakeDaemon daemon(dir.file("svc"));
  daemon.script({{Answer::kReply, {{protocol::kKeyMatches, Array{}}}}});
  base::LogCapture log;
  auto client = VTDaemonClient::initWithServiceName(dir.file("svc").c_str());
  const lmo::QueuePtr queue = client->replyQueue();
  auto replies = std::make_shared<Replies>();
  ASSERT_TRUE(client->matchPlugIns({}, protocol::DiscoveryFlags::kNone, recordInto(replies, queue))
                  .has_value());
  ASSERT_EQ(replies->waitFor(1).size(), 1u);
  client.reset();
  // The cancel runs on the I/O thread, which hands its event to the queue.
  lmo::IoLoop::shared().runAndWait([] {});
  queue->sync([] {});
  EXPECT_EQ(log.count("Communications error: connection invalid"), 0u);
}

TEST(VTDaemonClient, SendSyncWaitsForItsOwnReplyOrGivesUp) {
  testing::TempDir dir;
  FakeDaemon daemon(dir.file("svc"));
  daemon.script({{Answer::kHold, {}}, {Answer::kReply, {{"ok", u(1)}}}});
  auto client = VTDaemonClient::initWithServiceName(dir.file("svc").c_str());
  auto timedOut = client->sendSync(client->request(protocol::kRequestBulk), 50ms);
  ASSERT_FALSE(timedOut.has_value());
  EXPECT_EQ(timedOut.error(), base::error_with_code(protocol::kErrorBadRequest,
                                                    "no reply from vantreld within 50 ms"));
  daemon.answerHeld({{"late", u(1)}});  // dropped: nobody waits for it any more
  auto answered = client->sendSync(client->request(protocol::kRequestBulk), 10s);
  ASSERT_TRUE(answered.has_value());
  EXPECT_EQ(answered.value().message()->body(), Dictionary({{"ok", u(1)}}));

  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(client->replyQueue()->sync([&] { (void)client->sendSync({}, 10s); }),
               "sendSync on the reply queue would wait for its own reply");
}

}  // namespace
}  // namespace vantrel::client
