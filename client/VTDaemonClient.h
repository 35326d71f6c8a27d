#pragma once
// The client side of the daemon's request protocol: one connection to the
// daemon's service, one message per request, one reply per message.
//
// The proxy keeps no plug-in state and never retries. Every request
// operation builds its message and hands it to the connection together with
// the caller's handler; the handler runs exactly once, on replyQueue(), with
// the reply message or with the connection's error event
// (kConnectionInvalid when the daemon cannot be reached, goes away, or the
// proxy is destroyed first). errorInReply() turns either into an error.
//
// Request operations may be called from any thread. Handlers and the
// connection's own event handler run one at a time on the serial reply queue.

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "base/Error.h"
#include "base/Result.h"
#include "base/Uuid.h"
#include "lmo/Connection.h"
#include "lmo/Event.h"
#include "lmo/Protocol.h"
#include "lmo/Value.h"

namespace vantrel::client {

inline constexpr const char* kReplyQueueLabel = "vantreld_client";

class VTDaemonClient;
using VTDaemonClientPtr = std::shared_ptr<VTDaemonClient>;

class VTDaemonClient {
 public:
  using ReplyHandler = std::function<void(const lmo::Event&)>;
  // Starts one request: passes the handler it is given to a request
  // operation (or send) and returns that operation's result.
  using RequestStarter = std::function<base::Result<void>(ReplyHandler)>;

  // Connects to the named service (null: protocol::kDefaultServiceName; a
  // name that begins with "/" is the socket path itself). Never null in practice: when
  // the service cannot be reached the connection is invalid from the start,
  // and every request's handler gets kConnectionInvalid.
  static VTDaemonClientPtr initWithServiceName(const char* name);

  // Cancels the connection. Requests still waiting for a reply get
  // kConnectionInvalid on the reply queue afterwards; their handlers own
  // everything they use, so nothing of the proxy is touched then.
  ~VTDaemonClient();
  VTDaemonClient(const VTDaemonClient&) = delete;
  VTDaemonClient& operator=(const VTDaemonClient&) = delete;

  // A new message holding "request" = type and "version" = protocolVersion()
  // as an unsigned integer.
  lmo::Dictionary request(const char* type) const;
  // request(type) plus "paths" = the paths as an array of strings.
  lmo::Dictionary request(const char* type, const std::vector<std::string>& paths) const;
  // A copy of message with "uuids" = the UUIDs as UUID values, in order.
  static lmo::Dictionary set(const lmo::Dictionary& message, const std::vector<base::Uuid>& uuids);

  // Sends message expecting a reply; reply runs once on replyQueue().
  // Errors: the message cannot be encoded (nested too deep or too large for
  // one frame); then nothing is sent and reply never runs.
  base::Result<void> send(const lmo::Dictionary& message, ReplyHandler reply);

  // The requests. Each builds its message and calls send(); they fail as
  // send() does.
  base::Result<void> addPlugIns(const std::vector<std::string>& paths, ReplyHandler reply);
  base::Result<void> removePlugIns(const std::vector<std::string>& paths, ReplyHandler reply);
  base::Result<void> bulkPlugins(uint64_t flags, ReplyHandler reply);
  base::Result<void> readyPlugIns(const std::vector<base::Uuid>& uuids, uint64_t flags,
                                  ReplyHandler reply);
  base::Result<void> accessPlugIns(const std::vector<base::Uuid>& uuids, uint64_t flags,
                                   ReplyHandler reply);
  base::Result<void> matchPlugIns(const lmo::Dictionary& rules, protocol::DiscoveryFlags flags,
                                  ReplyHandler reply);
  base::Result<void> setPluginAnnotations(const std::vector<base::Uuid>& uuids,
                                          const lmo::Dictionary& annotations, ReplyHandler reply);
  // Takes a hold; a successful reply carries the hold's token under "uuids".
  base::Result<void> holdPlugins(const std::vector<std::string>& paths, protocol::HoldFlags flags,
                                 ReplyHandler reply);
  // "explain" (an extension beyond the base requests): the envelope plus
  // the selector's keys (protocol::kKeyUuid, kKeyPath or kKeyIdentifier;
  // kKeyPid or kKeyHostPath; kKeyRules, kKeyFlags). Without a plug-in the
  // reply is the daemon's status.
  base::Result<void> explainPlugIn(const lmo::Dictionary& selector, ReplyHandler reply);
  // Releases the hold that token names.
  base::Result<void> releaseHold(const base::Uuid& token, ReplyHandler reply);

  // For programs without an event loop: runs one request and blocks the
  // calling thread until its handler has run or timeout has passed, e.g.
  //   client->sendSyncWith(
  //       [&](auto h) { return client->holdPlugins(paths, HoldFlags::kPlugIn, h); }, 5s);
  // The value is what the handler got (the reply or kConnectionInvalid):
  // give it to errorInReply(). Errors: start's own error, or kErrorBadRequest
  // "no reply from vantreld within %u ms" on timeout. A reply that comes
  // after the timeout is dropped. Calling this on the reply queue would wait
  // for itself: it stops the process.
  base::Result<lmo::Event> sendSyncWith(const RequestStarter& start,
                                        std::chrono::milliseconds timeout);
  // sendSyncWith for send(message, ...).
  base::Result<lmo::Event> sendSync(const lmo::Dictionary& message,
                                    std::chrono::milliseconds timeout);

  // The error a reply stands for, or nullopt for success:
  //  - an error event: kErrorBadRequest with the event's description;
  //  - "errorcode" (low 32 bits, signed) not 0: that code with "error", or a
  //    generic message when "error" is missing.
  // A reply with "error" but no code breaks the protocol and stops the
  // process; it is never taken for success.
  static std::optional<base::Error> errorInReply(const lmo::Event& reply);

  // The property-list object a reply holds; nullopt unless protocolVersion()
  // is protocol::kCurrentVersion.
  std::optional<lmo::Value> convertFromLMO(const lmo::Dictionary& reply) const;
  // A property-list object as a message value (the daemon's match replies
  // carry an array of forms); nullopt unless version is
  // protocol::kCurrentVersion.
  static std::optional<lmo::Value> convertToLMO(const lmo::Value& object, uint64_t version);

  std::shared_ptr<lmo::Connection> vantreld() const;
  // Replaces the connection used by later requests. The previous one is
  // neither cancelled nor resumed here: that is the caller's business; the
  // destructor cancels only the one held then.
  void setVantreld(std::shared_ptr<lmo::Connection> connection);
  lmo::QueuePtr replyQueue() const;
  // Where handlers of later requests run. The connection's own event handler
  // stays on the queue it was resumed with.
  void setReplyQueue(lmo::QueuePtr queue);
  // The version every request carries: protocol::kCurrentVersion unless set
  // otherwise, and the only one whose replies convertFromLMO() understands.
  uint64_t protocolVersion() const { return protocolVersion_.load(std::memory_order_relaxed); }
  void setProtocolVersion(uint64_t version) {
    protocolVersion_.store(version, std::memory_order_relaxed);
  }

 private:
  VTDaemonClient(std::shared_ptr<lmo::Connection> connection, lmo::QueuePtr replyQueue);

  mutable std::mutex mutex_;
  std::shared_ptr<lmo::Connection> vantreld_;  // Guarded by mutex_.
  lmo::QueuePtr replyQueue_;                   // Guarded by mutex_.
  // Atomic: read by request operations on any thread.
  std::atomic<uint64_t> protocolVersion_{protocol::kCurrentVersion};
};

}  // namespace vantrel::client
