#pragma once
// The load programs' command lines: "--json" and "--NAME VALUE" pairs, where
// every value but a path is a number of zero or more.

#include <functional>
#include <optional>
#include <string>
#include <string_view>

namespace vantrel::bench::load {

// Calls take(name, value, number) for each "--NAME VALUE" pair of argv, with
// number the value read as a number >= 0 (nullopt when it is not one), and
// sets *json for "--json". Returns the first problem ("missing value after
// --x", or what take returned), or nullopt when every argument was taken.
std::optional<std::string> walkArguments(
    int argc, char** argv, bool* json,
    const std::function<std::optional<std::string>(std::string_view name, const char* value,
                                                   std::optional<double> number)>& take);

}  // namespace vantrel::bench::load
