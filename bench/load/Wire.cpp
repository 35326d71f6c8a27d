#include "bench/load/Wire.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "lmo/Cbor.h"
#include "lmo/Frame.h"
#include "lmo/Protocol.h"

namespace vantrel::bench::load {
namespace {

// Header offsets after the length prefix.
constexpr size_t kKindOffset = lmo::kFrameLengthSize + 1;
constexpr size_t kIdOffset = lmo::kFrameLengthSize + 4;
constexpr size_t kInReplyToOffset = kIdOffset + 8;
constexpr size_t kBodyOffset = lmo::kFrameLengthSize + lmo::kFrameHeaderSize;
// How much of an unexpected reply a message shows.
constexpr size_t kShownReply = 300;

uint64_t readBigEndian(std::span<const uint8_t> bytes, size_t offset, int size) {
  uint64_t value = 0;
  for (int i = 0; i < size; ++i) value = value << 8 | bytes[offset + static_cast<size_t>(i)];
  return value;
}

void writeBigEndian(std::span<uint8_t> bytes, size_t offset, uint64_t value) {
  for (int i = 7; i >= 0; --i, value >>= 8) bytes[offset + static_cast<size_t>(i)] = value & 0xFF;
}

sockaddr_un addressOf(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  path.copy(address.sun_path, sizeof address.sun_path - 1);
  return address;
}

std::string describeBody(std::span<const uint8_t> body) {
  auto decoded = lmo::decodeCborMessage(body.data(), body.size());
  if (!decoded.has_value()) return "an undecodable body: " + decoded.error().description();
  return lmo::describe(decoded.value()).substr(0, kShownReply);
}

}  // namespace

Bytes requestFrame(const lmo::Dictionary& body) {
  return lmo::encodeFrame({lmo::FrameKind::kRequest, 1, 0, body}).value();
}

uint8_t frameKind(std::span<const uint8_t> frame) {
  return frame[kKindOffset];
}
uint64_t frameId(std::span<const uint8_t> frame) {
  return readBigEndian(frame, kIdOffset, 8);
}
uint64_t frameInReplyTo(std::span<const uint8_t> frame) {
  return readBigEndian(frame, kInReplyToOffset, 8);
}
std::span<const uint8_t> frameBody(std::span<const uint8_t> frame) {
  return frame.subspan(kBodyOffset);
}
void setFrameId(std::span<uint8_t> frame, uint64_t id) {
  writeBigEndian(frame, kIdOffset, id);
}
void setFrameInReplyTo(std::span<uint8_t> frame, uint64_t id) {
  writeBigEndian(frame, kInReplyToOffset, id);
}

uint8_t* FrameSplitter::space(size_t size) {
  if (begin_ == end_) begin_ = end_ = 0;
  if (buffer_.size() - end_ < size) {
    // Move the unfinished frame to the front before growing (an empty
    // buffer has no data pointer to move from).
    if (end_ != begin_) std::memmove(buffer_.data(), buffer_.data() + begin_, end_ - begin_);
    end_ -= begin_;
    begin_ = 0;
    if (buffer_.size() - end_ < size) buffer_.resize(end_ + size);
  }
  return buffer_.data() + end_;
}

std::span<uint8_t> FrameSplitter::next() {
  const size_t available = end_ - begin_;
  if (bad_ || available < lmo::kFrameLengthSize) return {};
  const std::span<uint8_t> pending(buffer_.data() + begin_, available);
  const uint64_t length = readBigEndian(pending, 0, lmo::kFrameLengthSize);
  if (length < lmo::kFrameHeaderSize || length > lmo::kMaxFrameLength) {
    bad_ = true;
    return {};
  }
  const size_t whole = lmo::kFrameLengthSize + length;
  if (available < whole) return {};
  begin_ += whole;
  return pending.first(whole);
}

FrameSocket::~FrameSocket() {
  if (fd_ >= 0) ::close(fd_);
}

bool FrameSocket::send(std::span<const uint8_t> frame) {
  return writeAll(fd_, frame.data(), frame.size());
}

std::span<uint8_t> FrameSocket::receive() {
  for (;;) {
    if (std::span<uint8_t> frame = splitter_.next(); !frame.empty()) return frame;
    if (splitter_.bad()) return {};
    const ssize_t n = ::read(fd_, splitter_.space(kReadSize), kReadSize);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return {};
    splitter_.commit(static_cast<size_t>(n));
  }
}

int connectTo(const std::string& path) {
  const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  const sockaddr_un address = addressOf(path);
  if (fd >= 0 && ::connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0) {
    return fd;
  }
  if (fd >= 0) ::close(fd);
  return -1;
}

int listenOn(const std::string& path) {
  const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  const sockaddr_un address = addressOf(path);
  if (fd >= 0 && ::bind(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0 &&
      ::listen(fd, SOMAXCONN) == 0) {
    return fd;
  }
  if (fd >= 0) ::close(fd);
  return -1;
}

bool writeAll(int fd, const void* data, size_t size) {
  const auto* bytes = static_cast<const uint8_t*>(data);
  while (size > 0) {
    const ssize_t n = ::write(fd, bytes, size);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    bytes += n;
    size -= static_cast<size_t>(n);
  }
  return true;
}

bool readAll(int fd, void* data, size_t size) {
  auto* bytes = static_cast<uint8_t*>(data);
  while (size > 0) {
    const ssize_t n = ::read(fd, bytes, size);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    bytes += n;
    size -= static_cast<size_t>(n);
  }
  return true;
}

std::optional<std::string> checkReply(std::span<const uint8_t> frame, uint64_t id,
                                      const ReplyCheck& check) {
  if (frameKind(frame) != static_cast<uint8_t>(lmo::FrameKind::kReply) ||
      frameInReplyTo(frame) != id) {
    return "a frame that is not the reply to request " + std::to_string(id);
  }
  const std::span<const uint8_t> body = frameBody(frame);
  if (check.matches) {
    const std::optional<uint64_t> count = matchCount(body);
    if (count == check.matches) return std::nullopt;
    return "a reply with " + (count ? std::to_string(*count) : "no") + " forms instead of " +
           std::to_string(*check.matches) + ": " + describeBody(body);
  }
  // An empty map.
  if (body.size() == 1 && body[0] == 0xA0) return std::nullopt;
  return "a reply that is not the empty map: " + describeBody(body);
}

std::optional<uint64_t> matchCount(std::span<const uint8_t> body) {
  // A map of one entry, the key "matches" as CBOR text, then the array's
  // head: major type 4, the count inline below 24, otherwise in the 1, 2, 4
  // or 8 bytes that follow.
  static const Bytes key = lmo::encodeCbor(lmo::Value(protocol::kKeyMatches)).value();
  if (body.size() < 2 + key.size() || body[0] != 0xA1 ||
      !std::equal(key.begin(), key.end(), body.begin() + 1)) {
    return std::nullopt;
  }
  const std::span<const uint8_t> head = body.subspan(1 + key.size());
  if (head[0] >> 5 != 4) return std::nullopt;
  const uint8_t info = head[0] & 0x1F;
  if (info < 24) return info;
  if (info > 27) return std::nullopt;  // indefinite length or reserved
  const int size = 1 << (info - 24);
  if (head.size() < 1 + static_cast<size_t>(size)) return std::nullopt;
  return readBigEndian(head, 1, size);
}

}  // namespace vantrel::bench::load
