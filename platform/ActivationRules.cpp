#include "platform/ActivationRules.h"

#include <cmath>
#include <cstdint>
#include <limits>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace vantrel::platform {
namespace {

using Verdict = ActivationRuleVerdict;

// One type of a rule and the most attachments that may conform to it.
struct RuleType {
  std::string_view identifier;
  uint64_t maxCount;
};

struct ParsedRule {
  std::optional<uint64_t> maxItems;
  std::vector<RuleType> types;
};

// A whole number >= 0: an integer, or a real without a fraction (property
// lists and JSON may write 2 as 2.0). Booleans compare equal to 0 and 1
// elsewhere, but "true" is no count: neither typed read below accepts one.
std::optional<uint64_t> readCount(const lmo::Value& value) {
  if (std::optional<uint64_t> count = value.getIfUInt64()) return count;
  const double* real = value.getIfReal();
  if (real == nullptr || !std::isfinite(*real) || *real < 0 || *real != std::floor(*real)) {
    return std::nullopt;
  }
  // 2^64 and above: more than any input can hold, so as good as unlimited.
  constexpr double kTwoTo64 = 18446744073709551616.0;
  if (*real >= kTwoTo64) return std::numeric_limits<uint64_t>::max();
  return static_cast<uint64_t>(*real);
}

// The rule's dictionary read into `out`; a verdict other than kAdmitted when
// it cannot be.
Verdict parseRule(const lmo::Value& rule, ParsedRule& out) {
  const lmo::Dictionary* dictionary = rule.getIfDictionary();
  if (dictionary == nullptr) return Verdict::kMalformedRule;
  for (const auto& [key, value] : *dictionary) {
    std::optional<uint64_t> count = readCount(value);
    if (!count) return Verdict::kMalformedRule;
    if (key == kActivationRuleMaxItemsKey) {
      out.maxItems = count;
      continue;
    }
    if (key.empty() || key.size() > kMaxTypeIdentifierLength) return Verdict::kMalformedRule;
    if (out.types.size() == kMaxActivationRuleTypes) return Verdict::kOverLimit;
    out.types.push_back({key, *count});
  }
  return Verdict::kAdmitted;
}

// Every attachment of every item, in order, into `out`; a verdict other than
// kAdmitted when the items have another shape or exceed the bounds.
Verdict collectAttachments(const lmo::Value& extensionItems, size_t& itemCount,
                           std::vector<std::string_view>& out) {
  const lmo::Dictionary* root = extensionItems.getIfDictionary();
  const lmo::Array* items = root ? root->get(kExtensionItemsKey).getIfArray() : nullptr;
  if (items == nullptr) return Verdict::kMalformedItems;
  if (items->size() > kMaxExtensionItems) return Verdict::kOverLimit;
  itemCount = items->size();
  for (const lmo::Value& item : *items) {
    const lmo::Dictionary* fields = item.getIfDictionary();
    if (fields == nullptr) return Verdict::kMalformedItems;
    const lmo::Value* attachments = fields->find(kExtensionItemAttachmentsKey);
    if (attachments == nullptr) continue;  // an item with nothing attached
    const lmo::Array* list = attachments->getIfArray();
    if (list == nullptr) return Verdict::kMalformedItems;
    if (list->size() > kMaxExtensionAttachments - out.size()) return Verdict::kOverLimit;
    for (const lmo::Value& attachment : *list) {
      const std::string* type = attachment.getIfString();
      if (type == nullptr || type->size() > kMaxTypeIdentifierLength) {
        return Verdict::kMalformedItems;
      }
      out.push_back(*type);
    }
  }
  return Verdict::kAdmitted;
}

}  // namespace

ActivationRuleVerdict evaluateActivationRule(const lmo::Value& rule,
                                             const lmo::Value& extensionItems,
                                             const TypeRegistry& types) {
  ParsedRule parsed;
  if (Verdict v = parseRule(rule, parsed); v != Verdict::kAdmitted) return v;
  size_t itemCount = 0;
  std::vector<std::string_view> attachments;
  if (Verdict v = collectAttachments(extensionItems, itemCount, attachments);
      v != Verdict::kAdmitted) {
    return v;
  }
  if (parsed.maxItems && itemCount > *parsed.maxItems) return Verdict::kTooManyItems;

  // An attachment counts against every rule type it conforms to, so a rule
  // of {"public.image": 1, "public.jpeg": 1} takes one JPEG, not two images.
  std::vector<uint64_t> seen(parsed.types.size(), 0);
  for (std::string_view attachment : attachments) {
    bool matched = false;
    for (size_t i = 0; i < parsed.types.size(); ++i) {
      if (!types.conformsTo(attachment, parsed.types[i].identifier)) continue;
      matched = true;
      ++seen[i];
    }
    if (!matched) return Verdict::kUnmatchedAttachment;
  }
  for (size_t i = 0; i < parsed.types.size(); ++i) {
    if (seen[i] > parsed.types[i].maxCount) return Verdict::kCountExceeded;
  }
  return Verdict::kAdmitted;
}

bool activationRuleAdmits(const lmo::Value& rule, const lmo::Value& extensionItems,
                          const TypeRegistry& types) {
  return evaluateActivationRule(rule, extensionItems, types) == Verdict::kAdmitted;
}

bool activationRuleAdmits(const lmo::Value& rule, const lmo::Value& extensionItems) {
  return activationRuleAdmits(rule, extensionItems, *TypeRegistry::shared());
}

const char* describe(ActivationRuleVerdict verdict) {
  switch (verdict) {
    case Verdict::kAdmitted:
      return "admitted";
    case Verdict::kMalformedRule:
      return "malformed rule";
    case Verdict::kMalformedItems:
      return "malformed extension items";
    case Verdict::kOverLimit:
      return "over limit";
    case Verdict::kTooManyItems:
      return "more items than maxItems";
    case Verdict::kUnmatchedAttachment:
      return "attachment of no rule type";
    case Verdict::kCountExceeded:
      return "too many attachments of a type";
  }
  return "unknown verdict";
}

}  // namespace vantrel::platform
