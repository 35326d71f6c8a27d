#include "omnidex/Sqlite.h"

#include "base/Format.h"
#include "omnidex/Errors.h"

namespace vantrel::omnidex {

base::Result<sqlite3*> openConnection(const std::string& path, int flags, std::string_view what) {
  sqlite3* db = nullptr;
  const int rc = sqlite3_open_v2(path.c_str(), &db, flags | SQLITE_OPEN_FULLMUTEX, nullptr);
  if (rc != SQLITE_OK) {
    std::string reason = db != nullptr ? sqlite3_errmsg(db) : sqlite3_errstr(rc);
    sqlite3_close_v2(db);
    return omnidexError(kOmnidexStoreFailed,
                        base::format("cannot open %s at %@: %@", std::string(what), path, reason));
  }
  sqlite3_extended_result_codes(db, 1);
  sqlite3_busy_timeout(db, kBusyTimeoutMs);
  return db;
}

void bindText(sqlite3_stmt* s, int i, const std::string& text) {
  sqlite3_bind_text(s, i, text.data(), static_cast<int>(text.size()), SQLITE_STATIC);
}

}  // namespace vantrel::omnidex
