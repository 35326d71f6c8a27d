#include "platform/SmallFile.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstring>

#include "base/Format.h"

namespace vantrel::platform {
namespace {

class FileDescriptor {
 public:
  explicit FileDescriptor(int fd) : fd_(fd) {}
  ~FileDescriptor() {
    if (fd_ >= 0) ::close(fd_);
  }
  FileDescriptor(const FileDescriptor&) = delete;
  FileDescriptor& operator=(const FileDescriptor&) = delete;
  int get() const { return fd_; }

 private:
  int fd_;
};

}  // namespace

SmallFileRead readSmallFile(const std::string& path, size_t maxBytes) {
  SmallFileRead r;
  FileDescriptor fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK));
  if (fd.get() < 0) {
    r.error = errno;
    r.symbolicLink = (errno == ELOOP);
    return r;
  }
  if (::fstat(fd.get(), &r.st) != 0) {
    r.error = errno;
    return r;
  }
  if (!S_ISREG(r.st.st_mode)) {
    r.notRegular = true;
    return r;
  }
  if (static_cast<uint64_t>(r.st.st_size) > maxBytes) {
    r.tooLarge = true;
    return r;
  }
  // The file may grow while it is read: read one byte beyond the bound to
  // notice.
  r.bytes.resize(static_cast<size_t>(r.st.st_size) + 1);
  size_t used = 0;
  while (used < r.bytes.size()) {
    const ssize_t n = ::read(fd.get(), r.bytes.data() + used, r.bytes.size() - used);
    if (n < 0) {
      if (errno == EINTR) continue;
      r.error = errno;
      r.bytes.clear();
      return r;
    }
    if (n == 0) break;
    used += static_cast<size_t>(n);
    if (used == r.bytes.size() && used <= maxBytes)
      r.bytes.resize(std::min(used * 2, maxBytes + 1));
  }
  if (used > maxBytes) {
    r.tooLarge = true;
    r.bytes.clear();
    return r;
  }
  r.bytes.resize(used);
  return r;
}

std::optional<std::string> smallFileProblem(const SmallFileRead& r, size_t maxBytes) {
  if (r.symbolicLink) return std::string("it is a symbolic link");
  if (r.notRegular) return std::string("it is not a regular file");
  if (r.tooLarge) return base::format("it is larger than %u bytes", maxBytes);
  if (r.error != 0) return std::string(std::strerror(r.error));
  return std::nullopt;
}

}  // namespace vantrel::platform
