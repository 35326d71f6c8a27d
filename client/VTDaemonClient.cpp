#include "client/VTDaemonClient.h"

#include <condition_variable>
#include <utility>

#include "base/Check.h"
#include "base/Format.h"
#include "base/Log.h"
#include "lmo/Message.h"
#include "lmo/Protocol.h"

namespace vantrel::client {
namespace {

using lmo::Array;
using lmo::Dictionary;
using lmo::Value;

Array stringArray(const std::vector<std::string>& strings) {
  std::vector<Value> items;
  items.reserve(strings.size());
  for (const std::string& s : strings) items.emplace_back(s);
  return Array(std::move(items));
}

Array uuidArray(const std::vector<base::Uuid>& uuids) {
  std::vector<Value> items;
  items.reserve(uuids.size());
  for (const base::Uuid& u : uuids) items.emplace_back(u);
  return Array(std::move(items));
}

// What sendSyncWith waits on. The reply handler owns it together with the
// waiting thread, so a reply that arrives after the wait gave up writes into
// live memory that nobody reads again.
struct SyncReply {
  std::mutex mutex;
  std::condition_variable arrived;
  std::optional<lmo::Event> event;  // Guarded by mutex.
};

}  // namespace

VTDaemonClient::VTDaemonClient(std::shared_ptr<lmo::Connection> connection,
                               lmo::QueuePtr replyQueue)
    : vantreld_(std::move(connection)), replyQueue_(std::move(replyQueue)) {}

VTDaemonClientPtr VTDaemonClient::initWithServiceName(const char* name) {
  auto queue = std::make_shared<base::SerialQueue>(kReplyQueueLabel);
  auto connection = lmo::Connection::connectToService(
      name != nullptr ? name : protocol::kDefaultServiceName, queue);
  // The daemon sends nothing unprompted, so every event that reaches the
  // connection itself is a failure. The handler captures nothing: it may run
  // after the proxy is gone.
  connection->setEventHandler(
      [](const lmo::Event& event) { base::vtlog("Communications error: %@", event); });
  VTDaemonClientPtr client(new VTDaemonClient(connection, std::move(queue)));
  connection->resume();
  return client;
}

VTDaemonClient::~VTDaemonClient() {
  if (vantreld_ != nullptr) {
    // Our own cancel is not a communications error: without this, a tool
    // that got its answer could log one on its way out.
    vantreld_->setEventHandler(nullptr);
    vantreld_->cancel();
  }
  // The last reference may be dropped inside a reply handler, that is on the
  // reply queue's own worker, where a queue cannot be destroyed.
  lmo::releaseQueue(std::move(replyQueue_));
}

Dictionary VTDaemonClient::request(const char* type) const {
  return Dictionary{{protocol::kKeyRequest, Value(type)},
                    {protocol::kKeyVersion, Value::unsignedInteger(protocolVersion())}};
}

Dictionary VTDaemonClient::request(const char* type, const std::vector<std::string>& paths) const {
  return request(type).setting(protocol::kKeyPaths, stringArray(paths));
}

Dictionary VTDaemonClient::set(const Dictionary& message, const std::vector<base::Uuid>& uuids) {
  return message.setting(protocol::kKeyUuids, uuidArray(uuids));
}

base::Result<void> VTDaemonClient::send(const Dictionary& message, ReplyHandler reply) {
  std::shared_ptr<lmo::Connection> connection;
  lmo::QueuePtr queue;
  {
    std::lock_guard lock(mutex_);
    connection = vantreld_;
    queue = replyQueue_;
  }
  VT_CHECK(connection != nullptr && queue != nullptr, "daemon client without a connection");
  return connection->sendWithReply(message, std::move(queue), std::move(reply));
}

base::Result<void> VTDaemonClient::addPlugIns(const std::vector<std::string>& paths,
                                              ReplyHandler reply) {
  return send(request(protocol::kRequestAdd, paths), std::move(reply));
}

base::Result<void> VTDaemonClient::removePlugIns(const std::vector<std::string>& paths,
                                                 ReplyHandler reply) {
  return send(request(protocol::kRequestRemove, paths), std::move(reply));
}

base::Result<void> VTDaemonClient::bulkPlugins(uint64_t flags, ReplyHandler reply) {
  return send(
      request(protocol::kRequestBulk).setting(protocol::kKeyFlags, Value::unsignedInteger(flags)),
      std::move(reply));
}

base::Result<void> VTDaemonClient::readyPlugIns(const std::vector<base::Uuid>& uuids,
                                                uint64_t flags, ReplyHandler reply) {
  Dictionary message =
      request(protocol::kRequestReady).setting(protocol::kKeyFlags, Value::unsignedInteger(flags));
  return send(set(message, uuids), std::move(reply));
}

base::Result<void> VTDaemonClient::accessPlugIns(const std::vector<base::Uuid>& uuids,
                                                 uint64_t flags, ReplyHandler reply) {
  Dictionary message =
      request(protocol::kRequestAccess).setting(protocol::kKeyFlags, Value::unsignedInteger(flags));
  return send(set(message, uuids), std::move(reply));
}

base::Result<void> VTDaemonClient::matchPlugIns(const Dictionary& rules,
                                                protocol::DiscoveryFlags flags,
                                                ReplyHandler reply) {
  Dictionary message =
      request(protocol::kRequestMatch)
          .setting(protocol::kKeyRules, Value(lmo::propertyListFromMessage(rules)))
          .setting(protocol::kKeyFlags, Value::unsignedInteger(protocol::bits(flags)));
  return send(message, std::move(reply));
}

base::Result<void> VTDaemonClient::setPluginAnnotations(const std::vector<base::Uuid>& uuids,
                                                        const Dictionary& annotations,
                                                        ReplyHandler reply) {
  Dictionary message =
      set(request(protocol::kRequestAnnotate), uuids)
          .setting(protocol::kKeyAnnotations, Value(lmo::propertyListFromMessage(annotations)));
  return send(message, std::move(reply));
}

base::Result<void> VTDaemonClient::holdPlugins(const std::vector<std::string>& paths,
                                               protocol::HoldFlags flags, ReplyHandler reply) {
  return send(request(protocol::kRequestLock, paths)
                  .setting(protocol::kKeyFlags, Value::unsignedInteger(protocol::bits(flags))),
              std::move(reply));
}

base::Result<void> VTDaemonClient::explainPlugIn(const Dictionary& selector, ReplyHandler reply) {
  // The selector cannot change the request type or version: the envelope's
  // keys are set last.
  Dictionary message = selector;
  for (const auto& [key, value] : request(protocol::kRequestExplain)) {
    message = message.setting(key, value);
  }
  return send(message, std::move(reply));
}

base::Result<void> VTDaemonClient::releaseHold(const base::Uuid& token, ReplyHandler reply) {
  // The daemon tells a release from a hold by "uuids" being an array.
  return send(set(request(protocol::kRequestLock), {token}), std::move(reply));
}

base::Result<lmo::Event> VTDaemonClient::sendSyncWith(const RequestStarter& start,
                                                      std::chrono::milliseconds timeout) {
  VT_CHECK(!replyQueue()->isCurrent(), "sendSync on the reply queue would wait for its own reply");
  auto state = std::make_shared<SyncReply>();
  base::Result<void> started = start([state](const lmo::Event& event) {
    std::lock_guard lock(state->mutex);
    state->event = event;
    state->arrived.notify_all();
  });
  if (!started.has_value()) return started.error();
  std::unique_lock lock(state->mutex);
  if (!state->arrived.wait_for(lock, timeout, [&] { return state->event.has_value(); })) {
    return base::error_with_code_and_format(protocol::kErrorBadRequest,
                                            "no reply from vantreld within %u ms",
                                            static_cast<uint64_t>(timeout.count()));
  }
  return *state->event;
}

base::Result<lmo::Event> VTDaemonClient::sendSync(const Dictionary& message,
                                                  std::chrono::milliseconds timeout) {
  return sendSyncWith([&](ReplyHandler reply) { return send(message, std::move(reply)); }, timeout);
}

std::optional<base::Error> VTDaemonClient::errorInReply(const lmo::Event& reply) {
  const lmo::IncomingMessage* message = reply.message();
  if (message == nullptr) return base::error_with_code(protocol::kErrorBadRequest, describe(reply));
  const Dictionary& body = message->body();
  // A code is sent sign-extended to 64 bits; only its low half is the code.
  // Both integer encodings are read, since a negative one may arrive signed.
  const Value& codeValue = body.get(protocol::kKeyErrorCode);
  uint64_t wire =
      codeValue.getIfUInt64().value_or(static_cast<uint64_t>(codeValue.getIfInt64().value_or(0)));
  const auto code = static_cast<int32_t>(static_cast<uint32_t>(wire));
  const std::string* text = body.get(protocol::kKeyError).getIfString();
  if (code == 0) {
    if (text != nullptr) {
      base::internalInconsistency(
          base::format("vantreld reported error without a code: %s", *text).c_str(), __FILE__,
          __LINE__);
    }
    return std::nullopt;
  }
  if (text == nullptr) {
    return base::error_with_code(code, "unknown error returned by Vantrel subsystem");
  }
  return base::error_with_code(code, *text);
}

std::optional<Value> VTDaemonClient::convertFromLMO(const Dictionary& reply) const {
  if (protocolVersion() != protocol::kCurrentVersion) return std::nullopt;
  return Value(lmo::propertyListFromMessage(reply));
}

std::optional<Value> VTDaemonClient::convertToLMO(const Value& object, uint64_t version) {
  return lmo::convertToLMO(object, version);
}

std::shared_ptr<lmo::Connection> VTDaemonClient::vantreld() const {
  std::lock_guard lock(mutex_);
  return vantreld_;
}

void VTDaemonClient::setVantreld(std::shared_ptr<lmo::Connection> connection) {
  std::lock_guard lock(mutex_);
  vantreld_ = std::move(connection);
}

lmo::QueuePtr VTDaemonClient::replyQueue() const {
  std::lock_guard lock(mutex_);
  return replyQueue_;
}

void VTDaemonClient::setReplyQueue(lmo::QueuePtr queue) {
  std::unique_lock lock(mutex_);
  std::swap(replyQueue_, queue);
  lock.unlock();
  lmo::releaseQueue(std::move(queue));
}

}  // namespace vantrel::client
