#pragma once
// The registry's durable truth: one SQLite database in write-ahead-log mode.
//
// Two tables: plugins (one row per registered plug-in bundle path) and
// applications (one row per application that holds a registered plug-in).
// The database holds a third, the privacy-consent table, which
// omnidex/ConsentStore.h adds and uses through a connection of its own.
// The Info.plist and trusted Entitlements.plist bytes are stored as they
// were read, so a record rebuilt at the next start is the record that was
// announced, whatever became of the bundle since. The schema version is the
// database's user_version; a database of any other version is refused, never
// converted or replaced.
//
// Not thread-safe: the registry serialises every use (its write mutex).

#include <sqlite3.h>

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/Result.h"
#include "base/Uuid.h"

namespace vantrel::omnidex {

inline constexpr int kStoreSchemaVersion = 1;
inline constexpr const char* kStoreFileName = "registry.sqlite3";

struct PlugInRow {
  std::string path;
  base::Uuid uuid;
  std::string identifier;
  std::string originalIdentifier;
  std::string infoBytes;
  std::string entitlementsBytes;  // empty: no trusted entitlements
  double registered = 0;          // seconds since 1970
  bool isExplicit = false;        // registered by path rather than found by a scan
  std::string fingerprint;
};

// The columns a re-read that found the same content changes.
struct PlugInRowUpdate {
  std::string path;
  double registered = 0;
  bool isExplicit = false;
  std::string fingerprint;
};

struct ApplicationRow {
  std::string path;
  std::optional<std::string> infoBytes;  // nullopt: a placeholder
  std::string fingerprint;
};

// One transaction's worth of changes.
struct StoreBatch {
  std::vector<PlugInRow> plugIns;  // inserted or replacing the row of the same path
  std::vector<PlugInRowUpdate> plugInUpdates;
  std::vector<std::string> removedPlugIns;
  std::vector<ApplicationRow> applications;
  std::vector<std::string> removedApplications;

  bool empty() const {
    return plugIns.empty() && plugInUpdates.empty() && removedPlugIns.empty() &&
           applications.empty() && removedApplications.empty();
  }
};

class Store {
 public:
  // Opens (creating when missing) the database at path. Errors (domain
  // "Omnidex"): kOmnidexStoreFailed when the file cannot be opened or is not
  // a database (it is left as it is), kOmnidexSchemaMismatch naming both
  // versions.
  static base::Result<std::unique_ptr<Store>> open(const std::string& path);
  ~Store();
  Store(const Store&) = delete;
  Store& operator=(const Store&) = delete;

  // Every row, in path order. A row whose UUID cannot be read is skipped,
  // after the log line that onBadRow writes.
  base::Result<void> load(const std::function<void(PlugInRow&&)>& onPlugIn,
                          const std::function<void(ApplicationRow&&)>& onApplication,
                          const std::function<void(const std::string& path)>& onBadRow);

  // Writes the batch in one transaction: all of it or, on an error, none.
  base::Result<void> write(const StoreBatch& batch);

  // Returns SQLite's page cache and other freeable memory.
  void releaseMemory();

 private:
  Store(sqlite3* db, std::string path) : db_(db), path_(std::move(path)) {}
  base::Result<void> prepare();
  base::Result<void> execute(const char* sql);
  base::Error failure(const char* what) const;
  base::Result<void> writeRows(const StoreBatch& batch);

  sqlite3* db_;
  const std::string path_;
  // Prepared once, reused by every write.
  sqlite3_stmt* upsertPlugIn_ = nullptr;
  sqlite3_stmt* updatePlugIn_ = nullptr;
  sqlite3_stmt* deletePlugIn_ = nullptr;
  sqlite3_stmt* upsertApplication_ = nullptr;
  sqlite3_stmt* deleteApplication_ = nullptr;
};

}  // namespace vantrel::omnidex
