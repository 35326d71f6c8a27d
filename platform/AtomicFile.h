#pragma once
// Whole-file replacement that a crash or a failed write cannot leave half done.

#include <sys/types.h>

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

#include "base/Result.h"

namespace vantrel::platform {

// Error domain for failed system calls; the code is the errno.
inline constexpr const char* kPosixErrorDomain = "POSIX";

// The temporary file of a write is named
//   ".<file name>" kTemporaryFileMarker "<writer pid>-<sequence>"
// beside its target, the file name cut short when the whole would not fit
// NAME_MAX. The pattern is what tells a temporary that an interrupted write
// left behind from every other file, and whose it was.
inline constexpr std::string_view kTemporaryFileMarker = ".vt-tmp-";

// Whole-file replace: writes a temporary file in the same directory (created
// exclusively, named as above), fsync, fchmod(mode), rename over path, fsync
// of the directory. On any failure the old file is untouched and the
// temporary removed; only a crash or a kill leaves one behind. Errors: domain
// "POSIX", errno code, description naming the path. The one exception is a
// failed sync of the directory after the rename: the new contents are then in
// place but may not survive a crash, and the error says "cannot sync the
// directory of". A symbolic link at path is replaced, not followed.
base::Result<void> writeFileAtomically(const std::string& path, std::string_view bytes,
                                       mode_t mode = 0644);

// Creates path with bytes unless a file of that name exists: written and
// synced under a temporary name as above, then published with link(), which
// succeeds for exactly one of several racing writers and, unlike an O_EXCL
// create, never shows a half-written file. Errors as writeFileAtomically's;
// EEXIST (domain "POSIX") when path exists.
base::Result<void> createFileAtomically(const std::string& path, std::string_view bytes,
                                        mode_t mode = 0600);

// The pid of the writer whose temporary file fileName (one name, without
// directory) is; nullopt for a name of any other form.
std::optional<pid_t> temporaryFileWriter(std::string_view fileName);

// Removes from directory the temporary files interrupted writes left: those
// whose writer process no longer exists, and this process's own that no
// write in progress is using. With fileName, only the temporaries of that
// file. Returns how many were removed; one that cannot be removed is left
// and not counted. Errors: the directory cannot be read (domain "POSIX").
base::Result<size_t> removeStaleTemporaryFiles(const std::string& directory,
                                               std::string_view fileName = {});

// An error in the "POSIX" domain for errno value err: "<what> <path>: <strerror>".
base::Error posixError(int err, std::string_view what, const std::string& path);

}  // namespace vantrel::platform
