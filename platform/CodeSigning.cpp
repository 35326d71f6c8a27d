#include "platform/CodeSigning.h"

#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <utility>

#include "base/Format.h"
#include "platform/BundleService.h"
#include "platform/ProcessInfo.h"
#include "platform/PropertyList.h"
#include "platform/SmallFile.h"
#include "platform/TrustedFile.h"

namespace vantrel::platform {
namespace {

constexpr std::string_view kFdInfoPidField = "Pid:";

base::Error noProcess(std::string message) {
  return base::Error{kCodeSigningErrorDomain, kCodeSigningNoProcess, std::move(message)};
}

base::Error noExecutable(std::string message) {
  return base::Error{kCodeSigningErrorDomain, kCodeSigningNoExecutable, std::move(message)};
}

// The pid that pidfd stands for, from the "Pid:" line of its fdinfo: -1 (or
// 0 on older kernels) once the process has been reaped; nullopt when pidfd
// is not a pidfd at all.
std::optional<long> pidOfPidfd(int pidfd) {
  const SmallFileRead r =
      readSmallFile(base::format("/proc/self/fdinfo/%d", pidfd), kMaxFdInfoBytes);
  if (smallFileProblem(r, kMaxFdInfoBytes)) return std::nullopt;
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

// Succeeds while pidfd stands for a live process whose pid is pid.
base::Result<void> checkProcess(pid_t pid, int pidfd) {
  if (pid <= 0 || pidfd < 0) {
    return noProcess(base::format("no process descriptor for pid %d", static_cast<int>(pid)));
  }
  // Signal 0 only asks whether the process is there; EPERM means it is,
  // but is not ours to signal.
  // Through syscall(2): glibc 2.36 declares pidfd_send_signal without C
  // linkage for C++.
  if (::syscall(SYS_pidfd_send_signal, pidfd, 0, nullptr, 0) != 0 && errno != EPERM) {
    return noProcess(
        base::format("process %d is gone: %s", static_cast<int>(pid), std::strerror(errno)));
  }
  std::optional<long> actual = pidOfPidfd(pidfd);
  if (!actual) {
    return noProcess(base::format("descriptor %d is not a process descriptor for pid %d", pidfd,
                                  static_cast<int>(pid)));
  }
  if (*actual != pid) {
    return noProcess(base::format("descriptor %d stands for pid %d, not pid %d", pidfd,
                                  static_cast<int>(*actual), static_cast<int>(pid)));
  }
  return base::Result<void>::success();
}

std::string childPath(const std::string& dir, const char* name) {
  if (!dir.empty() && dir.back() == '/') return dir + name;
  return dir + "/" + name;
}

}  // namespace

CodeSigningTask::CodeSigningTask(pid_t pid, std::string executablePath)
    : pid_(pid), executablePath_(std::move(executablePath)) {}

base::Result<CodeSigningTaskPtr> CodeSigningTask::create(pid_t pid, int pidfd) {
  if (base::Result<void> alive = checkProcess(pid, pidfd); !alive.has_value()) {
    return alive.error();
  }
  std::optional<std::string> exe = processExecutablePath(pid);
  std::optional<FileIdentity> running = processExecutableIdentity(pid);
  // Checked again after the reads: while the process is still alive its pid
  // cannot have been handed to another one, so what was read is its own.
  if (base::Result<void> alive = checkProcess(pid, pidfd); !alive.has_value()) {
    return alive.error();
  }
  if (!exe || !running) {
    return noExecutable(
        base::format("cannot read the executable of pid %d", static_cast<int>(pid)));
  }
  // The path is only worth something while it still names the file the
  // process runs: a deleted or replaced executable (or one seen through
  // another mount namespace) would lend us someone else's entitlements.
  if (fileIdentity(*exe) != running) {
    return noExecutable(
        base::format("the executable of pid %d is no longer at %@", static_cast<int>(pid), *exe));
  }
  std::shared_ptr<CodeSigningTask> task(new CodeSigningTask(pid, std::move(*exe)));
  task->readEntitlements();
  return CodeSigningTaskPtr(std::move(task));
}

void CodeSigningTask::readEntitlements() {
  if (std::shared_ptr<BundleObject> bundle =
          BundleObject::create(executablePath_, BundleObject::Kind::kExecutable)) {
    bundlePath_ = bundle->stringProperty(kBundlePathProperty);
  }
  entitlementsPath_ = bundlePath_ ? childPath(*bundlePath_, kBundleEntitlementsFileName)
                                  : executablePath_ + kExecutableEntitlementsSuffix;
  auto refuse = [this](const std::string& why) {
    entitlementsError_ =
        base::Error{kCodeSigningErrorDomain, kCodeSigningBadEntitlements,
                    base::format("ignoring entitlements at %@: %@", entitlementsPath_, why)};
  };
  base::Result<std::optional<std::string>> bytes =
      readTrustedFile(entitlementsPath_, kMaxEntitlementsFileBytes);
  if (!bytes.has_value()) return refuse(bytes.error().description());
  if (!bytes.value()) return;
  base::Result<lmo::Value> value = readPropertyList(*bytes.value());
  if (!value.has_value()) return refuse(value.error().description());
  const lmo::Dictionary* dict = value->getIfDictionary();
  if (dict == nullptr) return refuse("it is not a dictionary");
  entitlements_ = *dict;
}

CodeSigningTask::Entitlement CodeSigningTask::copyValueForEntitlement(std::string_view key) const {
  return Entitlement{entitlements_.get(key), entitlementsError_};
}

std::string CodeSigningTask::description() const {
  return base::format("<CodeSigningTask pid=%d %@>", static_cast<int>(pid_), executablePath_);
}

std::string describe(const CodeSigningTask& task) {
  return task.description();
}

}  // namespace vantrel::platform
