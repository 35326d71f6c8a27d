#pragma once
// What identifies one version of a file: enough to tell that it changed since
// it was last read without reading it again.

#include <sys/stat.h>

#include <cstdint>

namespace vantrel::platform {

struct FileStamp {
  int error = 0;  // 0 when the file was found; else the errno of the failed stat or open
  dev_t device = 0;
  ino_t inode = 0;
  off_t size = 0;
  mode_t mode = 0;
  uid_t owner = 0;
  int64_t modifiedNs = 0;
  int64_t changedNs = 0;  // moves with every change of content, owner or mode

  bool operator==(const FileStamp&) const = default;

  static FileStamp failed(int error) { return FileStamp{error}; }
  static FileStamp of(const struct stat& st) {
    return FileStamp{0,
                     st.st_dev,
                     st.st_ino,
                     st.st_size,
                     st.st_mode,
                     st.st_uid,
                     nanoseconds(st.st_mtim),
                     nanoseconds(st.st_ctim)};
  }

 private:
  static int64_t nanoseconds(const timespec& t) {
    return int64_t{t.tv_sec} * 1'000'000'000 + t.tv_nsec;
  }
};

}  // namespace vantrel::platform
