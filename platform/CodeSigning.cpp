#include "platform/CodeSigning.h"

#include <sys/stat.h>

#include <utility>

#include "base/Format.h"
#include "platform/BundleService.h"
#include "platform/ProcessInfo.h"
#include "platform/PropertyList.h"
#include "platform/TrustedFile.h"

namespace vantrel::platform {
namespace {

base::Error noExecutable(std::string message) {
  return base::Error{kCodeSigningErrorDomain, kCodeSigningNoExecutable, std::move(message)};
}

// Succeeds while pidfd stands for a live process whose pid is pid; any
// failure is kCodeSigningNoProcess, with the reason the check gave.
base::Result<void> checkProcess(pid_t pid, int pidfd) {
  if (base::Result<void> alive = checkProcessIdentity(pid, pidfd); !alive.has_value()) {
    return base::Error{kCodeSigningErrorDomain, kCodeSigningNoProcess, alive.error().description()};
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

base::Result<CodeSigningTaskPtr> CodeSigningTask::createForBundle(const std::string& bundlePath) {
  struct stat st {};
  if (::stat(bundlePath.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
    return noExecutable(base::format("no bundle at %@", bundlePath));
  }
  std::shared_ptr<CodeSigningTask> task(new CodeSigningTask(0, bundlePath));
  task->bundlePath_ = bundlePath;
  task->readEntitlements();
  return CodeSigningTaskPtr(std::move(task));
}

void CodeSigningTask::readEntitlements() {
  if (!bundlePath_) {
    if (std::shared_ptr<BundleObject> bundle =
            BundleObject::create(executablePath_, BundleObject::Kind::kExecutable)) {
      bundlePath_ = bundle->stringProperty(kBundlePathProperty);
    }
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
