#include "lmo/LmoError.h"

#include <utility>

namespace vantrel::lmo {

base::Error lmoError(int64_t code, std::string text) {
  return base::Error{kLmoErrorDomain, code, std::move(text)};
}

}  // namespace vantrel::lmo
