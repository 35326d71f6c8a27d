#include "daemon/VTDLmoClient.h"

#include <unistd.h>

#include <chrono>

#include "base/Format.h"
#include "daemon/Limits.h"
#include "daemon/Transaction.h"
#include "daemon/VTDServer.h"
#include "lmo/Protocol.h"
#include "model/FileUrl.h"
#include "platform/Probes.h"
#include "platform/ProcessInfo.h"

namespace vantrel::daemon {

VTDLmoClientPtr VTDLmoClient::initWithConnection(std::shared_ptr<lmo::Connection> connection,
                                                 std::shared_ptr<VTDServer> server) {
  VTDLmoClientPtr client(new VTDLmoClient());
  client->connection_ = connection;
  client->server_ = std::move(server);
  client->identifyPeer(*connection);
  connection->setContext(client);
  connection->setEventHandler([client](const lmo::Event& event) { client->handleEvent(event); });
  // A message only becomes a transaction handed to the service queue: the
  // I/O thread may do that itself and spare a thread wake-up per request.
  connection->setInlineMessageDelivery(true);
  connection->resume();
  return client;
}

VTDLmoClient::~VTDLmoClient() = default;

void VTDLmoClient::identifyPeer(const lmo::Connection& connection) {
  pid_ = connection.pid();
  uid_ = connection.uid();
  logBudget_ = std::make_unique<base::LogBudget>(base::format("client %d", pid_),
                                                 kPeerLogLinesBurst, kPeerLogLinesPerSecond);
  const std::optional<std::string> executable = platform::processExecutablePath(pid_);
  if (executable) {
    bundle_ = model::VTBundle::initWithExecutableURL(model::FileUrl::fromPath(*executable));
  }
  server_->debug("client %d %s", pid_, executable ? executable->c_str() : "(unknown executable)");
  probes::clientNew(pid_);
  pidfd_ = connection.pidfd();
  executable_ = platform::processExecutableIdentity(pid_);
  base::Result<platform::CodeSigningTaskPtr> task =
      platform::CodeSigningTask::create(pid_, connection.pidfd());
  if (task.has_value()) {
    task_ = std::move(task).value();
  } else {
    taskError_ = task.error();
  }
}

void VTDLmoClient::handleEvent(const lmo::Event& event) {
  base::LogBudgetScope charged(logBudget_.get());
  if (const lmo::IncomingMessage* message = event.message()) {
    handleMessage(*message);
    return;
  }
  switch (*event.error()) {
    case lmo::ErrorEvent::kTerminationImminent:
      dying();
      return;
    case lmo::ErrorEvent::kConnectionInvalid:
      dead();
      return;
  }
  server_->log("unexpected error %@", event);
}

void VTDLmoClient::handleMessage(const lmo::IncomingMessage& message) {
  if (server_->verbose() >= kVerboseDumps) server_->debug("incoming request %@", message.body());
  probes::requestInput(pid_, [&] { return lmo::describe(message.body()); });
  std::shared_ptr<Transaction> transaction =
      Transaction::initWithRequest(message, shared_from_this());
  server_->submitRequest([transaction, client = shared_from_this()]() mutable {
    const auto started = std::chrono::steady_clock::now();
    {
      base::LogBudgetScope charged(client->logBudget());
      client->countRequest();
      transaction->dispatch();
      // What the request built goes now, unless it goes on elsewhere.
      transaction.reset();
    }
    client->server()->requestFinished(std::chrono::steady_clock::now() - started);
  });
}

void VTDLmoClient::countRequest() {
  server_->mainQueue()->assertCurrent();
  ++requestCount_;
  if (requestCount_ % kRequestCountReportInterval == 0) {
    server_->debug("client %d used %u requests so far", pid_, requestCount_);
  }
}

uint32_t VTDLmoClient::requestCount() const {
  server_->mainQueue()->assertCurrent();
  return requestCount_;
}

void VTDLmoClient::dying() {
  server_->debug("client %d termination imminent", pid_);
}

void VTDLmoClient::dead() {
  server_->unholdClient(*this);
  server_->debug("client %d is dead", pid_);
  setAcceptWork(false);
  probes::clientDone(pid_);
}

namespace {

// This thread's VTDLmoClient::ExecutableReadOnce: whether one is open, and
// the client whose answer it holds.
struct ExecutableRead {
  bool active = false;
  const VTDLmoClient* client = nullptr;
  bool runs = false;
};
thread_local ExecutableRead tlsExecutableRead;

}  // namespace

VTDLmoClient::ExecutableReadOnce::ExecutableReadOnce() : outermost_(!tlsExecutableRead.active) {
  if (outermost_) tlsExecutableRead.active = true;
}

VTDLmoClient::ExecutableReadOnce::~ExecutableReadOnce() {
  if (outermost_) tlsExecutableRead = ExecutableRead{};
}

bool VTDLmoClient::runsIdentifiedExecutable() const {
  ExecutableRead& once = tlsExecutableRead;
  if (once.active && once.client == this) return once.runs;
  const bool runs = readRunsIdentifiedExecutable();
  // A request has one client; another checked inside it is read each time.
  if (once.active && once.client == nullptr) {
    once.client = this;
    once.runs = runs;
  }
  return runs;
}

bool VTDLmoClient::readRunsIdentifiedExecutable() const {
  if (!executable_) return true;  // never read: the task could not be made either
  const std::optional<platform::FileIdentity> now = platform::processExecutableIdentity(pid_);
  // Gone, or a zombie: it runs nothing else, and what it was identified
  // with stands (a hold it took is still its own).
  if (!now || *now == *executable_) return true;
  // Another file under that pid: the peer exec'd, unless the pid now
  // belongs to another process and the peer is gone.
  return pidfd_ >= 0 && !platform::checkProcessIdentity(pid_, pidfd_).has_value();
}

lmo::Value VTDLmoClient::entitlementValueForKey(std::string_view key) const {
  if (!task_) {
    server_->log("error retrieving entitlements for pid %d", pid_);
    return lmo::Value();
  }
  // Entitlements belong to the executable read at connection time: a peer
  // that has exec'd another program since holds none of them.
  if (!runsIdentifiedExecutable()) {
    server_->log(
        "pid %d no longer runs the executable it connected with; its entitlements are "
        "not honoured",
        pid_);
    return lmo::Value();
  }
  platform::CodeSigningTask::Entitlement entitlement = task_->copyValueForEntitlement(key);
  if (entitlement.error) server_->log("error retrieving entitlements for pid %d", pid_);
  return entitlement.value;
}

bool VTDLmoClient::hasEntitlement(std::string_view key) const {
  return granted(entitlementValueForKey(key));
}

bool VTDLmoClient::mayChangeState() const {
  if (uid_ == 0 || uid_ == ::geteuid()) return true;
  return hasEntitlement(protocol::kManagerEntitlement);
}

std::string VTDLmoClient::description() const {
  const std::shared_ptr<lmo::Connection> connection = connection_.lock();
  if (!connection) return base::format("<VTDLmoClient %p NO CONNECTION>", this);
  return base::format("<VTDLmoClient %p pid=%d con=%@>", this, pid_, *connection);
}

std::string describe(const VTDLmoClient& client) {
  return client.description();
}

}  // namespace vantrel::daemon
