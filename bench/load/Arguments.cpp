#include "bench/load/Arguments.h"

#include <cstdlib>

namespace vantrel::bench::load {

std::optional<std::string> walkArguments(
    int argc, char** argv, bool* json, std::string* vantreld,
    const std::function<std::optional<std::string>(std::string_view name, double number)>& take) {
  for (int i = 1; i < argc; ++i) {
    const std::string_view arg = argv[i];
    if (arg == "--json") {
      *json = true;
      continue;
    }
    if (i + 1 >= argc) return "missing value after " + std::string(arg);
    const char* value = argv[++i];
    if (arg == "--vantreld") {
      *vantreld = value;
      continue;
    }
    char* end = nullptr;
    const double number = std::strtod(value, &end);
    if (end == value || *end != '\0' || number < 0) return "not a number: " + std::string(value);
    if (std::optional<std::string> problem = take(arg, number)) return problem;
  }
  return std::nullopt;
}

}  // namespace vantrel::bench::load
