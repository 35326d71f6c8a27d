#include "bench/load/Arguments.h"

#include <cstdlib>

namespace vantrel::bench::load {

std::optional<std::string> walkArguments(
    int argc, char** argv, bool* json,
    const std::function<std::optional<std::string>(std::string_view name, const char* value,
                                                   std::optional<double> number)>& take) {
  for (int i = 1; i < argc; ++i) {
    const std::string_view arg = argv[i];
    if (arg == "--json") {
      *json = true;
      continue;
    }
    if (i + 1 >= argc) return "missing value after " + std::string(arg);
    const char* value = argv[++i];
    char* end = nullptr;
    const double number = std::strtod(value, &end);
    const bool numeric = end != value && *end == '\0' && number >= 0;
    if (std::optional<std::string> problem =
            take(arg, value, numeric ? std::optional<double>(number) : std::nullopt)) {
      return problem;
    }
  }
  return std::nullopt;
}

}  // namespace vantrel::bench::load
