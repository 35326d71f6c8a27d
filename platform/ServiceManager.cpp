#include "platform/ServiceManager.h"

#include <dirent.h>
#include <fcntl.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <climits>
#include <cstring>
#include <mutex>
#include <set>
#include <thread>
#include <utility>

#include "base/Log.h"
#include "platform/AtomicFile.h"
#include "platform/Paths.h"
#include "platform/ProcessInfo.h"
#include "platform/PropertyList.h"
#include "platform/ScopedFd.h"

namespace vantrel::platform {
namespace {

constexpr const char* kQueueLabel = "com.karvo.vantrel.servicemanager";
constexpr const char* kFileName = "services.plist";
constexpr const char* kServicesDirectoryName = "services";
constexpr const char* kLaunchFileSuffix = ".plist";
constexpr mode_t kDirectoryMode = 0755;
// The table names every host and its plug-ins' environments; a host reads
// only its own launch descriptions.
constexpr mode_t kFileMode = 0600;
// Hosts pass through to their own directory but cannot list the others.
constexpr mode_t kServicesDirectoryMode = 0711;
constexpr mode_t kHostDirectoryMode = 0700;
constexpr mode_t kLaunchFileMode = 0600;

constexpr const char* kFormatVersionKey = "formatVersion";
constexpr const char* kServicesKey = "services";
constexpr const char* kBundleIdentifierKey = "bundleIdentifier";
constexpr const char* kVersionKey = "version";
constexpr const char* kPidKey = "pid";
constexpr const char* kExecutableKey = "executable";
constexpr const char* kDescriptionKey = "description";

constexpr std::string_view kUidField = "Uid:";
constexpr std::string_view kGidField = "Gid:";

bool isSameService(const ExternalServiceRegistration& a, const ExternalServiceRegistration& b) {
  return a.bundleIdentifier == b.bundleIdentifier && a.version == b.version &&
         a.hostPid == b.hostPid;
}

bool isValid(const ExternalServiceRegistration& r) {
  return isSinglePathComponent(r.bundleIdentifier, kMaxPublishedBundleIdentifierLength) &&
         r.hostPid > 0 && !r.executablePath.empty() && r.executablePath.front() == '/';
}

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

// ---- The table file ----

lmo::Value encode(const std::vector<ExternalServiceRegistration>& table) {
  std::vector<lmo::Value> services;
  services.reserve(table.size());
  for (const ExternalServiceRegistration& r : table) {
    services.emplace_back(lmo::Dictionary{
        {kBundleIdentifierKey, r.bundleIdentifier},
        {kVersionKey, r.version},
        {kPidKey, lmo::Value::integer(r.hostPid)},
        {kExecutableKey, r.executablePath},
        {kDescriptionKey, r.description},
    });
  }
  return lmo::Dictionary{
      {kFormatVersionKey, lmo::Value::integer(kServicesFileFormatVersion)},
      {kServicesKey, lmo::Array(std::move(services))},
  };
}

std::optional<ExternalServiceRegistration> decodeEntry(const lmo::Value& entry) {
  const lmo::Dictionary* d = entry.getIfDictionary();
  if (d == nullptr) return std::nullopt;
  const std::string* bundleIdentifier = d->get(kBundleIdentifierKey).getIfString();
  const std::string* version = d->get(kVersionKey).getIfString();
  const std::optional<int64_t> pid = d->get(kPidKey).getIfInt64();
  const std::string* executable = d->get(kExecutableKey).getIfString();
  const lmo::Dictionary* description = d->get(kDescriptionKey).getIfDictionary();
  if (!bundleIdentifier || !version || !pid || !executable || !description) return std::nullopt;
  if (*pid <= 0 || *pid > INT_MAX) return std::nullopt;
  ExternalServiceRegistration r{*bundleIdentifier, *version, static_cast<pid_t>(*pid), *executable,
                                *description};
  if (!isValid(r)) return std::nullopt;
  return r;
}

base::Error malformed(const char* what) {
  return base::Error{kPropertyListErrorDomain, kPropertyListMalformed, what};
}

// The table a file holds, or a description of what is wrong with it.
base::Result<std::vector<ExternalServiceRegistration>> decode(const lmo::Value& file) {
  const lmo::Dictionary* top = file.getIfDictionary();
  if (top == nullptr) return malformed("not a dictionary");
  if (top->get(kFormatVersionKey).getIfInt64() != kServicesFileFormatVersion) {
    return malformed("unknown format version");
  }
  const lmo::Array* services = top->get(kServicesKey).getIfArray();
  if (services == nullptr) return malformed("no services array");
  if (services->size() > kMaxExternalServiceRegistrations) return malformed("too many services");
  std::vector<ExternalServiceRegistration> table;
  table.reserve(services->size());
  for (const lmo::Value& entry : *services) {
    std::optional<ExternalServiceRegistration> r = decodeEntry(entry);
    if (!r) return malformed("malformed service entry");
    table.push_back(std::move(*r));
  }
  return table;
}

// ---- Launch descriptions ----

// What is wrong with an "LMOService" dictionary; nullptr when nothing.
const char* serviceProblem(const lmo::Dictionary& service) {
  const lmo::Value& environment = service.get(kLaunchEnvironmentKey);
  if (!environment.isNull()) {
    const lmo::Dictionary* variables = environment.getIfDictionary();
    if (variables == nullptr) return "the environment is not a dictionary";
    if (variables->size() > kMaxLaunchEnvironmentVariables) return "too many environment variables";
  }
  const lmo::Value& profile = service.get(kLaunchSandboxProfileKey);
  if (!profile.isNull() && profile.getIfString() == nullptr) {
    return "the sandbox profile is not a string";
  }
  return nullptr;
}

const lmo::Dictionary& environmentOf(const lmo::Dictionary& service) {
  static const lmo::Dictionary kNone;
  const lmo::Dictionary* variables = service.get(kLaunchEnvironmentKey).getIfDictionary();
  return variables != nullptr ? *variables : kNone;
}

bool isAbsolutePath(const std::string* path) {
  return path != nullptr && !path->empty() && path->front() == '/';
}

bool isEnvironmentName(std::string_view name) {
  return !name.empty() && name.find('=') == std::string_view::npos;
}

}  // namespace

std::optional<base::Error> executableProblem(const std::string& path) {
  struct stat st;
  if (::stat(path.c_str(), &st) != 0) return posixError(errno, "no executable at", path);
  if (!S_ISREG(st.st_mode) || (st.st_mode & (S_IXUSR | S_IXGRP | S_IXOTH)) == 0) {
    return posixError(EACCES, "cannot execute", path);
  }
  return std::nullopt;
}

std::string launchDirectoryPath(const std::string& directory, pid_t pid) {
  return base::format("%@/%s/%d", directory, kServicesDirectoryName, static_cast<int>(pid));
}

std::string launchDescriptionPath(const std::string& directory, pid_t pid,
                                  std::string_view bundleIdentifier) {
  return base::format("%@/%@%s", launchDirectoryPath(directory, pid), bundleIdentifier,
                      kLaunchFileSuffix);
}

base::Result<lmo::Value> encodeLaunchDescription(const ExternalServiceRegistration& registration) {
  const auto invalid = [&](int code, const char* what) {
    return base::Error{kPosixErrorDomain, code,
                       base::format("malformed launch description for %@: %s",
                                    registration.bundleIdentifier, what)};
  };
  lmo::Dictionary service;
  if (const lmo::Value& value = registration.description.get(kLaunchServiceKey); !value.isNull()) {
    const lmo::Dictionary* dictionary = value.getIfDictionary();
    if (dictionary == nullptr) return invalid(EINVAL, "the service is not a dictionary");
    service = *dictionary;
  }
  if (const char* problem = serviceProblem(service)) {
    return invalid(environmentOf(service).size() > kMaxLaunchEnvironmentVariables ? E2BIG : EINVAL,
                   problem);
  }
  lmo::Dictionary file{
      {kLaunchFormatVersionKey, lmo::Value::integer(kLaunchDescriptionFormatVersion)},
      {kLaunchBundleIdentifierKey, registration.bundleIdentifier},
      {kLaunchVersionKey, registration.version},
      {kLaunchExecutableKey, registration.executablePath},
      {kLaunchHostPidKey, lmo::Value::integer(registration.hostPid)},
      {kLaunchServiceKey, service},
  };
  const std::string* container =
      registration.dataContainer ? &*registration.dataContainer : nullptr;
  if (isAbsolutePath(container)) file = file.setting(kLaunchWorkingDirectoryKey, *container);
  return lmo::Value(file);
}

base::Result<LaunchDescription> decodeLaunchDescription(const lmo::Value& file) {
  const lmo::Dictionary* top = file.getIfDictionary();
  if (top == nullptr) return malformed("not a dictionary");
  if (top->get(kLaunchFormatVersionKey).getIfInt64() != kLaunchDescriptionFormatVersion) {
    return malformed("unknown format version");
  }
  const std::string* bundleIdentifier = top->get(kLaunchBundleIdentifierKey).getIfString();
  const std::string* version = top->get(kLaunchVersionKey).getIfString();
  const std::string* executable = top->get(kLaunchExecutableKey).getIfString();
  const std::optional<int64_t> pid = top->get(kLaunchHostPidKey).getIfInt64();
  const lmo::Dictionary* service = top->get(kLaunchServiceKey).getIfDictionary();
  if (!bundleIdentifier || !version || !pid || !service) return malformed("a key is missing");
  if (!isAbsolutePath(executable)) return malformed("the executable is not an absolute path");
  if (*pid <= 0 || *pid > INT_MAX) return malformed("the host pid is out of range");
  if (const char* problem = serviceProblem(*service)) return malformed(problem);
  LaunchDescription d;
  d.bundleIdentifier = *bundleIdentifier;
  d.version = *version;
  d.hostPid = static_cast<pid_t>(*pid);
  d.executablePath = *executable;
  for (const auto& [name, value] : environmentOf(*service)) {
    const std::string* text = value.getIfString();
    if (text != nullptr && isEnvironmentName(name)) d.environment.push_back(name + "=" + *text);
  }
  const std::string* profile = service->get(kLaunchSandboxProfileKey).getIfString();
  d.sandboxProfile = profile != nullptr ? *profile : kDefaultSandboxProfile;
  if (const lmo::Value& cwd = top->get(kLaunchWorkingDirectoryKey); !cwd.isNull()) {
    if (!isAbsolutePath(cwd.getIfString())) {
      return malformed("the working directory is not an absolute path");
    }
    d.workingDirectory = *cwd.getIfString();
  }
  return d;
}

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

// Polls every watched host's pidfd on a thread of its own and reports each
// exit once. The hosts are shared with the service manager's queue; the
// thread holds its own references while it polls, so a descriptor is never
// closed under poll(2).
class ServiceManager::HostWatcher {
 public:
  using ExitHandler = std::function<void(HostPtr)>;

  explicit HostWatcher(ExitHandler onExit)
      : onExit_(std::move(onExit)), wakeFd_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)) {
    if (wakeFd_ < 0) {
      base::writeLog(base::LogLevel::kError,
                     base::format("cannot watch host processes: %s", std::strerror(errno)));
      return;
    }
    thread_ = std::thread([this] { run(); });
  }
  ~HostWatcher() {
    stop();
    if (wakeFd_ >= 0) ::close(wakeFd_);
  }
  HostWatcher(const HostWatcher&) = delete;
  HostWatcher& operator=(const HostWatcher&) = delete;

  void watch(HostPtr host) {
    {
      std::lock_guard lock(mutex_);
      watched_.push_back(std::move(host));
    }
    wake();
  }

  void unwatch(const HostPtr& host) {
    {
      std::lock_guard lock(mutex_);
      std::erase(watched_, host);
    }
    wake();
  }

  // Joins the thread; no exit is reported afterwards.
  void stop() {
    {
      std::lock_guard lock(mutex_);
      stopping_ = true;
    }
    wake();
    if (thread_.joinable()) thread_.join();
  }

 private:
  void wake() {
    const uint64_t one = 1;
    if (wakeFd_ >= 0) (void)!::write(wakeFd_, &one, sizeof one);
  }

  void run() {
    std::vector<HostPtr> snapshot;
    std::vector<pollfd> fds;
    for (;;) {
      {
        std::lock_guard lock(mutex_);
        if (stopping_) return;
        snapshot = watched_;
      }
      fds.assign(1, pollfd{wakeFd_, POLLIN, 0});
      for (const HostPtr& host : snapshot) fds.push_back(pollfd{host->pidfd, POLLIN, 0});
      if (::poll(fds.data(), fds.size(), -1) < 0) {
        if (errno == EINTR) continue;
        base::writeLog(base::LogLevel::kError,
                       base::format("cannot poll host processes: %s", std::strerror(errno)));
        // Waits for the next change instead of spinning on the same error.
        fds.resize(1);
        (void)::poll(fds.data(), 1, -1);
      }
      uint64_t count = 0;
      if (fds[0].revents != 0) (void)!::read(wakeFd_, &count, sizeof count);
      for (size_t i = 1; i < fds.size(); ++i) {
        if (fds[i].revents == 0) continue;
        const HostPtr& exited = snapshot[i - 1];
        {
          std::lock_guard lock(mutex_);
          std::erase(watched_, exited);
        }
        onExit_(exited);
      }
    }
  }

  // Constant after construction.
  const ExitHandler onExit_;
  const int wakeFd_;  // -1 when no eventfd could be made: nothing is watched then

  std::mutex mutex_;
  std::vector<HostPtr> watched_;  // Guarded by mutex_.
  bool stopping_ = false;         // Guarded by mutex_.
  std::thread thread_;            // Started by the constructor, joined by stop().
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
  base::Result<lmo::Value> file = readPropertyListFile(path_);
  if (!file.has_value() && file.error().domain == kPosixErrorDomain &&
      file.error().code == ENOENT) {
    return;  // nothing registered yet
  }
  base::Result<Table> loaded =
      file.has_value() ? decode(file.value()) : base::Result<Table>(file.error());
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
  for (const auto& [pid, host] : hosts_) watcher_->watch(host);
}

base::Result<void> ServiceManager::persist(const Table& table) {
  VT_TRY(ensureDirectory(directory_, kDirectoryMode));
  return writePropertyListFile(path_, encode(table), kFileMode);
}

base::Result<void> ServiceManager::createHostDirectory(const Host& host) {
  VT_TRY(ensureDirectory(directory_, kDirectoryMode));
  VT_TRY(ensureDirectory(directory_ + "/" + kServicesDirectoryName, kServicesDirectoryMode));
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
  if (!isValid(registration)) {
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
