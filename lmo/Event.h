#pragma once
// What a connection delivers to its handlers: a message from the peer, or one
// of the two error events.

#include <cstdint>
#include <optional>
#include <string>
#include <variant>

#include "lmo/Value.h"

namespace vantrel::lmo {

enum class ErrorEvent {
  // The connection is closed (peer gone, bad input, cancelled, or never
  // connected) and will deliver nothing else. Always the last event.
  kConnectionInvalid,
  // The process is about to stop (see IoLoop::announceTerminationImminent);
  // the connection still works.
  kTerminationImminent,
};

// "connection invalid" or "termination imminent".
std::string describe(ErrorEvent event);

// A message received from the peer, as the event handler sees it.
class IncomingMessage {
 public:
  IncomingMessage(Dictionary body, uint64_t id, bool expectsReply, bool fromPeer = true)
      : body_(std::move(body)), id_(id), expectsReply_(expectsReply), fromPeer_(fromPeer) {}

  const Dictionary& body() const { return body_; }
  // The sender's id of the message; replies name it.
  uint64_t id() const { return id_; }
  bool expectsReply() const { return expectsReply_; }
  // Whether the process the connection was made by wrote it. False when the
  // kernel named another process as the writer of any of its bytes: a
  // socket inherited by a child, or kept across an exec by a process that
  // is gone. Accepted connections only; always true on the client side.
  bool fromPeer() const { return fromPeer_; }

 private:
  Dictionary body_;
  uint64_t id_;
  bool expectsReply_;
  bool fromPeer_;
};

// A reply being built for one received message. Fill body, then hand it to
// Connection::sendReply.
struct Reply {
  Dictionary body;
  uint64_t inReplyTo = 0;
};

// The reply to message with an empty body; nullopt when the sender expects
// none.
std::optional<Reply> createReply(const IncomingMessage& message);

// One event: a message or an error event. Reply handlers get the reply
// message (a body with id and expectsReply() false) or kConnectionInvalid.
class Event {
 public:
  Event(IncomingMessage message) : v_(std::move(message)) {}
  Event(ErrorEvent error) : v_(error) {}

  bool isError() const { return std::holds_alternative<ErrorEvent>(v_); }
  // The error event, or nullopt for a message.
  std::optional<ErrorEvent> error() const;
  // The message, or null for an error event.
  const IncomingMessage* message() const { return std::get_if<IncomingMessage>(&v_); }

 private:
  std::variant<IncomingMessage, ErrorEvent> v_;
};

// The error event's description, or the message body's.
std::string describe(const Event& event);

}  // namespace vantrel::lmo
