#include "omnidex/Scanner.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>

#include "base/Log.h"
#include "omnidex/BundlePaths.h"
#include "omnidex/Limits.h"

namespace vantrel::omnidex {
namespace {

constexpr std::string_view kApplicationExtension = ".app";
constexpr const char* kPlugInsDirectoryName = "PlugIns";

class DirectoryStream {
 public:
  DirectoryStream(const std::string& path, DirectoryLink link) {
    const int flags = O_RDONLY | O_DIRECTORY | O_CLOEXEC | O_NONBLOCK |
                      (link == DirectoryLink::kRefuse ? O_NOFOLLOW : 0);
    const int fd = ::open(path.c_str(), flags);
    if (fd < 0) return;
    dir_ = ::fdopendir(fd);
    if (dir_ == nullptr) ::close(fd);
  }
  ~DirectoryStream() {
    if (dir_ != nullptr) ::closedir(dir_);
  }
  DirectoryStream(const DirectoryStream&) = delete;
  DirectoryStream& operator=(const DirectoryStream&) = delete;
  DIR* get() const { return dir_; }

 private:
  DIR* dir_ = nullptr;
};

}  // namespace

bool isRealDirectory(const std::string& path) {
  struct stat st;
  return ::lstat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

std::vector<std::string> listSubdirectories(const std::string& dir, DirectoryLink link) {
  std::vector<std::string> paths;
  DirectoryStream stream(dir, link);
  if (stream.get() == nullptr) return paths;
  size_t read = 0;
  while (const dirent* entry = ::readdir(stream.get())) {
    if (std::strcmp(entry->d_name, ".") == 0 || std::strcmp(entry->d_name, "..") == 0) continue;
    if (++read > kMaxDirectoryEntries) {
      base::vtlog("not reading more than %u entries of %@", kMaxDirectoryEntries, dir);
      break;
    }
    std::string path = childPath(dir, entry->d_name);
    if (path.size() > kMaxPathLength) continue;
    const bool directory =
        entry->d_type == DT_DIR || (entry->d_type == DT_UNKNOWN && isRealDirectory(path));
    if (directory) paths.push_back(std::move(path));
  }
  std::sort(paths.begin(), paths.end());
  return paths;
}

bool isItemName(RootKind kind, std::string_view name) {
  if (kind == RootKind::kPlugIns) return !name.empty();
  return name.size() > kApplicationExtension.size() && name.ends_with(kApplicationExtension);
}

std::vector<std::string> itemsOf(const ScanRoot& root) {
  std::vector<std::string> items = listSubdirectories(root.path, DirectoryLink::kFollow);
  std::erase_if(items, [&](const std::string& path) {
    return !isItemName(root.kind, std::string_view(path).substr(path.rfind('/') + 1));
  });
  return items;
}

std::vector<std::string> bundlesOfItem(RootKind kind, const std::string& item) {
  if (!isRealDirectory(item)) return {};
  if (kind == RootKind::kPlugIns) return {item};
  return listSubdirectories(childPath(item, kPlugInsDirectoryName), DirectoryLink::kRefuse);
}

}  // namespace vantrel::omnidex
