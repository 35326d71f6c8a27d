#pragma once
// Frames of the wire protocol. Each message on a connection is one frame:
//
//   u32 BE  L          length of what follows (header + body), 20 <= L <= 16 MiB
//   u8      version    1
//   u8      kind       1 expects a reply, 2 expects none, 3 is a reply
//   u16     reserved   0
//   u64 BE  id         chosen by the sender; non-zero, unique per direction
//   u64 BE  inReplyTo  for a reply the id it answers, otherwise 0
//   body               one CBOR map (see Cbor.h)

#include <cstddef>
#include <cstdint>
#include <optional>
#include <vector>

#include "base/Result.h"
#include "lmo/Limits.h"
#include "lmo/Value.h"

namespace vantrel::lmo {

inline constexpr uint8_t kFrameVersion = 1;
inline constexpr size_t kFrameLengthSize = 4;
inline constexpr size_t kFrameHeaderSize = 20;

enum class FrameKind : uint8_t { kRequest = 1, kMessage = 2, kReply = 3 };

struct Frame {
  FrameKind kind = FrameKind::kMessage;
  uint64_t id = 0;
  uint64_t inReplyTo = 0;
  Dictionary body;
};

// The bytes of one whole frame (length prefix included). Errors: a body too
// deep to encode, or a frame longer than kMaxFrameLength.
base::Result<std::vector<uint8_t>> encodeFrame(const Frame& frame);

// Splits a byte stream into frames as the bytes arrive. Feed it whatever a
// read returned, then call next() until it yields nothing. Once it has
// reported an error the stream is unusable and every later next() repeats
// that error. The reader never buffers more than one frame's bytes plus
// whatever was fed after them.
class FrameReader {
 public:
  void feed(const uint8_t* data, size_t size);

  // The next complete frame; nullopt when more bytes are needed. Errors
  // (domain "LMO"): a length above kMaxFrameLength (reported as soon as the
  // length is read, before the body arrives) or below the header size, an
  // unknown version or kind, a non-zero reserved field, an id of 0, an
  // in-reply-to that does not suit the kind, or a body that is not one
  // valid CBOR map.
  std::optional<base::Result<Frame>> next();

  // Bytes of an unfinished frame are buffered: a stream that ends now ends
  // in the middle of a frame.
  bool hasPartialFrame() const { return buffer_.size() > consumed_; }
  // Bytes fed and not yet returned as frames.
  size_t bufferedBytes() const { return buffer_.size() - consumed_; }
  // Frames returned so far.
  uint64_t framesRead() const { return framesRead_; }

 private:
  base::Result<Frame> parse(const uint8_t* p, size_t length) const;

  std::vector<uint8_t> buffer_;
  size_t consumed_ = 0;  // bytes of buffer_ already returned as frames
  uint64_t framesRead_ = 0;
  std::optional<base::Error> error_;
};

}  // namespace vantrel::lmo
