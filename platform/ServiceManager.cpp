#include "platform/ServiceManager.h"

#include <signal.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <optional>
#include <utility>

#include "base/Log.h"
#include "platform/AtomicFile.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"

namespace vantrel::platform {
namespace {

constexpr const char* kQueueLabel = "com.karvo.vantrel.servicemanager";
constexpr const char* kFileName = "services.plist";
// The launcher runs as another user; it reads the table but never writes it.
constexpr mode_t kDirectoryMode = 0755;
constexpr mode_t kFileMode = 0644;

constexpr const char* kFormatVersionKey = "formatVersion";
constexpr const char* kServicesKey = "services";
constexpr const char* kBundleIdentifierKey = "bundleIdentifier";
constexpr const char* kVersionKey = "version";
constexpr const char* kPidKey = "pid";
constexpr const char* kExecutableKey = "executable";
constexpr const char* kDescriptionKey = "description";

bool isSameService(const ExternalServiceRegistration& a, const ExternalServiceRegistration& b) {
  return a.bundleIdentifier == b.bundleIdentifier && a.version == b.version &&
         a.hostPid == b.hostPid;
}

bool isValid(const ExternalServiceRegistration& r) {
  return !r.bundleIdentifier.empty() && r.hostPid > 0 && !r.executablePath.empty() &&
         r.executablePath.front() == '/';
}

bool processExists(pid_t pid) {
  return ::kill(pid, 0) == 0 || errno != ESRCH;
}

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

// The table a file holds, or a description of what is wrong with it.
base::Result<std::vector<ExternalServiceRegistration>> decode(const lmo::Value& file) {
  const auto malformed = [](const char* what) {
    return base::Error{kPropertyListErrorDomain, kPropertyListMalformed, what};
  };
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

// The errno a reply carries for a failed write.
int errorNumber(const base::Error& error) {
  return error.domain == kPosixErrorDomain && error.code > 0 && error.code <= INT_MAX
             ? static_cast<int>(error.code)
             : EIO;
}

}  // namespace

ServiceManager& ServiceManager::shared() {
  // Leaked on purpose: replies may still be in flight while the process exits.
  static ServiceManager* const instance = new ServiceManager(runtimeDirectory());
  return *instance;
}

ServiceManager::ServiceManager(std::string directory)
    : directory_(std::move(directory)), path_(directory_ + "/" + kFileName), queue_(kQueueLabel) {
  load();
}

void ServiceManager::load() {
  base::Result<lmo::Value> file = readPropertyListFile(path_);
  if (!file.has_value() && file.error().domain == kPosixErrorDomain &&
      file.error().code == ENOENT) {
    return;  // nothing registered yet
  }
  base::Result<std::vector<ExternalServiceRegistration>> loaded =
      file.has_value() ? decode(file.value())
                       : base::Result<std::vector<ExternalServiceRegistration>>(file.error());
  if (!loaded.has_value()) {
    base::writeLog(base::LogLevel::kWarning,
                   base::format("ignoring the external services in %@: %@", path_,
                                loaded.error().description()));
    return;
  }
  std::vector<ExternalServiceRegistration> live;
  for (ExternalServiceRegistration& r : loaded.value()) {
    if (processExists(r.hostPid)) live.push_back(std::move(r));
  }
  // A host that has gone can launch nothing; its entries only mislead readers.
  if (live.size() != loaded.value().size()) {
    if (auto written = persist(live); !written.has_value()) {
      base::writeLog(base::LogLevel::kWarning,
                     base::format("cannot drop the services of exited hosts: %@",
                                  written.error().description()));
    }
  }
  table_ = std::move(live);
}

base::Result<void> ServiceManager::persist(const std::vector<ExternalServiceRegistration>& table) {
  VT_TRY(ensureDirectory(directory_, kDirectoryMode));
  return writePropertyListFile(path_, encode(table), kFileMode);
}

base::Result<void> ServiceManager::registerExternalService(
    ExternalServiceRegistration registration) {
  if (!isValid(registration)) {
    return base::Error{kPosixErrorDomain, EINVAL,
                       base::format("invalid external service for %@ (pid %d, executable %@)",
                                    registration.bundleIdentifier, registration.hostPid,
                                    registration.executablePath)};
  }
  std::optional<base::Error> failure;
  queue_.sync([&] {
    std::vector<ExternalServiceRegistration> table = table_;
    auto same = [&](const ExternalServiceRegistration& r) {
      return isSameService(r, registration);
    };
    if (auto it = std::find_if(table.begin(), table.end(), same); it != table.end()) {
      *it = registration;
    } else if (table.size() >= kMaxExternalServiceRegistrations) {
      failure = posixError(ENOSPC, "too many external services in", path_);
      return;
    } else {
      table.push_back(registration);
    }
    if (auto written = persist(table); !written.has_value()) {
      failure = written.error();
      return;
    }
    table_ = std::move(table);
  });
  if (failure) return *failure;
  return base::Result<void>::success();
}

int ServiceManager::removeNow(const std::string& bundleIdentifier, const std::string& version) {
  queue_.assertCurrent();
  std::vector<ExternalServiceRegistration> table = table_;
  const size_t removed = std::erase_if(table, [&](const ExternalServiceRegistration& r) {
    return r.bundleIdentifier == bundleIdentifier && r.version == version;
  });
  if (removed == 0) return ESRCH;
  if (auto written = persist(table); !written.has_value()) return errorNumber(written.error());
  table_ = std::move(table);
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
