#include "platform/NotificationCenter.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <mutex>
#include <set>
#include <string>

#include "platform/AtomicFile.h"
#include "platform/FileLock.h"
#include "platform/Paths.h"

namespace vantrel::platform {
namespace {

constexpr mode_t kNotifyDirectoryMode = 0755;
constexpr mode_t kFileMode = 0644;
constexpr const char* kLockFileName = ".lock";
// "18446744073709551615\n" and some slack; a longer file is not ours.
constexpr size_t kMaxCounterFileSize = 32;

bool isValidName(std::string_view name) {
  return isSinglePathComponent(name, kMaxNotificationNameLength);
}

// The counter stored in path: 0 when missing, unreadable or not a number.
uint64_t readCounter(const std::string& path) {
  const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
  if (fd < 0) return 0;
  char buffer[kMaxCounterFileSize];
  ssize_t n;
  do {
    n = ::read(fd, buffer, sizeof buffer);
  } while (n < 0 && errno == EINTR);
  ::close(fd);
  if (n <= 0) return 0;
  uint64_t value = 0;
  const char* end = buffer + n;
  const auto [ptr, ec] = std::from_chars(buffer, end, value);
  if (ec != std::errc() || ptr == buffer) return 0;
  if (ptr != end && *ptr != '\n') return 0;
  return value;
}

// Creates the lock file with exactly kFileMode when it is missing: FileLock
// would create it with the mode less the umask.
int createLockFile(const std::string& path) {
  const int fd =
      ::open(path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, kFileMode);
  if (fd < 0) return errno == EEXIST ? 0 : errno;
  const int err = ::fchmod(fd, kFileMode) == 0 ? 0 : errno;
  ::close(fd);
  return err;
}

// The notification center starts in a directory with this process's first
// post there: the counters' temporaries that interrupted posts left behind
// are removed then. Called under the directory's lock, so no other process is
// posting; the atomic writer spares this process's own writes in progress.
void startIn(const std::string& dir) {
  static std::mutex mutex;
  static std::set<std::string>* started = new std::set<std::string>;
  std::lock_guard lock(mutex);
  if (!started->insert(dir).second) return;
  // Best effort: what cannot be removed now is tried again at the next start.
  (void)removeStaleTemporaryFiles(dir);
}

}  // namespace

std::string notificationDirectory() {
  return runtimeDirectory() + "/notify";
}

base::Result<uint64_t> postNotification(std::string_view name, uint64_t times) {
  if (!isValidName(name)) {
    return posixError(EINVAL, "invalid notification name", std::string(name));
  }
  const std::string dir = notificationDirectory();
  if (auto made = ensureDirectory(dir, kNotifyDirectoryMode); !made.has_value()) {
    return made.error();
  }
  const std::string lockPath = dir + "/" + kLockFileName;
  if (int err = createLockFile(lockPath)) return posixError(err, "cannot create", lockPath);
  FileLock lock;
  if (int err = lock.lockFile(lockPath, kFileMode)) return posixError(err, "cannot lock", lockPath);
  startIn(dir);

  const std::string path = dir + "/" + std::string(name);
  const uint64_t next = readCounter(path) + times;
  const std::string text = std::to_string(next) + "\n";
  if (auto written = writeFileAtomically(path, text, kFileMode); !written.has_value()) {
    // A failed sync of the directory leaves the new value in place; every
    // other failure leaves the old one. Either way the caller hears of it.
    return written.error();
  }
  return next;
}

uint64_t notificationCount(std::string_view name) {
  if (!isValidName(name)) return 0;
  return readCounter(notificationDirectory() + "/" + std::string(name));
}

}  // namespace vantrel::platform
