// "annotate": a user's choices about plug-ins (the election, and settings of
// the extension's own), stored through the database.

#include "base/Log.h"
#include "daemon/Transaction.h"
#include "daemon/VTDLmoClient.h"
#include "daemon/VTDServer.h"
#include "lmo/Message.h"

namespace vantrel::daemon {

namespace {

constexpr const char* kElectionKey = "election";
constexpr const char* kExtensionKey = "extension";

}  // namespace

void Transaction::annotatePlugIns() {
  const std::optional<lmo::Dictionary> annotations =
      lmo::lmo_dictionary_get_dictionary(request(), "annotations");
  if (!annotations) {
    failMessage(base::kErrorBadRequest, "invalid request format (bad annotations dictionary)");
    return;
  }
  const lmo::Dictionary given = lmo::propertyListFromMessage(*annotations);
  // Only the two known keys travel on; anything else a client sends is
  // dropped here rather than stored.
  lmo::Dictionary change;
  if (const lmo::Value* election = given.find(kElectionKey)) {
    if (!election->isNumeric()) {
      failMessage(base::kErrorBadRequest, "invalid request format (annotation election)");
      return;
    }
    change = change.setting(kElectionKey, *election);
  }
  if (const lmo::Value* extension = given.find(kExtensionKey)) {
    if (extension->getIfDictionary() == nullptr) {
      failMessage(base::kErrorBadRequest, "invalid request format (annotation extension)");
      return;
    }
    change = change.setting(kExtensionKey, *extension);
  }
  if (change.empty()) {
    done();
    return;
  }
  const bool annotated = processUuidList([&](const registry::VTDPlugInPtr& plugIn) {
    base::vtlog("client %d plug-in %@ election := %@", client()->pid(), plugIn->identifier(),
                change.find(kElectionKey) ? std::optional(change.get(kElectionKey)) : std::nullopt);
    server()->setAnnotation(change, *plugIn);
    return true;
  });
  if (annotated) done();
}

}  // namespace vantrel::daemon
