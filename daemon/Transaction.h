#pragma once
// One request being served: the envelope checks, the dispatch to the
// request's operation and the one reply.
//
// A transaction is made on the connection's event queue and runs dispatch()
// once on the service queue; everything else here runs there too. It holds
// its client (and through it the server) until it has replied. Every path
// through an operation ends in exactly one done() or fail...() call; a
// second reply stops the process.

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "base/Error.h"
#include "lmo/Connection.h"
#include "lmo/Event.h"
#include "lmo/Protocol.h"
#include "lmo/Value.h"
#include "registry/VTDPlugIn.h"

namespace vantrel::daemon {

class VTDLmoClient;
class VTDServer;
struct MatchState;
struct MatchHost;
enum class FormDetail;

// The canonical form of an absolute path a peer sent, resolved with the
// peer's right to look (its user and groups: see platform/PeerPaths.h), or
// nullopt when it does not exist, needs a directory the peer may not
// search, cannot be resolved, holds a NUL byte or resolves to something too
// long. The daemon could look anywhere; answering by what it found there
// would tell the peer what exists where the peer cannot look.
std::optional<std::string> canonicalPath(const std::string& path, const lmo::Connection& peer);

class Transaction : public std::enable_shared_from_this<Transaction> {
 public:
  // Gets (path, resolved): the canonical path and true, or the path as sent
  // and false when it could not be made canonical. Returns false to stop.
  using PathBlock = std::function<bool(const std::string& path, bool resolved)>;
  // Gets each plug-in named by the request; returns false to stop.
  using PlugInBlock = std::function<bool(const registry::VTDPlugInPtr& plugIn)>;

  static std::shared_ptr<Transaction> initWithRequest(lmo::IncomingMessage request,
                                                      std::shared_ptr<VTDLmoClient> client);

  // Checks the envelope and runs the request's operation. Service queue.
  void dispatch();

  // Sends the reply as it stands.
  void done();
  // Adds "errorcode" (code, sign-extended) and "error" to the reply and
  // sends it.
  void failMessage(int32_t code, std::string_view message);
  // As failMessage with the error's own code and description for an error
  // of the system's domain, else with code and the error's description.
  void failError(int32_t code, const base::Error& error);

  // Whether a request's count of what stays within limit; else replies
  // itself with code 4 "too many <what>: ..." and returns false.
  bool withinLimit(const char* what, size_t given, size_t limit);
  // Decodes "paths", handing each to block. On a decoding error it replies
  // itself and returns false; otherwise it sends nothing and returns whether
  // every path was accepted.
  bool marshalPaths(const PathBlock& block);
  // marshalPaths, then done() when every path was accepted.
  bool processPaths(const PathBlock& block);
  // Decodes "uuids" and looks each plug-in up, handing it to block. Replies
  // itself on a decoding or lookup error; sends nothing on success.
  bool processUuidList(const PlugInBlock& block);
  // A reply not sent yet: its code and text.
  struct Refusal {
    int32_t code;
    std::string message;
  };
  // As processUuidList without replying: the decoding or lookup error, or
  // nullopt. A block that returns false stops it and replied itself; that
  // gives a refusal with code 0.
  std::optional<Refusal> visitUuidList(const PlugInBlock& block);

  // ---- Operations, one per request type ----
  void addPlugIns();
  void removePlugIns();
  void bulkPlugIns();
  void matchPlugIns();
  void readyPlugIns();
  void accessPlugIns();
  void annotatePlugIns();
  void lockDownPlugIns();
  void explainPlugIn();

  // Sets the form's "annotations" to the plug-in's annotation (empty when
  // it has none).
  void addAnnotationForPlugIn(const registry::VTDPlugIn& plugIn, lmo::Dictionary& in);

  // Whether the client may make a request of this type that changes the
  // daemon's state; replies code 11 itself when it may not.
  bool allowStateChange(std::string_view type);

  // ---- Accessors ----
  const std::shared_ptr<VTDLmoClient>& client() const { return client_; }
  const lmo::Dictionary& request() const { return request_.body(); }
  // The reply so far; empty for a message that expects no reply.
  lmo::Dictionary reply() const { return reply_ ? reply_->body : lmo::Dictionary(); }
  // Adds key to the reply (nothing for a message that expects no reply).
  void setReplyValue(std::string_view key, lmo::Value value);
  uint64_t version() const { return version_; }
  const std::shared_ptr<VTDServer>& server() const;
  std::shared_ptr<lmo::Connection> connection() const;

 private:
  // ---- Discovery, shared by "match" and "explain" ----

  // Reads "rules" and "flags" (refusing an unauthorised kAll) and the
  // user's exclusions. Replies itself and returns false on an error.
  bool readMatchInput(std::optional<lmo::Dictionary>& rules, MatchState& state);
  // Visits every candidate of the registry (those of one identifier only,
  // when it is not empty) in the registry's order.
  void runMatch(MatchState& state, const std::optional<lmo::Dictionary>& rules,
                const MatchHost& host, FormDetail detail, std::string_view onlyIdentifier = {});
  // Runs the filters on one candidate and, when it passes them all, adds
  // its form to the results unless a duplicate beats it.
  void visitCandidate(const registry::VTDPlugIn& plugIn, MatchState& state,
                      const std::optional<lmo::Dictionary>& rules, const MatchHost& host,
                      FormDetail detail);
  bool keepCandidate(const registry::VTDPlugIn& plugIn, const MatchState& state,
                     const std::optional<lmo::Dictionary>& rules, const MatchHost& host);

  // ---- "explain" ----
  // Adds every key of keys to the reply and sends it.
  void replyWith(const lmo::Dictionary& keys);
  lmo::Dictionary explainStatus();
  lmo::Dictionary explainRecord(const omnidex::PlugInRecordPtr& record,
                                const std::optional<lmo::Dictionary>& rules, MatchState& state,
                                const MatchHost& host);

  Transaction(lmo::IncomingMessage request, std::shared_ptr<VTDLmoClient> client);

  // Constant after construction.
  const std::shared_ptr<VTDLmoClient> client_;
  const lmo::IncomingMessage request_;

  // Owned by the service queue.
  std::optional<lmo::Reply> reply_;
  uint64_t version_ = 0;
  bool replied_ = false;
};

using TransactionPtr = std::shared_ptr<Transaction>;

}  // namespace vantrel::daemon
