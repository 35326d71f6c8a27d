#include "client/VTPlugInLauncher.h"

#include <fcntl.h>
#include <linux/landlock.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstring>
#include <optional>
#include <utility>

#include "base/Format.h"
#include "base/Log.h"
#include "platform/AtomicFile.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"
#include "platform/ScopedFd.h"
#include "platform/LaunchDescription.h"
#include "platform/TrustedFile.h"

namespace vantrel::client {
namespace {

using platform::ScopedFd;

constexpr const char* kRootDirectory = "/";
// Writable under the "plugin" profile wherever the data container is: so
// many programs send output there that forbidding it breaks them for nothing.
constexpr const char* kNullDevice = "/dev/null";
constexpr int kChildFailedExit = 127;
// Descriptors marked one by one where close_range cannot: no process has
// more open than the kernel's default ceiling (fs.nr_open).
constexpr int kMaxDescriptorScan = 1 << 20;

// Landlock's file-system rights that change something, by the ABI version
// that introduced them. Truncation (ABI 3) is newer than the kernel headers
// we build against; its value is fixed by the kernel's ABI.
constexpr uint64_t kLandlockWriteAccessV1 =
    LANDLOCK_ACCESS_FS_WRITE_FILE | LANDLOCK_ACCESS_FS_REMOVE_DIR | LANDLOCK_ACCESS_FS_REMOVE_FILE |
    LANDLOCK_ACCESS_FS_MAKE_CHAR | LANDLOCK_ACCESS_FS_MAKE_DIR | LANDLOCK_ACCESS_FS_MAKE_REG |
    LANDLOCK_ACCESS_FS_MAKE_SOCK | LANDLOCK_ACCESS_FS_MAKE_FIFO | LANDLOCK_ACCESS_FS_MAKE_BLOCK |
    LANDLOCK_ACCESS_FS_MAKE_SYM;
constexpr uint64_t kLandlockAccessRefer = LANDLOCK_ACCESS_FS_REFER;  // ABI 2
constexpr uint64_t kLandlockAccessTruncate = 1ULL << 14;             // ABI 3

// The steps between fork and exec, in order; a failed one is reported to
// the parent by its index.
enum class ChildStep : int {
  kSignals,
  kStreams,
  kWorkingDirectory,
  kNoNewPrivs,
  kRestrictWrites,
  kDescriptors,
  kExecute,
};

const char* stepName(int step) {
  switch (static_cast<ChildStep>(step)) {
    case ChildStep::kSignals:
      return "reset the signals";
    case ChildStep::kStreams:
      return "set up the standard streams";
    case ChildStep::kWorkingDirectory:
      return "change to the working directory";
    case ChildStep::kNoNewPrivs:
      return "set no_new_privs";
    case ChildStep::kRestrictWrites:
      return "restrict file writes";
    case ChildStep::kDescriptors:
      return "close inherited descriptors";
    case ChildStep::kExecute:
      return "execute";
  }
  return "start";
}

// What the child writes to the report pipe when a step fails.
struct ChildFailure {
  int step = 0;
  int error = 0;
};

base::Error systemError(int err, std::string_view what) {
  return base::Error{platform::kPosixErrorDomain, err,
                     base::format("%@: %s", what, std::strerror(err))};
}

base::Error launcherError(PlugInLauncherErrorCode code, std::string message) {
  return base::Error{kPlugInLauncherErrorDomain, code, std::move(message)};
}

base::Result<platform::LaunchDescription> readDescription(std::string_view bundleIdentifier) {
  if (!platform::isSinglePathComponent(bundleIdentifier,
                                       platform::kMaxPublishedBundleIdentifierLength)) {
    return platform::posixError(EINVAL, "not a bundle identifier:", std::string(bundleIdentifier));
  }
  const pid_t self = ::getpid();
  const std::string path =
      platform::launchDescriptionPath(platform::runtimeDirectory(), self, bundleIdentifier);
  base::Result<std::optional<std::string>> bytes =
      platform::readTrustedFile(path, platform::kMaxLaunchDescriptionBytes);
  if (!bytes.has_value()) {
    return launcherError(kLaunchUntrustedDescription,
                         base::format("cannot use the launch description %@: %@", path,
                                      bytes.error().description()));
  }
  if (!bytes.value()) {
    return launcherError(kLaunchNotEnabled,
                         base::format("no launch description for %@ (not enabled for this process)",
                                      bundleIdentifier));
  }
  const auto bad = [&](const std::string& why) {
    return launcherError(kLaunchMalformedDescription,
                         base::format("malformed launch description %@: %@", path, why));
  };
  base::Result<lmo::Value> value = platform::readPropertyList(*bytes.value());
  if (!value.has_value()) return bad(value.error().description());
  base::Result<platform::LaunchDescription> description =
      platform::decodeLaunchDescription(value.value());
  if (!description.has_value()) return bad(description.error().description());
  if (description->bundleIdentifier != bundleIdentifier || description->hostPid != self) {
    return bad("it describes another plug-in or process");
  }
  return description;
}

// Allows the handled rights beneath the directory or file at path.
base::Result<void> allowBeneath(int ruleset, const std::string& path, uint64_t access) {
  ScopedFd target(::open(path.c_str(), O_PATH | O_CLOEXEC));
  if (target.get() < 0) return platform::posixError(errno, "cannot open", path);
  landlock_path_beneath_attr rule{};
  rule.allowed_access = access;
  rule.parent_fd = target.get();
  if (::syscall(SYS_landlock_add_rule, ruleset, LANDLOCK_RULE_PATH_BENEATH, &rule, 0) != 0) {
    return platform::posixError(errno, "cannot allow writes beneath", path);
  }
  return base::Result<void>::success();
}

// A Landlock ruleset that allows file writes only beneath writableRoot and
// to the null device; -1 when the kernel has no Landlock (logged once per
// launch). With no writableRoot nothing else is writable.
base::Result<int> makeWriteRuleset(const std::optional<std::string>& writableRoot) {
  const long abi =
      ::syscall(SYS_landlock_create_ruleset, nullptr, 0, LANDLOCK_CREATE_RULESET_VERSION);
  if (abi < 0) {
    if (errno != ENOSYS && errno != EOPNOTSUPP) {
      return systemError(errno, "cannot query the landlock version");
    }
    base::writeLog(base::LogLevel::kWarning,
                   base::format("landlock unavailable: %s", std::strerror(errno)));
    return -1;
  }
  uint64_t handled = kLandlockWriteAccessV1;
  if (abi >= 2) handled |= kLandlockAccessRefer;
  if (abi >= 3) handled |= kLandlockAccessTruncate;
  landlock_ruleset_attr attr{};
  attr.handled_access_fs = handled;
  ScopedFd ruleset(static_cast<int>(::syscall(SYS_landlock_create_ruleset, &attr, sizeof attr, 0)));
  if (ruleset.get() < 0) {
    return systemError(errno, "cannot create a landlock ruleset");
  }
  if (writableRoot) VT_TRY(allowBeneath(ruleset.get(), *writableRoot, handled));
  if (::access(kNullDevice, F_OK) == 0) {
    VT_TRY(allowBeneath(ruleset.get(), kNullDevice,
                        handled & (LANDLOCK_ACCESS_FS_WRITE_FILE | kLandlockAccessTruncate)));
  }
  return ruleset.release();
}

// Everything the child needs, built before fork: between fork and exec the
// child may only make async-signal-safe calls, so it allocates nothing.
struct ChildPlan {
  const char* executable = nullptr;
  std::vector<char*> argv;
  std::vector<char*> envp;
  const char* workingDirectory = kRootDirectory;
  int streams[3] = {-1, -1, -1};
  int ruleset = -1;
  int descriptorLimit = 0;  // one above the highest descriptor that may be open
};

[[noreturn]] void runChild(const ChildPlan& plan, int reportFd) {
  const auto fail = [reportFd](ChildStep step) {
    const ChildFailure failure{static_cast<int>(step), errno};
    (void)!::write(reportFd, &failure, sizeof failure);
    ::_exit(kChildFailedExit);
  };
  // The host's signal mask and ignored signals would otherwise carry over.
  sigset_t none;
  ::sigemptyset(&none);
  if (::sigprocmask(SIG_SETMASK, &none, nullptr) != 0) fail(ChildStep::kSignals);
  struct sigaction byDefault {};
  byDefault.sa_handler = SIG_DFL;
  for (int sig = 1; sig < NSIG; ++sig) (void)::sigaction(sig, &byDefault, nullptr);
  // Moved above 2 first, so that swapping two streams cannot lose one.
  int moved[3] = {-1, -1, -1};
  for (int i = 0; i < 3; ++i) {
    if (plan.streams[i] < 0) continue;
    moved[i] = ::fcntl(plan.streams[i], F_DUPFD_CLOEXEC, 3);
    if (moved[i] < 0) fail(ChildStep::kStreams);
  }
  for (int i = 0; i < 3; ++i) {
    if (moved[i] >= 0 && ::dup2(moved[i], i) < 0) fail(ChildStep::kStreams);
  }
  if (::chdir(plan.workingDirectory) != 0) fail(ChildStep::kWorkingDirectory);
  if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0) fail(ChildStep::kNoNewPrivs);
  if (plan.ruleset >= 0 && ::syscall(SYS_landlock_restrict_self, plan.ruleset, 0) != 0) {
    fail(ChildStep::kRestrictWrites);
  }
  // Whatever the host has open stays with the host; the report pipe closes
  // at exec as well. Kernels before 5.11 cannot mark a range: one by one.
  if (::close_range(3, UINT_MAX, CLOSE_RANGE_CLOEXEC) != 0) {
    for (int fd = 3; fd < plan.descriptorLimit; ++fd) {
      const int flags = ::fcntl(fd, F_GETFD);
      if (flags >= 0 && ::fcntl(fd, F_SETFD, flags | FD_CLOEXEC) != 0) {
        fail(ChildStep::kDescriptors);
      }
    }
  }
  ::execve(plan.executable, plan.argv.data(), plan.envp.data());
  fail(ChildStep::kExecute);
  ::_exit(kChildFailedExit);  // not reached: fail() exits
}

// Reads the child's report: 0 bytes when the exec succeeded (the pipe closed
// with it), a ChildFailure when a step failed.
ssize_t readReport(int fd, ChildFailure& failure) {
  size_t got = 0;
  auto* bytes = reinterpret_cast<char*>(&failure);
  while (got < sizeof failure) {
    const ssize_t n = ::read(fd, bytes + got, sizeof failure - got);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) break;
    got += static_cast<size_t>(n);
  }
  return static_cast<ssize_t>(got);
}

void reap(pid_t pid) {
  while (::waitpid(pid, nullptr, 0) < 0 && errno == EINTR) {
  }
}

std::vector<char*> pointersTo(std::vector<std::string>& strings) {
  std::vector<char*> pointers;
  pointers.reserve(strings.size() + 1);
  for (std::string& s : strings) pointers.push_back(s.data());
  pointers.push_back(nullptr);
  return pointers;
}

base::Result<void> checkOptions(const LaunchOptions& options) {
  if (options.arguments.size() > kMaxLaunchArguments) {
    return systemError(EINVAL, base::format("more than %u arguments", kMaxLaunchArguments));
  }
  for (int fd : {options.standardInput, options.standardOutput, options.standardError}) {
    if (fd >= 0 && ::fcntl(fd, F_GETFD) < 0) {
      return platform::posixError(EBADF, "not an open descriptor:", base::format("%d", fd));
    }
  }
  return base::Result<void>::success();
}

}  // namespace

base::Result<pid_t> VTPlugInLauncher::launch(std::string_view bundleIdentifier,
                                             LaunchOptions options) {
  VT_TRY(checkOptions(options));
  platform::LaunchDescription description = VT_TRY(readDescription(bundleIdentifier));
  ScopedFd ruleset;
  if (description.sandboxProfile == platform::kDefaultSandboxProfile) {
    ruleset.reset(VT_TRY(makeWriteRuleset(description.workingDirectory)));
  }
  std::vector<std::string> arguments{description.executablePath};
  arguments.insert(arguments.end(), options.arguments.begin(), options.arguments.end());
  ChildPlan plan;
  plan.executable = description.executablePath.c_str();
  plan.argv = pointersTo(arguments);
  plan.envp = pointersTo(description.environment);
  if (description.workingDirectory) plan.workingDirectory = description.workingDirectory->c_str();
  plan.streams[0] = options.standardInput;
  plan.streams[1] = options.standardOutput;
  plan.streams[2] = options.standardError;
  plan.ruleset = ruleset.get();
  rlimit files{};
  plan.descriptorLimit =
      ::getrlimit(RLIMIT_NOFILE, &files) == 0 && files.rlim_cur < kMaxDescriptorScan
          ? static_cast<int>(files.rlim_cur)
          : kMaxDescriptorScan;

  int report[2];
  if (::pipe2(report, O_CLOEXEC) != 0) {
    return platform::posixError(errno, "cannot start", description.executablePath);
  }
  ScopedFd reportRead(report[0]);
  ScopedFd reportWrite(report[1]);
  const pid_t pid = ::fork();
  if (pid < 0) return platform::posixError(errno, "cannot start", description.executablePath);
  if (pid == 0) runChild(plan, reportWrite.get());
  reportWrite.reset();
  ChildFailure failure;
  const ssize_t got = readReport(reportRead.get(), failure);
  if (got == 0) return pid;
  reap(pid);
  if (got != static_cast<ssize_t>(sizeof failure)) {
    return platform::posixError(EIO, "lost the start of", description.executablePath);
  }
  return base::Error{platform::kPosixErrorDomain, failure.error,
                     base::format("cannot start %@ (%s): %s", description.executablePath,
                                  stepName(failure.step), std::strerror(failure.error))};
}

}  // namespace vantrel::client
