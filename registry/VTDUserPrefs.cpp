#include "registry/VTDUserPrefs.h"

namespace vantrel::registry {

VTDUserPrefs::VTDUserPrefs() : preferences_(kUserPrefsDomain) {}

lmo::Value VTDUserPrefs::exclusions() {
  preferences_.synchronize();
  return preferences_.valueForKey(kExclusionsKey);
}

}  // namespace vantrel::registry
