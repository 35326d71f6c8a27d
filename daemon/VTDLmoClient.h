#pragma once
// One peer connection accepted on the daemon's listener: who the peer is
// (pid, executable bundle, entitlements) and the hand-off of its messages to
// the service queue as transactions.
//
// Ownership: the connection owns the client (as its context and through its
// event handler) until the connection has ended; the client refers to the
// connection weakly. Transactions hold their client, so a client outlives
// its connection while a transaction of it is queued.

#include <sys/types.h>

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "base/Error.h"
#include "base/Log.h"
#include "lmo/Connection.h"
#include "lmo/Value.h"
#include "model/VTBundle.h"
#include "platform/CodeSigning.h"
#include "platform/ProcessInfo.h"
#include "registry/VTDHost.h"

namespace vantrel::daemon {

class VTDServer;

// Requests of one client between two "used ... requests so far" lines.
inline constexpr uint32_t kRequestCountReportInterval = 1000;

class VTDLmoClient : public registry::VTDHost, public std::enable_shared_from_this<VTDLmoClient> {
 public:
  // Identifies the peer of connection, makes itself the connection's
  // context, installs its event handler and resumes the connection. Runs on
  // the listener's queue. Never null.
  static std::shared_ptr<VTDLmoClient> initWithConnection(
      std::shared_ptr<lmo::Connection> connection, std::shared_ptr<VTDServer> server);

  ~VTDLmoClient() override;
  VTDLmoClient(const VTDLmoClient&) = delete;
  VTDLmoClient& operator=(const VTDLmoClient&) = delete;

  // The peer's process id as the kernel gave it at connection time; kept
  // after the connection is gone.
  pid_t pid() const override { return pid_; }
  // The peer's effective uid at connection time; (uid_t)-1 when unknown.
  uid_t uid() const { return uid_; }
  // Whether the peer may change the daemon's state (elections, registered
  // bundles, holds): the daemon serves one user's choices, so only that
  // user, root and holders of the manager entitlement may.
  bool mayChangeState() const;

  // The value of one entitlement of the peer, or null. When the peer's
  // entitlements could not be read, "error retrieving entitlements for pid
  // %d" is logged and the value is null.
  lmo::Value entitlementValueForKey(std::string_view key) const override;
  // The entitlement exists and is not false.
  bool hasEntitlement(std::string_view key) const override;

  // While one is open on a thread, whether a client still runs the
  // executable it connected with is read once there, by the first lookup of
  // its entitlements: a request is one check, not one per plug-in it is
  // checked against. Nests: the outermost one ends the reading.
  class ExecutableReadOnce {
   public:
    ExecutableReadOnce();
    ~ExecutableReadOnce();
    ExecutableReadOnce(const ExecutableReadOnce&) = delete;
    ExecutableReadOnce& operator=(const ExecutableReadOnce&) = delete;

   private:
    const bool outermost_;
  };

  // "<VTDLmoClient %p pid=%d con=%@>", or "<VTDLmoClient %p NO CONNECTION>"
  // once the connection is gone.
  std::string description() const;

  // The connection's events: termination imminent (logged only) and
  // connection invalid (holds released, no more work accepted).
  void dying();
  void dead();

  // ---- Accessors ----

  // False once the connection has become invalid; read from any thread.
  bool acceptWork() const { return acceptWork_.load(); }
  void setAcceptWork(bool accept) { acceptWork_.store(accept); }
  std::shared_ptr<lmo::Connection> connection() const { return connection_.lock(); }
  const std::shared_ptr<VTDServer>& server() const { return server_; }
  // The bundle of the peer's executable; null when it has none or it could
  // not be read.
  const std::shared_ptr<model::VTBundle>& bundle() const { return bundle_; }
  // The peer's code-signing identity; null when it could not be read.
  const platform::CodeSigningTaskPtr& task() const { return task_; }
  // Requests submitted so far. Service queue only.
  uint32_t requestCount() const;
  // The lines this peer's messages and requests may make the daemon log
  // (charged while they are handled); never null after initWithConnection.
  base::LogBudget* logBudget() const { return logBudget_.get(); }

 private:
  VTDLmoClient() = default;
  void identifyPeer(const lmo::Connection& connection);
  // Whether the peer still runs the executable it was identified with;
  // read once per ExecutableReadOnce.
  bool runsIdentifiedExecutable() const;
  bool readRunsIdentifiedExecutable() const;
  void handleEvent(const lmo::Event& event);
  void handleMessage(const lmo::IncomingMessage& message);
  // Counts the request and reports every kRequestCountReportInterval-th.
  void countRequest();

  std::atomic<bool> acceptWork_{true};

  // Constant after initWithConnection.
  std::weak_ptr<lmo::Connection> connection_;
  std::shared_ptr<VTDServer> server_;
  pid_t pid_ = -1;
  uid_t uid_ = static_cast<uid_t>(-1);
  std::shared_ptr<model::VTBundle> bundle_;
  platform::CodeSigningTaskPtr task_;
  std::optional<base::Error> taskError_;  // why task_ is null
  // The file the peer ran when it was identified; entitlements are honoured
  // only while it still runs that file.
  std::optional<platform::FileIdentity> executable_;
  int pidfd_ = -1;  // the connection's, which outlives every request
  std::unique_ptr<base::LogBudget> logBudget_;

  uint32_t requestCount_ = 0;  // Owned by the server's service queue.
};

using VTDLmoClientPtr = std::shared_ptr<VTDLmoClient>;

std::string describe(const VTDLmoClient& client);

}  // namespace vantrel::daemon
