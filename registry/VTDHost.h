#pragma once
// The host process a plug-in is being checked for: what authorisation needs
// to know about it. The daemon's client connection is one.

#include <sys/types.h>

#include <string_view>

#include "lmo/Value.h"

namespace vantrel::registry {

class VTDHost {
 public:
  virtual ~VTDHost() = default;
  virtual pid_t pid() const = 0;
  // The host's entitlement of that name, or null.
  virtual lmo::Value entitlementValueForKey(std::string_view key) const = 0;
  // The entitlement exists and is not false.
  virtual bool hasEntitlement(std::string_view key) const = 0;

  // What hasEntitlement answers for an entitlement's value: it exists and
  // is not false.
  static bool granted(const lmo::Value& value) {
    return !value.isNull() && !(value == lmo::Value::boolean(false));
  }
};

}  // namespace vantrel::registry
