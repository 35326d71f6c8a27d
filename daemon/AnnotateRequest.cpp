// "annotate": a user's choices about plug-ins (the election, and settings of
// the extension's own), stored through the database.

#include <cstdint>
#include <set>
#include <string>
#include <vector>

#include "base/Log.h"
#include "daemon/Limits.h"
#include "daemon/Transaction.h"
#include "daemon/VTDLmoClient.h"
#include "daemon/VTDServer.h"
#include "lmo/Cbor.h"
#include "lmo/Message.h"
#include "lmo/Protocol.h"
#include "registry/VTDAnnotationStore.h"

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
    // Measured as it travels: the decoded form of a value costs more, and
    // what a peer sends is what the store will write.
    const base::Result<std::vector<uint8_t>> encoded = lmo::encodeCbor(*extension);
    const size_t bytes = encoded.has_value() ? encoded.value().size() : SIZE_MAX;
    if (bytes > kMaxExtensionAnnotationBytes) {
      failMessage(protocol::kErrorBadRequest,
                  base::format(kExtensionTooLargeFormat, bytes, kMaxExtensionAnnotationBytes));
      return;
    }
    change = change.setting(protocol::kAnnotationExtension, *extension);
  }
  if (change.empty()) {
    done();
    return;
  }
  // Looked up first and stored in one save; elements before a bad one keep
  // their effect, as if each were stored in turn.
  std::vector<registry::VTDPlugInPtr> plugIns;
  const std::optional<Refusal> refusal = visitUuidList([&](const registry::VTDPlugInPtr& plugIn) {
    plugIns.push_back(plugIn);
    return true;
  });
  // Every change rewrites the whole store: its number of entries is bounded,
  // counting the plug-ins this request would add.
  const lmo::Dictionary stored = server()->annotations()->annotations();
  std::set<std::string> added;
  for (const registry::VTDPlugInPtr& plugIn : plugIns) {
    const std::optional<std::string> key = plugIn->annotationKey();
    if (key && stored.find(*key) == nullptr) added.insert(*key);
  }
  if (!added.empty() && stored.size() + added.size() > kMaxAnnotations) {
    failMessage(protocol::kErrorBadRequest,
                base::format(kTooManyAnnotationsFormat, stored.size(), kMaxAnnotations));
    return;
  }
  const std::optional<lmo::Value> election =
      change.find(protocol::kAnnotationElection)
          ? std::optional(change.get(protocol::kAnnotationElection))
          : std::nullopt;
  for (size_t i = 0; i < plugIns.size() && i < kMaxItemLogLinesPerRequest; ++i) {
    base::vtlog("client %d plug-in %@ election := %@", client()->pid(), plugIns[i]->identifier(),
                election);
  }
  if (plugIns.size() > kMaxItemLogLinesPerRequest) {
    base::vtlog("client %d: %u more plug-ins, election := %@", client()->pid(),
                plugIns.size() - kMaxItemLogLinesPerRequest, election);
  }
  // Stored before the reply is sent, whichever it is.
  if (!plugIns.empty()) server()->setAnnotation(change, plugIns);
  if (refusal) {
    failMessage(refusal->code, refusal->message);
  } else {
    done();
  }
}

}  // namespace vantrel::daemon
