#pragma once
// Activation rules: whether a plug-in is willing to act on what a host hands
// it. The plug-in states a rule, a dictionary from type identifiers to the
// most attachments of that type it takes, with an optional "maxItems"; the
// host describes its extension items as
//   {"items": [{"attachments": ["public.jpeg", ...]}, ...]}.
// docs/activation-rules.md defines the language and gives worked examples.
//
// Rules come from plug-in bundles and items from client requests: anything
// of an unexpected shape is refused, never trusted, and evaluation work is
// bounded by the constants below.

#include <cstddef>

#include "lmo/Value.h"
#include "platform/TypeIdentifiers.h"

namespace vantrel::platform {

inline constexpr const char* kActivationRuleMaxItemsKey = "maxItems";
inline constexpr const char* kExtensionItemsKey = "items";
inline constexpr const char* kExtensionItemAttachmentsKey = "attachments";

// Types one rule may name; a rule naming more is refused.
inline constexpr size_t kMaxActivationRuleTypes = 64;
// Items, and attachments over all items, that one evaluation examines; more
// are refused.
inline constexpr size_t kMaxExtensionItems = 256;
inline constexpr size_t kMaxExtensionAttachments = 1024;

// Why a rule admits or refuses; everything but kAdmitted refuses.
enum class ActivationRuleVerdict {
  kAdmitted,
  kMalformedRule,        // not a dictionary, or a count that is not a whole number >= 0
  kMalformedItems,       // not {"items": [dictionary...]} with string attachments
  kOverLimit,            // more rule types, items or attachments than the bounds above
  kTooManyItems,         // more items than the rule's "maxItems"
  kUnmatchedAttachment,  // an attachment conforms to none of the rule's types
  kCountExceeded,        // more attachments conform to one of the rule's types than its count
};

// Evaluates a rule against extension items, with conformance taken from
// types. When several reasons to refuse apply, a malformed rule is reported
// first, then malformed or oversized items, then "maxItems", then an
// unmatched attachment, then an exceeded count.
ActivationRuleVerdict evaluateActivationRule(const lmo::Value& rule,
                                             const lmo::Value& extensionItems,
                                             const TypeRegistry& types);

// Whether the rule admits the items: the verdict is kAdmitted.
bool activationRuleAdmits(const lmo::Value& rule, const lmo::Value& extensionItems,
                          const TypeRegistry& types);
// The same with TypeRegistry::shared().
bool activationRuleAdmits(const lmo::Value& rule, const lmo::Value& extensionItems);

const char* describe(ActivationRuleVerdict verdict);

}  // namespace vantrel::platform
