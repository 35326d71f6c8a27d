#pragma once
// The code-signing service: which entitlements a peer process holds.
//
// A process's entitlements come from a property list that sits with its
// executable: the Entitlements.plist of the bundle the executable belongs to
// (the bundle service's kind-2 lookup), or, for an executable outside any
// bundle, "<executable>.entitlements.plist" beside it. The file is honoured
// only under the trust rule of platform/TrustedFile.h.
//
// The process is named by its pid and a pidfd taken when the peer connected.
// The pidfd stands for that very process, so the executable is read only
// while the pidfd shows the process alive under that pid: a pid the kernel
// has since given to another process cannot borrow that process's
// entitlements.

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "base/Error.h"
#include "base/Result.h"
#include "lmo/Value.h"

namespace vantrel::platform {

inline constexpr const char* kCodeSigningErrorDomain = "CodeSigning";

enum CodeSigningErrorCode : int64_t {
  kCodeSigningNoProcess = 1,        // the pidfd is not a live process with that pid
  kCodeSigningNoExecutable = 2,     // the executable cannot be read, or is no longer at its path
  kCodeSigningBadEntitlements = 3,  // the entitlements file is untrusted, unreadable or malformed
};

// Largest entitlements file read.
inline constexpr size_t kMaxEntitlementsFileBytes = 256 * 1024;

inline constexpr const char* kBundleEntitlementsFileName = "Entitlements.plist";
inline constexpr const char* kExecutableEntitlementsSuffix = ".entitlements.plist";

class CodeSigningTask;
using CodeSigningTaskPtr = std::shared_ptr<const CodeSigningTask>;

// The code-signing identity of one process, read once at creation. Immutable
// afterwards, so it may be read from any thread. The process may exit or exec
// another program later; the handle keeps answering for the executable that
// was running when it was made.
class CodeSigningTask {
 public:
  // The value of one entitlement: null when the process does not hold it.
  // error is set when the entitlements could not be read (then value is
  // null); the caller decides how to report it.
  struct Entitlement {
    lmo::Value value;
    std::optional<base::Error> error;
  };

  // Identifies the process pid through pidfd. Errors (domain "CodeSigning"):
  // kCodeSigningNoProcess when pidfd is not a pidfd, or its process has
  // exited or has another pid; kCodeSigningNoExecutable when the executable's
  // path cannot be read or no longer names the file the process runs.
  // Untrusted, unreadable or malformed entitlements do not fail creation: the
  // handle then holds no entitlements and reports entitlementsError().
  // No entitlements file at all is not an error: the entitlements are empty.
  static base::Result<CodeSigningTaskPtr> create(pid_t pid, int pidfd);
  // The identity an application bundle's code would have when run: its
  // Entitlements.plist under the same trust rule, pid 0. Errors: domain
  // "CodeSigning", kCodeSigningNoExecutable when path is not a directory.
  static base::Result<CodeSigningTaskPtr> createForBundle(const std::string& bundlePath);

  pid_t pid() const { return pid_; }
  const std::string& executablePath() const { return executablePath_; }
  // The bundle directory of the executable; nullopt when it has none. The
  // bundle itself for a task made by createForBundle (whose executablePath
  // is the bundle's path too).
  const std::optional<std::string>& bundlePath() const { return bundlePath_; }
  // The file the entitlements were (or would have been) read from.
  const std::string& entitlementsPath() const { return entitlementsPath_; }

  // Every entitlement; empty when there are none or they could not be read.
  const lmo::Dictionary& entitlements() const { return entitlements_; }
  // Why the entitlements file was not honoured (kCodeSigningBadEntitlements,
  // with the reason in the description); nullopt when it was, or is absent.
  const std::optional<base::Error>& entitlementsError() const { return entitlementsError_; }

  // The value of entitlement key, with entitlementsError() alongside.
  Entitlement copyValueForEntitlement(std::string_view key) const;

  std::string description() const;

 private:
  CodeSigningTask(pid_t pid, std::string executablePath);
  void readEntitlements();

  // Constant after creation.
  pid_t pid_;
  std::string executablePath_;
  std::optional<std::string> bundlePath_;
  std::string entitlementsPath_;
  lmo::Dictionary entitlements_;
  std::optional<base::Error> entitlementsError_;
};

std::string describe(const CodeSigningTask& task);

}  // namespace vantrel::platform
