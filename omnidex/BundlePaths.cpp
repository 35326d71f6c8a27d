#include "omnidex/BundlePaths.h"

#include <filesystem>
#include <system_error>

#include "omnidex/Limits.h"
#include "platform/Paths.h"

namespace vantrel::omnidex {
namespace {

namespace fs = std::filesystem;

constexpr std::string_view kPlugInsDirectoryName = "PlugIns";
constexpr std::string_view kApplicationExtension = ".app";

}  // namespace

std::optional<std::string> normalizeBundlePath(std::string_view path) {
  return platform::normalizePath(path, kMaxPathLength);
}

std::optional<std::string> containingApplicationPath(const std::string& bundlePath) {
  std::optional<std::string_view> app = containingApplicationPathView(bundlePath);
  if (!app) return std::nullopt;
  return std::string(*app);
}

std::optional<std::string_view> containingApplicationPathView(std::string_view bundlePath) {
  const size_t slash = bundlePath.rfind('/');
  if (slash == std::string::npos || slash == 0) return std::nullopt;
  const std::string_view parent = bundlePath.substr(0, slash);
  const size_t parentSlash = parent.rfind('/');
  if (parentSlash == std::string_view::npos) return std::nullopt;
  if (parent.substr(parentSlash + 1) != kPlugInsDirectoryName) return std::nullopt;
  const std::string_view app = parent.substr(0, parentSlash);
  const size_t appSlash = app.rfind('/');
  if (appSlash == std::string_view::npos) return std::nullopt;
  const std::string_view appName = app.substr(appSlash + 1);
  // "X.app", not a directory called just ".app".
  if (appName.size() <= kApplicationExtension.size() || !appName.ends_with(kApplicationExtension)) {
    return std::nullopt;
  }
  return app;
}

std::string bundleStem(const std::string& bundlePath) {
  return fs::path(bundlePath).stem().string();
}

bool isWithin(const std::string& path, const std::string& dir) {
  if (dir == "/") return !path.empty() && path.front() == '/';
  return path.size() >= dir.size() && path.compare(0, dir.size(), dir) == 0 &&
         (path.size() == dir.size() || path[dir.size()] == '/');
}

std::string childPath(const std::string& dir, std::string_view name) {
  std::string path = dir;
  if (path.empty() || path.back() != '/') path += '/';
  path += name;
  return path;
}

}  // namespace vantrel::omnidex
