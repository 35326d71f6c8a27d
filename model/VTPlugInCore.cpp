#include "model/VTPlugInCore.h"

#include "base/Check.h"
#include "base/Log.h"
#include "model/MetadataKeys.h"

namespace vantrel::model {

using lmo::Dictionary;
using lmo::Value;

// ---- Construction ----

bool VTPlugInCore::setupWithName(std::optional<std::string> name, std::optional<FileUrl> url,
                                 const Value& bundleInfo, const Value& /*info*/,
                                 std::optional<base::Uuid> uuid) {
  if (!url) return false;
  if (!name) {
    base::vtlog("missing identifier in plug-in at %@", url->path());
    return false;
  }
  if (!bundleInfo.isNull() && !setDictionaries(normalizeInfoDictionary(bundleInfo))) {
    base::vtlog("malformed plug-in dictionary in plug-in %@ at %@: %@", *name, *url, bundleInfo);
    return false;
  }
  setIdentifier(std::move(name));
  setUrl(std::move(url));
  setUuid(uuid ? *uuid : base::Uuid::random());
  return true;
}

bool VTPlugInCore::setDictionaries(const Value& d) {
  const Dictionary* info = d.getIfDictionary();
  if (info == nullptr) return false;
  setBundleInfoDictionary(*info);
  const Dictionary* extension = info->get(kExtensionKey).getIfDictionary();
  if (extension == nullptr) return false;
  plugInDictionary_ = *extension;
  if (extension->contains(kMultipleKey)) {
    base::vtlog("multiplexed plug-ins (%@ key) obsolete and ignored", kMultipleKey);
  }
  return true;
}

Value VTPlugInCore::normalizeInfoDictionary(const Value& bundleInfo) {
  return bundleInfo;
}

void VTPlugInCore::canonicalize() {
  Dictionary attrs = attributes().value_or(Dictionary());
  Dictionary info = plugInDictionary_.value_or(Dictionary());
  plugInDictionary_ = info.setting(kAttributesKey, attrs);
  if (!attribute(kVersionKey).isNull()) return;
  Value version = infoKey(kShortVersionKey);
  if (version.isNull()) version = Value(kDefaultVersion);
  plugInDictionary_ = info.setting(kAttributesKey, attrs.setting(kVersionKey, version));
}

// ---- Metadata lookups ----

Value VTPlugInCore::infoKey(std::string_view key) const {
  std::optional<Dictionary> info = bundleInfoDictionary();
  return info ? info->get(key) : Value();
}

Value VTPlugInCore::pluginKey(std::string_view key) const {
  return plugInDictionary_ ? plugInDictionary_->get(key) : Value();
}

Value VTPlugInCore::attribute(std::string_view key) const {
  std::optional<Dictionary> attrs = attributes();
  return attrs ? attrs->get(key) : Value();
}

// ---- Derived properties ----

bool VTPlugInCore::oldStyle() const {
  if (!infoKey(kExtensionKey).isNull()) return false;
  bool old = !infoKey(kOldStyleKey).isNull();
  VT_CHECK(old, "unknown plug-in configuration style");
  return true;
}

std::optional<std::string> VTPlugInCore::path() const {
  std::optional<FileUrl> u = url();
  return u ? std::optional<std::string>(u->path()) : std::nullopt;
}

std::optional<std::string> VTPlugInCore::containingPath() const {
  std::optional<FileUrl> u = containingUrl();
  return u ? std::optional<std::string>(u->path()) : std::nullopt;
}

std::optional<Dictionary> VTPlugInCore::attributes() const {
  Value attrs = pluginKey(kAttributesKey);
  const Dictionary* d = attrs.getIfDictionary();
  return d ? std::optional<Dictionary>(*d) : std::nullopt;
}

Value VTPlugInCore::version() const {
  return attribute(kVersionKey);
}

Value VTPlugInCore::protocolSpec() const {
  Value value = pluginKey(kProtocolKey);
  if (value.isNull() && isAppExtension()) return Value(kDefaultObjectClass);
  return value;
}

Value VTPlugInCore::principalSpec() const {
  Value value = pluginKey(kPrincipalClassKey);
  if (value.isNull() && isAppExtension()) return Value(kDefaultObjectClass);
  return value;
}

Value VTPlugInCore::sdkSpec() const {
  return pluginKey(kExtensionPointKey);
}

std::optional<std::string> VTPlugInCore::embeddedCodePath() const {
  return std::nullopt;
}

Value VTPlugInCore::embeddedProtocolSpec() const {
  Value value = pluginKey(kEmbeddedProtocolKey);
  return value.isNull() ? protocolSpec() : value;
}

lmo::Date VTPlugInCore::timestamp() const {
  return lmo::Date{static_cast<double>(lastModified_)};
}

bool VTPlugInCore::isAppExtension() const {
  std::optional<std::string> p = path();
  return p && p->ends_with(kAppExtensionSuffix);
}

bool VTPlugInCore::isMultiplexed() const {
  return false;
}

bool VTPlugInCore::isHybrid() const {
  return !pluginKey(kEmbeddedCodeKey).isNull();
}

bool VTPlugInCore::isDedicated() const {
  return pluginKey(kDedicatedKey).boolValue();
}

bool VTPlugInCore::isData() const {
  return protocolSpec() == Value(kDataProtocol);
}

Value VTPlugInCore::augmentInterface(const Value& /*interfaceDescription*/) const {
  return Value();
}

// ---- Identity ----

bool VTPlugInCore::isEqual(const VTPlugInCore* other) const {
  std::optional<base::Uuid> mine = uuid();
  VT_CHECK(mine.has_value(), "self.uuid");
  return other != nullptr && other->uuid() == mine;
}

uint32_t VTPlugInCore::hash() const {
  std::optional<base::Uuid> mine = uuid();
  VT_CHECK(mine.has_value(), "self.uuid");
  uint64_t h = mine->hash();
  return static_cast<uint32_t>(h ^ (h >> 32));
}

// ---- Stored properties ----

std::optional<std::string> VTPlugInCore::identifier() const {
  return locked(identifier_);
}
void VTPlugInCore::setIdentifier(std::optional<std::string> identifier) {
  store(identifier_, std::move(identifier));
}

std::optional<std::string> VTPlugInCore::originalIdentifier() const {
  return locked(originalIdentifier_);
}
void VTPlugInCore::setOriginalIdentifier(std::optional<std::string> identifier) {
  store(originalIdentifier_, std::move(identifier));
}

std::optional<FileUrl> VTPlugInCore::url() const {
  return locked(url_);
}
void VTPlugInCore::setUrl(std::optional<FileUrl> url) {
  store(url_, std::move(url));
}

std::optional<Dictionary> VTPlugInCore::bundleInfoDictionary() const {
  return locked(bundleInfoDictionary_);
}
void VTPlugInCore::setBundleInfoDictionary(std::optional<Dictionary> dictionary) {
  store(bundleInfoDictionary_, std::move(dictionary));
}

std::optional<Dictionary> VTPlugInCore::entitlements() const {
  return locked(entitlements_);
}
void VTPlugInCore::setEntitlements(std::optional<Dictionary> entitlements) {
  store(entitlements_, std::move(entitlements));
}

std::optional<Dictionary> VTPlugInCore::annotations() const {
  return locked(annotations_);
}
void VTPlugInCore::setAnnotations(std::optional<Dictionary> annotations) {
  store(annotations_, std::move(annotations));
}

std::optional<FileUrl> VTPlugInCore::containingUrl() const {
  return locked(containingUrl_);
}
void VTPlugInCore::setContainingUrl(std::optional<FileUrl> url) {
  store(containingUrl_, std::move(url));
}

std::optional<std::string> VTPlugInCore::localizedName() const {
  return locked(localizedName_);
}
void VTPlugInCore::setLocalizedName(std::optional<std::string> name) {
  store(localizedName_, std::move(name));
}

std::optional<std::string> VTPlugInCore::localizedShortName() const {
  return locked(localizedShortName_);
}
void VTPlugInCore::setLocalizedShortName(std::optional<std::string> name) {
  store(localizedShortName_, std::move(name));
}

std::optional<std::string> VTPlugInCore::localizedContainingName() const {
  return locked(localizedContainingName_);
}
void VTPlugInCore::setLocalizedContainingName(std::optional<std::string> name) {
  store(localizedContainingName_, std::move(name));
}

std::optional<base::Uuid> VTPlugInCore::uuid() const {
  return locked(uuid_);
}
void VTPlugInCore::setUuid(std::optional<base::Uuid> uuid) {
  store(uuid_, std::move(uuid));
}

Value VTPlugInCore::cdhash() const {
  return locked(cdhash_);
}
void VTPlugInCore::setCdhash(Value hash) {
  store(cdhash_, std::move(hash));
}

std::optional<std::string> VTPlugInCore::requirement() const {
  return locked(requirement_);
}
void VTPlugInCore::setRequirement(std::optional<std::string> requirement) {
  store(requirement_, std::move(requirement));
}

}  // namespace vantrel::model
