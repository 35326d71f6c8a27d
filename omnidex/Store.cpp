#include "omnidex/Store.h"

#include <utility>

#include "omnidex/Errors.h"
#include "omnidex/Sqlite.h"

namespace vantrel::omnidex {
namespace {

constexpr const char* kCreateSchema = R"sql(
CREATE TABLE plugins (
  path TEXT PRIMARY KEY NOT NULL,
  uuid BLOB NOT NULL UNIQUE,
  identifier TEXT NOT NULL,
  original_identifier TEXT NOT NULL,
  info BLOB NOT NULL,
  entitlements BLOB NOT NULL,
  registered REAL NOT NULL,
  explicit INTEGER NOT NULL,
  fingerprint TEXT NOT NULL
);
CREATE TABLE applications (
  path TEXT PRIMARY KEY NOT NULL,
  info BLOB,
  fingerprint TEXT NOT NULL
);
)sql";

constexpr const char* kSelectPlugIns =
    "SELECT path, uuid, identifier, original_identifier, info, entitlements, registered, "
    "explicit, fingerprint FROM plugins ORDER BY path";
constexpr const char* kSelectApplications =
    "SELECT path, info, fingerprint FROM applications ORDER BY path";
constexpr const char* kUpsertPlugIn =
    "INSERT OR REPLACE INTO plugins (path, uuid, identifier, original_identifier, info, "
    "entitlements, registered, explicit, fingerprint) VALUES (?1, ?2, ?3, ?4, ?5, ?6, ?7, ?8, ?9)";
constexpr const char* kUpdatePlugIn =
    "UPDATE plugins SET registered = ?2, explicit = ?3, fingerprint = ?4 WHERE path = ?1";
constexpr const char* kDeletePlugIn = "DELETE FROM plugins WHERE path = ?1";
constexpr const char* kUpsertApplication =
    "INSERT OR REPLACE INTO applications (path, info, fingerprint) VALUES (?1, ?2, ?3)";
constexpr const char* kDeleteApplication = "DELETE FROM applications WHERE path = ?1";

class Statement {
 public:
  explicit Statement(sqlite3_stmt* s) : s_(s) {}
  ~Statement() { sqlite3_finalize(s_); }
  Statement(const Statement&) = delete;
  Statement& operator=(const Statement&) = delete;
  sqlite3_stmt* get() const { return s_; }

 private:
  sqlite3_stmt* s_;
};

std::optional<std::string> columnBlob(sqlite3_stmt* s, int i) {
  if (sqlite3_column_type(s, i) == SQLITE_NULL) return std::nullopt;
  const void* blob = sqlite3_column_blob(s, i);
  const int size = sqlite3_column_bytes(s, i);
  if (blob == nullptr || size <= 0) return std::string();
  return std::string(static_cast<const char*>(blob), static_cast<size_t>(size));
}

void bindBlob(sqlite3_stmt* s, int i, const std::string& bytes) {
  // data() is never null, so an empty string binds an empty blob, not NULL.
  sqlite3_bind_blob(s, i, bytes.data(), static_cast<int>(bytes.size()), SQLITE_STATIC);
}

}  // namespace

base::Result<std::unique_ptr<Store>> Store::open(const std::string& path) {
  sqlite3* db = VT_TRY(
      openConnection(path, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, "the application registry"));
  std::unique_ptr<Store> store(new Store(db, path));
  VT_TRY(store->prepare());
  return store;
}

Store::~Store() {
  for (sqlite3_stmt* s :
       {upsertPlugIn_, updatePlugIn_, deletePlugIn_, upsertApplication_, deleteApplication_}) {
    sqlite3_finalize(s);
  }
  sqlite3_close_v2(db_);
}

base::Error Store::failure(const char* what) const {
  return omnidexError(kOmnidexStoreFailed, base::format("%s the application registry at %@: %s",
                                                        what, path_, sqlite3_errmsg(db_)));
}

base::Result<void> Store::execute(const char* sql) {
  if (sqlite3_exec(db_, sql, nullptr, nullptr, nullptr) != SQLITE_OK) {
    return failure("cannot update");
  }
  return base::Result<void>::success();
}

base::Result<void> Store::prepare() {
  // The version is checked before anything is written: a database of another
  // version (or another program) is left exactly as it was found.
  const std::optional<int64_t> stored = queryInteger(db_, "PRAGMA user_version");
  if (!stored) return failure("cannot open");
  const int64_t version = *stored;
  int64_t objects = 0;
  if (version == 0) {
    const std::optional<int64_t> count = queryInteger(db_, "SELECT count(*) FROM sqlite_master");
    if (!count) return failure("cannot open");
    objects = *count;
  }
  if (version != kStoreSchemaVersion && !(version == 0 && objects == 0)) {
    return omnidexError(kOmnidexSchemaMismatch,
                        base::format("the application registry at %@ has schema version %d; "
                                     "this build reads version %d",
                                     path_, version, kStoreSchemaVersion));
  }
  // WAL lets readers of the file (tools, a second look at a crash) proceed
  // while the daemon writes; NORMAL syncs at checkpoints rather than at every
  // commit, which is what makes a 1,000-bundle reconciliation cheap. A power
  // loss may lose the last commits but never corrupts the file, and what it
  // loses in the watched directories the next reconciliation reads again.
  // (The consent table's connection, whose answers cannot be read again from
  // anywhere, syncs each commit.)
  if (sqlite3_exec(db_, "PRAGMA journal_mode=WAL; PRAGMA synchronous=NORMAL", nullptr, nullptr,
                   nullptr) != SQLITE_OK) {
    return failure("cannot open");
  }
  if (version == 0) {
    VT_TRY(execute("BEGIN IMMEDIATE"));
    const std::string create =
        std::string(kCreateSchema) + "PRAGMA user_version = " + std::to_string(kStoreSchemaVersion);
    if (sqlite3_exec(db_, create.c_str(), nullptr, nullptr, nullptr) != SQLITE_OK) {
      base::Error error = failure("cannot create");
      sqlite3_exec(db_, "ROLLBACK", nullptr, nullptr, nullptr);
      return error;
    }
    VT_TRY(execute("COMMIT"));
  }
  const std::pair<const char*, sqlite3_stmt**> statements[] = {
      {kUpsertPlugIn, &upsertPlugIn_},           {kUpdatePlugIn, &updatePlugIn_},
      {kDeletePlugIn, &deletePlugIn_},           {kUpsertApplication, &upsertApplication_},
      {kDeleteApplication, &deleteApplication_},
  };
  for (const auto& [sql, slot] : statements) {
    if (sqlite3_prepare_v3(db_, sql, -1, SQLITE_PREPARE_PERSISTENT, slot, nullptr) != SQLITE_OK) {
      return failure("cannot open");
    }
  }
  return base::Result<void>::success();
}

base::Result<void> Store::load(const std::function<void(PlugInRow&&)>& onPlugIn,
                               const std::function<void(ApplicationRow&&)>& onApplication,
                               const std::function<void(const std::string& path)>& onBadRow) {
  sqlite3_stmt* raw = nullptr;
  if (sqlite3_prepare_v2(db_, kSelectApplications, -1, &raw, nullptr) != SQLITE_OK) {
    return failure("cannot read");
  }
  {
    Statement s(raw);
    int rc;
    while ((rc = sqlite3_step(s.get())) == SQLITE_ROW) {
      onApplication(
          ApplicationRow{columnText(s.get(), 0), columnBlob(s.get(), 1), columnText(s.get(), 2)});
    }
    if (rc != SQLITE_DONE) return failure("cannot read");
  }
  if (sqlite3_prepare_v2(db_, kSelectPlugIns, -1, &raw, nullptr) != SQLITE_OK) {
    return failure("cannot read");
  }
  Statement s(raw);
  int rc;
  while ((rc = sqlite3_step(s.get())) == SQLITE_ROW) {
    PlugInRow row;
    row.path = columnText(s.get(), 0);
    const std::string uuid = columnBlob(s.get(), 1).value_or(std::string());
    std::optional<base::Uuid> parsed =
        base::Uuid::fromBytes(reinterpret_cast<const uint8_t*>(uuid.data()), uuid.size());
    if (!parsed) {
      onBadRow(row.path);
      continue;
    }
    row.uuid = *parsed;
    row.identifier = columnText(s.get(), 2);
    row.originalIdentifier = columnText(s.get(), 3);
    row.infoBytes = columnBlob(s.get(), 4).value_or(std::string());
    row.entitlementsBytes = columnBlob(s.get(), 5).value_or(std::string());
    row.registered = sqlite3_column_double(s.get(), 6);
    row.isExplicit = sqlite3_column_int64(s.get(), 7) != 0;
    row.fingerprint = columnText(s.get(), 8);
    onPlugIn(std::move(row));
  }
  if (rc != SQLITE_DONE) return failure("cannot read");
  return base::Result<void>::success();
}

base::Result<void> Store::writeRows(const StoreBatch& batch) {
  // Every statement is reset (and its bindings cleared) before this returns,
  // so no statement keeps pointers into the batch.
  auto step = [this](sqlite3_stmt* s) -> base::Result<void> {
    const int rc = sqlite3_step(s);
    sqlite3_reset(s);
    sqlite3_clear_bindings(s);
    if (rc != SQLITE_DONE) return failure("cannot update");
    return base::Result<void>::success();
  };
  for (const std::string& path : batch.removedPlugIns) {
    bindText(deletePlugIn_, 1, path);
    VT_TRY(step(deletePlugIn_));
  }
  for (const std::string& path : batch.removedApplications) {
    bindText(deleteApplication_, 1, path);
    VT_TRY(step(deleteApplication_));
  }
  for (const ApplicationRow& row : batch.applications) {
    bindText(upsertApplication_, 1, row.path);
    if (row.infoBytes) {
      bindBlob(upsertApplication_, 2, *row.infoBytes);
    } else {
      sqlite3_bind_null(upsertApplication_, 2);
    }
    bindText(upsertApplication_, 3, row.fingerprint);
    VT_TRY(step(upsertApplication_));
  }
  for (const PlugInRow& row : batch.plugIns) {
    sqlite3_stmt* s = upsertPlugIn_;
    bindText(s, 1, row.path);
    sqlite3_bind_blob(s, 2, row.uuid.bytes().data(), static_cast<int>(row.uuid.bytes().size()),
                      SQLITE_STATIC);
    bindText(s, 3, row.identifier);
    bindText(s, 4, row.originalIdentifier);
    bindBlob(s, 5, row.infoBytes);
    bindBlob(s, 6, row.entitlementsBytes);
    sqlite3_bind_double(s, 7, row.registered);
    sqlite3_bind_int(s, 8, row.isExplicit ? 1 : 0);
    bindText(s, 9, row.fingerprint);
    VT_TRY(step(s));
  }
  for (const PlugInRowUpdate& update : batch.plugInUpdates) {
    sqlite3_stmt* s = updatePlugIn_;
    bindText(s, 1, update.path);
    sqlite3_bind_double(s, 2, update.registered);
    sqlite3_bind_int(s, 3, update.isExplicit ? 1 : 0);
    bindText(s, 4, update.fingerprint);
    VT_TRY(step(s));
  }
  return base::Result<void>::success();
}

base::Result<void> Store::write(const StoreBatch& batch) {
  if (batch.empty()) return base::Result<void>::success();
  VT_TRY(execute("BEGIN IMMEDIATE"));
  base::Result<void> written = writeRows(batch);
  if (written.has_value()) written = execute("COMMIT");
  if (!written.has_value()) sqlite3_exec(db_, "ROLLBACK", nullptr, nullptr, nullptr);
  return written;
}

void Store::releaseMemory() {
  sqlite3_db_release_memory(db_);
}

}  // namespace vantrel::omnidex
