#pragma once
// A listener on a named service: the bound (or service-manager provided)
// socket that accepts peer connections and hands each to a handler on the
// listener's target queue.

#include <sys/types.h>

#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>

#include "base/Result.h"
#include "lmo/Connection.h"
#include "lmo/IoLoop.h"
#include "lmo/Limits.h"

namespace vantrel::lmo {

class Listener : public IoSource, public std::enable_shared_from_this<Listener> {
 public:
  // Gets a new connection, not yet resumed, targeted at the listener's
  // queue (setTargetQueue may change that before resume). A handler that
  // drops the connection without resuming it closes it.
  using ConnectionHandler = std::function<void(std::shared_ptr<Connection>)>;

  // Listens on the named service (see socketPathForService), creating the
  // socket's directory when missing. When the service manager handed over a
  // socket (LISTEN_PID is this process and LISTEN_FDS >= 1), descriptor 3 is
  // used instead, once per process. Otherwise a socket file left by a
  // listener that is gone is replaced, and the new one gets mode 0666.
  // Errors (domain "LMO"): a live listener already on the path, a path that
  // exists and is not a socket, a path too long for a socket address, a
  // handed-over descriptor that is not a listening stream socket, or the
  // system call that failed.
  static base::Result<std::shared_ptr<Listener>> create(std::string_view name,
                                                        QueuePtr targetQueue);

  ~Listener() override;
  Listener(const Listener&) = delete;
  Listener& operator=(const Listener&) = delete;

  void setConnectionHandler(ConnectionHandler handler);
  // Starts accepting; a handler must be set. Calling it again does nothing.
  void resume();
  // Stops accepting and closes the socket (removing the socket file when
  // this listener bound it). Connections already accepted are unaffected.
  void cancel();

  // The socket path; empty for a socket handed over by the service manager.
  const std::string& path() const { return path_; }

  // IoSource
  void handleIo(uint32_t events) override;

 private:
  Listener(int fd, std::string path, QueuePtr targetQueue);
  void acceptOne(int fd);
  void close();

  // Constant after construction.
  const int fd_;
  const std::string path_;
  QueuePtr targetQueue_;  // set at construction, released in the destructor
  ino_t inode_ = 0;       // of the socket file we bound, to remove only our own

  // I/O thread only.
  int reserveFd_ = -1;  // given up to accept (and drop) a peer when out of descriptors

  mutable std::mutex mutex_;
  ConnectionHandler handler_;  // Guarded by mutex_.
  uint64_t token_ = 0;         // Guarded by mutex_.
  bool resumed_ = false;       // Guarded by mutex_.
  bool closed_ = false;        // Guarded by mutex_.
};

}  // namespace vantrel::lmo
