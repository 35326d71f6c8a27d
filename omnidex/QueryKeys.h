#pragma once
// How a query's "QXExtensionPointIdentifier" and "QXExtensionIdentifier"
// patterns narrow the candidates through the registry's indexes.
//
// The daemon matches a plain pattern (no operator prefix) by equality under
// a numeric-aware comparison, in which runs of decimal digits compare by
// their value. Index keys and looked-up patterns therefore both drop the
// leading zeros of every digit run: two strings the daemon may consider
// equal always share a key, so narrowing never loses a plug-in the daemon
// would select.

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "lmo/Value.h"
#include "omnidex/Records.h"

namespace vantrel::omnidex {

inline constexpr const char* kExtensionPointIdentifierKey = "QXExtensionPointIdentifier";
inline constexpr const char* kExtensionIdentifierKey = "QXExtensionIdentifier";

// text with the leading zeros of every run of ASCII digits removed (a run of
// zeros keeps one).
std::string matchingKey(std::string_view text);

// The keys of a pattern that can narrow: a string without an operator
// prefix ("?", "<>", "<=", ">=", "=", "<", ">"), or an array of only such
// strings (any one of them may match; an empty array matches nothing).
// nullopt when the pattern cannot narrow (any other form).
std::optional<std::vector<std::string>> plainPatternKeys(const lmo::Value& pattern);

// The keys under which record is indexed by extension point: the value a
// rule on "QXExtensionPointIdentifier" tests (the attribute, else the Info
// dictionary's entry, else the extension dictionary's), when it is a string
// or for each string of an array.
std::vector<std::string> extensionPointKeys(const PlugInRecord& record);

}  // namespace vantrel::omnidex
