#pragma once
// The registry's own errors. They explain to the caller (the plug-in
// database, a tool) why a bundle was refused or the store failed; the
// database turns a refused registration into its own error for clients.

#include <cstdint>
#include <string>

#include "base/Error.h"

namespace vantrel::omnidex {

inline constexpr const char* kOmnidexErrorDomain = "Omnidex";

enum OmnidexErrorCode : int64_t {
  kOmnidexBadPath = 1,          // empty, too long, or holding a NUL character
  kOmnidexNotABundle = 2,       // no directory there, or no Info.plist in it
  kOmnidexMalformedBundle = 3,  // Info.plist unreadable, too large, malformed, not a dictionary
  kOmnidexNotAPlugIn = 4,       // the Info dictionary has no "QXExtension" or "Vantrel" dictionary
  kOmnidexNoIdentifier = 5,     // neither "QXExtensionIdentifier" nor "KBBundleIdentifier"
  kOmnidexNotRegistered = 6,    // unregistering a path the registry does not know
  kOmnidexStoreFailed = 7,      // the database could not be opened, read or written
  kOmnidexSchemaMismatch = 8,   // the database was written by another schema version
  kOmnidexFull = 9,             // kMaxRegisteredPlugIns or a privacy-consent limit reached
  kOmnidexBadIdentifier = 10,   // a consent identifier empty, too long, or holding a NUL character
  kOmnidexStateInUse = 11,      // another registry holds the state directory
};

inline base::Error omnidexError(int64_t code, std::string message) {
  return base::Error{kOmnidexErrorDomain, code, std::move(message)};
}

}  // namespace vantrel::omnidex
