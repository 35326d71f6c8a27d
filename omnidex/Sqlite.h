#pragma once
// What the registry's SQLite connections share: how one is opened, and how
// text is bound.

#include <sqlite3.h>

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

}  // namespace vantrel::omnidex
