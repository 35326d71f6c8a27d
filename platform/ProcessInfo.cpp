#include "platform/ProcessInfo.h"

#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>

#include "base/Format.h"
#include "platform/AtomicFile.h"
#include "platform/SmallFile.h"

namespace vantrel::platform {
namespace {

constexpr std::string_view kFdInfoPidField = "Pid:";

std::string procPath(pid_t pid, const char* entry) {
  return base::format("/proc/%d/%s", static_cast<int>(pid), entry);
}

base::Error posixError(int code, std::string message) {
  return base::Error{kPosixErrorDomain, code, std::move(message)};
}

// The pid that pidfd stands for, from the "Pid:" line of its fdinfo: -1 (or
// 0 on older kernels) once the process has been reaped; nullopt when pidfd
// is not a pidfd at all.
std::optional<long> pidOfPidfd(int pidfd) {
  const SmallFileRead r =
      readSmallFile(base::format("/proc/self/fdinfo/%d", pidfd), kMaxPidfdInfoBytes);
  if (smallFileProblem(r, kMaxPidfdInfoBytes)) return std::nullopt;
  const std::string_view text = r.bytes;
  size_t at = 0;
  while (at < text.size()) {
    const size_t end = std::min(text.find('\n', at), text.size());
    const std::string_view line = text.substr(at, end - at);
    if (line.substr(0, kFdInfoPidField.size()) == kFdInfoPidField) {
      const std::string digits(line.substr(kFdInfoPidField.size()));
      char* stop = nullptr;
      errno = 0;
      const long pid = std::strtol(digits.c_str(), &stop, 10);
      if (errno != 0 || stop == digits.c_str()) return std::nullopt;
      return pid;
    }
    at = end + 1;
  }
  return std::nullopt;
}

}  // namespace

base::Result<void> checkProcessIdentity(pid_t pid, int pidfd) {
  if (pid <= 0 || pidfd < 0) {
    return posixError(EINVAL,
                      base::format("no process descriptor for pid %d", static_cast<int>(pid)));
  }
  // Signal 0 only asks whether the process is there; EPERM means it is,
  // but is not ours to signal.
  // Through syscall(2): glibc 2.36 declares pidfd_send_signal without C
  // linkage for C++.
  if (::syscall(SYS_pidfd_send_signal, pidfd, 0, nullptr, 0) != 0 && errno != EPERM) {
    const int error = errno;
    return posixError(
        error == EBADF || error == EINVAL ? EBADF : ESRCH,
        base::format("process %d is gone: %s", static_cast<int>(pid), std::strerror(error)));
  }
  std::optional<long> actual = pidOfPidfd(pidfd);
  if (!actual) {
    return posixError(EBADF, base::format("descriptor %d is not a process descriptor for pid %d",
                                          pidfd, static_cast<int>(pid)));
  }
  if (*actual != pid) {
    return posixError(ESRCH, base::format("descriptor %d stands for pid %d, not pid %d", pidfd,
                                          static_cast<int>(*actual), static_cast<int>(pid)));
  }
  return base::Result<void>::success();
}

std::optional<std::string> processExecutablePath(pid_t pid) {
  if (pid <= 0) return std::nullopt;
  // One byte more than the bound, so that a longer path is seen as such
  // rather than silently cut.
  std::string buffer(kMaxProcessPathLength + 1, '\0');
  const ssize_t n = ::readlink(procPath(pid, "exe").c_str(), buffer.data(), buffer.size());
  if (n <= 0 || static_cast<size_t>(n) > kMaxProcessPathLength) return std::nullopt;
  buffer.resize(static_cast<size_t>(n));
  // The kernel shows a path outside our root or mount namespace without a
  // leading slash (or not at all); such a path means nothing here.
  if (buffer.front() != '/') return std::nullopt;
  return buffer;
}

std::optional<FileIdentity> processExecutableIdentity(pid_t pid) {
  if (pid <= 0) return std::nullopt;
  return fileIdentity(procPath(pid, "exe"));
}

std::optional<FileIdentity> fileIdentity(const std::string& path) {
  struct stat st;
  if (::stat(path.c_str(), &st) != 0) return std::nullopt;
  return FileIdentity{st.st_dev, st.st_ino};
}

bool sharesMountNamespace(pid_t pid) {
  if (pid <= 0) return false;
  std::optional<FileIdentity> ours = fileIdentity("/proc/self/ns/mnt");
  std::optional<FileIdentity> theirs = fileIdentity(procPath(pid, "ns/mnt"));
  return ours && theirs && *ours == *theirs;
}

std::optional<std::string> readProcessStatus(pid_t pid) {
  SmallFileRead r =
      readSmallFile(base::format("/proc/%d/status", static_cast<int>(pid)), kMaxProcessStatusBytes);
  if (smallFileProblem(r, kMaxProcessStatusBytes)) return std::nullopt;
  return std::move(r.bytes);
}

std::optional<std::string_view> processStatusField(std::string_view status,
                                                   std::string_view field) {
  constexpr std::string_view kBlanks = " \t";
  for (size_t at = 0; at < status.size();) {
    const size_t end = std::min(status.find('\n', at), status.size());
    std::string_view line = status.substr(at, end - at);
    if (line.substr(0, field.size()) == field) {
      line.remove_prefix(field.size());
      const size_t first = line.find_first_not_of(kBlanks);
      if (first == std::string_view::npos) return std::string_view();
      return line.substr(first, line.find_last_not_of(kBlanks) - first + 1);
    }
    at = end + 1;
  }
  return std::nullopt;
}

}  // namespace vantrel::platform
