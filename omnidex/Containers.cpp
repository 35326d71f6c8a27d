#include "omnidex/Containers.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <filesystem>
#include <string_view>
#include <system_error>

#include "platform/AtomicFile.h"
#include "platform/Paths.h"

namespace vantrel::omnidex {
namespace {

constexpr mode_t kContainerMode = 0700;
constexpr const char* kTmpName = "tmp";

// mkdir with exactly mode (not masked), accepting an existing directory; a
// symbolic link or a file in the way is refused.
base::Result<void> makePrivateDirectory(const std::string& path) {
  if (::mkdir(path.c_str(), kContainerMode) == 0) {
    if (::chmod(path.c_str(), kContainerMode) != 0) {
      return platform::posixError(errno, "cannot set the mode of", path);
    }
    return base::Result<void>::success();
  }
  if (errno != EEXIST) return platform::posixError(errno, "cannot create directory", path);
  struct stat st;
  if (::lstat(path.c_str(), &st) != 0) return platform::posixError(errno, "cannot inspect", path);
  if (!S_ISDIR(st.st_mode)) return platform::posixError(ENOTDIR, "cannot create directory", path);
  return base::Result<void>::success();
}

}  // namespace

base::Result<void> Containers::open() const {
  return platform::ensureDirectory(root_, kContainerMode);
}

std::string Containers::pathFor(const base::Uuid& uuid) const {
  return root_ + "/" + uuid.string();
}

base::Result<std::string> Containers::ensure(const base::Uuid& uuid) const {
  std::string path = pathFor(uuid);
  VT_TRY(makePrivateDirectory(path));
  VT_TRY(makePrivateDirectory(path + "/" + kTmpName));
  return path;
}

std::unordered_set<base::Uuid> Containers::existing() const {
  std::unordered_set<base::Uuid> names;
  DIR* dir = ::opendir(root_.c_str());
  if (dir == nullptr) return names;
  while (const dirent* entry = ::readdir(dir)) {
    const std::string_view name = entry->d_name;
    if (name == "." || name == "..") continue;
    bool directory = entry->d_type == DT_DIR;
    if (entry->d_type == DT_UNKNOWN) {
      struct stat st;
      directory = ::fstatat(::dirfd(dir), entry->d_name, &st, AT_SYMLINK_NOFOLLOW) == 0 &&
                  S_ISDIR(st.st_mode);
    }
    // A container's name is its UUID's canonical text; anything else is no
    // container of ours.
    const std::optional<base::Uuid> uuid = base::Uuid::parse(name);
    if (directory && uuid && uuid->string() == name) names.insert(*uuid);
  }
  ::closedir(dir);
  return names;
}

base::Result<void> Containers::remove(const base::Uuid& uuid) const {
  const std::string path = pathFor(uuid);
  std::error_code ec;
  std::filesystem::remove_all(path, ec);
  if (ec) return platform::posixError(ec.value(), "cannot remove", path);
  return base::Result<void>::success();
}

}  // namespace vantrel::omnidex
