#pragma once
// Ordering of version strings, used to pick the newer of two plug-ins that
// share an identifier.

#include <string_view>

namespace vantrel::model {

// -1 when receiver orders before other, 0 when they are the same, 1 when it
// orders after. Maximal runs of decimal digits compare by numeric value (of
// any length: no integer conversion, so no overflow); every other byte
// compares literally and case-sensitively. Leading zeros of a digit run do
// not count, so "1.01" and "1.1" are the same version. When one string is a
// prefix of the other (after that rule), the shorter orders first:
// "1.0" < "1.0b", "1.0" < "1.0.0".
int compareVersionString(std::string_view receiver, std::string_view other);

}  // namespace vantrel::model
