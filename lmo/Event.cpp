#include "lmo/Event.h"

namespace vantrel::lmo {

std::string describe(ErrorEvent event) {
  switch (event) {
    case ErrorEvent::kConnectionInvalid:
      return "connection invalid";
    case ErrorEvent::kTerminationImminent:
      return "termination imminent";
  }
  return "unknown error event";
}

std::optional<Reply> createReply(const IncomingMessage& message) {
  if (!message.expectsReply()) return std::nullopt;
  return Reply{Dictionary(), message.id()};
}

std::optional<ErrorEvent> Event::error() const {
  const ErrorEvent* e = std::get_if<ErrorEvent>(&v_);
  if (e == nullptr) return std::nullopt;
  return *e;
}

std::string describe(const Event& event) {
  if (auto e = event.error()) return describe(*e);
  return describe(event.message()->body());
}

}  // namespace vantrel::lmo
