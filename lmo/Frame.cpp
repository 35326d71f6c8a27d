#include "lmo/Frame.h"

#include <cstring>

#include "lmo/Cbor.h"
#include "lmo/LmoError.h"

namespace vantrel::lmo {
namespace {

void putBE(std::vector<uint8_t>& out, uint64_t v, int bytes) {
  for (int i = bytes - 1; i >= 0; --i) out.push_back(static_cast<uint8_t>(v >> (8 * i)));
}

uint64_t getBE(const uint8_t* p, int bytes) {
  uint64_t v = 0;
  for (int i = 0; i < bytes; ++i) v = (v << 8) | p[i];
  return v;
}

// Buffered bytes already handed out are dropped once they are at least this
// many and at least half of the buffer, so compaction stays linear.
constexpr size_t kCompactThreshold = 64 * 1024;
// Buffer capacity kept between frames; more is released once drained.
constexpr size_t kRetainedBufferBytes = 256 * 1024;

}  // namespace

base::Result<std::vector<uint8_t>> encodeFrame(const Frame& frame) {
  std::vector<uint8_t> out;
  out.reserve(kFrameLengthSize + kFrameHeaderSize + 64);
  out.resize(kFrameLengthSize);  // the length, filled in below
  out.push_back(kFrameVersion);
  out.push_back(static_cast<uint8_t>(frame.kind));
  putBE(out, 0, 2);
  putBE(out, frame.id, 8);
  putBE(out, frame.inReplyTo, 8);
  VT_TRY(appendCbor(out, Value(frame.body)));
  size_t length = out.size() - kFrameLengthSize;
  if (length > kMaxFrameLength) {
    return lmoErrorf(kLmoLimitExceeded, "frame of %u bytes exceeds the limit of %u bytes", length,
                     kMaxFrameLength);
  }
  for (size_t i = 0; i < kFrameLengthSize; ++i) {
    out[i] = static_cast<uint8_t>(length >> (8 * (kFrameLengthSize - 1 - i)));
  }
  return out;
}

void FrameReader::feed(const uint8_t* data, size_t size) {
  if (error_) return;
  if (consumed_ >= kCompactThreshold && consumed_ * 2 >= buffer_.size()) {
    buffer_.erase(buffer_.begin(), buffer_.begin() + static_cast<ptrdiff_t>(consumed_));
    consumed_ = 0;
  }
  buffer_.insert(buffer_.end(), data, data + size);
}

std::optional<base::Result<Frame>> FrameReader::next() {
  if (error_) return base::Result<Frame>(*error_);
  size_t available = buffer_.size() - consumed_;
  if (available < kFrameLengthSize) return std::nullopt;
  const uint8_t* p = buffer_.data() + consumed_;
  uint64_t length = getBE(p, kFrameLengthSize);
  if (length > kMaxFrameLength) {
    error_ = lmoErrorf(kLmoLimitExceeded, "frame of %u bytes exceeds the limit of %u bytes", length,
                       kMaxFrameLength);
  } else if (length < kFrameHeaderSize) {
    error_ = lmoErrorf(kLmoMalformed, "frame of %u bytes is shorter than its header", length);
  }
  if (error_) return base::Result<Frame>(*error_);
  if (available < kFrameLengthSize + length) return std::nullopt;
  base::Result<Frame> frame = parse(p + kFrameLengthSize, static_cast<size_t>(length));
  if (!frame.has_value()) {
    error_ = frame.error();
    return frame;
  }
  consumed_ += kFrameLengthSize + length;
  ++framesRead_;
  if (consumed_ == buffer_.size()) {
    // A large frame's buffer is given back rather than kept for the life of
    // the connection: idle peers that once sent a big request hold nothing.
    if (buffer_.capacity() > kRetainedBufferBytes) {
      std::vector<uint8_t>().swap(buffer_);
    } else {
      buffer_.clear();
    }
    consumed_ = 0;
  }
  return frame;
}

base::Result<Frame> FrameReader::parse(const uint8_t* p, size_t length) const {
  uint8_t version = p[0];
  uint8_t kind = p[1];
  uint64_t reserved = getBE(p + 2, 2);
  Frame frame;
  frame.id = getBE(p + 4, 8);
  frame.inReplyTo = getBE(p + 12, 8);
  if (version != kFrameVersion)
    return lmoErrorf(kLmoMalformed, "unknown frame version %u", version);
  if (kind < 1 || kind > 3) return lmoErrorf(kLmoMalformed, "unknown frame kind %u", kind);
  if (reserved != 0) return lmoError(kLmoMalformed, "non-zero reserved field in a frame header");
  if (frame.id == 0) return lmoError(kLmoMalformed, "frame id 0");
  frame.kind = static_cast<FrameKind>(kind);
  bool isReply = frame.kind == FrameKind::kReply;
  if (isReply != (frame.inReplyTo != 0)) {
    return lmoErrorf(kLmoMalformed, "in-reply-to %u on a frame of kind %u", frame.inReplyTo, kind);
  }
  frame.body = VT_TRY(decodeCborMessage(p + kFrameHeaderSize, length - kFrameHeaderSize));
  return frame;
}

}  // namespace vantrel::lmo
