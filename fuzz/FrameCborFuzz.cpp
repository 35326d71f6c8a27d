// What a peer controls on a connection: frames and their CBOR bodies. The
// first byte picks the target, the rest is the input.
//  - Even: the CBOR decoder. Whatever decodes must encode, decode back to the
//    same value, and encode again to the same bytes (the encoding is
//    canonical).
//  - Odd: the frame reader, fed in chunks whose size comes from the first
//    byte. It must split the stream exactly as a reader fed the whole stream
//    at once does, and every frame it yields must encode and read back as
//    the same frame.

#include <cstddef>
#include <cstdint>
#include <vector>

#include "fuzz/FuzzSupport.h"
#include "lmo/Cbor.h"
#include "lmo/Frame.h"

namespace {

using namespace vantrel;
using lmo::Frame;
using lmo::FrameReader;

void checkCbor(const uint8_t* data, size_t size) {
  auto value = lmo::decodeCbor(data, size);
  if (!value.has_value()) return;
  auto bytes = lmo::encodeCbor(value.value());
  // Decoding bounds the depth the encoder accepts, so this cannot fail.
  FUZZ_REQUIRE(bytes.has_value(), "a decoded value encodes", bytes.error().description());
  auto again = lmo::decodeCbor(bytes.value().data(), bytes.value().size());
  FUZZ_REQUIRE(again.has_value(), "an encoded value decodes", again.error().description());
  FUZZ_REQUIRE(fuzz::sameValue(again.value(), value.value()), "decode(encode(v)) is v",
               describe(value.value()) + "\n" + describe(again.value()));
  auto bytesAgain = lmo::encodeCbor(again.value());
  FUZZ_REQUIRE(bytesAgain.has_value() && bytesAgain.value() == bytes.value(),
               "the encoding is canonical", describe(value.value()));
}

struct Split {
  std::vector<Frame> frames;
  bool failed = false;
};

bool sameFrame(const Frame& a, const Frame& b) {
  return a.kind == b.kind && a.id == b.id && a.inReplyTo == b.inReplyTo &&
         fuzz::sameValue(lmo::Value(a.body), lmo::Value(b.body));
}

// Drains reader into split; false once it has reported an error.
bool drain(FrameReader& reader, Split& split) {
  while (auto frame = reader.next()) {
    if (!frame->has_value()) {
      split.failed = true;
      return false;
    }
    split.frames.push_back(std::move(*frame).value());
  }
  return true;
}

void checkFrames(size_t chunk, const uint8_t* data, size_t size) {
  Split chunked;
  FrameReader reader;
  for (size_t i = 0; i < size; i += chunk) {
    reader.feed(data + i, size - i < chunk ? size - i : chunk);
    if (!drain(reader, chunked)) break;
  }
  Split whole;
  FrameReader wholeReader;
  wholeReader.feed(data, size);
  drain(wholeReader, whole);

  FUZZ_REQUIRE(chunked.failed == whole.failed && chunked.frames.size() == whole.frames.size(),
               "chunking does not change how a stream splits", "");
  for (size_t i = 0; i < whole.frames.size(); ++i) {
    FUZZ_REQUIRE(sameFrame(chunked.frames[i], whole.frames[i]),
                 "chunking does not change a frame", describe(whole.frames[i].body));
    auto bytes = lmo::encodeFrame(whole.frames[i]);
    FUZZ_REQUIRE(bytes.has_value(), "a frame read encodes", bytes.error().description());
    FrameReader again;
    again.feed(bytes.value().data(), bytes.value().size());
    auto frame = again.next();
    FUZZ_REQUIRE(frame && frame->has_value() && sameFrame(frame->value(), whole.frames[i]) &&
                     !again.hasPartialFrame(),
                 "an encoded frame reads back as itself", describe(whole.frames[i].body));
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  const uint8_t selector = data[0];
  if (selector % 2 == 0) {
    checkCbor(data + 1, size - 1);
  } else {
    checkFrames(1 + selector / 2, data + 1, size - 1);
  }
  return 0;
}
