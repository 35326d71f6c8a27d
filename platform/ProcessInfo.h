#pragma once
// What /proc tells about another process: whether a pidfd still stands for
// it, and which executable it runs. Every answer is a snapshot: the process
// may exit, or exec another program, right after it.

#include <sys/types.h>

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>

#include "base/Result.h"

namespace vantrel::platform {

// Largest /proc/self/fdinfo entry read while checking a pidfd.
inline constexpr size_t kMaxPidfdInfoBytes = 4096;

// Longest executable path read from /proc/<pid>/exe; a longer one reads as
// none.
inline constexpr size_t kMaxProcessPathLength = 4096;

// Which file a path names, compared across paths and mount namespaces.
struct FileIdentity {
  dev_t device = 0;
  ino_t inode = 0;
  bool operator==(const FileIdentity&) const = default;
};

// The path of pid's executable as the kernel reports it (resolved, in the
// reader's mount namespace when the process shares it). nullopt when the
// process is gone, is a kernel thread or a zombie, may not be inspected by
// us, or the path is longer than kMaxProcessPathLength. An executable that
// was deleted or replaced reads as its old path followed by " (deleted)".
std::optional<std::string> processExecutablePath(pid_t pid);

// The file pid is running, whatever path it was started from or is now at;
// nullopt as for processExecutablePath.
std::optional<FileIdentity> processExecutableIdentity(pid_t pid);

// The file at path, following symbolic links; nullopt when there is none.
std::optional<FileIdentity> fileIdentity(const std::string& path);

// Succeeds while pidfd stands for a live process whose pid is pid. Callers
// that read /proc/<pid> check before and after reading: while the process
// stays alive its pid cannot go to another one, so what was read between two
// successful checks was its own. Errors (domain "POSIX", the description
// naming pid and pidfd): EINVAL for a pid or descriptor that cannot be one,
// ESRCH when the process has exited (a zombie may still pass) or the pidfd
// stands for another pid, EBADF when the descriptor is not a pidfd.
base::Result<void> checkProcessIdentity(pid_t pid, int pidfd);

// Largest /proc/<pid>/status read; the supplementary group list makes it
// grow. A larger one reads as none.
inline constexpr size_t kMaxProcessStatusBytes = 256 * 1024;

// The text of /proc/<pid>/status; nullopt when it cannot be read or exceeds
// kMaxProcessStatusBytes. A snapshot like the rest: check the process's
// identity around it where that matters.
std::optional<std::string> readProcessStatus(pid_t pid);

// The value of the first line "<field> <value>" of a status text, without
// the blanks around it; nullopt when no line starts with field. The kernel
// escapes newlines in the one free-text field (Name), so a process cannot
// forge a line of its own.
std::optional<std::string_view> processStatusField(std::string_view status, std::string_view field);

// Whether pid runs in the mount namespace of this process. False when that
// cannot be told.
bool sharesMountNamespace(pid_t pid);

}  // namespace vantrel::platform
