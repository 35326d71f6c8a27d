#include "platform/FileLock.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <cerrno>

namespace vantrel::platform {

FileLock::~FileLock() {
  if (fd_ >= 0) ::close(fd_);
}

int FileLock::lockFile(const std::string& path, mode_t mode) {
  return lock(::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, mode));
}

int FileLock::lockDirectory(const std::string& path) {
  return lock(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
}

int FileLock::lock(int fd) {
  if (fd < 0) return errno;
  if (fd_ >= 0) ::close(fd_);
  fd_ = fd;
  while (::flock(fd_, LOCK_EX) != 0) {
    if (errno != EINTR) return errno;
  }
  return 0;
}

}  // namespace vantrel::platform
