#include "lmo/Cbor.h"

#include <bit>
#include <cmath>
#include <cstring>
#include <limits>
#include <string>
#include <utility>

#include "lmo/LmoError.h"
#include "lmo/Utf8.h"

namespace vantrel::lmo {
namespace {

enum Major : uint8_t {
  kUnsigned = 0,
  kNegative = 1,
  kBytes = 2,
  kText = 3,
  kArray = 4,
  kMap = 5,
  kTag = 6,
  kSimple = 7
};

constexpr uint8_t kBreak = 0xFF;
constexpr uint8_t kIndefinite = 31;
constexpr uint64_t kTagDate = 1;
constexpr uint64_t kTagUuid = 37;

// ---- Encoding ----

void writeHead(std::vector<uint8_t>& out, uint8_t major, uint64_t arg) {
  uint8_t m = static_cast<uint8_t>(major << 5);
  if (arg < 24) {
    out.push_back(m | static_cast<uint8_t>(arg));
    return;
  }
  int bytes;
  if (arg <= 0xFF) {
    out.push_back(m | 24);
    bytes = 1;
  } else if (arg <= 0xFFFF) {
    out.push_back(m | 25);
    bytes = 2;
  } else if (arg <= 0xFFFFFFFF) {
    out.push_back(m | 26);
    bytes = 4;
  } else {
    out.push_back(m | 27);
    bytes = 8;
  }
  for (int i = bytes - 1; i >= 0; --i) out.push_back(static_cast<uint8_t>(arg >> (8 * i)));
}

void writeDouble(std::vector<uint8_t>& out, double d) {
  out.push_back(0xFB);
  uint64_t bits = std::bit_cast<uint64_t>(d);
  for (int i = 7; i >= 0; --i) out.push_back(static_cast<uint8_t>(bits >> (8 * i)));
}

void writeString(std::vector<uint8_t>& out, uint8_t major, const void* data, size_t size) {
  writeHead(out, major, size);
  const auto* p = static_cast<const uint8_t*>(data);
  out.insert(out.end(), p, p + size);
}

bool encodeValue(std::vector<uint8_t>& out, const Value& v, int depth) {
  switch (v.type()) {
    case Value::Type::kNull:
      out.push_back(0xF6);
      return true;
    case Value::Type::kBoolean:
      out.push_back(*v.getIfBoolean() ? 0xF5 : 0xF4);
      return true;
    case Value::Type::kInteger:
      if (v.isUnsignedInteger()) {
        writeHead(out, kUnsigned, *v.getIfUInt64());
      } else {
        int64_t i = *v.getIfInt64();
        if (i >= 0) {
          writeHead(out, kUnsigned, static_cast<uint64_t>(i));
        } else {
          // -1 - i without overflow: the bitwise complement.
          writeHead(out, kNegative, ~static_cast<uint64_t>(i));
        }
      }
      return true;
    case Value::Type::kReal:
      writeDouble(out, *v.getIfReal());
      return true;
    case Value::Type::kString: {
      const std::string& s = *v.getIfString();
      writeString(out, kText, s.data(), s.size());
      return true;
    }
    case Value::Type::kData: {
      const Value::Bytes& b = *v.getIfData();
      writeString(out, kBytes, b.data(), b.size());
      return true;
    }
    case Value::Type::kDate:
      writeHead(out, kTag, kTagDate);
      writeDouble(out, v.getIfDate()->secondsSince1970);
      return true;
    case Value::Type::kUuid: {
      writeHead(out, kTag, kTagUuid);
      const auto& bytes = v.getIfUuid()->bytes();
      writeString(out, kBytes, bytes.data(), bytes.size());
      return true;
    }
    case Value::Type::kArray: {
      if (depth + 1 > kMaxCborDepth) return false;
      const Array& a = *v.getIfArray();
      writeHead(out, kArray, a.size());
      for (const Value& item : a) {
        if (!encodeValue(out, item, depth + 1)) return false;
      }
      return true;
    }
    case Value::Type::kDictionary: {
      if (depth + 1 > kMaxCborDepth) return false;
      const Dictionary& d = *v.getIfDictionary();
      writeHead(out, kMap, d.size());
      for (const auto& [key, item] : d) {
        writeString(out, kText, key.data(), key.size());
        if (!encodeValue(out, item, depth + 1)) return false;
      }
      return true;
    }
  }
  return false;
}

// ---- Decoding ----

double halfToDouble(uint16_t h) {
  int exponent = (h >> 10) & 0x1F;
  int mantissa = h & 0x3FF;
  double value;
  if (exponent == 0) {
    value = std::ldexp(mantissa, -24);
  } else if (exponent != 31) {
    value = std::ldexp(mantissa + 1024, exponent - 25);
  } else {
    value = mantissa == 0 ? std::numeric_limits<double>::infinity()
                          : std::numeric_limits<double>::quiet_NaN();
  }
  return (h & 0x8000) ? -value : value;
}

struct Head {
  uint8_t major;
  uint8_t info;  // the low five bits of the initial byte
  uint64_t arg;  // the argument; unused when info is kIndefinite
};

class Decoder {
 public:
  Decoder(const uint8_t* data, size_t size) : p_(data), end_(data + size) {}

  base::Result<Value> document() {
    // Returned as the Result it is: unwrapping it into a local Value trips
    // GCC 12's maybe-uninitialized warning at -O2.
    base::Result<Value> v = item(0);
    if (v.has_value() && p_ != end_) {
      return lmoErrorf(kLmoMalformed, "%u trailing bytes after the CBOR item",
                       static_cast<uint64_t>(end_ - p_));
    }
    return v;
  }

 private:
  size_t remaining() const { return static_cast<size_t>(end_ - p_); }

  static base::Error truncated() { return lmoError(kLmoMalformed, "truncated CBOR item"); }

  base::Result<Head> head() {
    if (p_ == end_) return truncated();
    uint8_t initial = *p_++;
    Head h{static_cast<uint8_t>(initial >> 5), static_cast<uint8_t>(initial & 0x1F), 0};
    if (h.info < 24) {
      h.arg = h.info;
      return h;
    }
    if (h.info == kIndefinite) {
      if (h.major == kUnsigned || h.major == kNegative || h.major == kTag) {
        return lmoErrorf(kLmoMalformed, "indefinite length on major type %u", h.major);
      }
      return h;
    }
    if (h.info > 27) return lmoErrorf(kLmoMalformed, "reserved additional information %u", h.info);
    size_t n = size_t{1} << (h.info - 24);
    if (remaining() < n) return truncated();
    for (size_t i = 0; i < n; ++i) h.arg = (h.arg << 8) | *p_++;
    return h;
  }

  bool atBreak() const { return p_ != end_ && *p_ == kBreak; }

  // Appends the bytes of a definite or indefinite string of the given major
  // type whose head has been read.
  base::Result<void> stringBody(const Head& h, std::string& out) {
    if (h.info != kIndefinite) return chunk(h, out);
    for (;;) {
      if (p_ == end_) return truncated();
      if (*p_ == kBreak) {
        ++p_;
        return base::Result<void>::success();
      }
      Head c = VT_TRY(head());
      if (c.major != h.major || c.info == kIndefinite) {
        return lmoError(kLmoMalformed, "bad chunk in an indefinite-length string");
      }
      VT_TRY(chunk(c, out));
    }
  }

  // Each chunk of a text string must be valid UTF-8 on its own: a chunk
  // boundary may not split a character.
  base::Result<void> chunk(const Head& h, std::string& out) {
    if (h.arg > remaining()) return truncated();
    std::string_view bytes(reinterpret_cast<const char*>(p_), static_cast<size_t>(h.arg));
    if (h.major == kText && !isValidUtf8(bytes)) {
      return lmoError(kLmoMalformed, "invalid UTF-8 in a text string");
    }
    out.append(bytes);
    p_ += h.arg;
    return base::Result<void>::success();
  }

  base::Result<Value> item(int depth) {
    Head h = VT_TRY(head());
    switch (h.major) {
      case kUnsigned:
        return Value::unsignedInteger(h.arg);
      case kNegative:
        return negative(h.arg);
      case kBytes: {
        std::string s;
        VT_TRY(stringBody(h, s));
        return Value::data(s.data(), s.size());
      }
      case kText: {
        std::string s;
        VT_TRY(stringBody(h, s));
        return Value(std::move(s));
      }
      case kArray:
        return array(h, depth + 1);
      case kMap:
        return map(h, depth + 1);
      case kTag:
        return tagged(h.arg);
      default:
        return simple(h);
    }
  }

  static base::Result<Value> negative(uint64_t arg) {
    if (arg > static_cast<uint64_t>(std::numeric_limits<int64_t>::max())) {
      return lmoError(kLmoLimitExceeded, "negative integer below -2^63");
    }
    return Value::integer(-static_cast<int64_t>(arg) - 1);
  }

  base::Result<Value> simple(const Head& h) {
    switch (h.info) {
      case 20:
        return Value::boolean(false);
      case 21:
        return Value::boolean(true);
      case 22:
        return Value();
      case 25:
        return Value::real(halfToDouble(static_cast<uint16_t>(h.arg)));
      case 26:
        return Value::real(std::bit_cast<float>(static_cast<uint32_t>(h.arg)));
      case 27:
        return Value::real(std::bit_cast<double>(h.arg));
      case kIndefinite:
        return lmoError(kLmoMalformed, "unexpected break");
      default:
        return lmoErrorf(kLmoMalformed, "unsupported simple value %u",
                         h.info == 24 ? h.arg : uint64_t{h.info});
    }
  }

  static base::Error tooDeep() {
    return lmoErrorf(kLmoLimitExceeded, "CBOR nested deeper than %d levels", kMaxCborDepth);
  }

  // Decodes one item onto the end of items. (Not VT_TRY inside push_back:
  // GCC 12 at -O2 warns about the moved-from temporary.)
  base::Result<void> appendItem(std::vector<Value>& items, int depth) {
    base::Result<Value> v = item(depth);
    if (!v.has_value()) return v.error();
    items.push_back(std::move(v).value());
    return base::Result<void>::success();
  }

  base::Result<Value> array(const Head& h, int depth) {
    if (depth > kMaxCborDepth) return tooDeep();
    std::vector<Value> items;
    if (h.info == kIndefinite) {
      while (!atBreak()) VT_TRY(appendItem(items, depth));
      ++p_;
    } else {
      // Every item takes at least one byte: a larger count cannot be real,
      // and must not size an allocation.
      if (h.arg > remaining()) {
        return lmoErrorf(kLmoMalformed, "array of %u items is longer than its input", h.arg);
      }
      items.reserve(static_cast<size_t>(h.arg));
      for (uint64_t i = 0; i < h.arg; ++i) VT_TRY(appendItem(items, depth));
    }
    return Value(Array(std::move(items)));
  }

  base::Result<Value> map(const Head& h, int depth) {
    if (depth > kMaxCborDepth) return tooDeep();
    std::vector<Dictionary::Entry> entries;
    if (h.info == kIndefinite) {
      while (!atBreak()) VT_TRY(appendEntry(entries, depth));
      ++p_;
    } else {
      if (h.arg > remaining() / 2) {
        return lmoErrorf(kLmoMalformed, "map of %u entries is longer than its input", h.arg);
      }
      entries.reserve(static_cast<size_t>(h.arg));
      for (uint64_t i = 0; i < h.arg; ++i) VT_TRY(appendEntry(entries, depth));
    }
    size_t count = entries.size();
    Dictionary d = Dictionary::fromEntries(std::move(entries));
    // fromEntries keeps one entry per key, so a shorter result means a key
    // was given twice.
    if (d.size() != count) return lmoError(kLmoMalformed, "duplicate map key");
    return Value(std::move(d));
  }

  // Decodes one key and value onto the end of entries, in place: a map is
  // on every message's path.
  base::Result<void> appendEntry(std::vector<Dictionary::Entry>& entries, int depth) {
    Head k = VT_TRY(head());
    if (k.major != kText) return lmoError(kLmoMalformed, "map key is not a text string");
    std::string key;
    VT_TRY(stringBody(k, key));
    base::Result<Value> v = item(depth);
    if (!v.has_value()) return v.error();
    entries.emplace_back(std::move(key), std::move(v).value());
    return base::Result<void>::success();
  }

  // The tag's content is read here rather than through item(): both tags
  // take a scalar, so tags cannot nest and add no depth.
  base::Result<Value> tagged(uint64_t tag) {
    if (tag == kTagDate) {
      Head c = VT_TRY(head());
      double seconds;
      if (c.major == kUnsigned) {
        seconds = static_cast<double>(c.arg);
      } else if (c.major == kNegative) {
        seconds = -static_cast<double>(c.arg) - 1;
      } else if (c.major == kSimple && c.info >= 25 && c.info <= 27) {
        seconds = *VT_TRY(simple(c)).getIfReal();
      } else {
        return lmoError(kLmoMalformed, "date tag over something that is not a number");
      }
      return Value(Date{seconds});
    }
    if (tag == kTagUuid) {
      Head c = VT_TRY(head());
      if (c.major != kBytes) return lmoError(kLmoMalformed, "UUID tag over a non-byte string");
      std::string s;
      VT_TRY(stringBody(c, s));
      auto uuid = base::Uuid::fromBytes(reinterpret_cast<const uint8_t*>(s.data()), s.size());
      if (!uuid) return lmoErrorf(kLmoMalformed, "UUID of %u bytes", s.size());
      return Value(*uuid);
    }
    return lmoErrorf(kLmoMalformed, "unknown tag %u", tag);
  }

  const uint8_t* p_;
  const uint8_t* const end_;
};

}  // namespace

base::Result<void> appendCbor(std::vector<uint8_t>& out, const Value& value) {
  size_t start = out.size();
  if (!encodeValue(out, value, 0)) {
    out.resize(start);
    return lmoErrorf(kLmoLimitExceeded, "value nested deeper than %d levels", kMaxCborDepth);
  }
  return base::Result<void>::success();
}

base::Result<std::vector<uint8_t>> encodeCbor(const Value& value) {
  std::vector<uint8_t> out;
  VT_TRY(appendCbor(out, value));
  return out;
}

base::Result<Value> decodeCbor(const uint8_t* data, size_t size) {
  return Decoder(data, size).document();
}

base::Result<Dictionary> decodeCborMessage(const uint8_t* data, size_t size) {
  Value v = VT_TRY(decodeCbor(data, size));
  const Dictionary* d = v.getIfDictionary();
  if (d == nullptr)
    return lmoErrorf(kLmoMalformed, "message body is a %s, not a map", typeName(v.type()));
  return *d;
}

}  // namespace vantrel::lmo
