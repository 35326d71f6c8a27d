#include "platform/NotificationCenter.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
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

}  // namespace

std::string notificationDirectory() {
  return runtimeDirectory() + "/notify";
}

base::Result<uint64_t> postNotification(std::string_view name) {
  if (!isValidName(name)) {
    return posixError(EINVAL, "invalid notification name", std::string(name));
  }
  const std::string dir = notificationDirectory();
  if (auto made = ensureDirectory(dir, kNotifyDirectoryMode); !made.has_value()) {
    return made.error();
  }
  const std::string lockPath = dir + "/" + kLockFileName;
  FileLock lock;
  if (int err = lock.lockFile(lockPath, kFileMode)) return posixError(err, "cannot lock", lockPath);

  const std::string path = dir + "/" + std::string(name);
  const uint64_t next = readCounter(path) + 1;
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
