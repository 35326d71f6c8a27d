#include "platform/ProcessAssertions.h"

#include <dirent.h>
#include <stdlib.h>
#include <sys/types.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <optional>
#include <utility>

#include "platform/Paths.h"
#include "platform/ProcessInfo.h"

namespace vantrel::platform {
namespace {

struct DirectoryCloser {
  void operator()(DIR* dir) const { ::closedir(dir); }
};

// A bundle directory as the kernel would spell paths inside it: symbolic
// links resolved while it exists, else the path made lexically normal (a
// bundle removed while its executable still runs).
std::optional<std::string> resolvedDirectory(const std::string& path) {
  std::optional<std::string> normal = normalizePath(path, kMaxProcessPathLength);
  if (!normal) return std::nullopt;
  std::unique_ptr<char, decltype(&std::free)> real(::realpath(normal->c_str(), nullptr),
                                                   &std::free);
  return real ? std::string(real.get()) : *normal;
}

// The directory prefixes to look for, each ending with '/'.
std::vector<std::pair<std::string, std::string>> directoryPrefixes(
    const std::vector<std::string>& bundlePaths) {
  std::vector<std::pair<std::string, std::string>> prefixes;
  for (const std::string& path : bundlePaths) {
    std::optional<std::string> dir = resolvedDirectory(path);
    if (!dir) continue;
    std::string prefix = *dir;
    if (prefix.back() != '/') prefix += '/';
    prefixes.emplace_back(std::move(prefix), *dir);
  }
  return prefixes;
}

// The pid an entry of /proc names, or nullopt for the entries that are not
// processes.
std::optional<pid_t> pidOfEntry(const char* name) {
  if (*name < '1' || *name > '9') return std::nullopt;
  char* end = nullptr;
  errno = 0;
  const long pid = std::strtol(name, &end, 10);
  if (errno != 0 || *end != '\0' || pid <= 0 || pid > INT32_MAX) return std::nullopt;
  return static_cast<pid_t>(pid);
}

// The bundle directory of prefixes that the process's executable lies in, or
// nullptr.
const std::string* bundleOfProcess(
    const ProcessSnapshot::Process& process,
    const std::vector<std::pair<std::string, std::string>>& prefixes) {
  const pid_t pid = process.pid;
  const std::string* exe = &process.executable;
  for (const auto& [prefix, dir] : prefixes) {
    if (exe->size() <= prefix.size() || exe->compare(0, prefix.size(), prefix) != 0) continue;
    // Paths another mount namespace shows may name different files here.
    if (!sharesMountNamespace(pid)) {
      std::optional<FileIdentity> running = processExecutableIdentity(pid);
      if (!running || fileIdentity(*exe) != running) return nullptr;
    }
    return &dir;
  }
  return nullptr;
}

}  // namespace

ProcessSnapshot ProcessSnapshot::take() {
  ProcessSnapshot snapshot;
  std::unique_ptr<DIR, DirectoryCloser> proc(::opendir("/proc"));
  if (!proc) return snapshot;
  std::vector<pid_t> pids;
  size_t scanned = 0;
  while (const dirent* entry = ::readdir(proc.get())) {
    if (++scanned > kMaxScannedProcesses) break;
    if (std::optional<pid_t> pid = pidOfEntry(entry->d_name)) pids.push_back(*pid);
  }
  std::sort(pids.begin(), pids.end());
  for (pid_t pid : pids) {
    if (std::optional<std::string> exe = processExecutablePath(pid)) {
      snapshot.processes_.push_back(Process{pid, std::move(*exe)});
    }
  }
  return snapshot;
}

std::vector<lmo::Dictionary> runningInstances(std::string_view bundleIdentifier,
                                              const std::vector<std::string>& bundlePaths) {
  if (bundlePaths.empty()) return {};
  return runningInstances(bundleIdentifier, bundlePaths, ProcessSnapshot::take());
}

std::vector<lmo::Dictionary> runningInstances(std::string_view bundleIdentifier,
                                              const std::vector<std::string>& bundlePaths,
                                              const ProcessSnapshot& snapshot) {
  std::vector<lmo::Dictionary> instances;
  const auto prefixes = directoryPrefixes(bundlePaths);
  for (const ProcessSnapshot::Process& process : snapshot.processes()) {
    const std::string* dir = bundleOfProcess(process, prefixes);
    if (dir == nullptr) continue;
    instances.push_back(lmo::Dictionary{
        {kInstanceBundleIdentifierKey, lmo::Value(std::string(bundleIdentifier))},
        {kInstancePidKey, lmo::Value::integer(process.pid)},
        {kInstanceBundlePathKey, lmo::Value(*dir)},
    });
  }
  return instances;
}

}  // namespace vantrel::platform
