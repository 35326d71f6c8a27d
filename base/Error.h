#pragma once
// Error objects: (domain, code, description). The daemon's own errors live in
// the "Vantrel" domain; their codes are protocol::ErrorCode (lmo/Protocol.h),
// shared by error objects and by the "errorcode" of error replies. base sits
// below lmo, so it takes the code as a plain integer.

#include <cstdint>
#include <optional>
#include <string>

#include "base/Format.h"

namespace vantrel::base {

inline constexpr const char* VTErrorDomain = "Vantrel";

struct Error {
  std::string domain;
  int64_t code = 0;
  // The user information's localized description. Absent when the error was
  // made without a message (the error then has no user information at all).
  std::optional<std::string> localizedDescription;

  // The description as a reply or log line shows it: the localized
  // description, or "<domain> error <code>" when there is none.
  std::string description() const;
  bool operator==(const Error&) const = default;
};

// An error in VTErrorDomain with that code; message may be null, and then the
// error carries no user information.
Error error_with_code(int64_t code, const char* message);
Error error_with_code(int64_t code, const std::string& message);

// As error_with_code, with the message built by base::format from fmt and the
// arguments; a null fmt gives an error without user information.
template <typename... Args>
Error error_with_code_and_format(int64_t code, const char* fmt, const Args&... args) {
  if (fmt == nullptr) return error_with_code(code, nullptr);
  return error_with_code(code, format(fmt, args...));
}

std::string describe(const Error& error);

}  // namespace vantrel::base
