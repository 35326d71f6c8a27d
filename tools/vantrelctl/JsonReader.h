#pragma once
// A strict JSON reader (RFC 8259) for rules typed on the command line.
//
// Objects become dictionaries, arrays arrays, strings strings, true/false
// booleans, null null; a number without fraction or exponent becomes an
// integer (signed when negative, else unsigned) when it fits 64 bits, any
// other number a real. Nothing beyond the standard is accepted: no comments,
// no trailing commas, no single quotes, no leading zeros, no repeated keys.

#include <cstddef>
#include <string>
#include <string_view>

#include "base/Result.h"
#include "lmo/Value.h"

namespace vantrel::ctl {

// Nesting the reader follows, as deep as a message may nest.
inline constexpr size_t kMaxJsonDepth = 64;

// The value text holds. Errors (code 4): the first fault, as
// "<what is wrong> at byte <offset>" with the zero-based byte offset.
base::Result<lmo::Value> readJson(std::string_view text);

}  // namespace vantrel::ctl
