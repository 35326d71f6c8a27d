#pragma once
// The service manager's table file, <directory>/services.plist (an XML
// property list, mode 0600, replaced atomically on every change), so that a
// restarted daemon finds its registrations again:
//   { "formatVersion": 1,
//     "services": [ { "bundleIdentifier": text, "version": text, "pid": integer,
//                     "executable": absolute path, "description": dictionary } ] }

#include <cstddef>
#include <cstdint>
#include <vector>

#include "base/Result.h"
#include "lmo/Value.h"
#include "platform/LaunchDescription.h"

namespace vantrel::platform {

// Registrations the table holds at most; registering beyond it fails.
inline constexpr size_t kMaxExternalServiceRegistrations = 4096;
inline constexpr int64_t kServicesFileFormatVersion = 1;

// One registration replaces another with the same bundle identifier,
// version and host pid.
bool isSameService(const ExternalServiceRegistration& a, const ExternalServiceRegistration& b);
// A bundle identifier that can be a file name, a positive pid and an
// absolute executable path.
bool isValidRegistration(const ExternalServiceRegistration& registration);

// The table file's value.
lmo::Value encodeServiceTable(const std::vector<ExternalServiceRegistration>& table);
// The table a file's value holds. Errors: domain "PropertyList", code
// kPropertyListMalformed, with what is wrong.
base::Result<std::vector<ExternalServiceRegistration>> decodeServiceTable(const lmo::Value& file);

}  // namespace vantrel::platform
