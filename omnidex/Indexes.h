#pragma once
// The registry's in-memory view: every registered plug-in by bundle path,
// UUID, extension point and identifier, and the applications that hold them.
// Lookups are answered from here; the store is only written.
//
// Not thread-safe by itself: Omnidex guards it with its index mutex.

#include <map>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "base/Uuid.h"
#include "lmo/Value.h"
#include "omnidex/BundleReader.h"
#include "omnidex/Records.h"

namespace vantrel::omnidex {

struct PlugInEntry {
  PlugInRecordPtr record;
  bool isExplicit = false;  // registered by path, so kept while its bundle exists
  std::string fingerprint;  // of the bundle as last read
  ContentDigest digest;     // of the bytes last read
};

struct ApplicationEntry {
  ApplicationRecordPtr record;
  std::string fingerprint;
  std::optional<platform::Sha1Digest> digest;  // nullopt for a placeholder
};

class Indexes {
 public:
  using PlugInMap = std::map<std::string, PlugInEntry>;

  size_t size() const { return byPath_.size(); }
  const PlugInMap& plugIns() const { return byPath_; }
  const PlugInEntry* plugInAt(const std::string& path) const;
  PlugInRecordPtr plugInWithUuid(const base::Uuid& uuid) const;
  const ApplicationEntry* applicationAt(const std::string& path) const;

  // Every plug-in, in path order.
  std::vector<PlugInRecordPtr> all() const;
  // The entries at dir or below it, in path order.
  std::vector<const PlugInEntry*> plugInsWithin(const std::string& dir) const;
  // The plug-ins whose containing application is the one at appPath.
  std::vector<PlugInRecordPtr> plugInsOfApplication(const std::string& appPath) const;
  // The candidates of a query, in path order: narrowed by the plain patterns
  // of "QXExtensionPointIdentifier" and "QXExtensionIdentifier" (QueryKeys.h),
  // intersected when both narrow, else every plug-in.
  std::vector<PlugInRecordPtr> candidates(const lmo::Dictionary& query) const;

  // Adds entry, replacing the entry of the same path.
  void put(PlugInEntry entry);
  void erase(const std::string& path);
  void putApplication(ApplicationEntry entry);
  void eraseApplication(const std::string& path);

 private:
  // Index key -> bundle path -> record; inner maps keep path order.
  using KeyIndex = std::unordered_map<std::string, std::map<std::string, PlugInRecordPtr>>;

  static void indexUnder(KeyIndex& index, const std::vector<std::string>& keys,
                         const PlugInRecordPtr& record);
  static void unindexUnder(KeyIndex& index, const std::vector<std::string>& keys,
                           const std::string& path);
  static std::optional<std::map<std::string, PlugInRecordPtr>> narrowed(
      const KeyIndex& index, const lmo::Dictionary& query, const char* key);

  PlugInMap byPath_;
  std::unordered_map<base::Uuid, PlugInRecordPtr> byUuid_;
  KeyIndex byExtensionPoint_;
  KeyIndex byIdentifier_;
  std::unordered_map<std::string, ApplicationEntry> applications_;
};

}  // namespace vantrel::omnidex
