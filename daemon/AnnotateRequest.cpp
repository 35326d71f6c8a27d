// "annotate": a user's choices about plug-ins (the election, and settings of
// the extension's own), stored through the database.

#include "base/Log.h"
#include "daemon/Transaction.h"
#include "daemon/VTDLmoClient.h"
#include "daemon/VTDServer.h"
#include "lmo/Message.h"
#include "lmo/Protocol.h"

namespace vantrel::daemon {

void Transaction::annotatePlugIns() {
  const std::optional<lmo::Dictionary> annotations =
      lmo::lmo_dictionary_get_dictionary(request(), protocol::kKeyAnnotations);
  if (!annotations) {
    failMessage(protocol::kErrorBadRequest, "invalid request format (bad annotations dictionary)");
    return;
  }
  const lmo::Dictionary given = lmo::propertyListFromMessage(*annotations);
  // Only the two known keys travel on; anything else a client sends is
  // dropped here rather than stored.
  lmo::Dictionary change;
  if (const lmo::Value* election = given.find(protocol::kAnnotationElection)) {
    if (!election->isNumeric()) {
      failMessage(protocol::kErrorBadRequest, "invalid request format (annotation election)");
      return;
    }
    change = change.setting(protocol::kAnnotationElection, *election);
  }
  if (const lmo::Value* extension = given.find(protocol::kAnnotationExtension)) {
    if (extension->getIfDictionary() == nullptr) {
      failMessage(protocol::kErrorBadRequest, "invalid request format (annotation extension)");
      return;
    }
    change = change.setting(protocol::kAnnotationExtension, *extension);
  }
  if (change.empty()) {
    done();
    return;
  }
  const bool annotated = processUuidList([&](const registry::VTDPlugInPtr& plugIn) {
    base::vtlog("client %d plug-in %@ election := %@", client()->pid(), plugIn->identifier(),
                change.find(protocol::kAnnotationElection)
                    ? std::optional(change.get(protocol::kAnnotationElection))
                    : std::nullopt);
    server()->setAnnotation(change, *plugIn);
    return true;
  });
  if (annotated) done();
}

}  // namespace vantrel::daemon
