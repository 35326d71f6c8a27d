#pragma once
// The trust rule for files that stand in for a code signature (a bundle's
// Entitlements.plist, an executable's .entitlements.plist): such a file is
// honoured only when nobody but root or this process's effective user could
// have written it. It must be a regular file reached without a symbolic link
// in its last component, owned by root or by our euid, and not writable by
// group or others. A file anyone else could have written is as good as no
// signature at all.

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

#include "base/Result.h"
#include "platform/SmallFile.h"

namespace vantrel::platform {

inline constexpr const char* kTrustedFileErrorDomain = "TrustedFile";

enum TrustedFileErrorCode : int64_t {
  kTrustedFileUnreadable = 1,  // symbolic link, not a regular file, too large, I/O error
  kTrustedFileUntrusted = 2,   // wrong owner, or writable by group or others
};

// Why the file r read may not be trusted, as a phrase for a log line (the
// phrases of smallFileProblem, "it is owned by uid <uid>", "it is writable by
// group or others"); nullopt when it may.
std::optional<std::string> trustProblem(const SmallFileRead& r, size_t maxBytes);

// The bytes of the file at path (at most maxBytes) when it may be trusted.
// No file there (ENOENT) is not an error: the value is nullopt. Any other
// problem is an error in kTrustedFileErrorDomain whose description is the
// trustProblem phrase, so a caller can log it as it is.
base::Result<std::optional<std::string>> readTrustedFile(const std::string& path, size_t maxBytes);

}  // namespace vantrel::platform
