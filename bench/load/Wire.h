#pragma once
// The load benchmark's side of the wire: whole frames over AF_UNIX stream
// sockets and nothing between the socket and the bytes. The daemon, the
// ping-pong answerer and the epoll server are all driven through this code,
// so that the client's share of every round trip is the same in each row.
//
// Requests are encoded once; each send only writes the id into the header.
// Replies are checked by their header and by the first bytes of the body
// (the CBOR heads), never decoded in the timed path.

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "lmo/Value.h"

namespace vantrel::bench::load {

using Bytes = std::vector<uint8_t>;

// How much one socket read asks for at most: a "match" reply of 100 forms
// arrives in a few reads, a request or an empty reply in one.
inline constexpr size_t kReadSize = 64 * 1024;

// A kind-1 frame (length prefix included) with body, id 1.
Bytes requestFrame(const lmo::Dictionary& body);

// Header fields of a whole frame, length prefix included (docs/protocol.md).
uint8_t frameKind(std::span<const uint8_t> frame);
uint64_t frameId(std::span<const uint8_t> frame);
uint64_t frameInReplyTo(std::span<const uint8_t> frame);
std::span<const uint8_t> frameBody(std::span<const uint8_t> frame);
void setFrameId(std::span<uint8_t> frame, uint64_t id);
void setFrameInReplyTo(std::span<uint8_t> frame, uint64_t id);

// Splits a byte stream into whole frames. Read into space(), commit() what
// arrived, then take frames from next() until it yields none.
class FrameSplitter {
 public:
  // Room for at least size more bytes; valid until the next call.
  uint8_t* space(size_t size);
  void commit(size_t size) { end_ += size; }
  // The next whole frame, valid until the next space(); empty when more
  // bytes are needed or once bad().
  std::span<uint8_t> next();
  // A length below the header or above the protocol's limit was read: the
  // stream cannot be split any further.
  bool bad() const { return bad_; }

 private:
  Bytes buffer_;
  size_t begin_ = 0;  // first byte not yet returned
  size_t end_ = 0;    // end of the bytes read
  bool bad_ = false;
};

// A connected blocking socket that carries frames; closes it when destroyed.
class FrameSocket {
 public:
  explicit FrameSocket(int fd) : fd_(fd) {}
  ~FrameSocket();
  FrameSocket(const FrameSocket&) = delete;
  FrameSocket& operator=(const FrameSocket&) = delete;

  bool send(std::span<const uint8_t> frame);
  // The next whole frame; empty at the end of the stream, on a read error or
  // on a stream that is not frames.
  std::span<uint8_t> receive();

 private:
  int fd_;
  FrameSplitter splitter_;
};

// A blocking stream socket connected to path; -1 when nothing listens there.
int connectTo(const std::string& path);
// A listening stream socket bound to path (which must not exist); -1 on failure.
int listenOn(const std::string& path);
// Whole-buffer write on a blocking descriptor; false when it fails (the
// program ignores SIGPIPE, so a peer gone is a failed write).
bool writeAll(int fd, const void* data, size_t size);
// Whole-buffer read; false at the end of the stream or on an error.
bool readAll(int fd, void* data, size_t size);

// What a reply must be for a run to count it: the empty map "annotate" with
// an empty change gets, or {"matches": [...]} with exactly that many forms.
struct ReplyCheck {
  std::optional<uint64_t> matches;
};

// Why frame is not the reply to request id that check asks for; nullopt when
// it is.
std::optional<std::string> checkReply(std::span<const uint8_t> frame, uint64_t id,
                                      const ReplyCheck& check);

// The number of forms in the body of a "match" reply, read from its CBOR
// heads; nullopt for any other body (an error reply, another shape).
std::optional<uint64_t> matchCount(std::span<const uint8_t> body);

}  // namespace vantrel::bench::load
