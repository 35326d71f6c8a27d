#pragma once
// Privacy consent: which platform services the user has granted to an
// application, keyed by the application's bundle identifier. The registry
// keeps the answers (omnidex/ConsentStore.h); the daemon reads them when it
// decides how far a plug-in of that application is confined.

#include <string>

#include "lmo/Value.h"

namespace vantrel::omnidex {

// The service that lets a keyboard plug-in reach the network (its "open
// access"): granted, the keyboard runs under the ordinary plug-in profile
// rather than the keyboard one.
inline constexpr const char* kKeyboardNetworkService = "com.karvo.privacy.keyboard-network";

// The user's last answer for one service.
struct ConsentEntry {
  std::string service;
  bool granted = false;
  lmo::Date changed;  // when the answer was last given
  bool operator==(const ConsentEntry&) const = default;
};

}  // namespace vantrel::omnidex
