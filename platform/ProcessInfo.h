#pragma once
// What /proc tells about another process's executable. Every answer is a
// snapshot: the process may exit, or exec another program, right after it.

#include <sys/types.h>

#include <cstddef>
#include <optional>
#include <string>

namespace vantrel::platform {

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

// Whether pid runs in the mount namespace of this process. False when that
// cannot be told.
bool sharesMountNamespace(pid_t pid);

}  // namespace vantrel::platform
