#include "daemon/Transaction.h"

#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <memory>

#include "base/Check.h"
#include "base/Format.h"
#include "base/Log.h"
#include "daemon/Limits.h"
#include "daemon/VTDLmoClient.h"
#include "daemon/VTDServer.h"
#include "lmo/Message.h"
#include "lmo/Protocol.h"
#include "platform/DeviceRestrictions.h"
#include "platform/PeerPaths.h"
#include "platform/Probes.h"
#include "platform/SandboxExtensionService.h"
#include "registry/VTDPlugIn.h"

namespace vantrel::daemon {

namespace {

// Whether a request changes the state the daemon keeps for its user.
enum class Scope { kAnyPeer, kChangesState };

struct Operation {
  std::string_view type;
  void (Transaction::*run)();
  Scope scope;
};

// Looked up in this order, byte for byte. "lock" decides for itself: taking
// a hold changes state, presenting a token does not.
constexpr Operation kDispatchTable[] = {
    {protocol::kRequestAdd, &Transaction::addPlugIns, Scope::kChangesState},
    {protocol::kRequestRemove, &Transaction::removePlugIns, Scope::kChangesState},
    {protocol::kRequestBulk, &Transaction::bulkPlugIns, Scope::kAnyPeer},
    {protocol::kRequestMatch, &Transaction::matchPlugIns, Scope::kAnyPeer},
    {protocol::kRequestReady, &Transaction::readyPlugIns, Scope::kAnyPeer},
    {protocol::kRequestAccess, &Transaction::accessPlugIns, Scope::kAnyPeer},
    {protocol::kRequestAnnotate, &Transaction::annotatePlugIns, Scope::kChangesState},
    {protocol::kRequestLock, &Transaction::lockDownPlugIns, Scope::kAnyPeer},
    {protocol::kRequestExplain, &Transaction::explainPlugIn, Scope::kAnyPeer},
};

}  // namespace

std::optional<std::string> canonicalPath(const std::string& path, const lmo::Connection& peer) {
  const platform::LookupCredentials who{peer.uid(), peer.gid(), peer.groups()};
  std::optional<std::string> canonical = platform::canonicalPathFor(path, who);
  if (canonical && canonical->size() >= kMaxCanonicalPathBytes) return std::nullopt;
  return canonical;
}

TransactionPtr Transaction::initWithRequest(lmo::IncomingMessage request,
                                            std::shared_ptr<VTDLmoClient> client) {
  return TransactionPtr(new Transaction(std::move(request), std::move(client)));
}

Transaction::Transaction(lmo::IncomingMessage request, std::shared_ptr<VTDLmoClient> client)
    : client_(std::move(client)),
      request_(std::move(request)),
      reply_(lmo::createReply(request_)) {}

const std::shared_ptr<VTDServer>& Transaction::server() const {
  return client_->server();
}

std::shared_ptr<lmo::Connection> Transaction::connection() const {
  return client_->connection();
}

void Transaction::dispatch() {
  server()->mainQueue()->assertCurrent();
  const lmo::Dictionary& body = request();
  const std::string* type = body.get(protocol::kKeyRequest).getIfString();
  version_ = body.get(protocol::kKeyVersion).getIfUInt64().value_or(0);
  if (version_ != protocol::kOldestVersion && version_ != protocol::kCurrentVersion) {
    failMessage(protocol::kErrorVersionMismatch,
                base::format("unsupported protocol version %d (current %d)",
                             static_cast<int32_t>(static_cast<uint32_t>(version_)),
                             protocol::kCurrentVersion));
    return;
  }
  if (!client_->acceptWork()) return;
  const char* typeText = type ? type->c_str() : nullptr;
  server()->debug("client %d request %s", client_->pid(), typeText);
  probes::request(client_->pid(), typeText ? typeText : "(null)");
  if (type == nullptr) {
    failMessage(protocol::kErrorBadRequest, "invalid request format (missing type)");
    return;
  }
  // A connection speaks for the process that made it, whose identity and
  // entitlements were read then. Bytes another process writes into it (a
  // child that inherited the socket, while the parent execs something
  // entitled) must not borrow that identity.
  if (!request_.fromPeer()) {
    failMessage(protocol::kErrorAccessDenied,
                base::format("request \"%@\" refused: it was not written by pid %d, the process "
                             "this connection belongs to",
                             *type, client_->pid()));
    return;
  }
  for (const Operation& operation : kDispatchTable) {
    if (operation.type == *type) {
      if (operation.scope == Scope::kChangesState && !allowStateChange(*type)) return;
      // Rules are matched against every candidate: one request logs an
      // unknown operator once, not once per candidate and element. Likewise
      // it reads the device's restrictions, the token secret and whether
      // its client still runs the executable it connected with once.
      registry::MatchLogOnce logOnce;
      platform::DeviceRestrictionsReadOnce restrictionsOnce;
      VTDLmoClient::ExecutableReadOnce executableOnce;
      platform::SandboxTokenBatch tokens;
      (this->*operation.run)();
      return;
    }
  }
  failMessage(protocol::kErrorBadRequest, "unrecognized request");
}

bool Transaction::allowStateChange(std::string_view type) {
  if (client_->mayChangeState()) return true;
  failMessage(protocol::kErrorAccessDenied,
              base::format("request \"%@\" refused: it changes what this daemon keeps for uid "
                           "%u, and uid %u is not that user, root or a manager",
                           type, static_cast<unsigned>(::geteuid()),
                           static_cast<unsigned>(client_->uid())));
  return false;
}

void Transaction::setReplyValue(std::string_view key, lmo::Value value) {
  if (reply_) reply_->body = reply_->body.setting(key, std::move(value));
}

void Transaction::done() {
  VT_CHECK(!replied_, "a transaction replied twice");
  replied_ = true;
  const lmo::Dictionary body = reply();
  if (server()->verbose() >= kVerboseDumps) server()->debug("Replying %@", body);
  probes::requestOutput(client_->pid(), [&] { return lmo::describe(body); });
  std::shared_ptr<lmo::Connection> peer = connection();
  if (!reply_ || !peer) return;
  base::Result<void> sent = peer->sendReply(*reply_);
  if (sent.has_value()) return;
  // The reply cannot be framed (too large or too deep). The client still
  // gets its one answer, as an error.
  server()->log("unable to send reply to pid %d: %@", client_->pid(), sent.error());
  lmo::Reply fallback{lmo::Dictionary{}, reply_->inReplyTo};
  fallback.body = fallback.body.setting(
      protocol::kKeyErrorCode,
      lmo::Value::unsignedInteger(static_cast<uint64_t>(protocol::kErrorBadRequest)));
  fallback.body =
      fallback.body.setting(protocol::kKeyError, lmo::Value(sent.error().description()));
  (void)peer->sendReply(fallback);
}

void Transaction::failMessage(int32_t code, std::string_view message) {
  const uint64_t wire = static_cast<uint64_t>(static_cast<int64_t>(code));
  setReplyValue(protocol::kKeyErrorCode, lmo::Value::unsignedInteger(wire));
  setReplyValue(protocol::kKeyError, lmo::Value(message));
  done();
}

void Transaction::failError(int32_t code, const base::Error& error) {
  if (error.domain == base::VTErrorDomain) {
    failMessage(static_cast<int32_t>(error.code), error.localizedDescription.value_or(""));
  } else {
    failMessage(code, error.description());
  }
}

bool Transaction::withinLimit(const char* what, size_t given, size_t limit) {
  if (given <= limit) return true;
  failMessage(protocol::kErrorBadRequest, base::format(kTooManyFormat, what, given, limit));
  return false;
}

bool Transaction::marshalPaths(const PathBlock& block) {
  const std::optional<lmo::Array> paths =
      lmo::lmo_dictionary_get_array(request(), protocol::kKeyPaths);
  if (!paths) {
    failMessage(protocol::kErrorBadRequest, "invalid request format");
    return false;
  }
  if (!withinLimit(protocol::kKeyPaths, paths->size(), kMaxPathsPerRequest)) return false;
  for (const lmo::Value& element : *paths) {
    const std::string* path = element.getIfString();
    if (path == nullptr) {
      failMessage(protocol::kErrorBadRequest, "invalid request format");
      return false;
    }
    if (path->empty() || path->front() != '/') {
      failMessage(protocol::kErrorBadPath,
                  base::format("absolute path required: %s", path->c_str()));
      return false;
    }
    const std::optional<std::string> canonical = canonicalPath(*path, *connection());
    if (!block(canonical.value_or(*path), canonical.has_value())) return false;
  }
  return true;
}

bool Transaction::processPaths(const PathBlock& block) {
  const bool accepted = marshalPaths(block);
  if (accepted) done();
  return accepted;
}

bool Transaction::processUuidList(const PlugInBlock& block) {
  const std::optional<Refusal> refusal = visitUuidList(block);
  if (refusal && refusal->code != 0) failMessage(refusal->code, refusal->message);
  return !refusal;
}

std::optional<Transaction::Refusal> Transaction::visitUuidList(const PlugInBlock& block) {
  const std::optional<lmo::Array> uuids =
      lmo::lmo_dictionary_get_array(request(), protocol::kKeyUuids);
  if (!uuids) return Refusal{protocol::kErrorBadRequest, "invalid request format (uuid)"};
  if (uuids->size() > kMaxUuidsPerRequest) {
    return Refusal{protocol::kErrorBadRequest, base::format(kTooManyFormat, protocol::kKeyUuids,
                                                            uuids->size(), kMaxUuidsPerRequest)};
  }
  for (const lmo::Value& element : *uuids) {
    const base::Uuid* uuid = element.getIfUuid();
    if (uuid == nullptr) {
      return Refusal{protocol::kErrorBadRequest, "invalid request (bad uuid array)"};
    }
    registry::VTDPlugInPtr plugIn = server()->findPlugIn(*uuid);
    if (!plugIn) return Refusal{protocol::kErrorBadRequest, "no such plugin (uuid not found)"};
    if (!block(plugIn)) return Refusal{0, ""};
  }
  return std::nullopt;
}

}  // namespace vantrel::daemon
