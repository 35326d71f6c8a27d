// SDK resolution: an extension point's registered SDK dictionary merged
// under a plug-in's own bundle info.

#include <set>
#include <vector>

#include "base/Check.h"
#include "base/Log.h"
#include "lmo/Message.h"
#include "model/MetadataKeys.h"
#include "model/VTPlugInCore.h"
#include "platform/SdkRegistry.h"

namespace vantrel::model {

using lmo::Array;
using lmo::Dictionary;
using lmo::Value;

namespace {

Dictionary mergeAtDepth(const Dictionary& source, const Dictionary& into, int depth);

// The merged value for a key present on both sides, or nullopt to keep the
// plug-in's value.
std::optional<Value> mergeValue(std::string_view key, const Value& s, const Value& r, int depth) {
  if (VTPlugInCore::sdkOverridesKey(key)) return s;
  if (key == kSharedKey) {
    const Array* sdkShared = s.getIfArray();
    const Array* ownShared = r.getIfArray();
    if (sdkShared == nullptr || ownShared == nullptr) return std::nullopt;
    return Value(VTPlugInCore::mergeSharedResources(*sdkShared, *ownShared));
  }
  const Dictionary* sdkDict = s.getIfDictionary();
  const Dictionary* ownDict = r.getIfDictionary();
  if (sdkDict == nullptr || ownDict == nullptr) return std::nullopt;
  if (depth >= VTPlugInCore::kMaxMergeDepth) return std::nullopt;
  return Value(mergeAtDepth(*sdkDict, *ownDict, depth + 1));
}

Dictionary mergeAtDepth(const Dictionary& source, const Dictionary& into, int depth) {
  // Every key of source is visited once, so reading the plug-in's side from
  // `into` is the same as reading the result built so far. Changes are
  // collected and applied at once: the later entry wins in fromEntries.
  std::vector<Dictionary::Entry> entries(into.begin(), into.end());
  for (const auto& [key, s] : source) {
    const Value* r = into.find(key);
    if (r == nullptr || r->isNull()) {
      entries.emplace_back(key, s);
    } else if (std::optional<Value> merged = mergeValue(key, s, *r, depth)) {
      entries.emplace_back(key, std::move(*merged));
    }
  }
  return Dictionary::fromEntries(std::move(entries));
}

}  // namespace

std::optional<Dictionary> VTPlugInCore::readSDKDictionary(const std::string& name) {
  std::optional<Dictionary> entry = platform::lookupExtensionSdk(name);
  if (!entry) {
    base::vtlog("plug-in sdk \"%@\" not registered", name);
    return std::nullopt;
  }
  return lmo::propertyListFromMessage(*entry);
}

void VTPlugInCore::resolveSDK() {
  std::optional<Dictionary> info = bundleInfoDictionary();
  VT_CHECK(info.has_value(), "cannot resolve SDK without materialized Info.plist");
  Value point = sdkSpec();
  if (!point.isNull()) {
    const std::string* name = point.getIfString();
    if (name == nullptr) {
      base::vtlog("invalid SDK key:%@", point);
      return;
    }
    if (std::optional<Dictionary> sdk = readSDKDictionary(*name)) {
      // Not checked: without a "QXExtension" dictionary in the merge the
      // bundle info is still replaced and the extension dictionary stays.
      (void)setDictionaries(Value(mergeDictionary(*sdk, *info)));
    }
  }
  canonicalize();
}

Dictionary VTPlugInCore::mergeDictionary(const Dictionary& source, const Dictionary& into) {
  return mergeAtDepth(source, into, 0);
}

bool VTPlugInCore::sdkOverridesKey(std::string_view key) {
  return key == kCleanTimeoutKey;
}

Array VTPlugInCore::mergeSharedResources(const Array& source, const Array& into) {
  // Resource paths are strings; anything else is kept once per type and
  // description, in the order met, so a malformed array cannot make this
  // quadratic.
  std::set<std::string> strings;
  std::set<std::string> otherKeys;
  std::vector<Value> others;
  auto add = [&](const Value& v) {
    if (const std::string* s = v.getIfString()) {
      strings.insert(*s);
    } else if (otherKeys.insert(std::string(lmo::typeName(v.type())) + ":" + describe(v)).second) {
      others.push_back(v);
    }
  };
  for (const Value& v : into) add(v);
  for (const Value& v : source) add(v);
  std::vector<Value> out(strings.begin(), strings.end());
  out.insert(out.end(), others.begin(), others.end());
  return Array(std::move(out));
}

}  // namespace vantrel::model
