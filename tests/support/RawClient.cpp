#include "tests/support/RawClient.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>

#include "lmo/Protocol.h"

namespace vantrel::testing {

RawClient::RawClient(const std::string& path, std::chrono::seconds timeout, bool inheritable)
    : fd_(::socket(AF_UNIX, SOCK_STREAM | (inheritable ? 0 : SOCK_CLOEXEC), 0)) {
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  path.copy(addr.sun_path, sizeof addr.sun_path - 1);
  const timeval limit{static_cast<time_t>(timeout.count()), 0};
  ::setsockopt(fd_, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
  if (::connect(fd_, reinterpret_cast<const sockaddr*>(&addr), sizeof addr) != 0) close();
}

RawClient RawClient::adopt(int fd) {
  return RawClient(fd);
}

RawClient::RawClient(RawClient&& other) noexcept
    : fd_(other.fd_), lastId_(other.lastId_), reader_(std::move(other.reader_)) {
  other.fd_ = -1;
}

RawClient::~RawClient() {
  close();
}

bool RawClient::write(const std::vector<uint8_t>& bytes) {
  return fd_ >= 0 && ::send(fd_, bytes.data(), bytes.size(), MSG_NOSIGNAL) == ssize_t(bytes.size());
}

bool RawClient::send(lmo::FrameKind kind, uint64_t id, const lmo::Dictionary& body) {
  base::Result<std::vector<uint8_t>> bytes = lmo::encodeFrame({kind, id, 0, body});
  return bytes.has_value() && write(bytes.value());
}

std::optional<base::Result<lmo::Frame>> RawClient::readFrame() {
  for (;;) {
    if (auto frame = reader_.next()) return frame;
    uint8_t buffer[4096];
    const ssize_t n = receive(buffer, sizeof buffer);
    if (n <= 0) return std::nullopt;
    reader_.feed(buffer, static_cast<size_t>(n));
  }
}

std::optional<lmo::Dictionary> RawClient::call(std::string_view type, lmo::Dictionary extras) {
  const lmo::Dictionary body =
      extras.setting(protocol::kKeyRequest, lmo::Value(std::string(type)))
          .setting(protocol::kKeyVersion, lmo::Value::unsignedInteger(protocol::kCurrentVersion));
  if (send(lmo::FrameKind::kRequest, ++lastId_, body)) {
    std::optional<base::Result<lmo::Frame>> reply = readFrame();
    if (reply && reply->has_value()) return std::move(reply->value().body);
  }
  close();
  return std::nullopt;
}

ssize_t RawClient::receive(uint8_t* buffer, size_t size) {
  ssize_t n;
  while ((n = ::recv(fd_, buffer, size, 0)) < 0 && errno == EINTR) {
  }
  return n;
}

void RawClient::shutdown(int how) {
  ::shutdown(fd_, how);
}

void RawClient::close() {
  if (fd_ >= 0) ::close(fd_);
  fd_ = -1;
}

}  // namespace vantrel::testing
