#include "omnidex/QueryKeys.h"

namespace vantrel::omnidex {
namespace {

bool isDigit(char c) {
  return c >= '0' && c <= '9';
}

// The rule language's operator prefixes: a type operator begins with "?",
// a comparison with one of "<>", "<=", ">=", "=", "<", ">" (the two-character
// ones all begin with a one-character one).
bool hasOperatorPrefix(const std::string& pattern) {
  if (pattern.empty()) return false;
  const char c = pattern.front();
  return c == '?' || c == '=' || c == '<' || c == '>';
}

}  // namespace

std::string matchingKey(std::string_view text) {
  std::string key;
  key.reserve(text.size());
  size_t i = 0;
  while (i < text.size()) {
    if (!isDigit(text[i])) {
      key += text[i++];
      continue;
    }
    size_t end = i;
    while (end < text.size() && isDigit(text[end])) ++end;
    size_t first = i;
    while (first + 1 < end && text[first] == '0') ++first;
    key.append(text.substr(first, end - first));
    i = end;
  }
  return key;
}

std::optional<std::vector<std::string>> plainPatternKeys(const lmo::Value& pattern) {
  if (const std::string* s = pattern.getIfString()) {
    if (hasOperatorPrefix(*s)) return std::nullopt;
    return std::vector<std::string>{matchingKey(*s)};
  }
  const lmo::Array* array = pattern.getIfArray();
  if (array == nullptr) return std::nullopt;
  std::vector<std::string> keys;
  keys.reserve(array->size());
  for (const lmo::Value& element : *array) {
    const std::string* s = element.getIfString();
    if (s == nullptr || hasOperatorPrefix(*s)) return std::nullopt;
    keys.push_back(matchingKey(*s));
  }
  return keys;
}

std::vector<std::string> extensionPointKeys(const PlugInRecord& record) {
  lmo::Value value = record.keyed(kExtensionPointIdentifierKey, LookupScope::kAttributes);
  if (value.isNull()) value = record.keyed(kExtensionPointIdentifierKey, LookupScope::kInfo);
  std::vector<std::string> keys;
  if (const std::string* s = value.getIfString()) {
    keys.push_back(matchingKey(*s));
  } else if (const lmo::Array* array = value.getIfArray()) {
    for (const lmo::Value& element : *array) {
      if (const std::string* e = element.getIfString()) keys.push_back(matchingKey(*e));
    }
  }
  return keys;
}

}  // namespace vantrel::omnidex
