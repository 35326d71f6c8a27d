#pragma once
// File-access tokens: a stand-in for a kernel sandbox's extensions.
//
// A process that may read a path issues a token naming it; another process
// that is handed the token consumes it to open the path read-only. Tokens are
// MAC'd with a per-installation secret kept in <stateDirectory()>/sandbox-secret,
// so a token cannot be forged or pointed at another path by anyone who cannot
// read that file. Consuming needs the same secret, so issuer and consumer must
// run as the user who owns it. Without a kernel sandbox a token adds no access
// the consumer did not already have: the open runs with the consumer's own
// credentials. docs/sandbox-tokens.md has the format and the threat model.
//
// All functions are safe to call from any thread.

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>

namespace vantrel::platform {

// A token is refused before any parsing when longer than this: a canonical
// path is at most PATH_MAX (4096) bytes, at most three token characters each
// once escaped, and the rest is fixed-size fields.
inline constexpr size_t kMaxSandboxTokenLength = 3 * 4096 + 128;
// The secret's file name inside stateDirectory(), and its length in bytes.
inline constexpr const char* kSandboxSecretFileName = "sandbox-secret";
inline constexpr size_t kSandboxSecretBytes = 32;

// Issues a read-only token for the canonical form of path (realpath). Returns
// nullopt and sets errno when the path is missing (ENOENT), not readable by
// this process (EACCES) or the secret cannot be made.
std::optional<std::string> sandbox_extension_issue_file(const std::string& path);

// The canonical form of path (realpath's answer, in one kernel resolution
// where /proc allows), or nullopt with errno when it does not resolve.
std::optional<std::string> canonicalPath(const std::string& path);

// As sandbox_extension_issue_file, for a path its caller already knows to be
// canonical (canonicalPath's answer kept from earlier): no resolution.
std::optional<std::string> sandbox_extension_issue_canonical_file(const std::string& canonical);

// While one lives, the tokens this thread issues share one reading of the
// secret and draw their nonces in bulk: a request that issues a token for
// each plug-in it reports pays for those once. Nests (the outermost one
// counts). A secret changed meanwhile applies from the next scope on.
class SandboxTokenBatch {
 public:
  SandboxTokenBatch();
  ~SandboxTokenBatch();
  SandboxTokenBatch(const SandboxTokenBatch&) = delete;
  SandboxTokenBatch& operator=(const SandboxTokenBatch&) = delete;

 private:
  bool outermost_;
};

// Verifies the token (format, HMAC) and opens the named path read-only
// (O_RDONLY|O_CLOEXEC; directories open too). Returns a handle > 0, or -1
// with errno (EINVAL for a malformed or forged token, the open's errno
// otherwise). The handle is a descriptor >= 3, never a standard stream.
int64_t sandbox_extension_consume(const std::string& token);

// Closes the handle's descriptor. 0 on success, -1 (EBADF) for a handle that
// is not open.
int sandbox_extension_release(int64_t handle);

// The open descriptor behind a consumed handle (for reading through it), or
// -1 when the handle is not open. The descriptor stays owned by the handle.
int sandbox_extension_descriptor(int64_t handle);

}  // namespace vantrel::platform
