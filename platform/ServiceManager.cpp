#include "platform/ServiceManager.h"

#include <dirent.h>
#include <fcntl.h>
#include <poll.h>
#include <sys/epoll.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <climits>
#include <cstring>
#include <map>
#include <mutex>
#include <set>
#include <utility>

#include "base/Log.h"
#include "lmo/IoLoop.h"
#include "platform/AtomicFile.h"
#include "platform/Paths.h"
#include "platform/ProcessInfo.h"
#include "platform/PropertyList.h"
#include "platform/ScopedFd.h"

namespace vantrel::platform {
namespace {

constexpr const char* kQueueLabel = "com.karvo.vantrel.servicemanager";
constexpr const char* kFileName = "services.plist";
constexpr mode_t kDirectoryMode = 0755;
// The table names every host and its plug-ins' environments; a host reads
// only its own launch descriptions.
constexpr mode_t kFileMode = 0600;
// Hosts pass through to their own directory but cannot list the others.
constexpr mode_t kServicesDirectoryMode = 0711;
constexpr mode_t kHostDirectoryMode = 0700;
constexpr mode_t kLaunchFileMode = 0600;

constexpr std::string_view kUidField = "Uid:";
constexpr std::string_view kGidField = "Gid:";

std::string pidText(pid_t pid) {
  return base::format("%d", static_cast<int>(pid));
}

// ---- Reading /proc ----

// The index-th blank-separated number of text.
std::optional<long> numberAt(std::string_view text, int index) {
  const char* p = text.data();
  const char* end = text.data() + text.size();
  for (int i = 0;; ++i) {
    while (p < end && (*p == ' ' || *p == '\t')) ++p;
    long value = 0;
    const auto [stop, error] = std::from_chars(p, end, value);
    if (error != std::errc()) return std::nullopt;
    if (i == index) return value;
    p = stop;
  }
}

// Whether pidfd stands for the live process pid.
bool isLiveProcess(int pidfd, pid_t pid) {
  return checkProcessIdentity(pid, pidfd).has_value();
}

// A pidfd becomes readable when its process exits.
bool hasExited(int pidfd) {
  pollfd p{pidfd, POLLIN, 0};
  return ::poll(&p, 1, 0) > 0;
}

struct Owner {
  uid_t uid = 0;
  gid_t gid = 0;
};

// The effective uid and gid of pid from /proc/<pid>/status.
std::optional<Owner> processOwner(pid_t pid) {
  const std::optional<std::string> status = readProcessStatus(pid);
  if (!status) return std::nullopt;
  const std::optional<std::string_view> uids = processStatusField(*status, kUidField);
  const std::optional<std::string_view> gids = processStatusField(*status, kGidField);
  const std::optional<long> uid = uids ? numberAt(*uids, 1) : std::nullopt;
  const std::optional<long> gid = gids ? numberAt(*gids, 1) : std::nullopt;
  if (!uid || !gid || *uid < 0 || *gid < 0) return std::nullopt;
  return Owner{static_cast<uid_t>(*uid), static_cast<gid_t>(*gid)};
}

// ---- Errors ----

// Every error registration reports is a POSIX one: the enabling step passes
// the code on as an error number.
base::Error asPosixError(const base::Error& error) {
  if (error.domain == kPosixErrorDomain) return error;
  int code = EIO;
  if (error.domain == kPropertyListErrorDomain) {
    code = error.code == kPropertyListTooLarge ? E2BIG : EINVAL;
  }
  return base::Error{kPosixErrorDomain, code, error.localizedDescription};
}

// The errno a reply carries for a failed write.
int errorNumber(const base::Error& error) {
  return error.domain == kPosixErrorDomain && error.code > 0 && error.code <= INT_MAX
             ? static_cast<int>(error.code)
             : EIO;
}

}  // namespace

// ---- Hosts and their watcher ----

// One host process, as long as it has registrations: our own pidfd for it
// and who its launch files belong to. Immutable once shared.
struct ServiceManager::Host {
  // A host for pid over pidfd (taken over, closed with the host), with its
  // owner read when we are root. ESRCH when the process is gone or pidfd is
  // not its descriptor.
  static base::Result<HostPtr> open(pid_t pid, int pidfd);

  Host(pid_t p, int fd) : pid(p), pidfd(fd) {}
  ~Host() {
    if (pidfd >= 0) ::close(pidfd);
  }
  Host(const Host&) = delete;
  Host& operator=(const Host&) = delete;

  const pid_t pid;
  const int pidfd;
  // Set when the daemon runs as root: the host's effective ids. Otherwise the
  // files stay the daemon's.
  std::optional<Owner> owner;
};

base::Result<ServiceManager::HostPtr> ServiceManager::Host::open(pid_t pid, int pidfd) {
  auto host = std::make_shared<Host>(pid, pidfd);
  const auto gone = [&] {
    return posixError(ESRCH, "no live host process with pid", pidText(pid));
  };
  if (!isLiveProcess(pidfd, pid)) return gone();
  if (::geteuid() == 0) {
    host->owner = processOwner(pid);
    // Checked again after the read: while the process is alive its pid has
    // not been handed to another one, so the ids read are its own.
    if (!host->owner || !isLiveProcess(pidfd, pid)) return gone();
  }
  return HostPtr(std::move(host));
}

// Watches every host's pidfd on the process's I/O loop (a pidfd becomes
// readable when its process exits) and reports each exit once. Each watched
// host is an I/O source holding its own reference, so a pidfd is never
// closed while epoll still watches it.
class ServiceManager::HostWatcher {
 public:
  using ExitHandler = std::function<void(HostPtr)>;

  explicit HostWatcher(ExitHandler onExit) : onExit_(std::move(onExit)) {}
  ~HostWatcher() { stop(); }
  HostWatcher(const HostWatcher&) = delete;
  HostWatcher& operator=(const HostWatcher&) = delete;

  // watch and unwatch are posted, not waited for: the manager's queue must
  // never wait for the I/O thread, which may be running a request that is
  // waiting for that queue. Posts run in order, so an unwatch follows its
  // watch, and stop() (which waits) follows both.
  void watch(HostPtr host) {
    lmo::IoLoop::shared().post([this, host = std::move(host)] {
      if (stopping_ || sources_.contains(host.get())) return;
      auto source = std::make_shared<Source>(this, host);
      source->token = lmo::IoLoop::shared().add(host->pidfd, EPOLLIN, source);
      sources_.emplace(host.get(), std::move(source));
    });
  }

  void unwatch(const HostPtr& host) {
    lmo::IoLoop::shared().post([this, host] { forget(host.get()); });
  }

  // Stops watching every host; no exit is reported afterwards. Waits, so
  // only at the manager's end.
  void stop() {
    lmo::IoLoop::shared().runAndWait([this] {
      stopping_ = true;
      while (!sources_.empty()) forget(sources_.begin()->first);
    });
  }

 private:
  struct Source : lmo::IoSource {
    Source(HostWatcher* w, HostPtr h) : watcher(w), host(std::move(h)) {}
    void handleIo(uint32_t) override { watcher->exited(host); }
    HostWatcher* const watcher;  // outlives every source: stop() removes them first
    const HostPtr host;
    uint64_t token = 0;
  };

  // On the I/O thread.
  void forget(const Host* host) {
    auto it = sources_.find(host);
    if (it == sources_.end()) return;
    lmo::IoLoop::shared().remove(it->second->host->pidfd, it->second->token);
    sources_.erase(it);
  }
  void exited(const HostPtr& host) {
    if (!sources_.contains(host.get())) return;
    forget(host.get());
    onExit_(host);
  }

  // Constant after construction.
  const ExitHandler onExit_;
  // Owned by the I/O thread.
  std::map<const Host*, std::shared_ptr<Source>> sources_;
  bool stopping_ = false;
};

// ---- The manager ----

namespace {

// Removes the entries of a host's directory (without following links, and
// only empty subdirectories) and the directory itself. No directory is not
// an error.
base::Result<void> removeLaunchDirectory(const std::string& dir) {
  const int fd = ::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (fd < 0) {
    if (errno == ENOENT) return base::Result<void>::success();
    return posixError(errno, "cannot open", dir);
  }
  DIR* stream = ::fdopendir(fd);
  if (stream == nullptr) {
    const int err = errno;
    ::close(fd);
    return posixError(err, "cannot read", dir);
  }
  std::vector<std::string> names;
  while (const dirent* entry = ::readdir(stream)) {
    const std::string_view name = entry->d_name;
    if (name == "." || name == "..") continue;
    if (names.size() == kMaxLaunchDirectoryEntries) break;
    names.emplace_back(name);
  }
  for (const std::string& name : names) {
    if (::unlinkat(fd, name.c_str(), 0) != 0 && errno == EISDIR) {
      (void)::unlinkat(fd, name.c_str(), AT_REMOVEDIR);
    }
  }
  ::closedir(stream);
  if (::rmdir(dir.c_str()) != 0 && errno != ENOENT) return posixError(errno, "cannot remove", dir);
  return base::Result<void>::success();
}

// Hands the file just written at path to owner. The directory is the host's,
// so the host could have put something else there since: only a regular
// file of ours with a single link is handed over.
base::Result<void> giveToOwner(const std::string& path, const Owner& owner) {
  ScopedFd fd(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (fd.get() < 0) return posixError(errno, "cannot open", path);
  struct stat st;
  if (::fstat(fd.get(), &st) != 0) return posixError(errno, "cannot inspect", path);
  if (!S_ISREG(st.st_mode) || st.st_uid != ::geteuid() || st.st_nlink != 1) {
    return posixError(EPERM, "replaced while being written:", path);
  }
  if (::fchown(fd.get(), owner.uid, owner.gid) != 0) {
    return posixError(errno, "cannot set the owner of", path);
  }
  return base::Result<void>::success();
}

}  // namespace

ServiceManager& ServiceManager::shared() {
  // Leaked on purpose: replies may still be in flight while the process exits.
  static ServiceManager* const instance = new ServiceManager(runtimeDirectory());
  return *instance;
}

ServiceManager::ServiceManager(std::string directory)
    : directory_(std::move(directory)),
      path_(directory_ + "/" + kFileName),
      watcher_(std::make_unique<HostWatcher>([this](HostPtr host) {
        queue_.async([this, host = std::move(host)] { hostExited(host); });
      })),
      queue_(kQueueLabel) {
  load();
}

ServiceManager::~ServiceManager() {
  // The watcher posts to queue_; it must be quiet before the queue drains.
  watcher_->stop();
}

void ServiceManager::load() {
  // What a save of the table killed half-way left (no directory yet: none).
  (void)removeStaleTemporaryFiles(directory_, kFileName);
  base::Result<lmo::Value> file = readPropertyListFile(path_);
  if (!file.has_value() && file.error().domain == kPosixErrorDomain &&
      file.error().code == ENOENT) {
    return;  // nothing registered yet
  }
  base::Result<Table> loaded =
      file.has_value() ? decodeServiceTable(file.value()) : base::Result<Table>(file.error());
  if (!loaded.has_value()) {
    base::writeLog(base::LogLevel::kWarning,
                   base::format("ignoring the external services in %@: %@", path_,
                                loaded.error().description()));
    return;
  }
  adoptLoadedHosts(loaded.value());
}

void ServiceManager::adoptLoadedHosts(Table& loaded) {
  Table live;
  std::set<pid_t> gone;
  for (ExternalServiceRegistration& r : loaded) {
    if (!hosts_.contains(r.hostPid) && !gone.contains(r.hostPid)) {
      const int pidfd = static_cast<int>(::syscall(SYS_pidfd_open, r.hostPid, 0));
      base::Result<HostPtr> host = Host::open(r.hostPid, pidfd);
      if (host.has_value()) {
        hosts_.emplace(r.hostPid, std::move(host.value()));
      } else {
        gone.insert(r.hostPid);
      }
    }
    if (hosts_.contains(r.hostPid)) live.push_back(std::move(r));
  }
  // A host that has gone can launch nothing; its entries only mislead readers.
  if (!gone.empty()) {
    if (auto written = persist(live); !written.has_value()) {
      base::writeLog(base::LogLevel::kWarning,
                     base::format("cannot drop the services of exited hosts: %@",
                                  written.error().description()));
    }
  }
  for (pid_t pid : gone) dropHost(pid);
  table_ = std::move(live);
  std::set<std::pair<pid_t, std::string>> published;
  for (const ExternalServiceRegistration& r : table_) {
    if (!published.emplace(r.hostPid, r.bundleIdentifier).second) continue;
    if (auto written = publish(table_, r.hostPid, r.bundleIdentifier); !written.has_value()) {
      base::writeLog(base::LogLevel::kWarning,
                     base::format("cannot publish the launch description of %@ for pid %d: %@",
                                  r.bundleIdentifier, static_cast<int>(r.hostPid),
                                  written.error().description()));
    }
  }
  for (const auto& [pid, host] : hosts_) {
    // The hosts that outlived the last daemon keep their directories; a
    // description it was writing when killed is left there half-way.
    (void)removeStaleTemporaryFiles(launchDirectoryPath(directory_, pid));
    watcher_->watch(host);
  }
}

base::Result<void> ServiceManager::persist(const Table& table) {
  VT_TRY(ensureDirectory(directory_, kDirectoryMode));
  return writePropertyListFile(path_, encodeServiceTable(table), kFileMode);
}

base::Result<void> ServiceManager::createHostDirectory(const Host& host) {
  VT_TRY(ensureDirectory(directory_, kDirectoryMode));
  VT_TRY(ensureDirectory(servicesDirectoryPath(directory_), kServicesDirectoryMode));
  const std::string dir = launchDirectoryPath(directory_, host.pid);
  if (::mkdir(dir.c_str(), kHostDirectoryMode) != 0 && errno != EEXIST) {
    return posixError(errno, "cannot create directory", dir);
  }
  // Our parent directory: nobody else can have swapped this name for a link.
  ScopedFd fd(::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (fd.get() < 0) return posixError(errno, "cannot open", dir);
  if (::fchmod(fd.get(), kHostDirectoryMode) != 0) {
    return posixError(errno, "cannot set the mode of", dir);
  }
  if (host.owner && ::fchown(fd.get(), host.owner->uid, host.owner->gid) != 0) {
    return posixError(errno, "cannot set the owner of", dir);
  }
  return base::Result<void>::success();
}

base::Result<void> ServiceManager::publish(const Table& table, pid_t pid,
                                           const std::string& bundleIdentifier) {
  const std::string path = launchDescriptionPath(directory_, pid, bundleIdentifier);
  const auto last = std::find_if(table.rbegin(), table.rend(), [&](const auto& r) {
    return r.hostPid == pid && r.bundleIdentifier == bundleIdentifier;
  });
  if (last == table.rend()) {
    if (::unlink(path.c_str()) != 0 && errno != ENOENT) {
      return posixError(errno, "cannot remove", path);
    }
    return base::Result<void>::success();
  }
  const auto host = hosts_.find(pid);
  VT_CHECK(host != hosts_.end(), "a registered host is known");
  const lmo::Value value = VT_TRY(encodeLaunchDescription(*last));
  const std::string xml = VT_TRY(writePropertyListXML(value));
  if (xml.size() > kMaxLaunchDescriptionBytes) {
    return posixError(E2BIG, "launch description too large for", path);
  }
  VT_TRY(createHostDirectory(*host->second));
  VT_TRY(writeFileAtomically(path, xml, kLaunchFileMode));
  if (host->second->owner) {
    if (auto given = giveToOwner(path, *host->second->owner); !given.has_value()) {
      ::unlink(path.c_str());
      return given.error();
    }
  }
  return base::Result<void>::success();
}

void ServiceManager::dropHost(pid_t pid) {
  const std::string dir = launchDirectoryPath(directory_, pid);
  if (auto removed = removeLaunchDirectory(dir); !removed.has_value()) {
    base::writeLog(base::LogLevel::kWarning,
                   base::format("cannot remove the launch directory %@: %@", dir,
                                removed.error().description()));
  }
  if (auto it = hosts_.find(pid); it != hosts_.end()) {
    watcher_->unwatch(it->second);
    hosts_.erase(it);
  }
}

base::Result<void> ServiceManager::registerExternalService(ExternalServiceRegistration registration,
                                                           int hostPidfd) {
  if (!isValidRegistration(registration)) {
    return base::Error{kPosixErrorDomain, EINVAL,
                       base::format("invalid external service for %@ (pid %d, executable %@)",
                                    registration.bundleIdentifier, registration.hostPid,
                                    registration.executablePath)};
  }
  if (auto encoded = encodeLaunchDescription(registration); !encoded.has_value()) {
    return encoded.error();
  }
  const std::string pid = pidText(registration.hostPid);
  const int ours = ::fcntl(hostPidfd, F_DUPFD_CLOEXEC, 3);
  if (ours < 0) {
    return posixError(errno == EBADF ? ESRCH : errno, "no descriptor for host process", pid);
  }
  base::Result<HostPtr> candidate = Host::open(registration.hostPid, ours);
  if (!candidate.has_value()) return candidate.error();
  if (std::optional<base::Error> problem = executableProblem(registration.executablePath)) {
    return *problem;
  }
  std::optional<base::Result<void>> result;
  queue_.sync([&] { result = registerOnQueue(registration, candidate.value()); });
  if (!result->has_value()) return asPosixError(result->error());
  return base::Result<void>::success();
}

base::Result<void> ServiceManager::registerOnQueue(const ExternalServiceRegistration& registration,
                                                   const HostPtr& candidate) {
  queue_.assertCurrent();
  const pid_t pid = registration.hostPid;
  // A host we still hold whose process has exited: its exit may not have
  // been handled yet, and this pid now names another process.
  if (auto it = hosts_.find(pid); it != hosts_.end() && hasExited(it->second->pidfd)) {
    const HostPtr stale = it->second;  // hostExited erases the map's copy
    hostExited(stale);
  }
  const bool newHost = !hosts_.contains(pid);
  Table table = table_;
  auto same = [&](const ExternalServiceRegistration& r) { return isSameService(r, registration); };
  if (auto it = std::find_if(table.begin(), table.end(), same); it != table.end()) {
    *it = registration;
  } else if (table.size() >= kMaxExternalServiceRegistrations) {
    return posixError(ENOSPC, "too many external services in", path_);
  } else {
    table.push_back(registration);
  }
  const std::string dir = launchDirectoryPath(directory_, pid);
  if (newHost) {
    // Left by an earlier process with this pid whose exit we never saw.
    if (!removeLaunchDirectory(dir).has_value()) {
      return posixError(EEXIST, "cannot clear the stale launch directory", dir);
    }
    hosts_.emplace(pid, candidate);
  }
  base::Result<void> done = publish(table, pid, registration.bundleIdentifier);
  if (done.has_value()) done = persist(table);
  if (!done.has_value()) {
    if (newHost) {
      hosts_.erase(pid);
      (void)removeLaunchDirectory(dir);
    } else {
      (void)publish(table_, pid, registration.bundleIdentifier);
    }
    return done.error();
  }
  table_ = std::move(table);
  if (newHost) watcher_->watch(candidate);
  return base::Result<void>::success();
}

void ServiceManager::hostExited(const HostPtr& host) {
  queue_.assertCurrent();
  const auto it = hosts_.find(host->pid);
  if (it == hosts_.end() || it->second != host) return;  // already handled
  Table table = table_;
  std::erase_if(table,
                [&](const ExternalServiceRegistration& r) { return r.hostPid == host->pid; });
  if (auto written = persist(table); !written.has_value()) {
    base::writeLog(base::LogLevel::kWarning,
                   base::format("cannot forget the services of exited host %d: %@",
                                static_cast<int>(host->pid), written.error().description()));
  }
  // The registrations go whether or not the file could be written: loading
  // drops the entries of exited hosts anyway.
  table_ = std::move(table);
  dropHost(host->pid);
}

int ServiceManager::removeNow(const std::string& bundleIdentifier, const std::string& version) {
  queue_.assertCurrent();
  Table table = table_;
  std::set<pid_t> affected;
  std::erase_if(table, [&](const ExternalServiceRegistration& r) {
    const bool match = r.bundleIdentifier == bundleIdentifier && r.version == version;
    if (match) affected.insert(r.hostPid);
    return match;
  });
  if (affected.empty()) return ESRCH;
  if (auto written = persist(table); !written.has_value()) return errorNumber(written.error());
  table_ = std::move(table);
  for (pid_t pid : affected) {
    const bool hostHasMore =
        std::any_of(table_.begin(), table_.end(), [&](const auto& r) { return r.hostPid == pid; });
    if (!hostHasMore) {
      dropHost(pid);
    } else if (auto unpublished = publish(table_, pid, bundleIdentifier);
               !unpublished.has_value()) {
      base::writeLog(
          base::LogLevel::kWarning,
          base::format("cannot update the launch description of %@ for pid %d: %@",
                       bundleIdentifier, static_cast<int>(pid), unpublished.error().description()));
    }
  }
  return 0;
}

void ServiceManager::removeExternalService(std::string bundleIdentifier, std::string version,
                                           base::SerialQueue& replyQueue,
                                           std::function<void(int)> reply) {
  queue_.async([this, bundleIdentifier = std::move(bundleIdentifier), version = std::move(version),
                &replyQueue, reply = std::move(reply)]() mutable {
    const int result = removeNow(bundleIdentifier, version);
    replyQueue.async([reply = std::move(reply), result] { reply(result); });
  });
}

std::vector<ExternalServiceRegistration> ServiceManager::registrations() {
  std::vector<ExternalServiceRegistration> copy;
  queue_.sync([&] { copy = table_; });
  return copy;
}

}  // namespace vantrel::platform
