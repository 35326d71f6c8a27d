#include "tools/vantrelctl/Output.h"

#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>

#include "lmo/Json.h"

namespace vantrel::ctl {

bool colourWanted() {
  const char* term = std::getenv("TERM");
  const char* noColour = std::getenv("NO_COLOR");
  return ::isatty(STDOUT_FILENO) == 1 && term != nullptr && std::strcmp(term, "dumb") != 0 &&
         (noColour == nullptr || *noColour == '\0');
}

void Table::print(std::FILE* out, bool legend) const {
  std::vector<size_t> widths(headers_.size(), 0);
  const auto measure = [&](const std::vector<std::string>& row) {
    for (size_t c = 0; c < row.size() && c < widths.size(); ++c) {
      widths[c] = std::max(widths[c], row[c].size());
    }
  };
  if (legend) measure(headers_);
  for (const auto& row : rows_) measure(row);
  const bool bold = colourWanted();
  const auto printRow = [&](const std::vector<std::string>& row, bool header) {
    std::string line;
    for (size_t c = 0; c < widths.size(); ++c) {
      const std::string& text = c < row.size() ? row[c] : std::string();
      line += text;
      if (c + 1 < widths.size()) line += std::string(widths[c] - text.size() + 2, ' ');
    }
    while (!line.empty() && line.back() == ' ') line.pop_back();
    if (header && bold) line = "\033[1m" + line + "\033[0m";
    std::fprintf(out, "%s\n", line.c_str());
  };
  if (legend) printRow(headers_, true);
  for (const auto& row : rows_) printRow(row, false);
}

void printJson(const lmo::Value& value) {
  std::printf("%s\n", lmo::toJson(value, lmo::JsonStyle::kPretty).c_str());
}

void printJsonLine(const lmo::Value& value) {
  std::printf("%s\n", lmo::toJson(value, lmo::JsonStyle::kCompact).c_str());
  std::fflush(stdout);
}

std::string cell(const lmo::Value& value) {
  using Type = lmo::Value::Type;
  switch (value.type()) {
    case Type::kNull:
      return "-";
    case Type::kBoolean:
      return *value.getIfBoolean() ? "yes" : "no";
    case Type::kString:
      return value.getIfString()->empty() ? "-" : *value.getIfString();
    case Type::kInteger:
    case Type::kReal:
    case Type::kDate:
    case Type::kUuid:
    case Type::kData: {
      // JSON's text for a scalar, without the quotes it puts around strings.
      std::string text = lmo::toJson(value);
      if (text.size() >= 2 && text.front() == '"') text = text.substr(1, text.size() - 2);
      return text;
    }
    case Type::kArray:
    case Type::kDictionary:
      return lmo::toJson(value);
  }
  return "-";
}

}  // namespace vantrel::ctl
