// The rule language hosts use to pick plug-ins: the match request's rules,
// a host's allowed-plug-ins entitlement and the user's exclusions.

#include <array>
#include <cstdint>
#include <string>

#include "base/Log.h"
#include "lmo/Protocol.h"
#include "model/VersionComparison.h"
#include "platform/ActivationRules.h"
#include "platform/TypeIdentifiers.h"
#include "registry/VTDPlugIn.h"
#include "registry/VTDatabase.h"

namespace vantrel::registry {

namespace {

constexpr std::string_view kEntitlementPrefix = "ENTITLEMENT:";
constexpr std::string_view kIdentifierKey = "QXExtensionIdentifier";
constexpr std::string_view kUuidKey = "com.karvo.uuid";
constexpr std::string_view kUserElectionKey = "QXUserElection";
constexpr std::string_view kContainingAppKey = "QXExtensionContainingApp";
constexpr std::string_view kConformsPrefix = "?KQ-CONFORMS:";
constexpr std::string_view kIsPrefix = "?KQ-IS:";
// Bits of a stored election that "QXUserElection" does not see.
constexpr int64_t kElectionHiddenBits = 0xFF00;

// A comparison operator: the pattern matches when (outcome == expected)
// differs from invert. Looked for in this order; the first prefix the
// pattern begins with wins.
struct Comparison {
  std::string_view prefix;
  int expected;
  bool invert;
};
constexpr std::array<Comparison, 6> kComparisons{{
    {"<>", 0, true},
    {"<=", 1, true},
    {">=", -1, true},
    {"=", 0, false},
    {"<", -1, false},
    {">", 1, false},
}};

const lmo::Value& booleanTrue() {
  static const lmo::Value value = lmo::Value::boolean(true);
  return value;
}
const lmo::Value& booleanFalse() {
  static const lmo::Value value = lmo::Value::boolean(false);
  return value;
}

// This thread's MatchLogOnce state: whether a scope is open, and whether it
// has logged.
thread_local bool tlsLogScope = false;
thread_local bool tlsLogged = false;

}  // namespace

MatchLogOnce::MatchLogOnce() : outermost_(!tlsLogScope) {
  if (outermost_) {
    tlsLogScope = true;
    tlsLogged = false;
  }
}

MatchLogOnce::~MatchLogOnce() {
  if (outermost_) tlsLogScope = false;
}

bool MatchLogOnce::mayLog() {
  if (!tlsLogScope) return true;
  if (tlsLogged) return false;
  tlsLogged = true;
  return true;
}

bool VTDPlugIn::match(const std::optional<lmo::Dictionary>& rules) const {
  if (!rules) return true;
  for (const auto& [key, pattern] : *rules) {
    if (!matchKey(key, pattern)) return false;
  }
  return true;
}

bool VTDPlugIn::matchKey(std::string_view key, const lmo::Value& pattern) const {
  lmo::Value value;
  if (key.starts_with(kEntitlementPrefix)) {
    value = valueForEntitlement(key.substr(kEntitlementPrefix.size()));
  } else {
    if (key == kIdentifierKey) {
      if (auto id = identifier()) value = lmo::Value(*id);
    } else if (key == kUuidKey) {
      if (auto id = uuid()) value = lmo::Value(id->string());
    } else if (key == kUserElectionKey) {
      value = lmo::Value(electionText());
    } else if (key == kContainingAppKey) {
      const std::optional<std::string> container = containingPath();
      if (!container) return false;
      value = lmo::Value(*container);
    }
    if (value.isNull()) value = attribute(key);
    if (value.isNull()) value = infoKey(key);
  }
  if (pattern == booleanTrue()) return !value.isNull() && !(value == booleanFalse());
  if (pattern == booleanFalse()) return value.isNull() || value == booleanFalse();
  if (value.isNull()) return false;
  if (const lmo::Dictionary* items = pattern.getIfDictionary()) {
    return matchDictionary(value, *items);
  }
  if (const std::string* text = value.getIfString()) return matchValuePatterns(*text, pattern);
  if (const lmo::Array* values = value.getIfArray()) {
    for (const lmo::Value& element : *values) {
      const std::string* text = element.getIfString();
      if (text != nullptr && matchValuePatterns(*text, pattern)) return true;
    }
  }
  return false;
}

bool VTDPlugIn::matchValuePatterns(std::string_view value, const lmo::Value& patterns) const {
  if (const std::string* pattern = patterns.getIfString())
    return matchValuePattern(value, *pattern);
  if (const lmo::Array* list = patterns.getIfArray()) {
    for (const lmo::Value& element : *list) {
      const std::string* pattern = element.getIfString();
      if (pattern != nullptr && matchValuePattern(value, *pattern)) return true;
    }
  }
  return false;
}

bool VTDPlugIn::matchValuePattern(std::string_view value, std::string_view pattern) const {
  if (pattern.starts_with('?')) {
    if (pattern.starts_with(kConformsPrefix)) {
      return platform::typeConformsTo(value, pattern.substr(kConformsPrefix.size()));
    }
    if (pattern.starts_with(kIsPrefix)) {
      return platform::typeConformsTo(pattern.substr(kIsPrefix.size()), value);
    }
    if (MatchLogOnce::mayLog()) base::vtlog("unrecognized match operator:%@", pattern);
    return false;
  }
  Comparison comparison{"", 0, false};
  for (const Comparison& candidate : kComparisons) {
    if (pattern.starts_with(candidate.prefix)) {
      comparison = candidate;
      break;
    }
  }
  const int outcome = model::compareVersionString(value, pattern.substr(comparison.prefix.size()));
  return (outcome == comparison.expected) != comparison.invert;
}

bool VTDPlugIn::matchDictionary(const lmo::Value& value, const lmo::Dictionary& pattern) const {
  return platform::activationRuleAdmits(value, lmo::Value(pattern));
}

std::string VTDPlugIn::electionText() const {
  int64_t election = 0;
  if (std::shared_ptr<VTDatabase> database = database_.lock()) {
    if (auto annotation = database->annotationForPlugIn(*this)) {
      election = annotation->get(protocol::kAnnotationElection).integerValue();
    }
  }
  return std::to_string(static_cast<int32_t>(election & ~kElectionHiddenBits));
}

}  // namespace vantrel::registry
