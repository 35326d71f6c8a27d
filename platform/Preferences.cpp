#include "platform/Preferences.h"

#include <fcntl.h>
#include <limits.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "base/Check.h"
#include "base/Log.h"
#include "platform/AtomicFile.h"
#include "platform/FileLock.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"
#include "platform/ScopedFd.h"

namespace vantrel::platform {
namespace {

constexpr mode_t kDirectoryMode = 0700;
constexpr mode_t kFileMode = 0600;
constexpr const char* kFallbackHostName = "localhost";

// Reads at most limit + 1 bytes, so that a file that grew past the limit
// after it was measured is still caught. Returns 0 or errno.
int readBounded(int fd, size_t limit, std::string& bytes) {
  char buffer[64 * 1024];
  while (bytes.size() <= limit) {
    const ssize_t n = ::read(fd, buffer, sizeof buffer);
    if (n < 0) {
      if (errno == EINTR) continue;
      return errno;
    }
    if (n == 0) break;
    bytes.append(buffer, static_cast<size_t>(n));
  }
  return 0;
}

// The domain held by an open preferences file.
base::Result<lmo::Dictionary> readDomain(int fd, const struct stat& st, const std::string& path) {
  if (!S_ISREG(st.st_mode)) {
    return base::Error{kPosixErrorDomain, EINVAL, base::format("%@ is not a regular file", path)};
  }
  if (static_cast<uint64_t>(st.st_size) > kMaxPropertyListBytes) {
    return base::Error{kPropertyListErrorDomain, kPropertyListTooLarge,
                       base::format("%@ is larger than %u bytes", path, kMaxPropertyListBytes)};
  }
  std::string bytes;
  if (int err = readBounded(fd, kMaxPropertyListBytes, bytes)) {
    return posixError(err, "cannot read", path);
  }
  lmo::Value value = VT_TRY(readPropertyList(bytes));
  const lmo::Dictionary* dictionary = value.getIfDictionary();
  if (dictionary == nullptr) {
    return base::Error{kPropertyListErrorDomain, kPropertyListMalformed,
                       base::format("%@ does not hold a dictionary", path)};
  }
  return *dictionary;
}

}  // namespace

std::string preferencesHostName() {
  char name[HOST_NAME_MAX + 1] = {};
  if (::gethostname(name, sizeof name - 1) != 0) return kFallbackHostName;
  const std::string host(name);
  return isSinglePathComponent(host, HOST_NAME_MAX) ? host : kFallbackHostName;
}

Preferences::Preferences(std::string domain)
    : domain_(std::move(domain)),
      directory_(preferencesDirectory() + "/" + preferencesHostName()),
      path_(directory_ + "/" + domain_ + ".plist") {
  VT_CHECK(isSinglePathComponent(domain_, kMaxPreferencesDomainLength),
           "preferences domain is not a single file name");
}

void Preferences::synchronize() {
  std::lock_guard lock(mutex_);
  (void)synchronizeLocked(/*force=*/false);
}

lmo::Value Preferences::valueForKey(std::string_view key) {
  std::lock_guard lock(mutex_);
  if (!loaded_) (void)synchronizeLocked(/*force=*/false);
  return values_.get(key);
}

base::Result<void> Preferences::synchronizeLocked(bool force) {
  // O_NONBLOCK keeps a FIFO planted at the path from stalling the caller.
  ScopedFd fd(::open(path_.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
  // The errno of a failed open or fstat is part of the stamp (ENOENT: no file).
  struct stat st = {};
  const FileStamp stamp = fd.get() < 0                  ? FileStamp::failed(errno)
                          : ::fstat(fd.get(), &st) != 0 ? FileStamp::failed(errno)
                                                        : FileStamp::of(st);
  if (loaded_ && !force && stamp == stamp_) return base::Result<void>::success();

  const bool changed = !loaded_ || stamp != stamp_;
  loaded_ = true;
  stamp_ = stamp;
  values_ = lmo::Dictionary();
  if (stamp.error == ENOENT) return base::Result<void>::success();

  base::Result<lmo::Dictionary> contents =
      stamp.error != 0
          ? base::Result<lmo::Dictionary>(posixError(stamp.error, "cannot open", path_))
          : readDomain(fd.get(), st, path_);
  if (!contents.has_value()) {
    // Logged once per version of the file, not at every synchronize.
    if (changed) {
      base::writeLog(base::LogLevel::kWarning, base::format("ignoring preferences file %@: %@",
                                                            path_, contents.error().description()));
    }
    return contents.error();
  }
  values_ = std::move(contents).value();
  return base::Result<void>::success();
}

base::Result<void> Preferences::setValue(std::string_view key, const lmo::Value& value) {
  std::lock_guard lock(mutex_);
  VT_TRY(ensureDirectory(directory_, kDirectoryMode));
  FileLock writers;
  if (int err = writers.lockDirectory(directory_))
    return posixError(err, "cannot lock", directory_);

  if (auto current = synchronizeLocked(/*force=*/true); !current.has_value()) {
    // Replacing the file would lose whatever its owner meant to keep in it.
    const base::Error& err = current.error();
    return base::Error{err.domain, err.code,
                       base::format("cannot replace the unreadable preferences file %@: %@", path_,
                                    err.description())};
  }
  const lmo::Dictionary updated = values_.setting(key, value);
  // Writers take turns under the lock, so what an earlier writer killed
  // half-way left can go now.
  (void)removeStaleTemporaryFiles(directory_, domain_ + ".plist");
  VT_TRY(writePropertyListFile(path_, lmo::Value(updated), kFileMode));
  values_ = updated;
  // The next synchronize() reads the file back and so learns its new stamp.
  loaded_ = false;
  return base::Result<void>::success();
}

}  // namespace vantrel::platform
