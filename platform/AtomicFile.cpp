#include "platform/AtomicFile.h"

#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <functional>
#include <memory>
#include <mutex>
#include <set>
#include <utility>

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

// Bytes of a file name (NAME_MAX on Linux).
constexpr size_t kMaxFileNameLength = 255;
// Names tried before a write gives up; a clash needs a stale temporary of
// a dead process that had this pid and reached the same sequence number.
constexpr int kMaxNameAttempts = 64;

// The temporaries this process is writing, by file name (the sequence number
// makes each unique in the process, whatever the directory is called). A
// name is entered before its file is created and leaves after the file is
// renamed or removed, so removeStaleTemporaryFiles never takes a file a write
// still needs.
struct LiveTemporaries {
  std::mutex mutex;
  std::set<std::string, std::less<>> names;
};

LiveTemporaries& liveTemporaries() {
  static LiveTemporaries* live = new LiveTemporaries;  // outlives static destructors
  return *live;
}

std::string temporaryName(std::string_view fileName, pid_t pid, uint64_t sequence) {
  const std::string suffix =
      std::string(kTemporaryFileMarker) + std::to_string(pid) + "-" + std::to_string(sequence);
  const size_t room = kMaxFileNameLength - 1 - suffix.size();
  std::string name;
  name.reserve(1 + std::min(room, fileName.size()) + suffix.size());
  name += '.';
  name.append(fileName.substr(0, room));
  name += suffix;
  return name;
}

// Parses ".<stem>" kTemporaryFileMarker "<pid>-<sequence>": the stem and pid.
std::optional<std::pair<std::string_view, pid_t>> parseTemporaryName(std::string_view name) {
  const size_t marker = name.rfind(kTemporaryFileMarker);
  if (name.size() > kMaxFileNameLength || name.empty() || name.front() != '.' ||
      marker == std::string_view::npos || marker < 2) {
    return std::nullopt;
  }
  const std::string_view tail = name.substr(marker + kTemporaryFileMarker.size());
  const size_t dash = tail.find('-');
  if (dash == std::string_view::npos) return std::nullopt;
  const auto isNumber = [](std::string_view digits) {
    return !digits.empty() && digits.size() <= 20 &&
           digits.find_first_not_of("0123456789") == std::string_view::npos;
  };
  if (!isNumber(tail.substr(0, dash)) || !isNumber(tail.substr(dash + 1))) return std::nullopt;
  pid_t pid = 0;
  const auto [end, ec] = std::from_chars(tail.data(), tail.data() + dash, pid);
  if (ec != std::errc() || pid <= 0) return std::nullopt;
  return std::pair{name.substr(1, marker - 1), pid};
}

// Whether a temporary with this stem belongs to fileName: the same name, or
// a name that had to be cut short and begins with the stem.
bool belongsTo(std::string_view temporary, std::string_view stem, std::string_view fileName) {
  if (stem == fileName) return true;
  return temporary.size() == kMaxFileNameLength && fileName.starts_with(stem);
}

// The temporary file until it has been renamed into place: removed when the
// write is abandoned.
class TemporaryFile {
 public:
  TemporaryFile(std::string directory, std::string fileName)
      : directory_(std::move(directory)), fileName_(std::move(fileName)) {}
  ~TemporaryFile() {
    if (fd_ >= 0) ::close(fd_);
    if (!name_.empty()) {
      if (!committed_) ::unlink(name_.c_str());
      LiveTemporaries& live = liveTemporaries();
      std::lock_guard lock(live.mutex);
      live.names.erase(liveName_);
    }
  }
  TemporaryFile(const TemporaryFile&) = delete;
  TemporaryFile& operator=(const TemporaryFile&) = delete;

  // Creates the file under a fresh name (mode 0600 until fchmod); 0 or errno.
  int create() {
    static std::atomic<uint64_t> sequence{0};
    LiveTemporaries& live = liveTemporaries();
    for (int attempt = 0; attempt < kMaxNameAttempts; ++attempt) {
      std::string temporary = temporaryName(fileName_, ::getpid(), sequence.fetch_add(1));
      std::string name = directory_ + "/" + temporary;
      {
        std::lock_guard lock(live.mutex);
        live.names.insert(temporary);
      }
      fd_ = ::open(name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600);
      if (fd_ >= 0) {
        name_ = std::move(name);
        liveName_ = std::move(temporary);
        return 0;
      }
      const int err = errno;
      {
        std::lock_guard lock(live.mutex);
        live.names.erase(temporary);
      }
      if (err != EEXIST) return err;
    }
    return EEXIST;
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
  std::string directory_;
  std::string fileName_;
  std::string name_;      // the path; empty until created
  std::string liveName_;  // its file name, as entered in liveTemporaries()
  int fd_ = -1;
  bool committed_ = false;
};

}  // namespace

base::Error posixError(int err, std::string_view what, const std::string& path) {
  char buffer[256];
  const char* text = ::strerror_r(err, buffer, sizeof buffer);
  return base::Error{kPosixErrorDomain, err, base::format("%s %s: %s", what, path, text)};
}

namespace {

// Creates temp and fills it with bytes, synced, with mode; errors name path.
base::Result<void> writeTemporary(TemporaryFile& temp, const std::string& path,
                                  std::string_view bytes, mode_t mode) {
  if (int err = temp.create()) return posixError(err, "cannot create a temporary file for", path);
  if (int err = writeAll(temp.fd(), bytes)) return posixError(err, "cannot write", path);
  if (::fchmod(temp.fd(), mode) != 0) return posixError(errno, "cannot set the mode of", path);
  if (::fsync(temp.fd()) != 0) return posixError(errno, "cannot sync", path);
  if (int err = temp.close()) return posixError(err, "cannot write", path);
  return base::Result<void>::success();
}

}  // namespace

base::Result<void> writeFileAtomically(const std::string& path, std::string_view bytes,
                                       mode_t mode) {
  if (path.empty() || path.back() == '/') return posixError(EINVAL, "cannot write", path);
  const std::string dir = directoryOf(path);
  TemporaryFile temp(dir, baseNameOf(path));
  VT_TRY(writeTemporary(temp, path, bytes, mode));
  if (::rename(temp.name().c_str(), path.c_str()) != 0)
    return posixError(errno, "cannot replace", path);
  temp.commit();
  // The new contents are in place; a failure here only means they may not
  // survive a crash of the machine.
  if (int err = syncDirectory(dir)) return posixError(err, "cannot sync the directory of", path);
  return base::Result<void>::success();
}

base::Result<void> createFileAtomically(const std::string& path, std::string_view bytes,
                                        mode_t mode) {
  if (path.empty() || path.back() == '/') return posixError(EINVAL, "cannot create", path);
  const std::string dir = directoryOf(path);
  TemporaryFile temp(dir, baseNameOf(path));  // removed when it goes, linked or not
  VT_TRY(writeTemporary(temp, path, bytes, mode));
  if (::link(temp.name().c_str(), path.c_str()) != 0)
    return posixError(errno, "cannot create", path);
  if (int err = syncDirectory(dir)) return posixError(err, "cannot sync the directory of", path);
  return base::Result<void>::success();
}

std::optional<pid_t> temporaryFileWriter(std::string_view fileName) {
  const auto parsed = parseTemporaryName(fileName);
  return parsed ? std::optional<pid_t>(parsed->second) : std::nullopt;
}

base::Result<size_t> removeStaleTemporaryFiles(const std::string& directory,
                                               std::string_view fileName) {
  struct CloseDirectory {
    void operator()(DIR* d) const { ::closedir(d); }
  };
  std::unique_ptr<DIR, CloseDirectory> dir(::opendir(directory.c_str()));
  if (!dir) return posixError(errno, "cannot read the directory", directory);
  const pid_t self = ::getpid();
  LiveTemporaries& live = liveTemporaries();
  size_t removed = 0;
  while (const dirent* entry = ::readdir(dir.get())) {
    const std::string_view name = entry->d_name;
    const auto parsed = parseTemporaryName(name);
    if (!parsed || (!fileName.empty() && !belongsTo(name, parsed->first, fileName))) continue;
    const std::string path = directory + "/" + std::string(name);
    if (parsed->second == self) {
      // Checked and removed under the lock: a write enters its name before
      // it creates the file, so a name not entered is no write's.
      std::lock_guard lock(live.mutex);
      if (live.names.contains(name)) continue;
      if (::unlink(path.c_str()) == 0) ++removed;
      continue;
    }
    // Another process's: stale once that process has gone. A pid taken over
    // by a new process keeps the file until a later clean-up.
    if (::kill(parsed->second, 0) != 0 && errno == ESRCH && ::unlink(path.c_str()) == 0) {
      ++removed;
    }
  }
  return removed;
}

}  // namespace vantrel::platform
