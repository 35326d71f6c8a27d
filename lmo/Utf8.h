#pragma once
// UTF-8 validation shared by the codecs: strict RFC 3629 (no overlong forms,
// no surrogates, nothing above U+10FFFF).

#include <cstddef>
#include <string_view>

namespace vantrel::lmo {

// Length of the valid UTF-8 sequence starting at s[i] (i < s.size()), or 0
// when the bytes there are not one.
size_t utf8SequenceLength(std::string_view s, size_t i);

// Whether the whole of s is valid UTF-8.
bool isValidUtf8(std::string_view s);

}  // namespace vantrel::lmo
