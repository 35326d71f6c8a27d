#include "tools/vantrelctl/Session.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "base/Format.h"
#include "lmo/Protocol.h"
#include "lmo/ServicePath.h"
#include "tools/vantrelctl/ExitStatus.h"

namespace vantrel::ctl {
namespace {

// Why connecting to path fails, tried once more on a socket of our own: the
// client library only says that it did.
std::string connectError(const std::string& path) {
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  if (path.size() >= sizeof addr.sun_path) return std::strerror(ENAMETOOLONG);
  std::memcpy(addr.sun_path, path.data(), path.size());
  const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (fd < 0) return std::strerror(errno);
  int result;
  do {
    result = ::connect(fd, reinterpret_cast<const sockaddr*>(&addr), sizeof addr);
  } while (result < 0 && errno == EINTR);
  const int error = errno;
  ::close(fd);
  return result == 0 ? std::string("the daemon closed the connection") : std::strerror(error);
}

}  // namespace

Session::Session(std::string service, std::chrono::milliseconds timeout)
    : service_(std::move(service)),
      socketPath_(lmo::socketPathForService(service_)),
      timeout_(timeout) {}

lmo::Dictionary Session::request(const char* type) {
  return lmo::Dictionary{
      {protocol::kKeyRequest, lmo::Value(type)},
      {protocol::kKeyVersion, lmo::Value::unsignedInteger(protocol::kCurrentVersion)}};
}

bool Session::connect() {
  if (failure_) return false;
  if (client_) return true;
  client_ = client::VTDaemonClient::initWithServiceName(service_.c_str());
  // A connection that never connected has no peer.
  if (client_->vantreld()->pid() >= 0) return true;
  failure_ = Answer{
      kExitUnreachable,
      {},
      0,
      base::format("cannot connect to vantreld at %@: %@", socketPath_, connectError(socketPath_))};
  return false;
}

Answer Session::call(const lmo::Dictionary& message) {
  if (!connect()) return *failure_;
  base::Result<lmo::Event> event = client_->sendSync(message, timeout_);
  if (!event.has_value()) {
    // Encoding errors cannot happen for what the tool sends; the rest is the
    // timeout.
    return Answer{kExitUnreachable,
                  {},
                  0,
                  base::format("no reply from vantreld at %@ within %@", socketPath_,
                               base::format("%u ms", static_cast<uint64_t>(timeout_.count())))};
  }
  if (event->isError()) {
    failure_ = Answer{kExitUnreachable,
                      {},
                      0,
                      base::format("lost the connection to vantreld at %@", socketPath_)};
    return *failure_;
  }
  Answer answer;
  answer.reply = event->message()->body();
  if (std::optional<base::Error> error = client::VTDaemonClient::errorInReply(event.value())) {
    answer.status = kExitRefused;
    answer.code = error->code;
    answer.message = base::format("%@ (code %d)", error->description(), error->code);
  }
  return answer;
}

std::optional<pid_t> Session::daemonPid() const {
  if (!client_ || client_->vantreld()->pid() < 0) return std::nullopt;
  return client_->vantreld()->pid();
}

int Session::complain(const Answer& answer) const {
  if (answer.ok()) return kExitOk;
  std::fprintf(stderr, "vantrelctl: %s\n", answer.message.c_str());
  if (answer.status == kExitUnreachable && answer.message.starts_with("cannot connect")) {
    std::fprintf(stderr,
                 "Start it with 'systemctl start vantreld.socket' or run 'vantreld -S %s'\n",
                 service_.c_str());
  }
  return answer.status;
}

}  // namespace vantrel::ctl
