#pragma once
// The plug-in database: the daemon's view of the installed plug-ins.
//
// It keeps no list of its own. The application registry (omnidex::Workspace)
// knows what is installed; the database asks it for records and turns each
// into a VTDPlugIn, caching what it built by UUID up to cacheLimit() (a purge
// empties the whole cache). It owns the annotation store, registers and
// unregisters bundles through the registry and observes its install and
// uninstall announcements.
//
// Threads: the database queue ("VTDatabase") is the only place the cache is
// touched. findPlugIn, plugInForProxy, annotationForPlugIn, setAnnotation and
// pluginsWillUninstall enter it synchronously and must not be called from it;
// createPlugInForProxy, autoElect and purgeCachesToLimit must run on it
// (checked: anything else stops the process). The remaining operations run on
// the caller's thread and enter the queue once per record.

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "base/Error.h"
#include "base/SerialQueue.h"
#include "base/Uuid.h"
#include "lmo/Value.h"
#include "model/FileUrl.h"
#include "omnidex/Workspace.h"
#include "registry/VTDAnnotationStore.h"
#include "registry/VTDPlugIn.h"

namespace vantrel::registry {

// Posts protocol::kAnnotationChangeNotification, once per change (in one
// write); a failure is logged, not reported.
void postAnnotationChange(size_t changes = 1);
// The cache limit a database starts with.
inline constexpr uint32_t kDefaultCacheLimit = 150;

// Told about plug-ins that are being uninstalled, after the database has
// dropped them from its cache. Called on the registry's announcement thread,
// never on the database queue.
class VTDatabaseDelegate {
 public:
  virtual ~VTDatabaseDelegate() = default;
  virtual void removedPlugIns(const std::vector<omnidex::PlugInRecordPtr>& records) = 0;
};

class VTDatabase : public omnidex::WorkspaceObserver,
                   public std::enable_shared_from_this<VTDatabase> {
 public:
  using PlugInList = std::vector<VTDPlugInPtr>;

  // Made by initWithDatabase (which sets it up and starts observing), or by a
  // subclass's factory through it.
  VTDatabase() = default;
  ~VTDatabase() override = default;
  VTDatabase(const VTDatabase&) = delete;
  VTDatabase& operator=(const VTDatabase&) = delete;

  // A database of type Database over workspace, with the annotation store at
  // annotationPath (nullopt: the default location, see VTDAnnotationStore).
  // It adds itself to the workspace's observers and starts the workspace's
  // monitoring before returning. Null when workspace is null.
  template <typename Database = VTDatabase>
  static std::shared_ptr<Database> initWithDatabase(std::optional<std::string> annotationPath,
                                                    std::shared_ptr<omnidex::Workspace> workspace);
  // As above over the process's registry (omnidex::Omnidex); null when the
  // registry cannot be opened (it has logged why).
  template <typename Database = VTDatabase>
  static std::shared_ptr<Database> initWithDatabase(std::optional<std::string> annotationPath) {
    return initWithDatabase<Database>(std::move(annotationPath), defaultWorkspace());
  }

  // ---- Lookups: each returns the cached record (the same object on every
  // lookup until a purge or an uninstall drops it), or null ----

  // The record of a registry record, from the cache or built now.
  VTDPlugInPtr plugInForProxy(const omnidex::PlugInRecordPtr& record);
  // plugInForProxy for each record, in one turn on the database queue; the
  // result is aligned with records (null where no record can be made).
  std::vector<VTDPlugInPtr> plugInsForProxies(const std::vector<omnidex::PlugInRecordPtr>& records);
  // Builds, auto-elects and caches the record of a registry record (purging
  // first when the cache is over its limit). Null, with the cache unchanged,
  // when no record can be made. On the database queue only.
  VTDPlugInPtr createPlugInForProxy(const omnidex::PlugInRecordPtr& record);
  // By UUID; logs "Omnidex cannot find plug-in with UUID:%@" when the
  // registry does not know it.
  VTDPlugInPtr findPlugIn(const base::Uuid& uuid);
  // By bundle location; logs "Omnidex cannot find plug-in at path:%@" when
  // the registry does not know it.
  VTDPlugInPtr findPlugInAtPath(const model::FileUrl& url);
  // The records of an application's plug-ins, in the registry's order,
  // leaving out those that cannot be made; nullopt when the registry knows
  // no plug-in of that application (or not the application).
  std::optional<PlugInList> plugInsWithinApplication(const model::FileUrl& url);
  // The installed plug-ins that may match query, one per UUID, in no
  // particular order. The registry matches the query; the database adds the
  // election filter of its "QXUserElection" key and drops plug-ins without a
  // bundle or inside a placeholder application. Null (or empty) query: every
  // installed plug-in. nullopt when the registry cannot answer. Not on the
  // database queue.
  std::optional<PlugInList> findPlugIns(const std::optional<lmo::Dictionary>& query);

  // ---- Cache ----

  // Empties the cache (all of it) when it holds more than limit records,
  // compared as unsigned, so a negative limit never purges; logs "purging
  // cache for %d > %d" and asks the registry to drop its caches. On the
  // database queue only.
  void purgeCachesToLimit(int32_t limit);

  // ---- Registration ----

  // Registers the bundle with the registry; null on success, else code 2
  // "Omnidex failed to register the plug-in".
  std::optional<base::Error> addPlugIn(const model::FileUrl& url);
  // Unregisters it; null on success, else code 2 "Omnidex failed to
  // deregister the plug-in".
  std::optional<base::Error> removePlugIn(const model::FileUrl& url);

  // ---- Annotations and elections ----

  std::optional<lmo::Dictionary> annotationForPlugIn(const VTDPlugIn& plugIn);
  // Merges (or, for nullopt, removes) the plug-in's annotation and saves,
  // then, off the queue, posts protocol::kAnnotationChangeNotification, whatever
  // happened to the save. Always returns null: a failed save or post is
  // only logged.
  std::optional<base::Error> setAnnotation(const std::optional<lmo::Dictionary>& annotation,
                                           const VTDPlugIn& plugIn);
  // As setAnnotation for each of plugIns, with one save and one post.
  std::optional<base::Error> setAnnotation(const std::optional<lmo::Dictionary>& annotation,
                                           const std::vector<VTDPlugInPtr>& plugIns);
  // Stores election 1 for a plug-in whose election is missing or 0, keeping
  // the rest of its annotation; posts nothing. On the database queue only.
  void autoElect(const VTDPlugIn& plugIn);

  // ---- Registry observer ----

  // Logs "INSTALLED:..." per record; the cache is left alone (a new plug-in
  // is built on its first lookup).
  void pluginsDidInstall(const std::vector<omnidex::PlugInRecordPtr>& records) override;
  // Logs "UNINSTALLED:..." and drops the cached record of each, then (off
  // the queue) tells the delegate, also about an empty list.
  void pluginsWillUninstall(const std::vector<omnidex::PlugInRecordPtr>& records) override;

  // ---- Accessors ----

  std::shared_ptr<VTDatabaseDelegate> delegate() const;
  void setDelegate(std::weak_ptr<VTDatabaseDelegate> delegate);
  uint32_t cacheLimit() const { return cacheLimit_.load(); }
  void setCacheLimit(uint32_t limit) { cacheLimit_.store(limit); }
  const std::shared_ptr<omnidex::Workspace>& workspace() const { return workspace_; }
  const VTDAnnotationStorePtr& annotations() const { return annotations_; }
  base::SerialQueue& queue() { return sync_; }
  // How many records the cache holds now (enters the queue).
  size_t cacheCountForTest();

 protected:
  // Steps of initWithDatabase before observing starts; false when workspace
  // is null.
  bool setupWithDatabase(std::optional<std::string> annotationPath,
                         std::shared_ptr<omnidex::Workspace> workspace);

 private:
  static std::shared_ptr<omnidex::Workspace> defaultWorkspace();
  void startObserving();
  // The record cached under uuid, or null. On the database queue.
  VTDPlugInPtr cached(const base::Uuid& uuid) const;

  // Guards delegate_.
  mutable std::mutex delegateMutex_;
  std::weak_ptr<VTDatabaseDelegate> delegate_;

  std::atomic<uint32_t> cacheLimit_{kDefaultCacheLimit};

  // Constant after setup.
  std::shared_ptr<omnidex::Workspace> workspace_;
  VTDAnnotationStorePtr annotations_;

  // The database queue. Guards cache_ and serialises the annotation writes.
  base::SerialQueue sync_{"VTDatabase"};
  // Owned by the database queue.
  std::unordered_map<base::Uuid, VTDPlugInPtr> cache_;
};

using VTDatabasePtr = std::shared_ptr<VTDatabase>;

template <typename Database>
std::shared_ptr<Database> VTDatabase::initWithDatabase(
    std::optional<std::string> annotationPath, std::shared_ptr<omnidex::Workspace> workspace) {
  auto database = std::make_shared<Database>();
  VTDatabase& base = *database;
  if (!base.setupWithDatabase(std::move(annotationPath), std::move(workspace))) return nullptr;
  base.startObserving();
  return database;
}

}  // namespace vantrel::registry
