// The plug-in form: the dictionary that stands for a record outside the
// daemon, and the record rebuilt from one.

#include <limits>

#include "lmo/Protocol.h"
#include "model/Collections.h"
#include "model/MetadataKeys.h"
#include "model/VTPlugInCore.h"

namespace vantrel::model {

using lmo::Dictionary;
using lmo::Value;

namespace {

using namespace protocol;

// A form's hub protocol version when it carries none (or not a number that
// fits).
constexpr uint32_t kDefaultHubProtocolVersion = 1;

std::optional<std::string> stringIn(const Dictionary& form, std::string_view key) {
  const std::string* s = form.get(key).getIfString();
  return s ? std::optional<std::string>(*s) : std::nullopt;
}

std::optional<Dictionary> dictionaryIn(const Dictionary& form, std::string_view key) {
  const Dictionary* d = form.get(key).getIfDictionary();
  return d ? std::optional<Dictionary>(*d) : std::nullopt;
}

std::optional<FileUrl> urlIn(const Dictionary& form, std::string_view key) {
  std::optional<std::string> path = stringIn(form, key);
  return path ? std::optional<FileUrl>(FileUrl::fromPath(*path)) : std::nullopt;
}

// A UUID string or a UUID value; anything else (a malformed string too)
// counts as absent.
std::optional<base::Uuid> uuidIn(const Dictionary& form) {
  const Value& v = form.get(kFormUuid);
  if (const base::Uuid* u = v.getIfUuid()) return *u;
  if (const std::string* s = v.getIfString()) return base::Uuid::parse(*s);
  return std::nullopt;
}

uint32_t hubProtocolVersionIn(const Dictionary& form) {
  std::optional<uint64_t> v = form.get(kFormHubProtocolVersion).getIfUInt64();
  if (!v || *v > std::numeric_limits<uint32_t>::max()) return kDefaultHubProtocolVersion;
  return static_cast<uint32_t>(*v);
}

int32_t lastModifiedIn(const Dictionary& form) {
  std::optional<int64_t> v = form.get(kFormLastModified).getIfInt64();
  if (!v || *v < std::numeric_limits<int32_t>::min() || *v > std::numeric_limits<int32_t>::max()) {
    return 0;
  }
  return static_cast<int32_t>(*v);
}

// A boolean, or a number read as one; anything else is false.
bool flagIn(const Dictionary& form, std::string_view key) {
  const Value& v = form.get(key);
  return v.isNumeric() && v.boolValue();
}

void addIfPresent(std::vector<Dictionary::Entry>& entries, std::string_view key, Value value) {
  if (!value.isNull()) entries.emplace_back(std::string(key), std::move(value));
}

template <typename T>
Value valueOf(const std::optional<T>& v) {
  return v ? Value(*v) : Value();
}

}  // namespace

bool VTPlugInCore::setupWithForm(const Dictionary& form) {
  if (!setupWithName(stringIn(form, kFormIdentifier), urlIn(form, kFormPath),
                     form.get(kFormBundleInfo), form.get(kFormInfo), uuidIn(form))) {
    return false;
  }
  setHubProtocolVersion(hubProtocolVersionIn(form));
  setOriginalIdentifier(stringIn(form, kFormOriginalIdentifier));
  const Value& hash = form.get(kFormHash);
  setCdhash(hash.getIfData() ? hash : Value());
  setRequirement(stringIn(form, kFormRequirement));
  setLastModified(lastModifiedIn(form));
  setEntitlements(dictionaryIn(form, kFormEntitlements));
  if (std::optional<FileUrl> containing = urlIn(form, kFormContainingPath)) {
    setContainingUrl(std::move(containing));
  }
  setOnSystemVolume(flagIn(form, kFormSystemResident));
  setAnnotations(dictionaryIn(form, kFormAnnotations));
  setLocalizedName(stringIn(form, kFormDisplayName));
  setLocalizedShortName(stringIn(form, kFormShortName));
  setLocalizedContainingName(stringIn(form, kFormContainingName));
  return true;
}

Dictionary VTPlugInCore::exportForm(base::Error* /*error*/) const {
  std::optional<Dictionary> bundle = bundleInfoDictionary();
  if (bundle) bundle = bundle->removing(kInfoPlistUrlKey);
  std::optional<base::Uuid> id = uuid();

  std::vector<Dictionary::Entry> entries;
  addIfPresent(entries, kFormHubProtocolVersion, Value::unsignedInteger(hubProtocolVersion()));
  addIfPresent(entries, kFormPath, valueOf(path()));
  addIfPresent(entries, kFormSystemResident, Value::boolean(onSystemVolume()));
  addIfPresent(entries, kFormIdentifier, valueOf(identifier()));
  addIfPresent(entries, kFormOriginalIdentifier, valueOf(originalIdentifier()));
  addIfPresent(entries, kFormVersion, version());
  addIfPresent(entries, kFormBundleInfo, valueOf(bundle));
  addIfPresent(entries, kFormInfo, valueOf(plugInDictionary()));
  addIfPresent(entries, kFormUuid, id ? Value(id->string()) : Value());
  addIfPresent(entries, kFormLastModified, Value::integer(lastModified()));
  addIfPresent(entries, kFormAnnotations, Value(annotations().value_or(Dictionary())));

  addIfPresent(entries, kFormEntitlements, valueOf(entitlements()));
  addIfPresent(entries, kFormContainingPath, valueOf(containingPath()));
  addIfPresent(entries, kFormContainingName, valueOf(localizedContainingName()));
  addIfPresent(entries, kFormDisplayName, valueOf(localizedName()));
  addIfPresent(entries, kFormShortName, valueOf(localizedShortName()));
  return Dictionary::fromEntries(std::move(entries));
}

void VTPlugInCore::updateFromForm(const Dictionary& form) {
  setAnnotations(dictionaryIn(form, kFormAnnotations));
}

void VTPlugInCore::setAnnotation(std::string_view key, const Value& value) {
  std::lock_guard lock(mutex_);
  annotations_ = dictionaryChanging(annotations_.value_or(Dictionary()), key, value);
}

}  // namespace vantrel::model
