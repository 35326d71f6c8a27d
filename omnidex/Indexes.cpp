#include "omnidex/Indexes.h"

#include <utility>

#include "omnidex/BundlePaths.h"
#include "omnidex/QueryKeys.h"

namespace vantrel::omnidex {
namespace {

std::vector<std::string> identifierKeys(const PlugInRecord& record) {
  if (!record.identifier) return {};
  return {matchingKey(*record.identifier)};
}

}  // namespace

const PlugInEntry* Indexes::plugInAt(const std::string& path) const {
  auto it = byPath_.find(path);
  return it == byPath_.end() ? nullptr : &it->second;
}

PlugInRecordPtr Indexes::plugInWithUuid(const base::Uuid& uuid) const {
  auto it = byUuid_.find(uuid);
  return it == byUuid_.end() ? nullptr : it->second;
}

const ApplicationEntry* Indexes::applicationAt(const std::string& path) const {
  auto it = applications_.find(path);
  return it == applications_.end() ? nullptr : &it->second;
}

std::vector<PlugInRecordPtr> Indexes::all() const {
  std::vector<PlugInRecordPtr> records;
  records.reserve(byPath_.size());
  for (const auto& [path, entry] : byPath_) records.push_back(entry.record);
  return records;
}

std::vector<const PlugInEntry*> Indexes::plugInsWithin(const std::string& dir) const {
  std::vector<const PlugInEntry*> entries;
  // "dir" sorts first, then "dir/..." ("/" sorts before every other
  // character a sibling such as "dir2" or "dir.x" could continue with, except
  // a few punctuation marks, which isWithin() filters out).
  for (auto it = byPath_.lower_bound(dir); it != byPath_.end(); ++it) {
    if (!it->first.starts_with(dir)) break;
    if (isWithin(it->first, dir)) entries.push_back(&it->second);
  }
  return entries;
}

std::vector<PlugInRecordPtr> Indexes::plugInsOfApplication(const std::string& appPath) const {
  std::vector<PlugInRecordPtr> records;
  for (const PlugInEntry* entry : plugInsWithin(appPath)) {
    const ApplicationRecordPtr& app = entry->record->containingApplication;
    if (app != nullptr && app->bundlePath == appPath) records.push_back(entry->record);
  }
  return records;
}

std::optional<std::map<std::string, PlugInRecordPtr>> Indexes::narrowed(
    const KeyIndex& index, const lmo::Dictionary& query, const char* key) {
  const lmo::Value* pattern = query.find(key);
  if (pattern == nullptr) return std::nullopt;
  std::optional<std::vector<std::string>> keys = plainPatternKeys(*pattern);
  if (!keys) return std::nullopt;
  std::map<std::string, PlugInRecordPtr> found;
  for (const std::string& k : *keys) {
    auto it = index.find(k);
    if (it != index.end()) found.insert(it->second.begin(), it->second.end());
  }
  return found;
}

std::vector<PlugInRecordPtr> Indexes::candidates(const lmo::Dictionary& query) const {
  std::optional<std::map<std::string, PlugInRecordPtr>> byPoint =
      narrowed(byExtensionPoint_, query, kExtensionPointIdentifierKey);
  std::optional<std::map<std::string, PlugInRecordPtr>> byId =
      narrowed(byIdentifier_, query, kExtensionIdentifierKey);
  if (!byPoint && !byId) return all();
  std::vector<PlugInRecordPtr> records;
  if (byPoint && byId) {
    for (const auto& [path, record] : *byPoint) {
      if (byId->contains(path)) records.push_back(record);
    }
    return records;
  }
  const auto& only = byPoint ? *byPoint : *byId;
  records.reserve(only.size());
  for (const auto& [path, record] : only) records.push_back(record);
  return records;
}

void Indexes::indexUnder(KeyIndex& index, const std::vector<std::string>& keys,
                         const PlugInRecordPtr& record) {
  // The end is the hint: loading the store puts records in path order.
  for (const std::string& key : keys) {
    std::map<std::string, PlugInRecordPtr>& paths = index[key];
    paths.insert_or_assign(paths.end(), *record->bundlePath, record);
  }
}

void Indexes::unindexUnder(KeyIndex& index, const std::vector<std::string>& keys,
                           const std::string& path) {
  for (const std::string& key : keys) {
    auto it = index.find(key);
    if (it == index.end()) continue;
    it->second.erase(path);
    if (it->second.empty()) index.erase(it);
  }
}

void Indexes::put(PlugInEntry entry) {
  const PlugInRecordPtr record = entry.record;
  const std::string& path = *record->bundlePath;
  // Loading the store puts entries in path order: past the last path there
  // is nothing to replace, and the entry goes at the end without a search.
  const bool last = byPath_.empty() || byPath_.rbegin()->first < path;
  if (!last) erase(path);
  indexUnder(byExtensionPoint_, extensionPointKeys(*record), record);
  indexUnder(byIdentifier_, identifierKeys(*record), record);
  byUuid_[record->uuid] = record;
  byPath_.emplace_hint(byPath_.end(), path, std::move(entry));
}

void Indexes::erase(const std::string& path) {
  auto it = byPath_.find(path);
  if (it == byPath_.end()) return;
  const PlugInRecordPtr& record = it->second.record;
  unindexUnder(byExtensionPoint_, extensionPointKeys(*record), path);
  unindexUnder(byIdentifier_, identifierKeys(*record), path);
  auto uuid = byUuid_.find(record->uuid);
  if (uuid != byUuid_.end() && uuid->second == record) byUuid_.erase(uuid);
  byPath_.erase(it);
}

void Indexes::putApplication(ApplicationEntry entry) {
  const std::string path = entry.record->bundlePath;
  applications_.insert_or_assign(path, std::move(entry));
}

void Indexes::eraseApplication(const std::string& path) {
  applications_.erase(path);
}

}  // namespace vantrel::omnidex
