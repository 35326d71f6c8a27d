// Fuzz entry point for what a peer controls: the first byte picks the target,
// the rest is the input. 0: the CBOR decoder; otherwise the frame reader, fed
// in chunks whose sizes come from the input itself.

#include <cstddef>
#include <cstdint>

#include "lmo/Cbor.h"
#include "lmo/Frame.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  using namespace vantrel::lmo;
  if (size == 0) return 0;
  const uint8_t selector = data[0];
  ++data;
  --size;
  if (selector % 2 == 0) {
    auto value = decodeCbor(data, size);
    // Whatever decodes must encode and decode back to an equal value.
    if (value.has_value()) {
      auto bytes = encodeCbor(value.value());
      if (bytes.has_value()) {
        auto again = decodeCbor(bytes.value().data(), bytes.value().size());
        if (!again.has_value() || !(again.value() == value.value())) {
          // NaN is the one value not equal to itself.
          if (again.has_value() && describe(again.value()) == describe(value.value())) return 0;
          __builtin_trap();
        }
      }
    }
    return 0;
  }
  FrameReader reader;
  size_t chunk = 1 + selector / 2;
  for (size_t i = 0; i < size; i += chunk) {
    reader.feed(data + i, size - i < chunk ? size - i : chunk);
    while (auto frame = reader.next()) {
      if (!frame->has_value()) return 0;
    }
  }
  return 0;
}
