#include "lmo/Frame.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "lmo/Protocol.h"

namespace vantrel::lmo {
namespace {

using Bytes = std::vector<uint8_t>;

Bytes frameBytes(const Frame& f) {
  auto r = encodeFrame(f);
  EXPECT_TRUE(r.has_value());
  return r.has_value() ? r.value() : Bytes();
}

// A frame assembled by hand, so that every header field can be wrong.
Bytes rawFrame(uint32_t length, uint8_t version, uint8_t kind, uint16_t reserved, uint64_t id,
               uint64_t inReplyTo, const Bytes& body) {
  Bytes out;
  for (int i = 3; i >= 0; --i) out.push_back(static_cast<uint8_t>(length >> (8 * i)));
  out.push_back(version);
  out.push_back(kind);
  out.push_back(static_cast<uint8_t>(reserved >> 8));
  out.push_back(static_cast<uint8_t>(reserved));
  for (int i = 7; i >= 0; --i) out.push_back(static_cast<uint8_t>(id >> (8 * i)));
  for (int i = 7; i >= 0; --i) out.push_back(static_cast<uint8_t>(inReplyTo >> (8 * i)));
  out.insert(out.end(), body.begin(), body.end());
  return out;
}

std::vector<Frame> drain(FrameReader& reader) {
  std::vector<Frame> frames;
  while (auto f = reader.next()) {
    EXPECT_TRUE(f->has_value()) << f->error().description();
    if (!f->has_value()) break;
    frames.push_back(std::move(*f).value());
  }
  return frames;
}

TEST(FrameTest, ReadsFramesHoweverTheBytesArrive) {
  const Frame sent[] = {
      {FrameKind::kRequest, 1, 0,
       Dictionary{{protocol::kKeyRequest, Value(protocol::kRequestMatch)}}},
      {FrameKind::kMessage, 2, 0, Dictionary{}},
      {FrameKind::kReply, 9, 1, Dictionary{{"data", Value::data(Bytes(70000, 7))}}},
  };
  Bytes stream;
  for (const Frame& f : sent) {
    Bytes b = frameBytes(f);
    stream.insert(stream.end(), b.begin(), b.end());
  }
  // Coalesced, split at every byte, and in uneven chunks.
  for (size_t chunk : {stream.size(), size_t{1}, size_t{7}, size_t{4096}}) {
    FrameReader reader;
    std::vector<Frame> got;
    for (size_t i = 0; i < stream.size(); i += chunk) {
      reader.feed(stream.data() + i, std::min(chunk, stream.size() - i));
      for (Frame& f : drain(reader)) got.push_back(std::move(f));
    }
    ASSERT_EQ(got.size(), 3u) << "chunk " << chunk;
    for (size_t i = 0; i < 3; ++i) {
      EXPECT_EQ(got[i].kind, sent[i].kind);
      EXPECT_EQ(got[i].id, sent[i].id);
      EXPECT_EQ(got[i].inReplyTo, sent[i].inReplyTo);
      EXPECT_EQ(got[i].body, sent[i].body);
    }
    EXPECT_FALSE(reader.hasPartialFrame());
  }
  FrameReader partial;
  Bytes one = frameBytes(sent[0]);
  partial.feed(one.data(), one.size() - 1);
  EXPECT_FALSE(partial.next().has_value());
  EXPECT_TRUE(partial.hasPartialFrame());
}

TEST(FrameTest, RefusesEveryKindOfBadFrame) {
  const Bytes map{0xA0};
  struct Case {
    const char* name;
    Bytes bytes;
    const char* reason;
  };
  const Case cases[] = {
      {"too long", rawFrame(kMaxFrameLength + 1, 1, 2, 0, 1, 0, {}), "exceeds the limit"},
      {"shorter than header", rawFrame(19, 1, 2, 0, 1, 0, {}), "shorter than its header"},
      {"no body", rawFrame(20, 1, 2, 0, 1, 0, {}), "truncated"},
      {"version 2", rawFrame(21, 2, 2, 0, 1, 0, map), "unknown frame version 2"},
      {"version 0", rawFrame(21, 0, 2, 0, 1, 0, map), "unknown frame version 0"},
      {"kind 0", rawFrame(21, 1, 0, 0, 1, 0, map), "unknown frame kind 0"},
      {"kind 4", rawFrame(21, 1, 4, 0, 1, 0, map), "unknown frame kind 4"},
      {"reserved", rawFrame(21, 1, 2, 1, 1, 0, map), "reserved"},
      {"id 0", rawFrame(21, 1, 1, 0, 0, 0, map), "frame id 0"},
      {"reply without in-reply-to", rawFrame(21, 1, 3, 0, 1, 0, map), "in-reply-to 0"},
      {"request with in-reply-to", rawFrame(21, 1, 1, 0, 1, 5, map), "in-reply-to 5"},
      {"body not a map", rawFrame(21, 1, 2, 0, 1, 0, {0x01}), "not a map"},
      {"body with trailing bytes", rawFrame(22, 1, 2, 0, 1, 0, {0xA0, 0xA0}), "trailing"},
      {"body with bad key", rawFrame(23, 1, 2, 0, 1, 0, {0xA1, 0x01, 0x01}), "text string"},
  };
  for (const Case& c : cases) {
    FrameReader reader;
    reader.feed(c.bytes.data(), c.bytes.size());
    auto f = reader.next();
    ASSERT_TRUE(f.has_value()) << c.name;
    ASSERT_FALSE(f->has_value()) << c.name;
    EXPECT_NE(f->error().description().find(c.reason), std::string::npos)
        << c.name << ": " << f->error().description();
    // The stream stays broken: a good frame after it is not read.
    Bytes good = frameBytes({FrameKind::kMessage, 3, 0, Dictionary{}});
    reader.feed(good.data(), good.size());
    auto again = reader.next();
    ASSERT_TRUE(again.has_value());
    EXPECT_FALSE(again->has_value()) << c.name;
  }
  // An oversized length is refused from the length alone, before any body.
  FrameReader early;
  Bytes header = rawFrame(0xFFFFFFFF, 1, 2, 0, 1, 0, {});
  early.feed(header.data(), 4);
  auto f = early.next();
  ASSERT_TRUE(f.has_value());
  EXPECT_FALSE(f->has_value());
}

TEST(FrameTest, EncoderRefusesFramesPeersWouldRefuse) {
  Frame big{FrameKind::kMessage, 1, 0,
            Dictionary{{"data", Value::data(Bytes(kMaxFrameLength, 0))}}};
  EXPECT_FALSE(encodeFrame(big).has_value());
  Frame fits{FrameKind::kMessage, 1, 0,
             Dictionary{{"data", Value::data(Bytes(kMaxFrameLength - 40, 0))}}};
  auto bytes = encodeFrame(fits);
  ASSERT_TRUE(bytes.has_value());
  FrameReader reader;
  reader.feed(bytes.value().data(), bytes.value().size());
  EXPECT_EQ(drain(reader).size(), 1u);
}

TEST(FrameTest, TheLongestFrameIsReadAndOneByteMoreIsRefused) {
  // {"data": <bytes>}: the header, a map head, the key (one byte of head and
  // four of text) and a byte string's five-byte head.
  constexpr size_t kBodyOverhead = 1 + 5 + 5;
  const Frame longest{
      FrameKind::kMessage, 1, 0,
      Dictionary{
          {"data", Value::data(Bytes(kMaxFrameLength - kFrameHeaderSize - kBodyOverhead, 0x5A))}}};
  Bytes bytes = frameBytes(longest);
  ASSERT_EQ(bytes.size(), kFrameLengthSize + kMaxFrameLength);
  Bytes tooLong = bytes;
  tooLong[kFrameLengthSize - 1] += 1;  // the length prefix, one more
  tooLong.push_back(0);
  const std::pair<Bytes*, bool> cases[] = {{&bytes, true}, {&tooLong, false}};
  for (const auto& [stream, read] : cases) {
    FrameReader reader;
    reader.feed(stream->data(), stream->size());
    auto frame = reader.next();
    ASSERT_TRUE(frame.has_value()) << read;
    ASSERT_EQ(frame->has_value(), read);
    if (read) {
      EXPECT_EQ(frame->value().body, longest.body);
    }
  }
  Frame oneMore = longest;
  oneMore.body = Dictionary{
      {"data", Value::data(Bytes(kMaxFrameLength - kFrameHeaderSize - kBodyOverhead + 1, 0))}};
  EXPECT_FALSE(encodeFrame(oneMore).has_value());
}

}  // namespace
}  // namespace vantrel::lmo
