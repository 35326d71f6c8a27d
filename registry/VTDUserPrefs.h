#pragma once
// The user's preferences as the daemon reads them: the domain
// "com.karvo.vantrel.userprefs" of the preferences store, for the current user
// and host. Its one key, "exclusions", hides plug-ins from match results.

#include "lmo/Value.h"
#include "platform/Preferences.h"

namespace vantrel::registry {

inline constexpr const char* kUserPrefsDomain = "com.karvo.vantrel.userprefs";
inline constexpr const char* kExclusionsKey = "exclusions";

class VTDUserPrefs {
 public:
  // Reads nothing yet; the file's place is fixed now (see
  // platform::Preferences).
  VTDUserPrefs();
  VTDUserPrefs(const VTDUserPrefs&) = delete;
  VTDUserPrefs& operator=(const VTDUserPrefs&) = delete;

  // The current value of "exclusions" as stored, re-reading the domain when
  // another process changed it since the last call; null when absent or when
  // the file is missing or unreadable. The value's type is not checked: the
  // caller decides what to do with something that is not an array of rule
  // dictionaries. Never cached between calls. Callable from any thread.
  lmo::Value exclusions();

 private:
  platform::Preferences preferences_;  // synchronises itself
};

}  // namespace vantrel::registry
