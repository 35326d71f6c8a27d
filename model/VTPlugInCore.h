#pragma once
// The plug-in record: who a plug-in is (identifier, uuid), where it lies (its
// bundle and the application containing it), what its metadata says and the
// per-user state travelling with it (annotations).
//
// Metadata is three nested dictionaries: the bundle info dictionary (the
// bundle's whole Info dictionary), the extension dictionary (its "QXExtension"
// entry, or the old-style "Vantrel" dictionary for records built from
// registry data) and the attributes dictionary (the extension dictionary's
// "QXExtensionAttributes" entry). Everything that reads metadata goes through
// infoKey(), pluginKey() and attribute(); a subclass that keeps its metadata
// elsewhere overrides those three and bundleInfoDictionary(), and every
// derived property, validation and export follow.
//
// Records are shared (std::shared_ptr) between work queues. They are built
// and canonicalised by one thread; afterwards the stored properties guarded by
// mutex_ may be replaced while others read them, and a reader always sees a
// whole old or whole new value.

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "base/Error.h"
#include "base/Uuid.h"
#include "lmo/Value.h"
#include "model/FileUrl.h"

namespace vantrel::model {

class VTPlugInCore {
 public:
  // init: an empty record, no field set. Records are made with
  // std::make_shared (or through the factories below) and then set up.
  VTPlugInCore() = default;
  virtual ~VTPlugInCore() = default;
  VTPlugInCore(const VTPlugInCore&) = delete;
  VTPlugInCore& operator=(const VTPlugInCore&) = delete;

  // ---- Construction ----

  // A record of type Record set up with setupWithName(); null when that
  // fails (it has logged why). When setup left the extension dictionary unset
  // (no bundle info given), a dictionary `info` becomes the extension
  // dictionary: records built from registry data pass the registry's copy of
  // it here.
  template <typename Record = VTPlugInCore>
  static std::shared_ptr<Record> initWithName(std::optional<std::string> name,
                                              std::optional<FileUrl> url,
                                              const lmo::Value& bundleInfo, const lmo::Value& info,
                                              std::optional<base::Uuid> uuid);

  // Sets identifier, url and uuid (a fresh random one when uuid is nullopt),
  // and the dictionaries when bundleInfo is not null. Fails (returns false,
  // stores nothing but what setDictionaries stored) when url is missing
  // (silently), name is missing ("missing identifier in plug-in at %@"), or
  // bundleInfo is not a dictionary holding a "QXExtension" dictionary
  // ("malformed plug-in dictionary in plug-in %@ at %@: %@"). info is not
  // read here; initWithName uses it.
  bool setupWithName(std::optional<std::string> name, std::optional<FileUrl> url,
                     const lmo::Value& bundleInfo, const lmo::Value& info,
                     std::optional<base::Uuid> uuid);

  // Stores d as the bundle info dictionary and its "QXExtension" entry as the
  // extension dictionary. False when d is not a dictionary (nothing stored)
  // or has no "QXExtension" dictionary (the bundle info stays stored). An
  // obsolete "Multiple" key is logged and otherwise ignored.
  bool setDictionaries(const lmo::Value& d);

  // Hook to rewrite bundle info before setupWithName stores it; the base
  // returns it unchanged.
  virtual lmo::Value normalizeInfoDictionary(const lmo::Value& bundleInfo);

  // Makes sure the extension dictionary holds an attributes dictionary (an
  // entry that is not a dictionary is replaced by an empty one) and that the
  // attributes hold a version: "KBBundleShortVersionString" from the bundle
  // info, else "1". Run before the record is shared.
  void canonicalize();

  // ---- SDK resolution and merging ----

  // The SDK dictionary registered for an extension point; nullopt, after the
  // log line "plug-in sdk \"<name>\" not registered", when there is none.
  static std::optional<lmo::Dictionary> readSDKDictionary(const std::string& name);

  // Merges the SDK named by "QXExtensionPointIdentifier" under the record's
  // own bundle info and canonicalises. An unregistered SDK leaves the
  // dictionaries as they are (still canonicalised); an extension point that
  // is not a string is logged and leaves the record untouched and not
  // canonical. The record must have a bundle info dictionary (checked).
  void resolveSDK();

  // source (the SDK's) merged under into (the plug-in's): keys only in source
  // are copied; for keys in both the plug-in's value wins, except that
  // "CleanTimeout" takes the source's value, "Shared" arrays are united and
  // two dictionaries merge recursively with the same rules. Where the two
  // values cannot be merged (dictionary against non-dictionary, "Shared" not
  // an array on either side, nesting beyond kMaxMergeDepth) the plug-in's
  // value is kept.
  static lmo::Dictionary mergeDictionary(const lmo::Dictionary& source,
                                         const lmo::Dictionary& into);
  // True when the SDK's value replaces the plug-in's for key.
  static bool sdkOverridesKey(std::string_view key);
  // The distinct elements of both arrays: strings first, in byte order, then
  // any other values (one per type and description) in the order met, so the
  // output is deterministic.
  static lmo::Array mergeSharedResources(const lmo::Array& source, const lmo::Array& into);

  // Dictionaries nested deeper than this are not merged further; the
  // plug-in's value stands.
  static constexpr int kMaxMergeDepth = 128;

  // ---- The plug-in form (the record's shape outside the daemon) ----

  // A record of type Record set up with setupWithForm(); null when it fails.
  template <typename Record = VTPlugInCore>
  static std::shared_ptr<Record> initWithForm(const lmo::Dictionary& form);

  // Rebuilds the record from a form. Fails exactly when setupWithName fails
  // on the form's "path", "identifier" and "bundleInfo"; then nothing else is
  // set. Values of the wrong type count as absent: a "uuid" that is neither a
  // UUID string nor a UUID value gives a fresh random uuid, a missing
  // "hubProtocolVersion" gives 1, "lastmodified" 0, "systemResident" false.
  bool setupWithForm(const lmo::Dictionary& form);

  // The record as a form. Never fails and never writes *error (which may be
  // null). Values that should always be present ("path", "identifier",
  // "original-identifier", "version", "bundleInfo", "info", "uuid") are left
  // out when the record lacks them, rather than stopping the export.
  lmo::Dictionary exportForm(base::Error* error) const;

  // Replaces annotations with the form's "annotations" dictionary (nullopt
  // when absent or not a dictionary). Nothing else changes.
  void updateFromForm(const lmo::Dictionary& form);

  // Replaces annotations with a copy in which key maps to value, or without
  // key when value is null. A record without annotations starts from an
  // empty dictionary, so the change is never lost.
  void setAnnotation(std::string_view key, const lmo::Value& value);

  // ---- Validation ----

  // Null when the plug-in's configuration is usable, else the error (domain
  // "Vantrel", code 12) of the first rule it breaks. Reports, never logs.
  virtual std::optional<base::Error> diagnose() const;

  // ---- Metadata lookups (a null value means "not there") ----

  // The bundle info dictionary's value for key (through
  // bundleInfoDictionary()).
  virtual lmo::Value infoKey(std::string_view key) const;
  // The extension dictionary's value for key.
  virtual lmo::Value pluginKey(std::string_view key) const;
  // The attributes dictionary's value for key (through attributes()).
  virtual lmo::Value attribute(std::string_view key) const;

  // ---- Derived properties ----

  // False for the extension style ("QXExtension" in the bundle info), true
  // for the old style ("Vantrel"); a record with neither is a broken
  // invariant and stops the process.
  bool oldStyle() const;
  std::optional<std::string> path() const;
  std::optional<std::string> containingPath() const;
  // The attributes dictionary; nullopt when absent or not a dictionary.
  std::optional<lmo::Dictionary> attributes() const;
  lmo::Value version() const;
  // "QXExtensionProtocol", defaulting to "QXObject" for an application
  // extension.
  lmo::Value protocolSpec() const;
  // "PrincipalClass", defaulting to "QXObject" for an application extension.
  lmo::Value principalSpec() const;
  lmo::Value sdkSpec() const;
  // This platform runs no embedded code: always nullopt.
  std::optional<std::string> embeddedCodePath() const;
  lmo::Value embeddedProtocolSpec() const;
  // The Unix epoch plus lastModified() seconds.
  lmo::Date timestamp() const;
  // The bundle path ends in ".appex" (case-sensitive).
  bool isAppExtension() const;
  // Multiplexed plug-ins are obsolete: always false.
  bool isMultiplexed() const;
  bool isHybrid() const;
  bool isDedicated() const;
  bool isData() const;
  // Extra interface a record adds to an interface description; the base adds
  // nothing and returns null.
  virtual lmo::Value augmentInterface(const lmo::Value& interfaceDescription) const;

  // ---- Identity: the uuid ----

  // Equal when other is a record (of any subclass) with the same uuid; null
  // is unequal. This record must have a uuid (checked).
  bool isEqual(const VTPlugInCore* other) const;
  bool operator==(const VTPlugInCore& other) const { return isEqual(&other); }
  // The hash of the uuid; this record must have one (checked).
  uint32_t hash() const;

  // ---- Stored properties ----

  std::optional<std::string> identifier() const;
  void setIdentifier(std::optional<std::string> identifier);
  std::optional<std::string> originalIdentifier() const;
  void setOriginalIdentifier(std::optional<std::string> identifier);
  std::optional<FileUrl> url() const;
  void setUrl(std::optional<FileUrl> url);
  virtual std::optional<lmo::Dictionary> bundleInfoDictionary() const;
  void setBundleInfoDictionary(std::optional<lmo::Dictionary> dictionary);
  std::optional<lmo::Dictionary> plugInDictionary() const { return plugInDictionary_; }
  void setPlugInDictionary(std::optional<lmo::Dictionary> d) { plugInDictionary_ = std::move(d); }
  std::optional<lmo::Dictionary> entitlements() const;
  void setEntitlements(std::optional<lmo::Dictionary> entitlements);
  std::optional<lmo::Dictionary> annotations() const;
  void setAnnotations(std::optional<lmo::Dictionary> annotations);
  std::optional<FileUrl> containingUrl() const;
  void setContainingUrl(std::optional<FileUrl> url);
  bool onSystemVolume() const { return onSystemVolume_; }
  void setOnSystemVolume(bool v) { onSystemVolume_ = v; }
  uint32_t hubProtocolVersion() const { return hubProtocolVersion_; }
  void setHubProtocolVersion(uint32_t v) { hubProtocolVersion_ = v; }
  virtual std::optional<std::string> localizedName() const;
  virtual void setLocalizedName(std::optional<std::string> name);
  virtual std::optional<std::string> localizedShortName() const;
  virtual void setLocalizedShortName(std::optional<std::string> name);
  virtual std::optional<std::string> localizedContainingName() const;
  virtual void setLocalizedContainingName(std::optional<std::string> name);
  int32_t lastModified() const { return lastModified_; }
  void setLastModified(int32_t seconds) { lastModified_ = seconds; }
  std::optional<base::Uuid> uuid() const;
  void setUuid(std::optional<base::Uuid> uuid);
  // Code-directory hash as carried by forms: a data value, or null.
  lmo::Value cdhash() const;
  void setCdhash(lmo::Value hash);
  std::optional<std::string> requirement() const;
  void setRequirement(std::optional<std::string> requirement);

 private:
  // Copy of, or replacement for, a field guarded by mutex_.
  template <typename T>
  T locked(const T& field) const {
    std::lock_guard lock(mutex_);
    return field;
  }
  template <typename T>
  void store(T& field, T value) {
    std::lock_guard lock(mutex_);
    field = std::move(value);
  }

  // Guards every field below it up to the plain fields, so that a reader on
  // one queue gets a whole value while another queue replaces it.
  mutable std::mutex mutex_;
  std::optional<std::string> identifier_;
  std::optional<std::string> originalIdentifier_;
  std::optional<FileUrl> url_;
  std::optional<lmo::Dictionary> bundleInfoDictionary_;
  std::optional<lmo::Dictionary> entitlements_;
  std::optional<lmo::Dictionary> annotations_;
  std::optional<FileUrl> containingUrl_;
  std::optional<std::string> localizedName_;
  std::optional<std::string> localizedShortName_;
  std::optional<std::string> localizedContainingName_;
  std::optional<base::Uuid> uuid_;
  lmo::Value cdhash_;
  std::optional<std::string> requirement_;

  // Plain fields: set during construction (and canonicalize or resolveSDK)
  // before the record is shared, read-only afterwards.
  std::optional<lmo::Dictionary> plugInDictionary_;
  bool onSystemVolume_ = false;
  uint32_t hubProtocolVersion_ = 0;
  int32_t lastModified_ = 0;
};

using VTPlugInCorePtr = std::shared_ptr<VTPlugInCore>;

template <typename Record>
std::shared_ptr<Record> VTPlugInCore::initWithName(std::optional<std::string> name,
                                                   std::optional<FileUrl> url,
                                                   const lmo::Value& bundleInfo,
                                                   const lmo::Value& info,
                                                   std::optional<base::Uuid> uuid) {
  auto record = std::make_shared<Record>();
  if (!record->setupWithName(std::move(name), std::move(url), bundleInfo, info, uuid)) {
    return nullptr;
  }
  const lmo::Dictionary* extension = info.getIfDictionary();
  if (!record->plugInDictionary() && extension != nullptr) record->setPlugInDictionary(*extension);
  return record;
}

template <typename Record>
std::shared_ptr<Record> VTPlugInCore::initWithForm(const lmo::Dictionary& form) {
  auto record = std::make_shared<Record>();
  if (!record->setupWithForm(form)) return nullptr;
  return record;
}

}  // namespace vantrel::model
