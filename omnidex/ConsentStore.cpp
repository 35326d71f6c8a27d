#include "omnidex/ConsentStore.h"

#include <string_view>
#include <utility>

#include "omnidex/Errors.h"
#include "omnidex/Limits.h"
#include "omnidex/Sqlite.h"
#include "omnidex/Store.h"

namespace vantrel::omnidex {
namespace {

// The table is created here, not with the registry's first tables: a
// database that predates it must gain it without a version change.
constexpr const char* kCreateTable = R"sql(
CREATE TABLE IF NOT EXISTS privacy_consent (
  application TEXT NOT NULL,
  service TEXT NOT NULL,
  granted INTEGER NOT NULL,
  changed REAL NOT NULL,
  PRIMARY KEY (application, service)
) WITHOUT ROWID
)sql";

// One statement, so the limits are checked and the row written atomically
// with respect to other connections. No row changes when the answer is new
// and a limit is reached.
constexpr const char* kUpsert = R"sql(
INSERT INTO privacy_consent (application, service, granted, changed)
SELECT ?1, ?2, ?3, ?4
WHERE EXISTS (SELECT 1 FROM privacy_consent WHERE application = ?1 AND service = ?2)
   OR ((SELECT count(*) FROM privacy_consent WHERE application = ?1) < ?5
       AND (SELECT count(*) FROM privacy_consent) < ?6)
ON CONFLICT (application, service) DO UPDATE SET granted = excluded.granted,
                                                 changed = excluded.changed
)sql";

constexpr const char* kSelect =
    "SELECT service, granted, changed FROM privacy_consent WHERE application = ?1 "
    "ORDER BY service LIMIT ?2";

bool usableIdentifier(std::string_view identifier) {
  return !identifier.empty() && identifier.size() <= kMaxConsentIdentifierLength &&
         identifier.find('\0') == std::string_view::npos;
}

// Clears a reused statement when the call that used it returns, so that no
// statement keeps pointers into the caller's strings.
class StatementUse {
 public:
  explicit StatementUse(sqlite3_stmt* s) : s_(s) {}
  ~StatementUse() {
    sqlite3_reset(s_);
    sqlite3_clear_bindings(s_);
  }
  StatementUse(const StatementUse&) = delete;
  StatementUse& operator=(const StatementUse&) = delete;

 private:
  sqlite3_stmt* s_;
};

}  // namespace

base::Result<std::unique_ptr<ConsentStore>> ConsentStore::open(const std::string& path) {
  sqlite3* db = VT_TRY(openConnection(path, SQLITE_OPEN_READWRITE, "the privacy-consent table"));
  std::unique_ptr<ConsentStore> store(new ConsentStore(db, path));
  VT_TRY(store->prepare());
  return store;
}

ConsentStore::~ConsentStore() {
  sqlite3_finalize(upsert_);
  sqlite3_finalize(select_);
  sqlite3_close_v2(db_);
}

base::Error ConsentStore::failure(const char* what) const {
  return omnidexError(kOmnidexStoreFailed, base::format("%s the privacy-consent table at %@: %s",
                                                        what, path_, sqlite3_errmsg(db_)));
}

base::Result<void> ConsentStore::prepare() {
  // Store::open has created or checked the database; this only guards
  // against being opened on something else, which must not be written to.
  const std::optional<int64_t> found = queryInteger(db_, "PRAGMA user_version");
  if (!found) return failure("cannot open");
  if (*found != kStoreSchemaVersion) {
    return omnidexError(kOmnidexSchemaMismatch,
                        base::format("the application registry at %@ has schema version %d; "
                                     "the privacy-consent table needs version %d",
                                     path_, *found, kStoreSchemaVersion));
  }
  // FULL (per connection, WAL already set): an acknowledged revocation must survive power loss.
  if (sqlite3_exec(db_, "PRAGMA synchronous=FULL", nullptr, nullptr, nullptr) != SQLITE_OK ||
      sqlite3_exec(db_, kCreateTable, nullptr, nullptr, nullptr) != SQLITE_OK) {
    return failure("cannot create");
  }
  // A table of that name with other columns fails here.
  if (sqlite3_prepare_v3(db_, kUpsert, -1, SQLITE_PREPARE_PERSISTENT, &upsert_, nullptr) !=
          SQLITE_OK ||
      sqlite3_prepare_v3(db_, kSelect, -1, SQLITE_PREPARE_PERSISTENT, &select_, nullptr) !=
          SQLITE_OK) {
    return failure("cannot open");
  }
  return base::Result<void>::success();
}

base::Result<void> ConsentStore::setConsent(const std::string& application,
                                            const std::string& service, bool granted,
                                            lmo::Date changed) {
  for (const std::string* identifier : {&application, &service}) {
    if (!usableIdentifier(*identifier)) {
      return omnidexError(kOmnidexBadIdentifier,
                          base::format("not a usable privacy-consent identifier: %@", *identifier));
    }
  }
  std::lock_guard lock(mutex_);
  StatementUse use(upsert_);
  bindText(upsert_, 1, application);
  bindText(upsert_, 2, service);
  sqlite3_bind_int(upsert_, 3, granted ? 1 : 0);
  sqlite3_bind_double(upsert_, 4, changed.secondsSince1970);
  sqlite3_bind_int64(upsert_, 5, static_cast<sqlite3_int64>(kMaxConsentEntriesPerApplication));
  sqlite3_bind_int64(upsert_, 6, static_cast<sqlite3_int64>(kMaxConsentEntries));
  if (sqlite3_step(upsert_) != SQLITE_DONE) return failure("cannot update");
  if (sqlite3_changes(db_) == 0) {
    return omnidexError(
        kOmnidexFull,
        base::format("no room for another privacy-consent answer for %@ "
                     "(at most %u per application, %u in all)",
                     application, kMaxConsentEntriesPerApplication, kMaxConsentEntries));
  }
  return base::Result<void>::success();
}

base::Result<std::vector<ConsentEntry>> ConsentStore::entries(const std::string& application) {
  std::vector<ConsentEntry> found;
  if (!usableIdentifier(application)) return found;
  std::lock_guard lock(mutex_);
  StatementUse use(select_);
  bindText(select_, 1, application);
  sqlite3_bind_int64(select_, 2, static_cast<sqlite3_int64>(kMaxConsentEntriesPerApplication));
  int rc;
  while ((rc = sqlite3_step(select_)) == SQLITE_ROW) {
    const std::string service = columnText(select_, 0);
    if (!usableIdentifier(service)) continue;
    found.push_back(ConsentEntry{service, sqlite3_column_int64(select_, 1) != 0,
                                 lmo::Date{sqlite3_column_double(select_, 2)}});
  }
  if (rc != SQLITE_DONE) return failure("cannot read");
  return found;
}

void ConsentStore::releaseMemory() {
  std::lock_guard lock(mutex_);
  sqlite3_db_release_memory(db_);
}

}  // namespace vantrel::omnidex
