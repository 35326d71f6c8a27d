#include "platform/PropertyListChecks.h"

#include <cerrno>
#include <charconv>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <vector>

#include "base/Format.h"
#include "platform/PropertyListChecks.h"

namespace vantrel::platform::plist_checks {
namespace {

// ---------------------------------------------------------------------------
// Binary preflight. libplist 2.2's binary parser expands shared objects (a
// hundred bytes of references can ask for gigabytes), takes time quadratic in
// the nesting depth and recurses per level. So the object graph is walked
// here first, without recursion, with the depth and the expanded object count
// bounded, before libplist sees the bytes.

class BinaryPreflight {
 public:
  explicit BinaryPreflight(std::string_view input) : in_(input) {}
  std::optional<base::Error> run();

 private:
  struct Frame {
    size_t refs;        // offset of the next reference
    uint64_t left;      // references still to visit
    uint64_t keysLeft;  // of those, how many are dictionary keys
  };

  uint64_t readInt(size_t at, size_t size) const {
    uint64_t v = 0;
    for (size_t i = 0; i < size; ++i) v = v << 8 | static_cast<uint8_t>(in_[at + i]);
    return v;
  }
  std::optional<base::Error> visit(uint64_t ref, bool mustBeKey, std::vector<Frame>* stack);
  std::optional<base::Error> checkScalar(size_t offset) const;
  // The object count of a container (or length of a scalar) at offset, and
  // where its payload starts; false when it runs past the object area.
  bool countAt(size_t offset, uint64_t* count, size_t* payload) const;

  std::string_view in_;
  size_t offsetSize_ = 0, refSize_ = 0, tableOffset_ = 0;
  uint64_t objectCount_ = 0;
  size_t visited_ = 0;
};

bool BinaryPreflight::countAt(size_t offset, uint64_t* count, size_t* payload) const {
  const uint8_t marker = static_cast<uint8_t>(in_[offset]);
  *payload = offset + 1;
  if ((marker & 0xF) != 0xF) {
    *count = marker & 0xF;
    return true;
  }
  if (*payload >= tableOffset_) return false;
  const uint8_t intMarker = static_cast<uint8_t>(in_[*payload]);
  if ((intMarker & 0xF0) != 0x10 || (intMarker & 0xF) > 3) return false;
  const size_t size = size_t{1} << (intMarker & 0xF);
  if (*payload + 1 + size > tableOffset_) return false;
  *count = readInt(*payload + 1, size);
  *payload += 1 + size;
  return true;
}

std::optional<base::Error> BinaryPreflight::visit(uint64_t ref, bool mustBeKey,
                                                  std::vector<Frame>* stack) {
  if (ref >= objectCount_) return malformed("bad object reference");
  if (++visited_ > kMaxPropertyListObjects) return tooManyObjects();
  const uint64_t offset = readInt(tableOffset_ + ref * offsetSize_, offsetSize_);
  if (offset < 8 || offset >= tableOffset_) return malformed("bad object offset");
  const uint8_t marker = static_cast<uint8_t>(in_[offset]);
  const uint8_t type = marker >> 4;
  if (mustBeKey && type != 0x5 && type != 0x6) return malformed("dictionary key not a string");
  if (type != 0xA && type != 0xC && type != 0xD) return checkScalar(offset);
  uint64_t count = 0;
  size_t payload = 0;
  if (!countAt(offset, &count, &payload)) return malformed("truncated container");
  const uint64_t refs = type == 0xD ? 2 * count : count;
  // A container may repeat a reference, so its count is bounded by the bytes
  // its references take, not by the number of objects.
  if (count > tableOffset_ || payload + refs * refSize_ > tableOffset_) {
    return malformed("truncated container");
  }
  if (stack->size() >= static_cast<size_t>(kMaxPropertyListDepth)) return tooDeep();
  stack->push_back({payload, refs, type == 0xD ? count : 0});
  return std::nullopt;
}

// The scalars libplist 2.2 mishandles rather than refuses: it aborts on a
// UTF-16 string holding U+0000, cuts an ASCII string at a NUL, reads a UTF-16
// string with an unpaired surrogate as empty and keeps only the low 64 bits of
// wider integers and UIDs.
std::optional<base::Error> BinaryPreflight::checkScalar(size_t offset) const {
  const uint8_t marker = static_cast<uint8_t>(in_[offset]);
  const uint8_t type = marker >> 4;
  if (marker == 0x14) {
    if (offset + 17 > tableOffset_) return malformed("truncated integer");
    if (readInt(offset + 1, 8) != 0) return malformed("integer out of range");
  } else if (type == 0x8 && (marker & 0xF) >= 8) {
    return malformed("UID out of range");
  } else if (type == 0x5 || type == 0x6) {
    uint64_t count = 0;
    size_t payload = 0;
    const size_t unit = type == 0x5 ? 1 : 2;
    if (!countAt(offset, &count, &payload) || count > tableOffset_ ||
        payload + count * unit > tableOffset_) {
      return malformed("truncated string");
    }
    bool highSurrogate = false;
    for (uint64_t i = 0; i < count; ++i) {
      const uint64_t c = readInt(payload + i * unit, unit);
      if (c == 0) return malformed("NUL character in a string");
      if (unit == 1) continue;
      const bool high = c >= 0xD800 && c <= 0xDBFF, low = c >= 0xDC00 && c <= 0xDFFF;
      if (highSurrogate != low) return malformed("unpaired surrogate in a string");
      highSurrogate = high;
    }
    if (highSurrogate) return malformed("unpaired surrogate in a string");
  }
  return std::nullopt;
}

std::optional<base::Error> BinaryPreflight::run() {
  constexpr size_t kHeader = 8, kTrailer = 32;
  if (in_.size() < kHeader + kTrailer) return malformed("truncated binary property list");
  const size_t trailer = in_.size() - kTrailer;
  offsetSize_ = static_cast<uint8_t>(in_[trailer + 6]);
  refSize_ = static_cast<uint8_t>(in_[trailer + 7]);
  objectCount_ = readInt(trailer + 8, 8);
  const uint64_t top = readInt(trailer + 16, 8);
  const uint64_t tableOffset = readInt(trailer + 24, 8);
  if (offsetSize_ < 1 || offsetSize_ > 8 || refSize_ < 1 || refSize_ > 8 || objectCount_ == 0 ||
      top >= objectCount_ || tableOffset < kHeader || tableOffset > trailer ||
      objectCount_ > (trailer - tableOffset) / offsetSize_) {
    return malformed("bad binary trailer");
  }
  tableOffset_ = static_cast<size_t>(tableOffset);

  std::vector<Frame> stack;
  if (auto error = visit(top, false, &stack)) return error;
  while (!stack.empty()) {
    Frame& frame = stack.back();
    if (frame.left == 0) {
      stack.pop_back();
      continue;
    }
    const uint64_t ref = readInt(frame.refs, refSize_);
    const bool key = frame.keysLeft > 0;
    frame.refs += refSize_;
    --frame.left;
    if (key) --frame.keysLeft;
    if (auto error = visit(ref, key, &stack)) return error;  // may invalidate frame
  }
  return std::nullopt;
}

}  // namespace

std::optional<base::Error> preflightBinary(std::string_view input) {
  return BinaryPreflight(input).run();
}

}  // namespace vantrel::platform::plist_checks
