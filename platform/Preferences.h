#pragma once
// The preferences store: one XML property-list file per domain and host,
//   <preferencesDirectory()>/<host name>/<domain>.plist
// read by the daemon and written by tools (or by hand). A domain object keeps
// the contents it last read and re-reads the file only when it has changed,
// so a value written by another process is seen at the next synchronize().

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <mutex>
#include <string>
#include <string_view>

#include "base/Result.h"
#include "lmo/Value.h"
#include "platform/FileStamp.h"

namespace vantrel::platform {

// Longest domain name; with ".plist" and the temporary file's affixes it
// still fits in NAME_MAX (255).
inline constexpr size_t kMaxPreferencesDomainLength = 200;

// The host part of the preferences path: gethostname(), or "localhost" when
// that fails or yields something that is not a single file name.
std::string preferencesHostName();

class Preferences {
 public:
  // The file's location is taken from preferencesDirectory() and
  // preferencesHostName() now and kept. The domain is fixed by the calling
  // code; one that is not a single file name of at most
  // kMaxPreferencesDomainLength bytes is a programming error and stops the
  // process. Nothing is read until the first synchronize() or valueForKey().
  explicit Preferences(std::string domain);
  Preferences(const Preferences&) = delete;
  Preferences& operator=(const Preferences&) = delete;

  const std::string& domain() const { return domain_; }
  const std::string& path() const { return path_; }

  // Re-reads the file when it differs from the one last read (a FileStamp:
  // inode, size, owner, mode, modification and change times). A missing file is an empty domain. A
  // file that cannot be read or is not a property-list dictionary (malformed,
  // above the property-list size limit, not a regular file) is an empty
  // domain too, with one log line per change of the file; it is never
  // rewritten by a read.
  void synchronize();

  // The value under key as of the last synchronize() or setValue(); the file
  // is read at the first call when it never was. Null when absent.
  lmo::Value valueForKey(std::string_view key);

  // Reads the file afresh, sets key to value (a null value removes the key)
  // and replaces the file atomically, making the directories (0700) when
  // missing. Writers in several processes are serialised by an flock on the
  // host directory. Errors, with the file left as it was: a file that exists
  // but cannot be read as a dictionary is not replaced (domain of the read
  // error, description naming the path); a value with no property-list form
  // (domain "PropertyList", code 3); I/O (domain "POSIX").
  base::Result<void> setValue(std::string_view key, const lmo::Value& value);

 private:
  // Re-reads when forced or when the file changed; returns the error that
  // made the domain empty, if any. Requires mutex_.
  base::Result<void> synchronizeLocked(bool force);

  // Constant after construction.
  const std::string domain_;
  const std::string directory_;
  const std::string path_;

  std::mutex mutex_;
  // Guarded by mutex_: whether the file was read at all, the stamp of the
  // file last read and what it held.
  bool loaded_ = false;
  FileStamp stamp_;
  lmo::Dictionary values_;
};

}  // namespace vantrel::platform
