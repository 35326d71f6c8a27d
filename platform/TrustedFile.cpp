#include "platform/TrustedFile.h"

#include <unistd.h>

#include <cerrno>
#include <utility>

#include "base/Format.h"

namespace vantrel::platform {

std::optional<std::string> trustProblem(const SmallFileRead& r, size_t maxBytes) {
  if (std::optional<std::string> problem = smallFileProblem(r, maxBytes)) return problem;
  if (r.st.st_uid != 0 && r.st.st_uid != ::geteuid()) {
    return base::format("it is owned by uid %u", static_cast<unsigned>(r.st.st_uid));
  }
  if ((r.st.st_mode & (S_IWGRP | S_IWOTH)) != 0) {
    return std::string("it is writable by group or others");
  }
  return std::nullopt;
}

base::Result<std::optional<std::string>> readTrustedFile(const std::string& path, size_t maxBytes) {
  SmallFileRead r = readSmallFile(path, maxBytes);
  if (r.error == ENOENT) return std::optional<std::string>();
  if (std::optional<std::string> problem = trustProblem(r, maxBytes)) {
    const bool readable = !smallFileProblem(r, maxBytes).has_value();
    return base::Error{kTrustedFileErrorDomain,
                       readable ? kTrustedFileUntrusted : kTrustedFileUnreadable,
                       std::move(*problem)};
  }
  return std::optional<std::string>(std::move(r.bytes));
}

}  // namespace vantrel::platform
