#pragma once
// An exclusive flock(2) held for as long as the object lives. Each instance
// opens its own descriptor, so two threads of one process exclude each other
// as two processes do.

#include <sys/types.h>

#include <string>

namespace vantrel::platform {

class FileLock {
 public:
  FileLock() = default;
  ~FileLock();  // closing the descriptor drops the lock
  FileLock(const FileLock&) = delete;
  FileLock& operator=(const FileLock&) = delete;

  // Locks the regular file at path, creating it with mode when missing (a
  // symbolic link is refused). 0, or the errno of the failed call.
  int lockFile(const std::string& path, mode_t mode);
  // Locks the directory at path. 0, or the errno of the failed call.
  int lockDirectory(const std::string& path);

 private:
  int lock(int fd);

  int fd_ = -1;
};

}  // namespace vantrel::platform
