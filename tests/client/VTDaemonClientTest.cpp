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
#include "lmo/Listener.h"
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
  FakeDaemon daemon(kDefaultServiceName);
  auto client = VTDaemonClient::initWithServiceName(nullptr);
  ::unsetenv("VANTREL_RUNTIME_DIR");

  const base::Uuid a = base::Uuid::random(), b = base::Uuid::random();
  const std::vector<base::Uuid> ab{a, b}, ba{b, a};
  const Dictionary rules{{"QXExtensionPoint", "com.x.share"},
                         {"nested", Dictionary{{"list", Array{u(1), "two"}}}}};
  const Dictionary annotations{{"election", u(1)}};
  const std::vector<std::string> list{"/A.app/PlugIns/x.qxt", "/B"};
  const Array paths{"/A.app/PlugIns/x.qxt", "/B"};
  const std::vector<std::pair<VTDaemonClient::RequestStarter, Dictionary>> cases = {
      {[&](auto h) { return client->addPlugIns(list, h); }, {{"request", "add"}, {"paths", paths}}},
      {[&](auto h) { return client->removePlugIns({}, h); },
       {{"request", "remove"}, {"paths", Array{}}}},
      {[&](auto h) { return client->bulkPlugins(0x8000000000000001, h); },
       {{"request", "bulk"}, {"flags", u(0x8000000000000001)}}},
      {[&](auto h) { return client->readyPlugIns(ba, 2, h); },
       {{"request", "ready"}, {"flags", u(2)}, {"uuids", Array{b, a}}}},
      {[&](auto h) { return client->accessPlugIns({a}, 0, h); },
       {{"request", "access"}, {"flags", u(0)}, {"uuids", Array{a}}}},
      {[&](auto h) { return client->matchPlugIns(rules, 4, h); },
       {{"request", "match"}, {"rules", rules}, {"flags", u(4)}}},
      {[&](auto h) { return client->setPluginAnnotations(ab, annotations, h); },
       {{"request", "annotate"}, {"uuids", Array{a, b}}, {"annotations", annotations}}},
      {[&](auto h) { return client->holdPlugins(list, 1, h); },
       {{"request", "lock"}, {"paths", paths}, {"flags", u(1)}}},
      {[&](auto h) { return client->releaseHold(b, h); },
       {{"request", "lock"}, {"uuids", Array{b}}}},
  };
  for (size_t i = 0; i < cases.size(); ++i) {
    auto outcome = client->sendSyncWith(cases[i].first, 10s);
    ASSERT_TRUE(outcome.has_value());
    EXPECT_EQ(VTDaemonClient::errorInReply(outcome.value()), std::nullopt);
    const Dictionary sent = daemon.received(i + 1).at(i);
    // Equality is numeric and the wire keeps no sign for small numbers: a
    // flags value with the top bit set shows that flags travel unsigned.
    EXPECT_EQ(sent, cases[i].second.setting("version", u(3))) << describe(sent);
  }
}

TEST(VTDaemonClient, ProtocolVersionGovernsMessagesAndConversions) {
  testing::TempDir dir;
  FakeDaemon daemon(dir.file("svc"));
  auto client = VTDaemonClient::initWithServiceName(dir.file("svc").c_str());
  const Dictionary reply{{"matches", Array{Dictionary{{"id", "x"}}}}};
  EXPECT_EQ(client->convertFromLMO(reply), Value(reply));
  EXPECT_EQ(VTDaemonClient::convertToLMO(Value(reply), 3), Value(reply));
  EXPECT_EQ(VTDaemonClient::convertToLMO(Value(reply), 2), std::nullopt);
  EXPECT_EQ(VTDaemonClient::convertToLMO(Value(lmo::Array{"form"}), 3), Value(lmo::Array{"form"}));

  client->setProtocolVersion(2);
  const Dictionary bulk = client->request("bulk");
  EXPECT_TRUE(bulk.get("version").isUnsignedInteger());
  ASSERT_TRUE(client->sendSync(bulk, 10s).has_value());
  EXPECT_EQ(daemon.received(1).at(0).get("version"), u(2));
  EXPECT_EQ(client->convertFromLMO(reply), std::nullopt);
}

TEST(VTDaemonClient, ErrorInReplyDecodesEveryReplyShape) {
  const auto error = static_cast<base::Error (*)(int64_t, const char*)>(base::error_with_code);
  const std::vector<std::pair<Event, std::optional<base::Error>>> cases = {
      {replyWith({}), std::nullopt},
      {replyWith({{"matches", Array{}}, {"errorcode", u(0)}}), std::nullopt},
      {replyWith({{"errorcode", u(14)}, {"error", "plug-ins are busy"}}),
       error(14, "plug-ins are busy")},
      {replyWith({{"errorcode", u(9)}}), error(9, "unknown error returned by Vantrel subsystem")},
      {replyWith({{"errorcode", u(9)}, {"error", u(5)}}),
       error(9, "unknown error returned by Vantrel subsystem")},
      {replyWith({{"errorcode", u(0xFFFFFFFF)}, {"error", "x"}}), error(-1, "x")},
      {replyWith({{"errorcode", u(0xFFFFFFFFFFFFFFF2)}, {"error", "x"}}), error(-14, "x")},
      {replyWith({{"errorcode", Value::integer(-7)}, {"error", "x"}}), error(-7, "x")},
      {replyWith({{"errorcode", u(0x100000007)}, {"error", "x"}}), error(7, "x")},
      {Event(lmo::ErrorEvent::kConnectionInvalid), error(4, "connection invalid")},
  };
  for (const auto& [reply, expected] : cases) {
    EXPECT_EQ(VTDaemonClient::errorInReply(reply), expected) << describe(reply);
  }
  // A code whose low half is 0 is no code: with a message, the protocol is broken.
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(
      VTDaemonClient::errorInReply(replyWith({{"errorcode", u(1ull << 32)}, {"error", "hi"}})),
      "vantreld reported error without a code: hi");
}

TEST(VTDaemonClient, EachHandlerRunsOnceOnTheReplyQueue) {
  testing::TempDir dir;
  FakeDaemon daemon(dir.file("svc"));
  daemon.script({{Answer::kReply, {{"matches", Array{}}}}, {Answer::kClose, {}}});
  base::LogCapture log;
  auto client = VTDaemonClient::initWithServiceName(dir.file("svc").c_str());
  const lmo::QueuePtr queue = client->replyQueue();
  EXPECT_EQ(queue->label(), "vantreld_client");
  auto replies = std::make_shared<Replies>();
  ASSERT_TRUE(client->matchPlugIns({}, 0, recordInto(replies, queue)).has_value());
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
  EXPECT_FALSE(client->matchPlugIns(deep, 0, recordInto(replies, queue)).has_value());

  const auto events = replies->waitFor(3);
  ASSERT_EQ(events.size(), 3u);
  queue->sync([] {});  // anything queued before now has run
  EXPECT_EQ(replies->waitFor(0).size(), 3u);
  for (const auto& [event, onQueue] : events) EXPECT_TRUE(onQueue) << describe(event);
  EXPECT_EQ(events[0].first.message()->body(), Dictionary({{"matches", Array{}}}));
  for (size_t i : {1, 2}) {
    EXPECT_EQ(VTDaemonClient::errorInReply(events[i].first),
              base::error_with_code(4, "connection invalid"));
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

TEST(VTDaemonClient, SendSyncWaitsForItsOwnReplyOrGivesUp) {
  testing::TempDir dir;
  FakeDaemon daemon(dir.file("svc"));
  daemon.script({{Answer::kHold, {}}, {Answer::kReply, {{"ok", u(1)}}}});
  auto client = VTDaemonClient::initWithServiceName(dir.file("svc").c_str());
  auto timedOut = client->sendSync(client->request("bulk"), 50ms);
  ASSERT_FALSE(timedOut.has_value());
  EXPECT_EQ(timedOut.error(), base::error_with_code(4, "no reply from vantreld within 50 ms"));
  daemon.answerHeld({{"late", u(1)}});  // dropped: nobody waits for it any more
  auto answered = client->sendSync(client->request("bulk"), 10s);
  ASSERT_TRUE(answered.has_value());
  EXPECT_EQ(answered.value().message()->body(), Dictionary({{"ok", u(1)}}));

  GTEST_FLAG_SET(death_test_style, "threadsafe");
  EXPECT_DEATH(client->replyQueue()->sync([&] { (void)client->sendSync({}, 10s); }),
               "sendSync on the reply queue would wait for its own reply");
}

}  // namespace
}  // namespace vantrel::client
