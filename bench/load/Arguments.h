#pragma once
// The load programs' command lines: "--json", "--vantreld PATH" and
// "--NAME NUMBER" pairs, every number zero or more.

#include <functional>
#include <optional>
#include <string>
#include <string_view>

namespace vantrel::bench::load {

// Sets *json for "--json" and *vantreld for "--vantreld PATH", and calls
// take(name, number) for each other "--NAME NUMBER" pair of argv. Returns
// the first problem ("missing value after --x", "not a number: x", or what
// take returned), or nullopt when every argument was taken.
std::optional<std::string> walkArguments(
    int argc, char** argv, bool* json, std::string* vantreld,
    const std::function<std::optional<std::string>(std::string_view name, double number)>& take);

}  // namespace vantrel::bench::load
