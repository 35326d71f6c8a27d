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

std::string columnText(sqlite3_stmt* s, int i) {
  const unsigned char* text = sqlite3_column_text(s, i);
  if (text == nullptr) return {};
  return std::string(reinterpret_cast<const char*>(text),
                     static_cast<size_t>(sqlite3_column_bytes(s, i)));
}

std::optional<int64_t> queryInteger(sqlite3* db, const char* sql) {
  sqlite3_stmt* s = nullptr;
  if (sqlite3_prepare_v2(db, sql, -1, &s, nullptr) != SQLITE_OK) {
    sqlite3_finalize(s);
    return std::nullopt;
  }
  std::optional<int64_t> value;
  if (sqlite3_step(s) == SQLITE_ROW) value = sqlite3_column_int64(s, 0);
  sqlite3_finalize(s);
  return value;
}

}  // namespace vantrel::omnidex
