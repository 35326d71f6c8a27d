#include "omnidex/RecordFactory.h"

#include <chrono>
#include <memory>
#include <utility>

#include "omnidex/BundlePaths.h"
#include "platform/Paths.h"

namespace vantrel::omnidex {
namespace {

constexpr const char* kDisplayNameKey = "KBBundleDisplayName";
constexpr const char* kNameKey = "KBBundleName";
constexpr const char* kBundleIdentifierKey = "KBBundleIdentifier";
constexpr const char* kBundleVersionKey = "KBBundleVersion";

std::optional<std::string> stringFor(const lmo::Dictionary& d, const char* key) {
  if (const std::string* s = d.get(key).getIfString()) return *s;
  return std::nullopt;
}

// "KBBundleDisplayName", else "KBBundleName", else the bundle's directory
// name without its extension: every bundle has something to show.
std::string displayName(const std::string& path, const lmo::Dictionary& info) {
  if (std::optional<std::string> name = stringFor(info, kDisplayNameKey)) return *name;
  if (std::optional<std::string> name = stringFor(info, kNameKey)) return *name;
  return bundleStem(path);
}

}  // namespace

PlugInRecordPtr makePlugInRecord(const std::string& path, const PlugInInfo& metadata,
                                 const lmo::Dictionary& entitlements,
                                 const PlugInIdentity& identity,
                                 ApplicationRecordPtr containingApplication,
                                 std::optional<std::string> dataContainerPath) {
  auto record = std::make_shared<PlugInRecord>();
  record->uuid = identity.uuid;
  record->bundlePath = path;
  record->identifier = metadata.identifier;
  record->originalIdentifier = identity.originalIdentifier;
  record->extensionDictionary = metadata.extension;
  record->infoDictionary = metadata.info;
  record->entitlements = entitlements;
  record->registrationDate = identity.registrationDate;
  record->onSystemPartition = platform::isOnSystemVolume(path);
  record->containingApplication = std::move(containingApplication);
  record->localizedName = displayName(path, metadata.info);
  record->localizedShortName = stringFor(metadata.info, kNameKey);
  if (!record->localizedShortName) record->localizedShortName = record->localizedName;
  record->bundleIdentifier = stringFor(metadata.info, kBundleIdentifierKey);
  record->bundleVersion = stringFor(metadata.info, kBundleVersionKey);
  record->dataContainerPath = std::move(dataContainerPath);
  return record;
}

PlugInRecordPtr rebuildPlugInRecord(const PlugInRecord& record,
                                    ApplicationRecordPtr containingApplication,
                                    std::optional<lmo::Date> date) {
  auto copy = std::make_shared<PlugInRecord>(record);
  copy->containingApplication = std::move(containingApplication);
  if (date) copy->registrationDate = *date;
  return copy;
}

ApplicationRecordPtr makeApplicationRecord(const std::string& path,
                                           const std::optional<lmo::Dictionary>& info) {
  auto record = std::make_shared<ApplicationRecord>();
  record->bundlePath = path;
  record->placeholder = !info.has_value();
  const lmo::Dictionary empty;
  const lmo::Dictionary& dict = info ? *info : empty;
  record->localizedName = displayName(path, dict);
  record->bundleIdentifier = stringFor(dict, kBundleIdentifierKey);
  const size_t slash = path.rfind('/');
  record->bundleContainerPath = slash == 0 ? "/" : path.substr(0, slash);
  return record;
}

lmo::Date currentDate() {
  const auto since = std::chrono::system_clock::now().time_since_epoch();
  return lmo::Date{std::chrono::duration<double>(since).count()};
}

}  // namespace vantrel::omnidex
