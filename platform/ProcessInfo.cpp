#include "platform/ProcessInfo.h"

#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "base/Format.h"

namespace vantrel::platform {
namespace {

std::string procPath(pid_t pid, const char* entry) {
  return base::format("/proc/%d/%s", static_cast<int>(pid), entry);
}

}  // namespace

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

}  // namespace vantrel::platform
