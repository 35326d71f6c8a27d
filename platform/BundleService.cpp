#include "platform/BundleService.h"

#include "platform/Paths.h"

#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <system_error>
#include <utility>

#include "base/Format.h"
#include "platform/PropertyList.h"

namespace vantrel::platform {
namespace {

namespace fs = std::filesystem;

constexpr const char* kInfoPlistName = "Info.plist";
constexpr const char* kExecutableKey = "KBBundleExecutable";
constexpr const char* kSelfExecutable = "/proc/self/exe";

// Absolute and lexically normal, without a trailing slash ("/" stays "/").
// nullopt for paths we refuse outright.
std::optional<fs::path> normalizedPath(const std::string& path) {
  std::optional<std::string> normal = normalizePath(path, kMaxBundlePathLength);
  if (!normal) return std::nullopt;
  return fs::path(*normal);
}

// stat(2) follows symbolic links, so a link to a directory is a directory and
// a link to an executable is a regular file; a dangling link or a loop is
// neither.
bool isDirectory(const fs::path& p) {
  struct stat st;
  return ::stat(p.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

bool isRegularFile(const fs::path& p) {
  struct stat st;
  return ::stat(p.c_str(), &st) == 0 && S_ISREG(st.st_mode);
}

// The Info dictionary of the bundle directory dir. Only a regular file is
// read: a FIFO or device named Info.plist would otherwise block or stream.
std::optional<lmo::Dictionary> readInfoDictionary(const fs::path& dir) {
  fs::path plist = dir / kInfoPlistName;
  if (!isRegularFile(plist)) return std::nullopt;
  base::Result<lmo::Value> value = readPropertyListFile(plist.string());
  if (!value.has_value()) return std::nullopt;
  const lmo::Dictionary* dict = value->getIfDictionary();
  if (dict == nullptr) return std::nullopt;
  return *dict;
}

// The executable that info names inside the bundle at dir, as a lexically
// normal path; nullopt when info names none, or names something absolute or
// reaching outside the bundle.
std::optional<fs::path> namedExecutable(const fs::path& dir,
                                        const std::optional<lmo::Dictionary>& info) {
  if (!info) return std::nullopt;
  const std::string* name = info->get(kExecutableKey).getIfString();
  if (name == nullptr || name->empty() || name->size() > kMaxBundlePathLength) return std::nullopt;
  if (name->find('\0') != std::string::npos) return std::nullopt;
  fs::path relative = fs::path(*name).lexically_normal();
  if (relative.is_absolute() || relative.empty() || *relative.begin() == "..") return std::nullopt;
  if (relative == ".") return std::nullopt;
  return (dir / relative).lexically_normal();
}

std::optional<fs::path> canonicalPath(const fs::path& p) {
  std::error_code ec;
  fs::path c = fs::canonical(p, ec);
  if (ec) return std::nullopt;
  return c;
}

}  // namespace

BundleObject::BundleObject(std::string path, std::optional<lmo::Dictionary> info)
    : path_(std::move(path)), info_(std::move(info)) {
  std::optional<fs::path> exe = namedExecutable(path_, info_);
  if (exe && isRegularFile(*exe)) executablePath_ = exe->string();
}

std::shared_ptr<BundleObject> BundleObject::create(const std::string& path, Kind kind) {
  std::optional<fs::path> p = normalizedPath(path);
  if (!p) return nullptr;
  if (kind == Kind::kBundleDirectory) {
    if (!isDirectory(*p)) return nullptr;
    return std::shared_ptr<BundleObject>(new BundleObject(p->string(), readInfoDictionary(*p)));
  }
  if (kind != Kind::kExecutable || !isRegularFile(*p)) return nullptr;
  std::optional<fs::path> target = canonicalPath(*p);
  if (!target) return nullptr;
  // Walk the lexical parents: the bundle is where the caller's path says it
  // is, even when a directory on the way is a symbolic link.
  fs::path dir = p->parent_path();
  for (int depth = 0; depth < kMaxBundleSearchDepth; ++depth) {
    std::optional<lmo::Dictionary> info = readInfoDictionary(dir);
    std::optional<fs::path> exe = namedExecutable(dir, info);
    if (exe && canonicalPath(*exe) == target) {
      return std::shared_ptr<BundleObject>(new BundleObject(dir.string(), std::move(info)));
    }
    if (dir == dir.root_path() || !dir.has_parent_path()) break;
    dir = dir.parent_path();
  }
  return nullptr;
}

std::shared_ptr<BundleObject> BundleObject::mainBundle() {
  std::error_code ec;
  fs::path exe = fs::read_symlink(kSelfExecutable, ec);
  if (ec) return nullptr;
  if (auto bundle = create(exe.string(), Kind::kExecutable)) return bundle;
  return create(exe.parent_path().string(), Kind::kBundleDirectory);
}

std::optional<std::string> BundleObject::stringProperty(int number) const {
  switch (number) {
    case kBundlePathProperty:
      return path_;
    case kBundleExecutableProperty:
      return executablePath_;
    default:
      return std::nullopt;
  }
}

std::optional<std::string> BundleObject::copySupportDirectory() const {
  return path_;
}

std::optional<lmo::Dictionary> BundleObject::infoDictionary() const {
  return info_;
}

std::optional<std::string> BundleObject::infoString(std::string_view key) const {
  if (!info_) return std::nullopt;
  const std::string* s = info_->get(key).getIfString();
  if (s == nullptr) return std::nullopt;
  return *s;
}

std::string BundleObject::description() const {
  return base::format("<BundleObject %@>", path_);
}

std::string describe(const BundleObject& b) {
  return b.description();
}

}  // namespace vantrel::platform
