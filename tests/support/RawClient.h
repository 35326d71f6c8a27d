#pragma once
// A plain blocking socket to the daemon, with no client library between the
// test and the bytes: frames (or garbage) out, frames back. Tests use it to
// send what the library never would, and the test peer to hand its
// connection to another program across fork or exec.

#include <sys/types.h>

#include <chrono>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/Result.h"
#include "lmo/Frame.h"
#include "lmo/Value.h"

namespace vantrel::testing {

class RawClient {
 public:
  // Connects to the socket at path; a read gives up after timeout. With
  // inheritable, the descriptor survives exec.
  explicit RawClient(const std::string& path,
                     std::chrono::seconds timeout = std::chrono::seconds(30),
                     bool inheritable = false);
  // Adopts an open, connected descriptor.
  static RawClient adopt(int fd);
  ~RawClient();
  RawClient(RawClient&& other) noexcept;
  RawClient& operator=(RawClient&&) = delete;
  RawClient(const RawClient&) = delete;
  RawClient& operator=(const RawClient&) = delete;

  bool connected() const { return fd_ >= 0; }
  int fd() const { return fd_; }

  bool write(const std::vector<uint8_t>& bytes);
  bool send(lmo::FrameKind kind, uint64_t id, const lmo::Dictionary& body);
  // The next frame; nullopt at end of stream or when none comes in time, an
  // error for bytes that are no frame.
  std::optional<base::Result<lmo::Frame>> readFrame();
  // Sends {"request": type, "version": <current>} over extras as the next
  // request and returns the reply's body; nullopt when the connection fails
  // or the reply is no frame, which also closes the connection.
  std::optional<lmo::Dictionary> call(std::string_view type, lmo::Dictionary extras = {});
  // One read from the socket, retried on EINTR.
  ssize_t receive(uint8_t* buffer, size_t size);

  void shutdown(int how);
  void close();

 private:
  explicit RawClient(int fd) : fd_(fd) {}

  int fd_;
  uint64_t lastId_ = 0;
  lmo::FrameReader reader_;
};

}  // namespace vantrel::testing
