#pragma once
// Reading one small file that someone else may control: a bundle's
// Info.plist, an Entitlements.plist. The file is opened without following a
// symbolic link in its last component and without blocking on a FIFO, only a
// regular file is read, and never more than the caller's bound, even when the
// file grows while it is read.

#include <sys/stat.h>

#include <cstddef>
#include <optional>
#include <string>

namespace vantrel::platform {

// The outcome of one readSmallFile. At most one of error, symbolicLink,
// notRegular and tooLarge describes a failure; bytes is filled only when
// there is none.
struct SmallFileRead {
  int error = 0;  // errno of the open, fstat or read, or 0
  bool symbolicLink = false;
  bool notRegular = false;
  bool tooLarge = false;
  struct stat st {};  // of the opened file; zero when the open failed
  std::string bytes;
};

// Reads the regular file at path, at most maxBytes. Never throws; every
// failure is described in the returned value.
SmallFileRead readSmallFile(const std::string& path, size_t maxBytes);

// Why r holds no bytes, as a phrase for a log line ("it is a symbolic link",
// "it is not a regular file", "it is larger than <maxBytes> bytes", or the
// errno's text); nullopt when the read succeeded.
std::optional<std::string> smallFileProblem(const SmallFileRead& r, size_t maxBytes);

}  // namespace vantrel::platform
