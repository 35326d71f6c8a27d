#include "omnidex/Records.h"

namespace vantrel::omnidex {
namespace {

constexpr const char* kAttributesKey = "QXExtensionAttributes";

}  // namespace

lmo::Value PlugInRecord::keyed(std::string_view key, LookupScope scope) const {
  switch (scope) {
    case LookupScope::kAttributes:
      if (const lmo::Dictionary* attributes =
              extensionDictionary.get(kAttributesKey).getIfDictionary()) {
        return attributes->get(key);
      }
      return lmo::Value();
    case LookupScope::kExtension:
      return extensionDictionary.get(key);
    case LookupScope::kInfo:
      // The fallback lets a host's rule on "QXExtensionPointIdentifier",
      // which reads the Info dictionary, see the extension point that the
      // plug-in declares in its extension dictionary.
      if (const lmo::Value* value = infoDictionary.find(key)) return *value;
      return extensionDictionary.get(key);
  }
  return lmo::Value();
}

}  // namespace vantrel::omnidex
