#include "platform/AtomicFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace vantrel::platform {
namespace {

std::string directoryOf(const std::string& path) {
  const size_t slash = path.rfind('/');
  if (slash == std::string::npos) return ".";
  if (slash == 0) return "/";
  return path.substr(0, slash);
}

std::string baseNameOf(const std::string& path) {
  const size_t slash = path.rfind('/');
  return slash == std::string::npos ? path : path.substr(slash + 1);
}

// Writes all of bytes, resuming after short writes and interruptions.
// Returns 0 or the errno of the failed write.
int writeAll(int fd, std::string_view bytes) {
  while (!bytes.empty()) {
    const ssize_t n = ::write(fd, bytes.data(), bytes.size());
    if (n < 0) {
      if (errno == EINTR) continue;
      return errno;
    }
    bytes.remove_prefix(static_cast<size_t>(n));
  }
  return 0;
}

// Makes a rename inside dir durable. Some file systems cannot sync a
// directory and say so with EINVAL; there is nothing more to do on those.
int syncDirectory(const std::string& dir) {
  const int fd = ::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (fd < 0) return errno;
  int err = ::fsync(fd) == 0 ? 0 : errno;
  ::close(fd);
  return err == EINVAL ? 0 : err;
}

// The temporary file until it has been renamed into place: removed when the
// write is abandoned.
class TemporaryFile {
 public:
  explicit TemporaryFile(std::string name) : name_(std::move(name)) {}
  ~TemporaryFile() {
    if (fd_ >= 0) ::close(fd_);
    if (!committed_) ::unlink(name_.c_str());
  }
  TemporaryFile(const TemporaryFile&) = delete;
  TemporaryFile& operator=(const TemporaryFile&) = delete;

  // mkstemp over the name's XXXXXX suffix; 0 or errno.
  int create() {
    fd_ = ::mkostemp(name_.data(), O_CLOEXEC);
    if (fd_ < 0) committed_ = true;  // nothing was created, nothing to remove
    return fd_ < 0 ? errno : 0;
  }
  int fd() const { return fd_; }
  const std::string& name() const { return name_; }
  // Closes the descriptor, reporting a deferred write error; 0 or errno.
  int close() {
    const int result = ::close(fd_);
    fd_ = -1;
    return result == 0 ? 0 : errno;
  }
  void commit() { committed_ = true; }

 private:
  std::string name_;
  int fd_ = -1;
  bool committed_ = false;
};

}  // namespace

base::Error posixError(int err, std::string_view what, const std::string& path) {
  char buffer[256];
  const char* text = ::strerror_r(err, buffer, sizeof buffer);
  return base::Error{kPosixErrorDomain, err, base::format("%s %s: %s", what, path, text)};
}

base::Result<void> writeFileAtomically(const std::string& path, std::string_view bytes,
                                       mode_t mode) {
  if (path.empty() || path.back() == '/') return posixError(EINVAL, "cannot write", path);
  const std::string dir = directoryOf(path);
  TemporaryFile temp(dir + "/." + baseNameOf(path) + ".XXXXXX");
  if (int err = temp.create()) return posixError(err, "cannot create a temporary file for", path);
  if (int err = writeAll(temp.fd(), bytes)) return posixError(err, "cannot write", path);
  if (::fchmod(temp.fd(), mode) != 0) return posixError(errno, "cannot set the mode of", path);
  if (::fsync(temp.fd()) != 0) return posixError(errno, "cannot sync", path);
  if (int err = temp.close()) return posixError(err, "cannot write", path);
  if (::rename(temp.name().c_str(), path.c_str()) != 0)
    return posixError(errno, "cannot replace", path);
  temp.commit();
  // The new contents are in place; a failure here only means they may not
  // survive a crash of the machine.
  if (int err = syncDirectory(dir)) return posixError(err, "cannot sync the directory of", path);
  return base::Result<void>::success();
}

}  // namespace vantrel::platform
