// The database as the registry's observer: plug-ins installed and plug-ins
// about to be uninstalled.

#include "base/Log.h"
#include "registry/VTDatabase.h"

namespace vantrel::registry {

void VTDatabase::pluginsDidInstall(const std::vector<omnidex::PlugInRecordPtr>& records) {
  // A new plug-in's record is built (and auto-elected) on its first lookup;
  // a reinstalled one keeps any record already cached until a purge.
  for (const omnidex::PlugInRecordPtr& r : records) {
    if (!r) continue;
    base::vtlog("INSTALLED:%@ %@(%@) %@ %@", r->bundleIdentifier, r->identifier, r->bundleVersion,
                r->uuid, r->bundlePath);
  }
}

void VTDatabase::pluginsWillUninstall(const std::vector<omnidex::PlugInRecordPtr>& records) {
  sync_.sync([&] {
    for (const omnidex::PlugInRecordPtr& r : records) {
      if (!r) continue;
      base::vtlog("UNINSTALLED:%@ %@(%@) %@ %@", r->bundleIdentifier, r->identifier,
                  r->bundleVersion, r->uuid.string(), r->bundlePath);
      cache_.erase(r->uuid);
    }
  });
  // Outside the queue: the delegate withdraws services and may look plug-ins
  // up while doing so.
  if (std::shared_ptr<VTDatabaseDelegate> listener = delegate()) listener->removedPlugIns(records);
}

}  // namespace vantrel::registry
