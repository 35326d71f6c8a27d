#include "base/Error.h"

namespace vantrel::base {

std::string Error::description() const {
  if (localizedDescription) return *localizedDescription;
  return format("%s error %d", domain.c_str(), code);
}

Error error_with_code(int64_t code, const char* message) {
  Error e{VTErrorDomain, code, std::nullopt};
  if (message != nullptr) e.localizedDescription = message;
  return e;
}

Error error_with_code(int64_t code, const std::string& message) {
  return Error{VTErrorDomain, code, message};
}

std::string describe(const Error& error) {
  return error.description();
}

}  // namespace vantrel::base
