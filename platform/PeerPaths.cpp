#include "platform/PeerPaths.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <deque>
#include <string_view>

namespace vantrel::platform {
namespace {

bool maySearch(const std::string& directory, const LookupCredentials& who) {
  struct stat st {};
  if (::stat(directory.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) return false;
  if (who.uid == 0) return true;
  if (st.st_uid == who.uid) return (st.st_mode & S_IXUSR) != 0;
  const bool member = st.st_gid == who.gid || std::find(who.groups.begin(), who.groups.end(),
                                                        st.st_gid) != who.groups.end();
  if (member) return (st.st_mode & S_IXGRP) != 0;
  return (st.st_mode & S_IXOTH) != 0;
}

// The components of path, in order, empty ones and "." left out.
void pushComponents(std::string_view path, std::deque<std::string>& out, bool front) {
  std::vector<std::string> parts;
  size_t start = 0;
  while (start <= path.size()) {
    const size_t slash = std::min(path.find('/', start), path.size());
    std::string_view part = path.substr(start, slash - start);
    if (!part.empty() && part != ".") parts.emplace_back(part);
    start = slash + 1;
  }
  if (front) {
    out.insert(out.begin(), parts.begin(), parts.end());
  } else {
    out.insert(out.end(), parts.begin(), parts.end());
  }
}

std::string parentOf(const std::string& path) {
  const size_t slash = path.rfind('/');
  return slash == 0 || slash == std::string::npos ? "/" : path.substr(0, slash);
}

}  // namespace

std::optional<std::string> canonicalPathFor(const std::string& path, const LookupCredentials& who) {
  if (path.empty() || path.front() != '/' || path.find('\0') != std::string::npos) {
    return std::nullopt;
  }
  std::deque<std::string> pending;
  pushComponents(path, pending, false);
  std::string resolved = "/";
  int links = 0;
  while (!pending.empty()) {
    const std::string component = std::move(pending.front());
    pending.pop_front();
    // Looking anything up in a directory, ".." included, takes the right to
    // search it.
    if (!maySearch(resolved, who)) return std::nullopt;
    if (component == "..") {
      resolved = parentOf(resolved);
      continue;
    }
    std::string next = resolved;
    if (next.back() != '/') next += '/';
    next += component;
    struct stat st {};
    if (::lstat(next.c_str(), &st) != 0) return std::nullopt;
    if (S_ISLNK(st.st_mode)) {
      if (++links > kMaxPathSymlinks) return std::nullopt;
      std::string target(static_cast<size_t>(st.st_size > 0 ? st.st_size : 4096), '\0');
      const ssize_t n = ::readlink(next.c_str(), target.data(), target.size());
      if (n <= 0 || static_cast<size_t>(n) > target.size()) return std::nullopt;
      target.resize(static_cast<size_t>(n));
      if (target.front() == '/') resolved.assign(1, '/');
      pushComponents(target, pending, true);
      continue;
    }
    if (!pending.empty() && !S_ISDIR(st.st_mode)) return std::nullopt;
    resolved = next;
  }
  return resolved;
}

}  // namespace vantrel::platform
