#pragma once
// How vantrelctl prints: aligned tables sized to their content for people,
// one JSON document for programs.

#include <cstdio>
#include <string>
#include <vector>

#include "lmo/Value.h"

namespace vantrel::ctl {

// The tool's own JSON keys, beyond the daemon's protocol keys it passes on.
inline constexpr const char* kJsonSocket = "socket";
inline constexpr const char* kJsonAnswering = "answering";
inline constexpr const char* kJsonEvent = "event";
inline constexpr const char* kJsonOld = "old";
inline constexpr const char* kJsonOk = "ok";

// Whether standard output is a terminal that takes colour (bold headers).
bool colourWanted();

class Table {
 public:
  explicit Table(std::vector<std::string> headers) : headers_(std::move(headers)) {}
  void add(std::vector<std::string> row) { rows_.push_back(std::move(row)); }
  bool empty() const { return rows_.empty(); }
  // Columns as wide as their widest cell, two spaces apart, the last one
  // unpadded; the header row unless legend is false.
  void print(std::FILE* out, bool legend) const;

 private:
  std::vector<std::string> headers_;
  std::vector<std::vector<std::string>> rows_;
};

// value as one JSON document on standard output: pretty, or one line.
void printJson(const lmo::Value& value);
void printJsonLine(const lmo::Value& value);

// A value as one table cell or field: strings as they are, numbers in
// decimal, booleans yes/no, UUIDs and dates as text, nothing as "-",
// containers as compact JSON.
std::string cell(const lmo::Value& value);

}  // namespace vantrel::ctl
