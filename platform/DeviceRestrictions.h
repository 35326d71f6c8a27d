#pragma once
// The device's restrictions that apply to plug-ins: for now the highest age
// rating of an application the user may run. They live in the preferences
// store (platform/Preferences.h), domain kRestrictionsDomain, where an
// administrator's tool (or a test) writes them and the daemon reads them.

#include <cstdint>
#include <optional>

#include "base/Result.h"

namespace vantrel::platform {

inline constexpr const char* kRestrictionsDomain = "com.karvo.vantrel.restrictions";
inline constexpr const char* kMaxApplicationRatingKey = "maxApplicationRating";

// The highest application rating the device allows, read afresh at every
// call (the domain's file is re-read whenever it changed since the last
// call, by whichever process wrote it), so a new restriction applies at
// once. nullopt, meaning no restriction, when the key is absent or holds
// anything but a number (a string, a boolean, a real that is not a number),
// and when the domain's file cannot be read (the preferences store logs
// that once per version of the file). A real is cut toward zero; a number
// beyond the signed 64-bit range is clamped to it.
std::optional<int64_t> maximumApplicationRating();

// While one lives, this thread reads the restrictions once, at its first
// maximumApplicationRating(), and keeps the answer: a request is one check,
// however many plug-ins it looks at. Nests (the outermost one counts).
class DeviceRestrictionsReadOnce {
 public:
  DeviceRestrictionsReadOnce();
  ~DeviceRestrictionsReadOnce();
  DeviceRestrictionsReadOnce(const DeviceRestrictionsReadOnce&) = delete;
  DeviceRestrictionsReadOnce& operator=(const DeviceRestrictionsReadOnce&) = delete;

 private:
  bool outermost_;
};

// Sets the highest application rating (nullopt removes the restriction) in
// the domain's file, for every process that reads it. Errors as
// Preferences::setValue, with the file left as it was.
base::Result<void> setMaximumApplicationRating(std::optional<int64_t> rating);

}  // namespace vantrel::platform
