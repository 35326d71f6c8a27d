#pragma once
// The CBOR (RFC 8949) codec of the wire protocol, straight between bytes and
// lmo::Value, with no intermediate tree.
//
// Mapping (both directions):
//   null, false, true      simple values 22, 20, 21
//   integer                major type 0 when >= 0, major type 1 when < 0
//   real                   double (decoding also takes half and single floats)
//   string                 text string, UTF-8
//   data                   byte string
//   date                   tag 1 over a number of seconds since 1970 (written
//                          as a double; decoding also takes an integer)
//   UUID                   tag 37 over a 16-byte byte string
//   array / dictionary     array / map with text keys
//
// Integers: CBOR carries no signedness for non-negative numbers, so the
// decoder returns every major type 0 item as an unsigned integer and every
// major type 1 item as a signed one. Since lmo compares integers by value,
// every lmo value round-trips to an equal value; only the signed/unsigned
// flag of a non-negative signed integer comes back as unsigned.
//
// The encoder writes definite lengths and the shortest argument encodings;
// the decoder also accepts indefinite-length strings, arrays and maps.

#include <cstddef>
#include <cstdint>
#include <vector>

#include "base/Result.h"
#include "lmo/Limits.h"
#include "lmo/Value.h"

namespace vantrel::lmo {

// Appends the encoding of value to out. Error, with out left as it was:
// arrays or dictionaries nested deeper than kMaxCborDepth, which no peer
// would accept.
base::Result<void> appendCbor(std::vector<uint8_t>& out, const Value& value);

// The encoding of value alone; errors as appendCbor.
base::Result<std::vector<uint8_t>> encodeCbor(const Value& value);

// Decodes exactly one data item that fills the whole input. Errors (domain
// "LMO") name the first fault: truncation, trailing bytes, nesting deeper
// than kMaxCborDepth, an unknown tag or simple value, a map key that is not a
// text string or that repeats, invalid UTF-8 in a text string, a malformed
// date or UUID, a negative integer below -2^63, or a length or count larger
// than the input could hold. Nothing is allocated beyond what the input's
// size can justify.
base::Result<Value> decodeCbor(const uint8_t* data, size_t size);

// As decodeCbor, and the item must be a map: a message body.
base::Result<Dictionary> decodeCborMessage(const uint8_t* data, size_t size);

}  // namespace vantrel::lmo
