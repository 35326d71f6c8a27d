// The server's list of holds. Every read and write runs on "serverSync";
// each operation is synchronous for its caller.

#include "base/Log.h"
#include "daemon/VTDLmoClient.h"
#include "daemon/VTDPlugInHold.h"
#include "daemon/VTDServer.h"

namespace vantrel::daemon {

VTDPlugInHoldPtr VTDServer::holdFor(const registry::VTDPlugIn& plugIn) {
  VTDPlugInHoldPtr found;
  syncQueue_->sync([&] {
    for (const VTDPlugInHoldPtr& hold : holds_) {
      if (hold->blocks(plugIn)) {
        found = hold;
        break;
      }
    }
  });
  return found;
}

void VTDServer::addHold(VTDPlugInHoldPtr hold) {
  syncQueue_->sync([&] { holds_.push_back(std::move(hold)); });
  registry::postAnnotationChange();
}

void VTDServer::unholdToken(const base::Uuid& token) {
  syncQueue_->sync([&] {
    for (auto it = holds_.begin(); it != holds_.end(); ++it) {
      if ((*it)->uuid() != token) continue;
      base::vtlog("releasing plug-in hold %@ at client's request", token.string());
      holds_.erase(it);
      registry::postAnnotationChange();
      return;
    }
  });
}

void VTDServer::unholdClient(const VTDLmoClient& client) {
  // The released holds are destroyed after leaving the queue: a hold's
  // destructor may drop the last reference to its plug-ins.
  std::vector<VTDPlugInHoldPtr> released;
  syncQueue_->sync([&] {
    for (auto it = holds_.begin(); it != holds_.end();) {
      if ((*it)->client().get() != &client) {
        ++it;
        continue;
      }
      base::vtlog("releasing plug-in hold %@ for dead client pid %d", (*it)->uuid().string(),
                  client.pid());
      released.push_back(std::move(*it));
      it = holds_.erase(it);
      registry::postAnnotationChange();
    }
  });
}

std::vector<VTDPlugInHoldPtr> VTDServer::holds() {
  std::vector<VTDPlugInHoldPtr> copy;
  syncQueue_->sync([&] { copy = holds_; });
  return copy;
}

}  // namespace vantrel::daemon
