#include "model/VersionComparison.h"

namespace vantrel::model {
namespace {

bool isDigit(char c) {
  return c >= '0' && c <= '9';
}

// The digit run starting at pos, without its leading zeros; pos moves past
// the run.
std::string_view digitRun(std::string_view s, size_t& pos) {
  size_t start = pos;
  while (pos < s.size() && isDigit(s[pos])) ++pos;
  std::string_view run = s.substr(start, pos - start);
  size_t nonZero = run.find_first_not_of('0');
  return nonZero == std::string_view::npos ? std::string_view() : run.substr(nonZero);
}

// Two digit runs without leading zeros: the longer is the larger number;
// equal lengths compare digit by digit.
int compareNumbers(std::string_view a, std::string_view b) {
  if (a.size() != b.size()) return a.size() < b.size() ? -1 : 1;
  int c = a.compare(b);
  return c < 0 ? -1 : (c > 0 ? 1 : 0);
}

}  // namespace

int compareVersionString(std::string_view receiver, std::string_view other) {
  size_t i = 0;
  size_t j = 0;
  while (i < receiver.size() && j < other.size()) {
    if (isDigit(receiver[i]) && isDigit(other[j])) {
      int c = compareNumbers(digitRun(receiver, i), digitRun(other, j));
      if (c != 0) return c;
      continue;
    }
    auto a = static_cast<unsigned char>(receiver[i++]);
    auto b = static_cast<unsigned char>(other[j++]);
    if (a != b) return a < b ? -1 : 1;
  }
  if (i < receiver.size()) return 1;
  if (j < other.size()) return -1;
  return 0;
}

}  // namespace vantrel::model
