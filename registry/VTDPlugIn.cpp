#include "registry/VTDPlugIn.h"

#include <cmath>
#include <cstdint>
#include <limits>
#include <vector>

#include "base/Log.h"
#include "lmo/Protocol.h"
#include "model/MetadataKeys.h"
#include "platform/Paths.h"

namespace vantrel::registry {

using lmo::Dictionary;
using lmo::Value;
using omnidex::LookupScope;

namespace {

// Info dictionary keys that prunedInfoDictionaryFor drops.
constexpr std::string_view kBuildKeyPrefix = "DT";

// A registration date as whole seconds since 1970, truncated toward zero. A
// date beyond what 32 bits hold saturates rather than wrapping into a date
// on the other side of the epoch; a missing or NaN date is 0.
int32_t truncatedSeconds(const std::optional<lmo::Date>& date) {
  if (!date || std::isnan(date->secondsSince1970)) return 0;
  const double seconds = std::trunc(date->secondsSince1970);
  if (seconds <= std::numeric_limits<int32_t>::min()) return std::numeric_limits<int32_t>::min();
  if (seconds >= std::numeric_limits<int32_t>::max()) return std::numeric_limits<int32_t>::max();
  return static_cast<int32_t>(seconds);
}

base::Error invalid(const char* message) {
  return base::error_with_code(protocol::kErrorInvalidPlugIn, message);
}

}  // namespace

std::shared_ptr<VTDPlugIn> VTDPlugIn::initWithOXData(omnidex::PlugInRecordPtr record) {
  std::shared_ptr<VTDPlugIn> plugIn = fromOXData(record);
  if (!plugIn) return nullptr;
  if (std::optional<base::Error> error = plugIn->diagnose()) {
    base::vtlog("ignoring mis-configured plug-in at %@: %@", *record->bundlePath,
                error->description());
    return nullptr;
  }
  return plugIn;
}

std::optional<base::Error> VTDPlugIn::recordProblem(const omnidex::PlugInRecordPtr& record) {
  const std::shared_ptr<VTDPlugIn> plugIn = fromOXData(record);
  if (!plugIn) {
    return base::error_with_code(protocol::kErrorInvalidPlugIn, "missing identifier or bundle");
  }
  return plugIn->diagnose();
}

std::shared_ptr<VTDPlugIn> VTDPlugIn::fromOXData(const omnidex::PlugInRecordPtr& record) {
  if (!record || !record->bundlePath) return nullptr;
  auto plugIn = VTPlugInCore::initWithName<VTDPlugIn>(
      record->identifier, model::FileUrl::fromPath(*record->bundlePath), Value(),
      Value(record->extensionDictionary), record->uuid);
  if (!plugIn) return nullptr;

  plugIn->setOxproxy(record);
  plugIn->setEntitlements(plugIn->oxproxy()->entitlements);
  plugIn->setOriginalIdentifier(record->originalIdentifier);
  plugIn->setLastModified(truncatedSeconds(record->registrationDate));
  plugIn->setOnSystemVolume(record->onSystemPartition);

  std::optional<Dictionary> extension = plugIn->plugInDictionary();
  const Value* hub = extension ? extension->find(kHubProtocolVersionKey) : nullptr;
  if (hub != nullptr) {
    // Wraps as an unsigned 32-bit conversion does: -1 reads as 4294967295.
    plugIn->setHubProtocolVersion(static_cast<uint32_t>(hub->unsignedValue()));
  } else if (!plugIn->infoKey(model::kOldStyleKey).isNull()) {
    plugIn->setHubProtocolVersion(kOldStyleHubProtocolVersion);
  } else {
    plugIn->setHubProtocolVersion(kDefaultHubProtocolVersion);
  }

  if (record->containingApplication) {
    plugIn->setContainingUrl(model::FileUrl::fromPath(record->containingApplication->bundlePath));
  }

  return plugIn;
}

// ---- Metadata ----

Value VTDPlugIn::infoKey(std::string_view key) const {
  if (!oxproxy_) return VTPlugInCore::infoKey(key);
  return oxproxy_->keyed(key, LookupScope::kInfo);
}

Value VTDPlugIn::pluginKey(std::string_view key) const {
  if (!oxproxy_) return VTPlugInCore::pluginKey(key);
  return oxproxy_->keyed(key, LookupScope::kExtension);
}

Value VTDPlugIn::attribute(std::string_view key) const {
  if (!oxproxy_) return VTPlugInCore::attribute(key);
  return oxproxy_->keyed(key, LookupScope::kAttributes);
}

std::optional<Dictionary> VTDPlugIn::bundleInfoDictionary() const {
  if (!oxproxy_) return VTPlugInCore::bundleInfoDictionary();
  return oxproxy_->infoDictionary;
}

std::optional<base::Error> VTDPlugIn::diagnose() const {
  if (std::optional<base::Error> error = VTPlugInCore::diagnose()) return error;
  const bool hasContainer = oxproxy_ && oxproxy_->dataContainerPath.has_value();
  if (!isData() && !hasContainer) return invalid("this plug-in has no sandbox data container");
  if (!containingUrl() && !platform::isOnSystemVolume(path().value_or(""))) {
    return invalid("plug-ins outside containing apps must be in /System");
  }
  return std::nullopt;
}

// ---- Display names ----

std::optional<std::string> VTDPlugIn::lazyName(std::optional<std::string>& field,
                                               NameFetch fetch) const {
  {
    std::lock_guard lock(namesMutex_);
    if (field) return field;
  }
  if (!oxproxy_) return std::nullopt;
  // Fetched outside the lock; the registry record is immutable.
  std::optional<std::string> fetched = fetch(*oxproxy_);
  std::lock_guard lock(namesMutex_);
  if (!field) field = std::move(fetched);
  return field;
}

std::optional<std::string> VTDPlugIn::localizedName() const {
  return lazyName(localizedName_, [](const omnidex::PlugInRecord& r) { return r.localizedName; });
}

void VTDPlugIn::setLocalizedName(std::optional<std::string> name) {
  std::lock_guard lock(namesMutex_);
  localizedName_ = std::move(name);
}

std::optional<std::string> VTDPlugIn::localizedShortName() const {
  return lazyName(localizedShortName_,
                  [](const omnidex::PlugInRecord& r) { return r.localizedShortName; });
}

void VTDPlugIn::setLocalizedShortName(std::optional<std::string> name) {
  std::lock_guard lock(namesMutex_);
  localizedShortName_ = std::move(name);
}

std::optional<std::string> VTDPlugIn::localizedContainingName() const {
  return lazyName(localizedContainingName_, [](const omnidex::PlugInRecord& r) {
    return r.containingApplication ? r.containingApplication->localizedName : std::nullopt;
  });
}

void VTDPlugIn::setLocalizedContainingName(std::optional<std::string> name) {
  std::lock_guard lock(namesMutex_);
  localizedContainingName_ = std::move(name);
}

// ---- Entitlements and annotations ----

Value VTDPlugIn::valueForEntitlement(std::string_view name) const {
  std::optional<Dictionary> all = entitlements();
  return all ? all->get(name) : Value();
}

bool VTDPlugIn::hasEntitlement(std::string_view name) const {
  const Value value = valueForEntitlement(name);
  // Property-list equality is numeric for numbers and booleans, so this also
  // refuses 0 and 0.0, while the string "false" stays granted.
  return !value.isNull() && value != Value::boolean(false);
}

std::optional<std::string> VTDPlugIn::annotationKey() const {
  const Value replaced = valueForEntitlement(kReplacePlugInEntitlement);
  if (const std::string* key = replaced.getIfString()) return *key;
  return identifier();
}

Dictionary VTDPlugIn::prunedInfoDictionaryFor(const std::optional<Dictionary>& info) {
  if (!info) return Dictionary();
  std::vector<Dictionary::Entry> kept;
  for (const Dictionary::Entry& entry : *info) {
    if (!entry.first.starts_with(kBuildKeyPrefix)) kept.push_back(entry);
  }
  return Dictionary::fromEntries(std::move(kept));
}

}  // namespace vantrel::registry
