#pragma once
// What the registry's SQLite connections share: how one is opened, how text
// is bound and read, and one-value queries.

#include <sqlite3.h>

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "base/Result.h"

namespace vantrel::omnidex {

// How long a connection waits for another connection's write transaction.
inline constexpr int kBusyTimeoutMs = 5000;

// Opens path with flags (serialised, extended result codes, the busy
// timeout). Errors: kOmnidexStoreFailed, "cannot open <what> at <path>:
// <reason>", with nothing left open.
base::Result<sqlite3*> openConnection(const std::string& path, int flags, std::string_view what);

// Binds text without a copy: it must outlive the statement's use.
void bindText(sqlite3_stmt* s, int i, const std::string& text);

// Column i of the current row as text ("" for NULL), embedded NULs kept.
std::string columnText(sqlite3_stmt* s, int i);

// The first column of the first row of sql (one statement, no parameters),
// such as a PRAGMA or a count; nullopt when it cannot be run or gives no row.
std::optional<int64_t> queryInteger(sqlite3* db, const char* sql);

}  // namespace vantrel::omnidex
