#pragma once
// Read-only sandbox extensions for files, handed to other processes as
// token strings.

#include <optional>
#include <string>

#include "model/FileUrl.h"

namespace vantrel::model {

// The token of a read-only extension for url's path (canonicalised by the
// service); nullopt when the service issues none (missing or unreadable
// file). Does not log: callers decide what a missing token means.
std::optional<std::string> issue_read_extension(const FileUrl& url);

}  // namespace vantrel::model
