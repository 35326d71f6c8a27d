#include "omnidex/Omnidex.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>
#include <thread>
#include <utility>

#include "base/Log.h"
#include "omnidex/BundlePaths.h"
#include "omnidex/Errors.h"
#include "omnidex/OmnidexState.h"
#include "omnidex/RecordFactory.h"
#include "platform/AtomicFile.h"
#include "platform/Paths.h"
#include "platform/ScopedFd.h"

namespace vantrel::omnidex {
namespace {

// The state directory holds the token secret and every plug-in's data
// container: nobody else has any business listing it.
constexpr mode_t kStateDirectoryMode = 0700;
constexpr const char* kContainersDirectoryName = "containers";
constexpr const char* kLockFileName = "registry.lock";

// The configured directories as scan roots; a path that cannot be one (empty,
// too long) is left out.
std::vector<ScanRoot> scanRoots(const OmnidexConfig& config) {
  std::vector<ScanRoot> roots;
  for (const std::string& dir : config.applicationDirectories) {
    if (std::optional<std::string> path = normalizeBundlePath(dir)) {
      roots.push_back(ScanRoot{*path, RootKind::kApplications});
    }
  }
  for (const std::string& dir : config.plugInDirectories) {
    if (std::optional<std::string> path = normalizeBundlePath(dir)) {
      roots.push_back(ScanRoot{*path, RootKind::kPlugIns});
    }
  }
  return roots;
}

base::Error badPath(const std::string& path) {
  return omnidexError(kOmnidexBadPath, base::format("not a usable bundle path: %@", path));
}

// Takes the state directory for this registry: two processes on one
// directory would each keep indexes that miss the other's changes, and
// both would create and remove the same data containers. The lock is the
// kernel's (flock on an open file), so it ends with the process however
// the process ends, and a registry opened twice in one process is refused
// alike. The holder's pid is written into the file to name it.
base::Result<platform::ScopedFd> lockStateDirectory(const std::string& directory) {
  const std::string path = childPath(directory, kLockFileName);
  platform::ScopedFd fd(::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0600));
  if (fd.get() < 0) return platform::posixError(errno, "cannot open", path);
  if (::flock(fd.get(), LOCK_EX | LOCK_NB) != 0) {
    if (errno != EWOULDBLOCK) return platform::posixError(errno, "cannot lock", path);
    char holder[32] = {};
    const ssize_t n = ::pread(fd.get(), holder, sizeof holder - 1, 0);
    const std::string pid = n > 0 ? std::string(holder, static_cast<size_t>(n)) : "unknown";
    return omnidexError(kOmnidexStateInUse,
                        base::format("the state directory %@ is in use by another registry "
                                     "(pid %@); one process may open it at a time",
                                     directory, pid.substr(0, pid.find('\n'))));
  }
  const std::string pid = std::to_string(::getpid()) + "\n";
  if (::ftruncate(fd.get(), 0) != 0 ||
      ::pwrite(fd.get(), pid.data(), pid.size(), 0) != static_cast<ssize_t>(pid.size())) {
    return platform::posixError(errno, "cannot write", path);
  }
  return fd;
}

}  // namespace

base::Result<std::shared_ptr<Omnidex>> Omnidex::open(const OmnidexConfig& config) {
  std::optional<std::string> stateDirectory = normalizeBundlePath(config.stateDirectory);
  if (!stateDirectory) return badPath(config.stateDirectory);
  VT_TRY(platform::ensureDirectory(*stateDirectory, kStateDirectoryMode));
  platform::ScopedFd lock = VT_TRY(lockStateDirectory(*stateDirectory));
  const std::string databasePath = childPath(*stateDirectory, kStoreFileName);
  std::unique_ptr<Store> store = VT_TRY(Store::open(databasePath));
  // After Store::open, which creates the database or checks its version.
  std::unique_ptr<ConsentStore> consent = VT_TRY(ConsentStore::open(databasePath));
  std::shared_ptr<Omnidex> omnidex(new Omnidex());
  omnidex->state_ = std::make_unique<State>(scanRoots(config), std::move(store),
                                            childPath(*stateDirectory, kContainersDirectoryName));
  omnidex->state_->consent = std::move(consent);
  omnidex->state_->stateLock = std::move(lock);
  VT_TRY(omnidex->state_->containers.open());
  State* state = omnidex->state_.get();
  // Putting the watches in is mostly the kernel's path walks and does not
  // depend on what is stored, so it runs beside the load instead of after.
  std::optional<base::Result<std::unique_ptr<Watcher>>> watcher;
  std::thread watching;
  if (config.followChanges) watching = std::thread([&] { watcher = state->makeWatcher(); });
  base::Result<void> loaded = state->load();
  if (watching.joinable()) watching.join();
  VT_TRY(loaded);
  {
    std::lock_guard monitor(state->monitorMutex);
    state->openedWatcher = std::move(watcher);
  }
  return omnidex;
}

std::shared_ptr<Workspace> Omnidex::defaultWorkspace() {
  // Made once and never destroyed: the registry is the process's for its
  // whole life, and tearing it down during exit would race the threads that
  // still use it.
  static std::shared_ptr<Workspace>* const instance = [] {
    // The process's registry is the daemon's, which always follows changes.
    OmnidexConfig config = OmnidexConfig::fromEnvironment();
    config.followChanges = true;
    base::Result<std::shared_ptr<Omnidex>> opened = open(config);
    if (!opened.has_value()) {
      base::vtlog("unable to open the application registry: %@", opened.error());
      return new std::shared_ptr<Workspace>();
    }
    return new std::shared_ptr<Workspace>(std::move(opened).value());
  }();
  return *instance;
}

Omnidex::~Omnidex() {
  if (!state_) return;
  std::unique_ptr<Watcher> watcher;
  {
    std::lock_guard lock(state_->monitorMutex);
    watcher = std::move(state_->watcher);
  }
  watcher.reset();                // stops following; a rescan in progress finishes first
  state_->announcements.reset();  // delivers what is queued, then joins its thread
}

void Omnidex::addObserver(std::weak_ptr<WorkspaceObserver> observer) {
  std::lock_guard lock(state_->observersMutex);
  state_->observers.push_back(std::move(observer));
}

void Omnidex::startMonitoring() {
  {
    std::lock_guard lock(state_->monitorMutex);
    if (state_->monitoring) return;
    state_->monitoring = true;
  }
  // Watches go in before the first scan (at open, when asked for), so a
  // change made while it runs is reported afterwards rather than missed.
  std::optional<base::Result<std::unique_ptr<Watcher>>> opened;
  {
    std::lock_guard lock(state_->monitorMutex);
    opened.swap(state_->openedWatcher);
  }
  base::Result<std::unique_ptr<Watcher>> watcher =
      opened ? std::move(*opened) : state_->makeWatcher();
  if (!watcher.has_value()) {
    base::vtlog("cannot follow the file system: %@", watcher.error().description());
  }
  reconcile();
  if (watcher.has_value()) {
    std::lock_guard lock(state_->monitorMutex);
    state_->watcher = std::move(watcher).value();
    state_->watcher->start();
  }
}

void Omnidex::reconcile() {
  state_->reconcileScope(nullptr);
  state_->waitForAnnouncements();
}

std::optional<std::vector<PlugInRecordPtr>> Omnidex::installedPlugIns() {
  std::shared_lock lock(state_->indexMutex);
  return state_->indexes.all();
}

std::optional<std::vector<PlugInRecordPtr>> Omnidex::plugInsMatchingQuery(
    const lmo::Dictionary& query, const PlugInFilter& filter) {
  std::vector<PlugInRecordPtr> candidates;
  {
    std::shared_lock lock(state_->indexMutex);
    candidates = state_->indexes.candidates(query);
  }
  // Filtered without the lock: the filter is the caller's code and may look
  // things up here, or wait on something that is registering a plug-in.
  if (!filter) return candidates;
  static const std::string kNoIdentifier;
  std::erase_if(candidates, [&](const PlugInRecordPtr& record) {
    return !filter(record->identifier ? *record->identifier : kNoIdentifier, record->entitlements);
  });
  return candidates;
}

PlugInRecordPtr Omnidex::plugInForUuid(const base::Uuid& uuid) {
  std::shared_lock lock(state_->indexMutex);
  return state_->indexes.plugInWithUuid(uuid);
}

PlugInRecordPtr Omnidex::plugInForUrl(const std::string& path) {
  std::optional<std::string> normal = normalizeBundlePath(path);
  if (!normal) return nullptr;
  std::shared_lock lock(state_->indexMutex);
  const PlugInEntry* entry = state_->indexes.plugInAt(*normal);
  return entry != nullptr ? entry->record : nullptr;
}

Workspace::ApplicationLookup Omnidex::applicationForUrl(const std::string& path) {
  std::optional<std::string> normal = normalizeBundlePath(path);
  if (!normal) return {};
  std::shared_lock lock(state_->indexMutex);
  const ApplicationEntry* entry = state_->indexes.applicationAt(*normal);
  if (entry == nullptr) return {};
  return ApplicationLookup{entry->record, state_->indexes.plugInsOfApplication(*normal)};
}

base::Result<void> Omnidex::registerPlugIn(const std::string& path) {
  std::optional<std::string> normal = normalizeBundlePath(path);
  if (!normal) return badPath(path);
  std::lock_guard write(state_->writeMutex);
  PlugInBundle bundle = VT_TRY(readPlugInBundle(*normal));
  Planner planner(state_->indexes, state_->containers, currentDate());
  VT_TRY(planner.read(std::move(bundle), Origin::kRegistration));
  return state_->apply(planner.finish());
}

base::Result<void> Omnidex::unregisterPlugIn(const std::string& path) {
  std::optional<std::string> normal = normalizeBundlePath(path);
  if (!normal) return badPath(path);
  std::lock_guard write(state_->writeMutex);
  const PlugInEntry* entry = state_->indexes.plugInAt(*normal);
  if (entry == nullptr) {
    return omnidexError(kOmnidexNotRegistered,
                        base::format("no plug-in is registered at %@", *normal));
  }
  Planner planner(state_->indexes, state_->containers, lmo::Date{});
  planner.drop(*entry);
  return state_->apply(planner.finish());
}

void Omnidex::clearCaches() {
  {
    std::lock_guard write(state_->writeMutex);
    state_->store->releaseMemory();
  }
  state_->consent->releaseMemory();
}

std::optional<std::vector<ConsentEntry>> Omnidex::privacyConsentEntries(
    const std::string& appBundleIdentifier) {
  base::Result<std::vector<ConsentEntry>> found = state_->consent->entries(appBundleIdentifier);
  if (!found.has_value()) return std::nullopt;
  return std::move(found).value();
}

base::Result<void> Omnidex::grantConsent(const std::string& appBundleIdentifier,
                                         const std::string& serviceIdentifier) {
  return state_->consent->setConsent(appBundleIdentifier, serviceIdentifier, true, currentDate());
}

base::Result<void> Omnidex::revokeConsent(const std::string& appBundleIdentifier,
                                          const std::string& serviceIdentifier) {
  return state_->consent->setConsent(appBundleIdentifier, serviceIdentifier, false, currentDate());
}

}  // namespace vantrel::omnidex
