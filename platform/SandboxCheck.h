#pragma once
// Whether another process runs confined. Linux has no single sandbox flag;
// what the common confiners (bubblewrap, Flatpak, systemd's sandboxing
// options) leave behind in every confined process is the no-new-privileges
// bit or a seccomp filter, both shown in /proc/<pid>/status. Neither can be
// dropped once set, so a process that shows one stays confined.

#include <sys/types.h>

#include <cstddef>

namespace vantrel::platform {

// Whether the process pid, named by pidfd (taken when it connected), is
// sandboxed: its status shows "NoNewPrivs: 1" or a "Seccomp" mode other
// than 0. Whenever that cannot be told, the answer is true, so that the
// caller refuses what it would grant only to an unconfined process: pidfd
// does not stand for pid before or after the read (the process exited, or
// the pid went to another process mid-read), the process is a zombie, the
// status cannot be read (readProcessStatus, platform/ProcessInfo.h) or lacks
// either field, or a field is not a decimal number.
bool processIsSandboxed(pid_t pid, int pidfd);

}  // namespace vantrel::platform
