// The plug-in database: construction, the cache and lookups, registration.

#include "registry/VTDatabase.h"

#include "base/Log.h"
#include "lmo/Protocol.h"
#include "omnidex/Omnidex.h"

namespace vantrel::registry {

std::shared_ptr<omnidex::Workspace> VTDatabase::defaultWorkspace() {
  return omnidex::Omnidex::defaultWorkspace();
}

bool VTDatabase::setupWithDatabase(std::optional<std::string> annotationPath,
                                   std::shared_ptr<omnidex::Workspace> workspace) {
  if (!workspace) return false;
  workspace_ = std::move(workspace);
  annotations_ = VTDAnnotationStore::initWithDatabase(std::move(annotationPath));
  return annotations_ != nullptr;
}

void VTDatabase::startObserving() {
  // The registry holds observers weakly, so the database can go away without
  // unregistering; monitoring starts only once the database is whole, since
  // it announces what changed since the registry was last open.
  workspace_->addObserver(weak_from_this());
  workspace_->startMonitoring();
}

// ---- Lookups ----

VTDPlugInPtr VTDatabase::cached(const base::Uuid& uuid) const {
  auto found = cache_.find(uuid);
  return found == cache_.end() ? nullptr : found->second;
}

VTDPlugInPtr VTDatabase::plugInForProxy(const omnidex::PlugInRecordPtr& record) {
  VTDPlugInPtr plugIn;
  sync_.sync([&] {
    plugIn = cached(record->uuid);
    if (!plugIn) plugIn = createPlugInForProxy(record);
  });
  return plugIn;
}

std::vector<VTDPlugInPtr> VTDatabase::plugInsForProxies(
    const std::vector<omnidex::PlugInRecordPtr>& records) {
  std::vector<VTDPlugInPtr> plugIns(records.size());
  sync_.sync([&] {
    for (size_t i = 0; i < records.size(); ++i) {
      if (!records[i]) continue;
      plugIns[i] = cached(records[i]->uuid);
      if (!plugIns[i]) plugIns[i] = createPlugInForProxy(records[i]);
    }
  });
  return plugIns;
}

VTDPlugInPtr VTDatabase::createPlugInForProxy(const omnidex::PlugInRecordPtr& record) {
  sync_.assertCurrent();
  VTDPlugInPtr plugIn = VTDPlugIn::initWithOXData(record);
  if (!plugIn) return nullptr;
  plugIn->setDatabase(weak_from_this());
  if (plugIn->hasEntitlement(kAutoElectEntitlement)) autoElect(*plugIn);
  purgeCachesToLimit(static_cast<int32_t>(cacheLimit()));
  // initWithOXData never yields a record without uuid.
  cache_[*plugIn->uuid()] = plugIn;
  return plugIn;
}

VTDPlugInPtr VTDatabase::findPlugIn(const base::Uuid& uuid) {
  VTDPlugInPtr plugIn;
  sync_.sync([&] {
    plugIn = cached(uuid);
    if (plugIn) return;
    omnidex::PlugInRecordPtr record = workspace_->plugInForUuid(uuid);
    if (!record) {
      base::vtlog("Omnidex cannot find plug-in with UUID:%@", uuid.string());
      return;
    }
    plugIn = createPlugInForProxy(record);
  });
  return plugIn;
}

VTDPlugInPtr VTDatabase::findPlugInAtPath(const model::FileUrl& url) {
  omnidex::PlugInRecordPtr record = workspace_->plugInForUrl(url.path());
  if (!record) {
    base::vtlog("Omnidex cannot find plug-in at path:%@", url.path());
    return nullptr;
  }
  return findPlugIn(record->uuid);
}

std::optional<VTDatabase::PlugInList> VTDatabase::plugInsWithinApplication(
    const model::FileUrl& url) {
  omnidex::Workspace::ApplicationLookup lookup = workspace_->applicationForUrl(url.path());
  if (lookup.plugIns.empty()) return std::nullopt;
  PlugInList plugIns;
  for (const omnidex::PlugInRecordPtr& record : lookup.plugIns) {
    if (VTDPlugInPtr plugIn = plugInForProxy(record)) plugIns.push_back(std::move(plugIn));
  }
  return plugIns;
}

// ---- Cache ----

void VTDatabase::purgeCachesToLimit(int32_t limit) {
  sync_.assertCurrent();
  const size_t count = cache_.size();
  if (count <= static_cast<uint32_t>(limit)) return;
  base::vtlog("purging cache for %d > %d", count, limit);
  cache_.clear();
  workspace_->clearCaches();
}

size_t VTDatabase::cacheCountForTest() {
  size_t count = 0;
  sync_.sync([&] { count = cache_.size(); });
  return count;
}

// ---- Registration ----

std::optional<base::Error> VTDatabase::addPlugIn(const model::FileUrl& url) {
  if (workspace_->registerPlugIn(url.path()).has_value()) return std::nullopt;
  return base::error_with_code(protocol::kErrorRegistryRefused,
                               "Omnidex failed to register the plug-in");
}

std::optional<base::Error> VTDatabase::removePlugIn(const model::FileUrl& url) {
  if (workspace_->unregisterPlugIn(url.path()).has_value()) return std::nullopt;
  return base::error_with_code(protocol::kErrorRegistryRefused,
                               "Omnidex failed to deregister the plug-in");
}

// ---- Accessors ----

std::shared_ptr<VTDatabaseDelegate> VTDatabase::delegate() const {
  std::lock_guard lock(delegateMutex_);
  return delegate_.lock();
}

void VTDatabase::setDelegate(std::weak_ptr<VTDatabaseDelegate> delegate) {
  std::lock_guard lock(delegateMutex_);
  delegate_ = std::move(delegate);
}

}  // namespace vantrel::registry
