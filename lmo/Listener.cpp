#include "lmo/Listener.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>

#include "base/Check.h"
#include "base/Log.h"
#include "lmo/LmoError.h"
#include "lmo/ServicePath.h"

namespace vantrel::lmo {
namespace {

constexpr int kActivatedFd = 3;
// Accepts per wake-up, so a connection flood cannot hold the I/O thread.
constexpr int kMaxAcceptsPerWakeup = 64;

std::atomic<bool> gActivatedFdTaken{false};

base::Error systemError(const char* what, const std::string& path) {
  return lmoErrorf(kLmoTransport, "%s %s: %s", what, path, std::strerror(errno));
}

// Descriptor 3 when the service manager handed this process a socket and no
// listener has taken it yet; -1 otherwise.
int activatedSocket() {
  const char* pid = std::getenv("LISTEN_PID");
  const char* fds = std::getenv("LISTEN_FDS");
  if (pid == nullptr || fds == nullptr) return -1;
  if (std::strtoll(pid, nullptr, 10) != ::getpid() || std::strtoll(fds, nullptr, 10) < 1) {
    return -1;
  }
  if (gActivatedFdTaken.exchange(true)) return -1;
  return kActivatedFd;
}

bool fillAddress(sockaddr_un& addr, const std::string& path) {
  addr = sockaddr_un{};
  addr.sun_family = AF_UNIX;
  if (path.size() >= sizeof addr.sun_path) return false;
  std::memcpy(addr.sun_path, path.data(), path.size());
  return true;
}

// Removes a socket file that no listener answers on. Errors when a listener
// does answer, or when the path holds something else.
base::Result<void> clearStaleSocket(const std::string& path, const sockaddr_un& addr) {
  struct stat st {};
  if (::lstat(path.c_str(), &st) != 0) {
    if (errno == ENOENT) return base::Result<void>::success();
    return systemError("unable to inspect", path);
  }
  if (!S_ISSOCK(st.st_mode)) return lmoErrorf(kLmoTransport, "%s exists and is not a socket", path);
  int probe = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (probe < 0) return systemError("unable to probe", path);
  int r = ::connect(probe, reinterpret_cast<const sockaddr*>(&addr), sizeof addr);
  int error = errno;
  ::close(probe);
  if (r == 0) return lmoErrorf(kLmoTransport, "a listener is already running on %s", path);
  if (error != ECONNREFUSED) {
    errno = error;
    return systemError("unable to probe", path);
  }
  if (::unlink(path.c_str()) != 0 && errno != ENOENT) return systemError("unable to remove", path);
  return base::Result<void>::success();
}

}  // namespace

Listener::Listener(int fd, std::string path, QueuePtr targetQueue)
    : fd_(fd), path_(std::move(path)), targetQueue_(std::move(targetQueue)) {
  // Set on the listening socket, the kernel records the writer of every byte
  // a peer sends, also before its connection is accepted (accepted sockets
  // inherit it); see Connection's reads.
  const int on = 1;
  ::setsockopt(fd_, SOL_SOCKET, SO_PASSCRED, &on, sizeof on);
  reserveFd_ = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
  struct stat st {};
  if (!path_.empty() && ::stat(path_.c_str(), &st) == 0) inode_ = st.st_ino;
}

base::Result<std::shared_ptr<Listener>> Listener::create(std::string_view name,
                                                         QueuePtr targetQueue) {
  VT_CHECK(targetQueue != nullptr, "listener without a target queue");
  if (int fd = activatedSocket(); fd >= 0) {
    int accepting = 0, domain = 0;
    socklen_t len = sizeof accepting;
    socklen_t dlen = sizeof domain;
    if (::getsockopt(fd, SOL_SOCKET, SO_ACCEPTCONN, &accepting, &len) != 0 || !accepting ||
        ::getsockopt(fd, SOL_SOCKET, SO_DOMAIN, &domain, &dlen) != 0 || domain != AF_UNIX) {
      return lmoError(kLmoTransport, "descriptor 3 is not a listening AF_UNIX socket");
    }
    ::fcntl(fd, F_SETFL, ::fcntl(fd, F_GETFL) | O_NONBLOCK);
    ::fcntl(fd, F_SETFD, FD_CLOEXEC);
    return std::shared_ptr<Listener>(new Listener(fd, std::string(), std::move(targetQueue)));
  }

  std::string path = socketPathForService(name);
  sockaddr_un addr;
  if (!fillAddress(addr, path)) return lmoErrorf(kLmoTransport, "socket path too long: %s", path);
  std::error_code ec;
  std::filesystem::create_directories(std::filesystem::path(path).parent_path(), ec);
  if (ec)
    return lmoErrorf(kLmoTransport, "unable to create the directory of %s: %s", path, ec.message());
  VT_TRY(clearStaleSocket(path, addr));

  int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
  if (fd < 0) return systemError("unable to create a socket for", path);
  if (::bind(fd, reinterpret_cast<const sockaddr*>(&addr), sizeof addr) != 0) {
    base::Error e = systemError("unable to bind", path);
    ::close(fd);
    return e;
  }
  // Anyone may connect; what a peer may do is decided by its entitlements.
  if (::chmod(path.c_str(), 0666) != 0 || ::listen(fd, SOMAXCONN) != 0) {
    base::Error e = systemError("unable to listen on", path);
    ::close(fd);
    ::unlink(path.c_str());
    return e;
  }
  return std::shared_ptr<Listener>(new Listener(fd, std::move(path), std::move(targetQueue)));
}

Listener::~Listener() {
  if (!closed_) close();
  if (reserveFd_ >= 0) ::close(reserveFd_);
  releaseQueue(std::move(targetQueue_));
}

void Listener::close() {
  ::close(fd_);
  struct stat st {};
  if (!path_.empty() && ::stat(path_.c_str(), &st) == 0 && st.st_ino == inode_) {
    ::unlink(path_.c_str());
  }
}

void Listener::setConnectionHandler(ConnectionHandler handler) {
  std::lock_guard lock(mutex_);
  handler_ = std::move(handler);
}

void Listener::resume() {
  std::lock_guard lock(mutex_);
  VT_CHECK(handler_ != nullptr, "listener resumed without a connection handler");
  if (resumed_ || closed_) return;
  resumed_ = true;
  token_ = IoLoop::shared().add(fd_, EPOLLIN, shared_from_this());
}

void Listener::cancel() {
  auto self = shared_from_this();
  IoLoop::shared().post([self] {
    std::lock_guard lock(self->mutex_);
    if (self->closed_) return;
    self->closed_ = true;
    if (self->token_ != 0) IoLoop::shared().remove(self->fd_, self->token_);
    self->token_ = 0;
    self->close();
  });
}

void Listener::handleIo(uint32_t) {
  for (int i = 0; i < kMaxAcceptsPerWakeup; ++i) {
    int fd = ::accept4(fd_, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
    if (fd >= 0) {
      acceptOne(fd);
      continue;
    }
    if (errno == EINTR || errno == ECONNABORTED) continue;
    if (errno == EAGAIN || errno == EWOULDBLOCK) return;
    base::vtlog("unable to accept a connection: %s", std::strerror(errno));
    if ((errno == EMFILE || errno == ENFILE) && reserveFd_ >= 0) {
      // Out of descriptors: the pending peer would keep the socket readable
      // for ever. Free the reserve, accept that peer and close it at once.
      ::close(reserveFd_);
      int dropped = ::accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC);
      if (dropped >= 0) ::close(dropped);
      reserveFd_ = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
    }
    return;
  }
}

void Listener::acceptOne(int fd) {
  if (Connection::openCount() >= kMaxOpenConnections) {
    base::vtlog("refusing a connection: %u connections are open", Connection::openCount());
    ::close(fd);
    return;
  }
  ConnectionHandler handler;
  {
    std::lock_guard lock(mutex_);
    handler = handler_;
  }
  auto connection = Connection::fromAcceptedSocket(fd, targetQueue_);
  // Root and this process's own user may use every slot; any other user
  // leaves the reserve alone and holds at most its own share, so no one
  // user can lock the others (or the administrator) out. A refused
  // connection closes as it goes out of scope.
  const uid_t uid = connection->uid();
  if (uid != 0 && uid != ::geteuid()) {
    const size_t open = Connection::openCount();
    if (open > kMaxOpenConnections - kReservedConnections) {
      base::vtlog("refusing a connection from uid %d: %u connections are open", uid, open - 1);
      return;
    }
    const size_t mine = Connection::openCountForUser(uid);
    if (mine > kMaxConnectionsPerUser) {
      base::vtlog("refusing a connection from uid %d: %u connections of that user are open", uid,
                  mine - 1);
      return;
    }
  }
  targetQueue_->async(
      [handler = std::move(handler), connection = std::move(connection)] { handler(connection); });
}

}  // namespace vantrel::lmo
