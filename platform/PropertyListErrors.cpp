#include "platform/PropertyListChecks.h"

#include "base/Format.h"

namespace vantrel::platform::plist_checks {

base::Error plistError(int64_t code, std::string message) {
  return base::Error{kPropertyListErrorDomain, code, std::move(message)};
}

base::Error malformed(const char* what) {
  return plistError(kPropertyListMalformed, base::format("not a valid property list: %s", what));
}

base::Error tooDeep() {
  return plistError(
      kPropertyListTooLarge,
      base::format("property list nested deeper than %d levels", kMaxPropertyListDepth));
}

base::Error tooManyObjects() {
  return plistError(kPropertyListTooLarge, base::format("property list holds more than %u values",
                                                        kMaxPropertyListObjects));
}

}  // namespace vantrel::platform::plist_checks
