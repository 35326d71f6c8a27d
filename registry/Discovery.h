#pragma once
// The election filter of discovery queries. A query's "QXUserElection" value
// (a string or an array of strings) selects plug-ins by their election, the
// integer "election" of their annotation; the registry applies the filter to
// every candidate before the database builds anything from it.

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "lmo/Value.h"

namespace vantrel::registry {

class VTDAnnotationStore;

// The query key of the election filter.
inline constexpr std::string_view kUserElectionKey = "QXUserElection";

// One election selector: "=x" selects "x" (so "=" selects the empty string,
// which matches nothing); a value starting with a letter, combining mark or
// digit is itself. nullopt for anything else: not a string, empty, or
// starting with another character ("-1").
std::optional<std::string> parse_election_value(const lmo::Value& value);

// The elections a "QXUserElection" value admits, as decimal text 0 to 255;
// nullopt, meaning no filtering at all, when the value is absent, neither a
// string nor an array, or has a selector that does not parse.
std::optional<std::vector<std::string>> electionFilterFor(const lmo::Value& value);

// Whether the candidate with this identifier and these entitlements passes
// filter. Its election is the one stored under its annotation key (the
// replace-plugin entitlement when a string, else identifier); without one,
// 1 when its auto-elect entitlement is a true number, else 0. Compared as the
// decimal text of the election's low 8 bits, so 257 passes "1" and -1 passes
// "255". Reads store under its lock: safe against a concurrent write.
bool electionFilterAccepts(const std::vector<std::string>& filter, const std::string& identifier,
                           const lmo::Dictionary& entitlements, const VTDAnnotationStore& store);

}  // namespace vantrel::registry
