#include "platform/Paths.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <filesystem>
#include <system_error>

#include "lmo/ServicePath.h"
#include "platform/AtomicFile.h"

namespace vantrel::platform {
namespace {

constexpr std::string_view kDefaultSystemVolume = "/System";

// The variable's value, or nullptr when it is unset or empty.
const char* environment(const char* name) {
  const char* value = std::getenv(name);
  return value != nullptr && *value != '\0' ? value : nullptr;
}

}  // namespace

std::string stateDirectory() {
  if (const char* dir = environment("VANTREL_STATE_DIR")) return dir;
  if (::geteuid() == 0) return "/var/lib/vantrel";
  if (const char* dir = environment("XDG_STATE_HOME")) return std::string(dir) + "/vantrel";
  const char* home = environment("HOME");
  return std::string(home != nullptr ? home : "") + "/.local/state/vantrel";
}

std::string runtimeDirectory() {
  // The IPC layer, below this one, needs the same directory for its sockets;
  // the rule lives there so the two can never disagree.
  return lmo::serviceRuntimeDirectory();
}

std::string preferencesDirectory() {
  if (const char* dir = environment("VANTREL_PREFERENCES_DIR")) return dir;
  if (const char* dir = environment("XDG_CONFIG_HOME")) {
    return std::string(dir) + "/vantrel/preferences";
  }
  const char* home = environment("HOME");
  return std::string(home != nullptr ? home : "") + "/.config/vantrel/preferences";
}

std::string systemVolumeDirectory() {
  const char* dir = environment("VANTREL_SYSTEM_DIR");
  // A relative or otherwise odd value must not widen what counts as system.
  std::optional<std::string> normal =
      dir != nullptr && dir[0] == '/' ? normalizePath(dir, PATH_MAX) : std::nullopt;
  return normal && *normal != "/" ? *normal : std::string(kDefaultSystemVolume);
}

bool isOnSystemVolume(std::string_view path) {
  const std::string volume = systemVolumeDirectory();
  return path.size() > volume.size() + 1 && path.starts_with(volume) && path[volume.size()] == '/';
}

std::vector<std::string> sdkDirectories() {
  const char* list = environment("VANTREL_SDK_DIRS");
  if (list == nullptr) return {"/usr/share/vantrel/sdks"};
  return splitPathList(list);
}

std::vector<std::string> splitPathList(std::string_view list) {
  std::vector<std::string> dirs;
  std::string_view rest(list);
  while (!rest.empty()) {
    const size_t colon = rest.find(':');
    const std::string_view part = rest.substr(0, colon);
    if (!part.empty()) dirs.emplace_back(part);
    if (colon == std::string_view::npos) break;
    rest.remove_prefix(colon + 1);
  }
  return dirs;
}

std::optional<std::string> normalizePath(std::string_view path, size_t maxLength) {
  if (path.empty() || path.size() > maxLength) return std::nullopt;
  if (path.find('\0') != std::string_view::npos) return std::nullopt;
  std::filesystem::path p(path);
  if (p.is_relative()) {
    std::error_code ec;
    std::filesystem::path cwd = std::filesystem::current_path(ec);
    if (ec) return std::nullopt;
    p = cwd / p;
  }
  std::string normal = p.lexically_normal().string();
  while (normal.size() > 1 && normal.back() == '/') normal.pop_back();
  if (normal.size() > maxLength) return std::nullopt;
  return normal;
}

bool isSinglePathComponent(std::string_view name, size_t maxLength) {
  if (name.empty() || name.size() > maxLength || name == "." || name == "..") return false;
  return name.find('/') == std::string_view::npos && name.find('\0') == std::string_view::npos;
}

base::Result<void> ensureDirectory(const std::string& path, mode_t mode) {
  if (path.empty()) return posixError(ENOENT, "cannot create directory", path);
  // Walk the components from the root, creating what is missing.
  for (size_t end = path.find('/', 1);; end = path.find('/', end + 1)) {
    const std::string prefix = path.substr(0, end);
    if (::mkdir(prefix.c_str(), mode) == 0) {
      // mkdir honours the umask; the caller asked for exactly this mode.
      if (::chmod(prefix.c_str(), mode) != 0) {
        return posixError(errno, "cannot set the mode of", prefix);
      }
    } else if (errno != EEXIST) {
      return posixError(errno, "cannot create directory", prefix);
    }
    if (end == std::string::npos) break;
  }
  struct stat st;
  if (::stat(path.c_str(), &st) != 0) return posixError(errno, "cannot create directory", path);
  if (!S_ISDIR(st.st_mode)) return posixError(ENOTDIR, "cannot create directory", path);
  return base::Result<void>::success();
}

}  // namespace vantrel::platform
