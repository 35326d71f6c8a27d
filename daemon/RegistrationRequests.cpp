// "add", "remove" and "bulk": registering and unregistering bundles with the
// application registry on a client's behalf.

#include "base/Log.h"
#include "daemon/Transaction.h"
#include "daemon/VTDServer.h"
#include "model/FileUrl.h"
#include "platform/Probes.h"

namespace vantrel::daemon {

void Transaction::addPlugIns() {
  processPaths([this](const std::string& path, bool resolved) {
    if (!resolved) {
      failMessage(protocol::kErrorBadPath, base::format("invalid plugin path: %@", path));
      return false;
    }
    probes::pluginAdd(path.c_str());
    if (server()->addPlugIn(model::FileUrl::fromPath(path))) {
      base::vtlog("failed to register plug-in at %@", path);
      failMessage(protocol::kErrorRegistryRefused,
                  base::format("unable to register plug-in at %@", path));
      return false;
    }
    return true;
  });
}

void Transaction::removePlugIns() {
  // An unresolvable path is still passed on: the bundle may be gone from
  // the disk and yet registered.
  processPaths([this](const std::string& path, bool resolved) {
    probes::pluginRemove(path.c_str(), resolved);
    if (server()->removePlugIn(model::FileUrl::fromPath(path))) {
      failMessage(protocol::kErrorBadPath, base::format("no plugin at %@", path));
      return false;
    }
    return true;
  });
}

void Transaction::bulkPlugIns() {
  const uint64_t flags = request().get(protocol::kKeyFlags).getIfUInt64().value_or(0);
  base::vtlog("bulk options 0x%lx not supported", static_cast<uint32_t>(flags));
  done();
}

}  // namespace vantrel::daemon
