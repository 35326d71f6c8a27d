#pragma once
// The privacy-consent table of the registry's database: one row per
// application bundle identifier and service identifier, saying whether the
// user granted the service and when that answer was given.
//
// The table came after the first schema version. It is added at open when
// missing, and the schema version is left as it was, so a database made by an
// older build opens (and gains the table), and an older build still opens a
// database that has it (it never looks at the table).
//
// The store has a connection of its own to the database, so a consent
// lookup does not wait behind a reconciliation holding the registry's write
// mutex (in write-ahead-log mode readers never wait for the writer; a consent
// write waits for a registry transaction to commit). Thread-safe.

#include <sqlite3.h>

#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "base/Result.h"
#include "lmo/Value.h"
#include "omnidex/PrivacyConsent.h"

namespace vantrel::omnidex {

class ConsentStore {
 public:
  // Opens another connection to the registry's database at path, which
  // Store::open must have opened (so created, or checked the version of)
  // first, and adds the consent table when it has none. Errors (domain
  // "Omnidex"): kOmnidexStoreFailed when the database cannot be opened, or
  // holds a table of that name that this build cannot use;
  // kOmnidexSchemaMismatch when the database is not of the registry's
  // schema version. Nothing is written in either case.
  static base::Result<std::unique_ptr<ConsentStore>> open(const std::string& path);
  ~ConsentStore();
  ConsentStore(const ConsentStore&) = delete;
  ConsentStore& operator=(const ConsentStore&) = delete;

  // Records the user's answer for service in application, replacing an
  // earlier one. Errors (domain "Omnidex"), with the table left as it was:
  // kOmnidexBadIdentifier for an identifier that is empty, longer than
  // kMaxConsentIdentifierLength or holds a NUL character; kOmnidexFull when
  // the answer is new and kMaxConsentEntriesPerApplication or
  // kMaxConsentEntries answers are stored already; kOmnidexStoreFailed.
  base::Result<void> setConsent(const std::string& application, const std::string& service,
                                bool granted, lmo::Date changed);

  // application's answers, by service identifier; empty when it has none
  // (an identifier that could not have been stored has none). At most
  // kMaxConsentEntriesPerApplication; a row no write could have made (an
  // identifier beyond the bounds) is left out. kOmnidexStoreFailed when the
  // table cannot be read.
  base::Result<std::vector<ConsentEntry>> entries(const std::string& application);

  // Returns SQLite's page cache and other freeable memory.
  void releaseMemory();

 private:
  ConsentStore(sqlite3* db, std::string path) : db_(db), path_(std::move(path)) {}
  base::Result<void> prepare();
  base::Error failure(const char* what) const;

  // Constant after open.
  sqlite3* const db_;
  const std::string path_;

  std::mutex mutex_;
  // Guarded by mutex_: prepared once, reused by every call.
  sqlite3_stmt* upsert_ = nullptr;
  sqlite3_stmt* select_ = nullptr;
};

}  // namespace vantrel::omnidex
