#pragma once
// Whole-file replacement that a crash or a failed write cannot leave half done.

#include <sys/types.h>

#include <string>
#include <string_view>

#include "base/Result.h"

namespace vantrel::platform {

// Error domain for failed system calls; the code is the errno.
inline constexpr const char* kPosixErrorDomain = "POSIX";

// Whole-file replace: writes a temporary file in the same directory (mkstemp),
// fsync, fchmod(mode), rename over path, fsync of the directory. On any
// failure the old file is untouched and the temporary removed. Errors: domain
// "POSIX", errno code, description naming the path. The one exception is a
// failed sync of the directory after the rename: the new contents are then in
// place but may not survive a crash, and the error says "cannot sync the
// directory of". A symbolic link at path is replaced, not followed.
base::Result<void> writeFileAtomically(const std::string& path, std::string_view bytes,
                                       mode_t mode = 0644);

// An error in the "POSIX" domain for errno value err: "<what> <path>: <strerror>".
base::Error posixError(int err, std::string_view what, const std::string& path);

}  // namespace vantrel::platform
