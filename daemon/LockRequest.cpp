// "lock": taking and releasing holds on plug-ins.

#include <vector>

#include "base/Log.h"
#include "daemon/Transaction.h"
#include "daemon/VTDLmoClient.h"
#include "daemon/VTDPlugInHold.h"
#include "daemon/VTDServer.h"
#include "lmo/Message.h"
#include "model/FileUrl.h"
#include "platform/ProcessAssertions.h"

namespace vantrel::daemon {

namespace {

// What each path of a take-form request names.
constexpr uint64_t kHoldApplication = 1;  // every plug-in of an application bundle
constexpr uint64_t kHoldPlugIn = 2;       // one plug-in bundle; no busy check

// "identifier(uuid)" of each plug-in, for log lines.
lmo::Array describePlugIns(const std::vector<registry::VTDPlugInPtr>& plugIns) {
  std::vector<lmo::Value> names;
  for (const registry::VTDPlugInPtr& plugIn : plugIns) {
    names.emplace_back(base::format("%@(%@)", plugIn->identifier(), plugIn->uuid()));
  }
  return lmo::Array(std::move(names));
}

}  // namespace

void Transaction::lockDownPlugIns() {
  if (const std::optional<lmo::Array> tokens = lmo::lmo_dictionary_get_array(request(), "uuids")) {
    // Whoever presents a token releases its hold. Elements that are not
    // UUIDs name no hold and release nothing.
    for (const lmo::Value& token : *tokens) {
      if (const base::Uuid* uuid = token.getIfUuid()) server()->unholdToken(*uuid);
    }
    done();
    return;
  }
  const uint64_t flags = request().get("flags").getIfUInt64().value_or(0);
  std::vector<registry::VTDPlugInPtr> plugIns;
  const bool accepted = marshalPaths([&](const std::string& path, bool resolved) {
    if (!resolved) {
      failMessage(base::kErrorBadPath, base::format("invalid path: %@", path));
      return false;
    }
    const model::FileUrl url = model::FileUrl::fromPath(path);
    if (flags == kHoldPlugIn) {
      registry::VTDPlugInPtr plugIn = server()->findPlugInAtPath(url);
      if (!plugIn) {
        failMessage(base::kErrorBadPath, base::format("no plug-in at path:%@", path));
        return false;
      }
      plugIns.push_back(std::move(plugIn));
      return true;
    }
    if (flags == kHoldApplication) {
      if (auto within = server()->plugInsWithinApplication(url)) {
        plugIns.insert(plugIns.end(), within->begin(), within->end());
      }
      return true;
    }
    failMessage(base::kErrorBadRequest, "invalid request format (unsupported hold flags)");
    return false;
  });
  if (!accepted) return;

  std::vector<lmo::Value> conflicts;
  std::vector<registry::VTDPlugInPtr> busy;
  if (flags != kHoldPlugIn && !plugIns.empty()) {
    const platform::ProcessSnapshot processes = platform::ProcessSnapshot::take();
    for (const registry::VTDPlugInPtr& plugIn : plugIns) {
      if (std::optional<lmo::Dictionary> conflict =
              plugIn->checkBusy(*server()->workspace(), processes)) {
        busy.push_back(plugIn);
        conflicts.emplace_back(std::move(*conflict));
      }
    }
  }
  if (!busy.empty()) {
    server()->debug("hold rejected. Busy plug-ins:%@", describePlugIns(busy));
    setReplyValue("conflicts", lmo::Array(std::move(conflicts)));
    failMessage(base::kErrorBusy, "plug-ins are busy");
    return;
  }
  std::shared_ptr<VTDPlugInHold> hold = VTDPlugInHold::initWithPlugIns(plugIns, client());
  const base::Uuid token = hold->uuid();
  server()->addHold(std::move(hold));
  setReplyValue("uuids", lmo::Value(token));
  server()->debug("hold request granted uuid:%@", token.string());
  done();
}

}  // namespace vantrel::daemon
