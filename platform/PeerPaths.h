#pragma once
// Resolving a path a peer sent with the peer's own right to look, not the
// daemon's. The daemon may search every directory; a peer that could not
// must not learn, from how a request about a path is answered, whether
// something exists where it cannot look. So every directory the resolution
// passes through, symbolic links followed, must be searchable by the peer,
// and a path that needs one it may not search resolves exactly like a path
// that does not exist.
//
// Permissions are the classic mode bits (owner, group, others) checked
// against the peer's user, group and supplementary groups. POSIX access
// control lists are not consulted: a directory that only an ACL opens to
// the peer reads as closed to it.

#include <sys/types.h>

#include <optional>
#include <string>
#include <vector>

namespace vantrel::platform {

// Symbolic links one resolution follows, as the kernel's own limit.
inline constexpr int kMaxPathSymlinks = 40;

// Who looks: a peer's user, group and supplementary groups.
struct LookupCredentials {
  uid_t uid = static_cast<uid_t>(-1);
  gid_t gid = static_cast<gid_t>(-1);
  std::vector<gid_t> groups;
};

// The canonical form of an absolute path (".", ".." and symbolic links
// resolved, as realpath(3) makes it), or nullopt when it does not resolve,
// or when resolving it needs a directory who may not search: the caller
// cannot tell the two apart, which is the point. Root resolves everything
// that exists.
std::optional<std::string> canonicalPathFor(const std::string& path, const LookupCredentials& who);

}  // namespace vantrel::platform
