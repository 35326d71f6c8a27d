#pragma once
// JSON text for values, for tools that print machine-readable output.
//
// JSON has fewer types than a value, so some map to strings: data becomes
// base64, a date its ISO 8601 UTC text, a UUID its canonical text. A real
// that is not finite becomes null. Invalid UTF-8 in a string is replaced by
// U+FFFD so that the output is always valid JSON.

#include <string>

#include "lmo/Value.h"

namespace vantrel::lmo {

enum class JsonStyle { kCompact, kPretty };

// indent: the column the value starts at (pretty style only), so that a
// value can be nested inside text printed by the caller.
std::string toJson(const Value& value, JsonStyle style = JsonStyle::kCompact, int indent = 0);

// A JSON string literal (with quotes) for text.
std::string jsonQuote(std::string_view text);

}  // namespace vantrel::lmo
