#pragma once
// The service manager's table of external services: a plug-in made
// launchable by one host process. Enabling a plug-in for a host adds a
// registration; uninstalling the plug-in removes every registration of its
// bundle identifier and version; the host's exit removes all of its own.
//
// The table is kept in <directory>/services.plist (platform/ServiceTable.h)
// so that a restarted daemon finds it again. Each registration is also
// published for its host alone, as a launch description
// (platform/LaunchDescription.h) that client/VTPlugInLauncher reads.
// The services directory is 0711 (hosts may pass through, not list it); a
// host's directory is 0700 and its files 0600, owned by the host's
// effective uid and gid when the daemon runs as root (otherwise by the
// daemon's own user, which then must be the hosts' user too). The format is
// described in docs/launch-descriptions.md.
//
// The host is named by its pid and a pidfd, so a pid the kernel hands to
// another process later never inherits a registration. The process's I/O
// loop watches the hosts' pidfds; when a host exits, its registrations and
// its directory are removed and the table persisted.

#include <sys/types.h>

#include <cstddef>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/Result.h"
#include "base/SerialQueue.h"
#include "lmo/Value.h"
#include "platform/LaunchDescription.h"
#include "platform/ServiceTable.h"

namespace vantrel::platform {

class ServiceManager {
 public:
  // The process's one instance, over runtimeDirectory() as it is at the
  // first call. Never destroyed.
  static ServiceManager& shared();

  // A table kept in <directory>/services.plist, loaded now. A missing file is
  // an empty table. A file that cannot be read or does not have the form
  // above is an empty table and one log line (the next change replaces it).
  // Registrations whose host process no longer exists are dropped while
  // loading (with their launch descriptions), and the file rewritten without
  // them; the hosts still alive are watched from then on and their launch
  // descriptions written again.
  explicit ServiceManager(std::string directory);
  // Stops watching hosts, then runs the removals already submitted (their
  // replies are still posted). Registrations and files stay.
  ~ServiceManager();
  ServiceManager(const ServiceManager&) = delete;
  ServiceManager& operator=(const ServiceManager&) = delete;

  const std::string& path() const { return path_; }
  const std::string& directory() const { return directory_; }

  // Adds a registration for the live process registration.hostPid, named
  // also by hostPidfd (borrowed: the manager keeps a duplicate of its own),
  // replacing one for the same bundle identifier, version and host pid;
  // publishes the launch description and persists the table. Synchronous.
  // Two versions of one bundle identifier for one host share one launch
  // description file: it describes the one registered last.
  //
  // Every error is in domain "POSIX" with the errno as its code (the error
  // number the enabling step reports), and leaves the table and files as they
  // were:
  //   EINVAL  an empty bundle identifier or one that cannot be a file name
  //           (a '/', too long), a pid that is not positive, an executable
  //           path that is not absolute, a malformed description (see
  //           encodeLaunchDescription), or a description with no property-list
  //           form;
  //   ESRCH   the host has exited, or hostPidfd does not stand for it;
  //   ENOENT  no executable at the path (or another error of stat(2) on it);
  //   EACCES  the executable is not a regular file with an execute bit;
  //   E2BIG   too many environment variables, or a launch description larger
  //           than kMaxLaunchDescriptionBytes;
  //   ENOSPC  the table is full;
  //   EEXIST  a stale directory of an exited host with the same pid could not
  //           be cleared;
  //   the errno of a failed write (EIO when the failure had none).
  base::Result<void> registerExternalService(ExternalServiceRegistration registration,
                                             int hostPidfd);

  // Removes every registration of bundleIdentifier and version (whatever the
  // host pid) and their launch descriptions on the service manager's own
  // queue, then posts reply(result) to replyQueue: 0 when at least one was
  // removed, ESRCH when none matched, or the errno of a failed write of the
  // table (the table and files are then unchanged). A launch description
  // that cannot be removed after the table was written is logged. Returns at
  // once. replyQueue must outlive the reply.
  void removeExternalService(std::string bundleIdentifier, std::string version,
                             base::SerialQueue& replyQueue, std::function<void(int)> reply);

  // A copy of the table, in registration order.
  std::vector<ExternalServiceRegistration> registrations();

 private:
  struct Host;
  class HostWatcher;
  using HostPtr = std::shared_ptr<const Host>;
  using Table = std::vector<ExternalServiceRegistration>;

  void load();
  void adoptLoadedHosts(Table& table);
  // Replaces the file with table. Requires the queue (or the constructor).
  base::Result<void> persist(const Table& table);
  base::Result<void> registerOnQueue(const ExternalServiceRegistration& registration,
                                     const HostPtr& candidate);
  int removeNow(const std::string& bundleIdentifier, const std::string& version);
  void hostExited(const HostPtr& host);
  // Makes the launch description of (pid, bundleIdentifier) show the last
  // matching registration of table, or removes it when there is none.
  base::Result<void> publish(const Table& table, pid_t pid, const std::string& bundleIdentifier);
  base::Result<void> createHostDirectory(const Host& host);
  void dropHost(pid_t pid);

  // Constant after construction.
  const std::string directory_;
  const std::string path_;

  // Owned by queue_ (filled by the constructor before any block runs).
  Table table_;
  // Owned by queue_: the hosts that have registrations, each watched.
  std::map<pid_t, HostPtr> hosts_;

  // Has its own thread and lock. Stopped by the destructor before queue_
  // drains, destroyed after it.
  std::unique_ptr<HostWatcher> watcher_;

  // Declared last so that it is destroyed first: its destructor runs the
  // removals still queued while table_ is alive.
  base::SerialQueue queue_;
};

}  // namespace vantrel::platform
