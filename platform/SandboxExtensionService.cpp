#include "platform/SandboxExtensionService.h"

#include <fcntl.h>
#include <openssl/crypto.h>
#include <openssl/rand.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <set>
#include <string_view>

#include "platform/AtomicFile.h"
#include "platform/Digest.h"
#include "platform/FileStamp.h"
#include "platform/Paths.h"

namespace vantrel::platform {
namespace {

// Token: "1;<nonce hex>;<mac hex>;<escaped path>". Version 1 tokens grant
// read-only access. The MAC covers the domain tag, the raw nonce and the
// unescaped path, so any change to any field is caught.
constexpr std::string_view kTokenVersion = "1";
constexpr std::string_view kMacDomain = "vantrel sandbox extension, read-only, version 1";
constexpr size_t kNonceBytes = 16;
constexpr int kFirstHandle = 3;  // above the standard streams

// --- random bytes and hex ---

// Fills size bytes from the kernel's generator; 0 or errno. For the secret.
int randomBytes(uint8_t* out, size_t size) {
  while (size > 0) {
    const ssize_t n = ::getrandom(out, size, 0);
    if (n < 0) {
      if (errno == EINTR) continue;
      return errno;
    }
    out += n;
    size -= static_cast<size_t>(n);
  }
  return 0;
}

// A nonce from OpenSSL's generator (a DRBG the kernel seeds, reseeded after
// fork): a match issues a token per plug-in, and a system call each adds up.
int nonceBytes(uint8_t* out, size_t size) {
  return RAND_bytes(out, static_cast<int>(size)) == 1 ? 0 : EIO;
}

int hexValue(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

// Decodes exactly out.size() bytes of lower-case-or-upper-case hex.
bool decodeHex(std::string_view hex, uint8_t* out, size_t size) {
  if (hex.size() != 2 * size) return false;
  for (size_t i = 0; i < size; ++i) {
    const int hi = hexValue(hex[2 * i]), lo = hexValue(hex[2 * i + 1]);
    if (hi < 0 || lo < 0) return false;
    out[i] = static_cast<uint8_t>(hi << 4 | lo);
  }
  return true;
}

// --- path escaping: keeps tokens printable ASCII for any path byte ---

std::string escapePath(const std::string& path) {
  static const char kDigits[] = "0123456789ABCDEF";
  std::string out;
  out.reserve(path.size());
  for (unsigned char c : path) {
    if (c > ' ' && c < 0x7f && c != '%') {
      out.push_back(static_cast<char>(c));
    } else {
      out += {'%', kDigits[c >> 4], kDigits[c & 0xf]};
    }
  }
  return out;
}

std::optional<std::string> unescapePath(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  for (size_t i = 0; i < text.size(); ++i) {
    const unsigned char c = static_cast<unsigned char>(text[i]);
    if (c != '%') {
      if (c <= ' ' || c >= 0x7f) return std::nullopt;
      out.push_back(static_cast<char>(c));
      continue;
    }
    uint8_t byte;
    if (i + 2 >= text.size()) return std::nullopt;
    if (!decodeHex(text.substr(i + 1, 2), &byte, 1) || byte == 0) return std::nullopt;
    out.push_back(static_cast<char>(byte));
    i += 2;
  }
  return out;
}

// --- the per-installation secret ---

std::string secretPath() {
  return stateDirectory() + "/" + kSandboxSecretFileName;
}

// The last secret read, kept while its file is unchanged: one stat instead
// of an open and a read per token. Deleting, replacing or loosening the file
// still takes effect at the next issue or consume.
class SecretCache {
 public:
  bool find(const std::string& path, const FileStamp& stamp, std::string* secret) {
    std::lock_guard lock(mutex_);
    if (path != path_ || stamp != stamp_) return false;
    *secret = secret_;
    return true;
  }
  void remember(const std::string& path, const FileStamp& stamp, const std::string& secret) {
    std::lock_guard lock(mutex_);
    path_ = path;
    stamp_ = stamp;
    secret_ = secret;
  }

 private:
  std::mutex mutex_;
  std::string path_;    // guarded by mutex_
  FileStamp stamp_;     // guarded by mutex_
  std::string secret_;  // guarded by mutex_
};

SecretCache& secretCache() {
  static SecretCache* cache = new SecretCache;  // never destroyed: used until exit
  return *cache;
}

// A secret that others could read (or that someone else owns) is refused:
// it would let them forge. 0 or EACCES.
int checkSecretFile(const struct stat& st) {
  return S_ISREG(st.st_mode) && st.st_uid == ::geteuid() && (st.st_mode & 077) == 0 ? 0 : EACCES;
}

// Reads the secret; 0 and the bytes, or errno.
int readSecret(const std::string& path, std::string* secret) {
  struct stat st;
  if (::fstatat(AT_FDCWD, path.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  if (int err = checkSecretFile(st)) return err;
  if (secretCache().find(path, FileStamp::of(st), secret)) return 0;
  const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
  if (fd < 0) return errno;
  int err = 0;
  char buffer[kSandboxSecretBytes + 1];
  if (::fstat(fd, &st) != 0) {
    err = errno;
  } else if ((err = checkSecretFile(st)) == 0) {
    const ssize_t n = ::read(fd, buffer, sizeof buffer);
    if (n < 0) {
      err = errno;
    } else if (static_cast<size_t>(n) != kSandboxSecretBytes) {
      err = EINVAL;  // damaged: better to refuse than to run with a short key
    } else {
      secret->assign(buffer, kSandboxSecretBytes);
      secretCache().remember(path, FileStamp::of(st), *secret);
    }
  }
  ::close(fd);
  return err;
}

// Makes a fresh secret and publishes it whole, for exactly one of several
// racing processes, so the losers can read the winner's secret straight
// away. 0, EEXIST (lost the race) or errno.
int createSecret(const std::string& path) {
  uint8_t bytes[kSandboxSecretBytes];
  if (int err = randomBytes(bytes, sizeof bytes)) return err;
  // What a creation killed half-way left beside the secret.
  (void)removeStaleTemporaryFiles(stateDirectory(), kSandboxSecretFileName);
  const base::Result<void> created = createFileAtomically(
      path, std::string_view(reinterpret_cast<const char*>(bytes), sizeof bytes), 0600);
  return created.has_value() ? 0 : static_cast<int>(created.error().code);
}

// The secret, made on first use; 0 or errno.
int loadSecret(std::string* secret) {
  const std::string path = secretPath();
  int err = readSecret(path, secret);
  if (err != ENOENT) return err;
  auto made = ensureDirectory(stateDirectory(), 0700);
  if (!made.has_value()) return static_cast<int>(made.error().code);
  err = createSecret(path);
  if (err != 0 && err != EEXIST) return err;
  return readSecret(path, secret);
}

// What a SandboxTokenBatch keeps for its thread: the secret as read at its
// first token, and nonces drawn kBatchNonces at a time.
constexpr size_t kBatchNonces = 64;
struct BatchState {
  bool active = false;
  bool secretRead = false;
  int secretError = 0;
  std::string secret;
  uint8_t nonces[kBatchNonces * kNonceBytes] = {};
  size_t noncesLeft = 0;
  bool noncesDrawn = false;  // nonces has held random bytes in this batch
};
thread_local BatchState tlsBatch;

int batchedSecret(std::string* secret) {
  if (!tlsBatch.active) return loadSecret(secret);
  if (!tlsBatch.secretRead) {
    tlsBatch.secretError = loadSecret(&tlsBatch.secret);
    tlsBatch.secretRead = true;
  }
  if (tlsBatch.secretError == 0) *secret = tlsBatch.secret;
  return tlsBatch.secretError;
}

int batchedNonce(uint8_t* nonce) {
  if (!tlsBatch.active) return nonceBytes(nonce, kNonceBytes);
  if (tlsBatch.noncesLeft == 0) {
    tlsBatch.noncesDrawn = true;
    if (int err = nonceBytes(tlsBatch.nonces, sizeof tlsBatch.nonces)) return err;
    tlsBatch.noncesLeft = kBatchNonces;
  }
  --tlsBatch.noncesLeft;
  uint8_t* next = tlsBatch.nonces + tlsBatch.noncesLeft * kNonceBytes;
  std::memcpy(nonce, next, kNonceBytes);
  OPENSSL_cleanse(next, kNonceBytes);  // each nonce is handed out once
  return 0;
}

std::string macFor(const std::string& secret, const uint8_t* nonce, const std::string& path) {
  std::string message(kMacDomain);
  message.push_back('\0');
  message.append(reinterpret_cast<const char*>(nonce), kNonceBytes);
  message += path;
  const HmacSha256 mac = hmacSha256(secret, message);
  return std::string(reinterpret_cast<const char*>(mac.data()), mac.size());
}

// --- canonical paths ---

// realpath(3) without its system call per component: the kernel resolves the
// path once (an O_PATH open) and names what it found. A link name that is
// not absolute (/proc missing, a deleted or detached file) falls back to
// realpath. nullopt with errno when the path does not resolve.
std::optional<std::string> resolveCanonical(const std::string& path) {
  const int fd = ::open(path.c_str(), O_PATH | O_CLOEXEC);
  if (fd < 0) return std::nullopt;
  char link[PATH_MAX];
  const std::string self = "/proc/self/fd/" + std::to_string(fd);
  const ssize_t n = ::readlink(self.c_str(), link, sizeof link);
  ::close(fd);
  if (n > 0 && static_cast<size_t>(n) < sizeof link && link[0] == '/' &&
      !std::string_view(link, static_cast<size_t>(n)).ends_with(" (deleted)")) {
    return std::string(link, static_cast<size_t>(n));
  }
  char* resolved = ::realpath(path.c_str(), nullptr);
  if (resolved == nullptr) return std::nullopt;  // errno from realpath
  std::string canonical(resolved);
  std::free(resolved);
  return canonical;
}

// --- token parsing ---

struct ParsedToken {
  uint8_t nonce[kNonceBytes];
  uint8_t mac[sizeof(HmacSha256)];
  std::string path;
};

std::optional<ParsedToken> parseToken(std::string_view token) {
  if (token.size() > kMaxSandboxTokenLength) return std::nullopt;
  ParsedToken parsed;
  std::string_view fields[3];
  for (std::string_view& field : fields) {
    const size_t semicolon = token.find(';');
    if (semicolon == std::string_view::npos) return std::nullopt;
    field = token.substr(0, semicolon);
    token.remove_prefix(semicolon + 1);
  }
  if (fields[0] != kTokenVersion || !decodeHex(fields[1], parsed.nonce, kNonceBytes) ||
      !decodeHex(fields[2], parsed.mac, sizeof parsed.mac)) {
    return std::nullopt;
  }
  auto path = unescapePath(token);
  if (!path || path->empty() || path->front() != '/') return std::nullopt;
  parsed.path = std::move(*path);
  return parsed;
}

// --- handles ---

// The descriptors this module opened and has not yet released. Only these
// may be released, so a stray number can never close someone else's file.
class HandleTable {
 public:
  void add(int fd) {
    std::lock_guard lock(mutex_);
    open_.insert(fd);
  }
  bool contains(int64_t handle) {
    std::lock_guard lock(mutex_);
    return open_.count(handle) != 0;
  }
  bool remove(int64_t handle) {
    std::lock_guard lock(mutex_);
    return open_.erase(handle) != 0;
  }

 private:
  std::mutex mutex_;
  std::set<int64_t> open_;  // guarded by mutex_
};

HandleTable& handles() {
  static HandleTable* table = new HandleTable;  // never destroyed: used until exit
  return *table;
}

// Opens path read-only as a descriptor >= kFirstHandle; the descriptor or -1
// with errno. O_NONBLOCK keeps a FIFO from stalling the open; it is cleared
// afterwards so reads through the handle behave as usual.
int openReadOnly(const std::string& path) {
  int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK);
  if (fd < 0) return -1;
  if (fd < kFirstHandle) {
    const int high = ::fcntl(fd, F_DUPFD_CLOEXEC, kFirstHandle);
    const int err = errno;
    ::close(fd);
    errno = err;
    if (high < 0) return -1;
    fd = high;
  }
  const int flags = ::fcntl(fd, F_GETFL);
  if (flags >= 0) ::fcntl(fd, F_SETFL, flags & ~O_NONBLOCK);
  return fd;
}

}  // namespace

std::optional<std::string> canonicalPath(const std::string& path) {
  return resolveCanonical(path);
}

std::optional<std::string> sandbox_extension_issue_file(const std::string& path) {
  std::optional<std::string> resolved = resolveCanonical(path);
  if (!resolved) return std::nullopt;
  return sandbox_extension_issue_canonical_file(*resolved);
}

SandboxTokenBatch::SandboxTokenBatch() : outermost_(!tlsBatch.active) {
  if (outermost_) tlsBatch.active = true;
}

SandboxTokenBatch::~SandboxTokenBatch() {
  if (!outermost_) return;
  // Most requests issue no token: only what this batch read is wiped.
  if (tlsBatch.secretRead) OPENSSL_cleanse(tlsBatch.secret.data(), tlsBatch.secret.size());
  if (tlsBatch.noncesDrawn) OPENSSL_cleanse(tlsBatch.nonces, sizeof tlsBatch.nonces);
  tlsBatch.active = false;
  tlsBatch.secretRead = false;
  tlsBatch.secretError = 0;
  tlsBatch.secret.clear();
  tlsBatch.noncesLeft = 0;
  tlsBatch.noncesDrawn = false;
}

std::optional<std::string> sandbox_extension_issue_canonical_file(const std::string& canonical) {
  if (::faccessat(AT_FDCWD, canonical.c_str(), R_OK, AT_EACCESS) != 0) return std::nullopt;

  std::string secret;
  if (int err = batchedSecret(&secret)) {
    errno = err;
    return std::nullopt;
  }
  uint8_t nonce[kNonceBytes];
  if (int err = batchedNonce(nonce)) {
    errno = err;
    return std::nullopt;
  }
  const std::string mac = macFor(secret, nonce, canonical);
  std::string token(kTokenVersion);
  token += ';' + hexString(nonce, sizeof nonce) + ';';
  token += hexString(reinterpret_cast<const uint8_t*>(mac.data()), mac.size());
  token += ';' + escapePath(canonical);
  return token;
}

int64_t sandbox_extension_consume(const std::string& token) {
  auto parsed = parseToken(token);
  if (!parsed) {
    errno = EINVAL;
    return -1;
  }
  std::string secret;
  if (int err = loadSecret(&secret)) {
    errno = err;
    return -1;
  }
  const std::string expected = macFor(secret, parsed->nonce, parsed->path);
  if (CRYPTO_memcmp(expected.data(), parsed->mac, sizeof parsed->mac) != 0) {
    errno = EINVAL;
    return -1;
  }
  const int fd = openReadOnly(parsed->path);
  if (fd < 0) return -1;
  handles().add(fd);
  return fd;
}

int sandbox_extension_release(int64_t handle) {
  if (!handles().remove(handle)) {
    errno = EBADF;
    return -1;
  }
  ::close(static_cast<int>(handle));
  return 0;
}

int sandbox_extension_descriptor(int64_t handle) {
  return handles().contains(handle) ? static_cast<int>(handle) : -1;
}

}  // namespace vantrel::platform
