#pragma once
// The service manager's table of external services: a plug-in made
// launchable by one host process. Enabling a plug-in for a host adds a
// registration; uninstalling the plug-in removes every registration of its
// bundle identifier and version. The table is kept in
// <directory>/services.plist (an XML property list, replaced atomically on
// every change) so that the process that launches plug-ins can read it:
//   { "formatVersion": 1,
//     "services": [ { "bundleIdentifier": text, "version": text, "pid": integer,
//                     "executable": absolute path, "description": dictionary } ] }

#include <sys/types.h>

#include <cstddef>
#include <functional>
#include <string>
#include <vector>

#include "base/Result.h"
#include "base/SerialQueue.h"
#include "lmo/Value.h"

namespace vantrel::platform {

// Registrations the table holds at most; registering beyond it fails.
inline constexpr size_t kMaxExternalServiceRegistrations = 4096;
inline constexpr int64_t kServicesFileFormatVersion = 1;

struct ExternalServiceRegistration {
  std::string bundleIdentifier;
  std::string version;  // may be empty: a bundle need not declare one
  pid_t hostPid = 0;
  std::string executablePath;
  lmo::Dictionary description;  // the launch description the plug-in runs with
  bool operator==(const ExternalServiceRegistration&) const = default;
};

class ServiceManager {
 public:
  // The process's one instance, over runtimeDirectory() as it is at the
  // first call. Never destroyed.
  static ServiceManager& shared();

  // A table kept in <directory>/services.plist, loaded now. A missing file is
  // an empty table. A file that cannot be read or does not have the form
  // above is an empty table and one log line (the next change replaces it).
  // Registrations whose host process no longer exists are dropped while
  // loading, and the file rewritten without them.
  explicit ServiceManager(std::string directory);
  // Runs the removals already submitted (their replies are still posted).
  ~ServiceManager() = default;
  ServiceManager(const ServiceManager&) = delete;
  ServiceManager& operator=(const ServiceManager&) = delete;

  const std::string& path() const { return path_; }

  // Adds a registration, replacing one for the same bundle identifier,
  // version and host pid, and persists the table. Synchronous. Errors (the
  // table and file unchanged): domain "POSIX", code EINVAL for an empty
  // bundle identifier, a pid that is not positive or an executable path that
  // is not absolute; ENOSPC when the table is full; the write's error
  // (domain "POSIX" or "PropertyList") when the file cannot be replaced.
  base::Result<void> registerExternalService(ExternalServiceRegistration registration);

  // Removes every registration of bundleIdentifier and version (whatever the
  // host pid) on the service manager's own queue, then posts reply(result)
  // to replyQueue: 0 when at least one was removed, ESRCH when none matched,
  // or the errno of a failed write of the file (the table is then unchanged).
  // Returns at once. replyQueue must outlive the reply.
  void removeExternalService(std::string bundleIdentifier, std::string version,
                             base::SerialQueue& replyQueue, std::function<void(int)> reply);

  // A copy of the table, in registration order.
  std::vector<ExternalServiceRegistration> registrations();

 private:
  void load();
  // Replaces the file with table. Requires the queue (or the constructor).
  base::Result<void> persist(const std::vector<ExternalServiceRegistration>& table);
  int removeNow(const std::string& bundleIdentifier, const std::string& version);

  // Constant after construction.
  const std::string directory_;
  const std::string path_;

  // Owned by queue_ (filled by the constructor before any block runs).
  std::vector<ExternalServiceRegistration> table_;

  // Declared last so that it is destroyed first: its destructor runs the
  // removals still queued while table_ is alive.
  base::SerialQueue queue_;
};

}  // namespace vantrel::platform
