// The rule language: a host's rule dictionary matched against a plug-in
// record, and the activation rule a plug-in declares evaluated against a
// host's extension items. The input is four CBOR parts (FuzzSupport.h), as
// rules and items arrive on the wire: the rule dictionary, the plug-in's
// Info dictionary (its "QXExtension" dictionary is the extension
// dictionary), its entitlements and the extension items.
//
// Beyond running every key and operator without fault:
//  - version operators agree with each other: of "<x", "=x" and ">x"
//    exactly one holds, "<>x", "<=x" and ">=x" are their negations, a bare
//    "x" is "=x", and the version order is antisymmetric and transitive;
//  - an activation rule that admits some items admits fewer of them.

#include <array>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "fuzz/FuzzSupport.h"
#include "lmo/Cbor.h"
#include "model/MetadataKeys.h"
#include "model/VersionComparison.h"
#include "omnidex/RecordFactory.h"
#include "platform/ActivationRules.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"
#include "platform/TypeIdentifiers.h"
#include "registry/VTDPlugIn.h"

namespace {

using namespace vantrel;
using lmo::Array;
using lmo::Dictionary;
using lmo::Value;
using platform::ActivationRuleVerdict;

// Version operands examined per input, so that the triple check stays small.
constexpr size_t kMaxOperands = 8;
constexpr std::string_view kActivationRuleKey = "QXExtensionActivationRule";

struct Fixture {
  std::string bundle;
  omnidex::ApplicationRecordPtr application;
};

// The types the rules see: the built-in ones and a few declared, with a
// cycle, in the SDK directory's types.plist.
const Fixture& fixture() {
  static const Fixture f = [] {
    fuzz::setUpProcess();
    const Array types{
        Dictionary{{"identifier", "com.example.note"},
                   {"conformsTo", Array{"public.plain-text", "com.example.page"}},
                   {"extensions", Array{"note"}}},
        Dictionary{{"identifier", "com.example.page"}, {"conformsTo", Array{"com.example.note"}}},
        Dictionary{{"identifier", "com.example.photo"}, {"conformsTo", Array{"public.jpeg"}}},
    };
    fuzz::writeFile(platform::sdkDirectories().front() + "/" + platform::kTypeDeclarationsFileName,
                    platform::writePropertyListXML(Value(types)).value());
    const std::string applicationPath = fuzz::scratchDirectory() + "/Applications/Host.app";
    return Fixture{applicationPath + "/PlugIns/P.appex",
                   omnidex::makeApplicationRecord(applicationPath,
                                                  Dictionary{{"KBBundleName", "Host"}})};
  }();
  return f;
}

Dictionary dictionaryPart(std::string_view part) {
  auto value = lmo::decodeCbor(reinterpret_cast<const uint8_t*>(part.data()), part.size());
  const Dictionary* d = value.has_value() ? value->getIfDictionary() : nullptr;
  return d != nullptr ? *d : Dictionary();
}

// The daemon's record of a registered plug-in with this Info dictionary and
// these entitlements, built as the database builds one but without the
// validation that would refuse a mis-configured plug-in: rules see those too
// (the "explain" request runs them).
std::shared_ptr<registry::VTDPlugIn> makePlugIn(const Dictionary& info,
                                                const Dictionary& entitlements) {
  auto record = std::make_shared<omnidex::PlugInRecord>();
  record->uuid = *base::Uuid::parse("6D46A508-9227-4A2E-98ED-8701E2DB39A1");
  record->bundlePath = fixture().bundle;
  // The registry registers only bundles with an extension dictionary.
  const Dictionary* metadata = info.get(model::kExtensionKey).getIfDictionary();
  if (metadata == nullptr) metadata = info.get(model::kOldStyleKey).getIfDictionary();
  record->infoDictionary = metadata ? info : info.setting(model::kExtensionKey, Dictionary());
  if (metadata != nullptr) record->extensionDictionary = *metadata;
  const std::string* identifier = record->extensionDictionary.get("QXExtensionIdentifier").getIfString();
  if (identifier == nullptr) identifier = info.get(model::kBundleIdentifierKey).getIfString();
  record->identifier = identifier ? *identifier : "com.example.fuzzed";
  record->entitlements = entitlements;
  record->containingApplication = fixture().application;
  record->dataContainerPath = fuzz::scratchDirectory() + "/containers/P";

  auto plugIn = model::VTPlugInCore::initWithName<registry::VTDPlugIn>(
      record->identifier, model::FileUrl::fromPath(*record->bundlePath), Value(),
      Value(record->extensionDictionary), record->uuid);
  plugIn->setOxproxy(record);
  plugIn->setEntitlements(record->entitlements);
  plugIn->setContainingUrl(model::FileUrl::fromPath(record->containingApplication->bundlePath));
  return plugIn;
}

bool isOperator(char c) {
  return c == '<' || c == '>' || c == '=' || c == '?';
}

// Version operands: every pattern string of the rules with its operator
// taken off, and the record's identifier and version.
std::vector<std::string> operands(const Dictionary& rules, const registry::VTDPlugIn& plugIn) {
  std::vector<std::string> out;
  auto add = [&](const Value& v) {
    const std::string* s = v.getIfString();
    if (s == nullptr || out.size() >= kMaxOperands) return;
    std::string_view text = *s;
    while (!text.empty() && isOperator(text.front()) && text.front() != '?') text.remove_prefix(1);
    if (!text.empty() && isOperator(text.front())) return;
    out.emplace_back(text);
  };
  for (const auto& [key, pattern] : rules) {
    add(pattern);
    if (const Array* list = pattern.getIfArray()) {
      for (const Value& element : *list) add(element);
    }
  }
  add(Value(plugIn.identifier().value_or("")));
  add(plugIn.version());
  return out;
}

void checkVersionOperators(const registry::VTDPlugIn& plugIn, const std::vector<std::string>& xs) {
  for (const std::string& v : xs) {
    for (const std::string& x : xs) {
      const bool lt = plugIn.matchValuePattern(v, "<" + x);
      const bool eq = plugIn.matchValuePattern(v, "=" + x);
      const bool gt = plugIn.matchValuePattern(v, ">" + x);
      const std::string pair = v + " against " + x;
      FUZZ_REQUIRE(lt + eq + gt == 1, "exactly one of <, = and > holds", pair);
      FUZZ_REQUIRE(plugIn.matchValuePattern(v, "<>" + x) == !eq, "<> is not =", pair);
      FUZZ_REQUIRE(plugIn.matchValuePattern(v, "<=" + x) == !gt, "<= is not >", pair);
      FUZZ_REQUIRE(plugIn.matchValuePattern(v, ">=" + x) == !lt, ">= is not <", pair);
      FUZZ_REQUIRE(plugIn.matchValuePattern(v, x) == eq, "a bare version is =", pair);
      FUZZ_REQUIRE(model::compareVersionString(v, x) == -model::compareVersionString(x, v),
                   "the version order is antisymmetric", pair);
      for (const std::string& y : xs) {
        if (model::compareVersionString(v, x) <= 0 && model::compareVersionString(x, y) <= 0) {
          FUZZ_REQUIRE(model::compareVersionString(v, y) <= 0, "the version order is transitive",
                       pair + " against " + y);
        }
      }
    }
  }
}

// items with one item left out, or with one attachment of one item left out.
std::vector<Value> fewerItems(const Value& items) {
  std::vector<Value> out;
  const Dictionary* root = items.getIfDictionary();
  const Array* list = root ? root->get(platform::kExtensionItemsKey).getIfArray() : nullptr;
  if (list == nullptr || list->empty()) return out;
  auto withItems = [&](std::vector<Value> kept) {
    return Value(root->setting(platform::kExtensionItemsKey, Value(Array(std::move(kept)))));
  };
  std::vector<Value> all(list->begin(), list->end());
  std::vector<Value> withoutFirst(all.begin() + 1, all.end());
  out.push_back(withItems(withoutFirst));
  std::vector<Value> withoutLast(all.begin(), all.end() - 1);
  out.push_back(withItems(withoutLast));
  const Dictionary* first = all.front().getIfDictionary();
  const Array* attachments =
      first ? first->get(platform::kExtensionItemAttachmentsKey).getIfArray() : nullptr;
  if (attachments != nullptr && !attachments->empty()) {
    std::vector<Value> kept(attachments->begin() + 1, attachments->end());
    all.front() = Value(first->setting(platform::kExtensionItemAttachmentsKey, Array(std::move(kept))));
    out.push_back(withItems(all));
  }
  return out;
}

void checkActivationRule(const Value& rule, const Value& items) {
  const platform::TypeRegistry::SharedPtr types = platform::TypeRegistry::shared();
  if (platform::evaluateActivationRule(rule, items, *types) != ActivationRuleVerdict::kAdmitted) {
    return;
  }
  for (const Value& fewer : fewerItems(items)) {
    const ActivationRuleVerdict verdict = platform::evaluateActivationRule(rule, fewer, *types);
    FUZZ_REQUIRE(verdict == ActivationRuleVerdict::kAdmitted,
                 "a rule that admits items admits fewer of them",
                 describe(rule) + "\n" + describe(fewer) + "\n" + platform::describe(verdict));
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  fixture();
  const auto parts = fuzz::splitParts(data, size, 4);
  const Dictionary rules = dictionaryPart(parts[0]);
  auto plugIn = makePlugIn(dictionaryPart(parts[1]), dictionaryPart(parts[2]));
  auto itemsValue = lmo::decodeCbor(reinterpret_cast<const uint8_t*>(parts[3].data()),
                                    parts[3].size());
  const Value items = itemsValue.has_value() ? itemsValue.value() : Value();

  (void)plugIn->match(rules);
  checkVersionOperators(*plugIn, operands(rules, *plugIn));
  // A dictionary pattern is a host's extension items for the value's rule.
  const Value rule = plugIn->attribute(kActivationRuleKey);
  checkActivationRule(rule, items);
  for (const auto& [key, pattern] : rules) {
    if (pattern.getIfDictionary() != nullptr) checkActivationRule(rule, pattern);
  }
  return 0;
}
