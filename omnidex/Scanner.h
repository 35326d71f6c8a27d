#pragma once
// Walking the watched trees. An application directory holds "*.app"
// bundles whose "PlugIns" directories hold plug-in bundles; a plug-in
// directory holds stand-alone plug-in bundles. The registry rescans one
// top-level item (an application, or a stand-alone plug-in bundle) at a time
// when the watcher reports a change below it.
//
// Symbolic links are never followed: an entry that is a link is skipped, so
// a link cannot pull a tree from elsewhere (or a loop) into the registry.
// At most kMaxDirectoryEntries entries of a directory are read.

#include <string>
#include <string_view>
#include <vector>

namespace vantrel::omnidex {

enum class RootKind { kApplications, kPlugIns };

struct ScanRoot {
  std::string path;  // normal (normalizeBundlePath)
  RootKind kind;
};

// Whether a directory that is itself a symbolic link is listed. Only the
// configured roots are followed: an administrator may well make
// "/Applications" a link.
enum class DirectoryLink { kFollow, kRefuse };

// The subdirectories of dir (not links to directories), as full paths in
// name order. Nothing when dir is missing, not a directory, or (kRefuse) a
// symbolic link.
std::vector<std::string> listSubdirectories(const std::string& dir, DirectoryLink link);

// Whether path is a directory itself (lstat).
bool isRealDirectory(const std::string& path);

// The names under root that can be items: every name under a plug-in
// directory, names ending in ".app" under an application directory.
bool isItemName(RootKind kind, std::string_view name);

// The items of root, as full paths in name order.
std::vector<std::string> itemsOf(const ScanRoot& root);

// The bundles of one item that may be plug-ins: the subdirectories of an
// application's PlugIns directory, or the stand-alone bundle itself.
std::vector<std::string> bundlesOfItem(RootKind kind, const std::string& item);

}  // namespace vantrel::omnidex
