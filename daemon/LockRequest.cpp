// "lock": taking and releasing holds on plug-ins.

#include <algorithm>
#include <vector>

#include "base/Log.h"
#include "daemon/Limits.h"
#include "daemon/Transaction.h"
#include "daemon/VTDLmoClient.h"
#include "daemon/VTDPlugInHold.h"
#include "daemon/VTDServer.h"
#include "lmo/Message.h"
#include "lmo/Protocol.h"
#include "model/FileUrl.h"
#include "platform/ProcessAssertions.h"

namespace vantrel::daemon {

namespace {

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
  if (const std::optional<lmo::Array> tokens =
          lmo::lmo_dictionary_get_array(request(), protocol::kKeyUuids)) {
    // Whoever presents a token releases its hold. Elements that are not
    // UUIDs name no hold and release nothing.
    if (!withinLimit(protocol::kKeyUuids, tokens->size(), kMaxUuidsPerRequest)) return;
    for (const lmo::Value& token : *tokens) {
      if (const base::Uuid* uuid = token.getIfUuid()) server()->unholdToken(*uuid);
    }
    done();
    return;
  }
  if (!allowStateChange(protocol::kRequestLock)) return;
  {
    const std::vector<std::shared_ptr<VTDPlugInHold>> holds = server()->holds();
    const size_t own = static_cast<size_t>(std::count_if(
        holds.begin(), holds.end(), [&](const auto& hold) { return hold->client() == client(); }));
    if (own >= kMaxHoldsPerClient) {
      failMessage(protocol::kErrorAccessDenied,
                  base::format(kHoldsPerClientFormat, own, kMaxHoldsPerClient));
      return;
    }
    if (holds.size() >= kMaxHolds) {
      failMessage(protocol::kErrorAccessDenied,
                  base::format(kHoldsFormat, holds.size(), kMaxHolds));
      return;
    }
  }
  // Compared whole: a value with any other bit set is refused.
  const auto flags = static_cast<protocol::HoldFlags>(
      request().get(protocol::kKeyFlags).getIfUInt64().value_or(0));
  std::vector<registry::VTDPlugInPtr> plugIns;
  const bool accepted = marshalPaths([&](const std::string& path, bool resolved) {
    if (!resolved) {
      failMessage(protocol::kErrorBadPath, base::format("invalid path: %@", path));
      return false;
    }
    const model::FileUrl url = model::FileUrl::fromPath(path);
    if (flags == protocol::HoldFlags::kPlugIn) {
      registry::VTDPlugInPtr plugIn = server()->findPlugInAtPath(url);
      if (!plugIn) {
        failMessage(protocol::kErrorBadPath, base::format("no plug-in at path:%@", path));
        return false;
      }
      plugIns.push_back(std::move(plugIn));
      return true;
    }
    if (flags == protocol::HoldFlags::kApplication) {
      if (auto within = server()->plugInsWithinApplication(url)) {
        plugIns.insert(plugIns.end(), within->begin(), within->end());
      }
      return true;
    }
    failMessage(protocol::kErrorBadRequest, "invalid request format (unsupported hold flags)");
    return false;
  });
  if (!accepted) return;

  std::vector<lmo::Value> conflicts;
  std::vector<registry::VTDPlugInPtr> busy;
  if (flags != protocol::HoldFlags::kPlugIn && !plugIns.empty()) {
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
    setReplyValue(protocol::kKeyConflicts, lmo::Array(std::move(conflicts)));
    failMessage(protocol::kErrorBusy, "plug-ins are busy");
    return;
  }
  std::shared_ptr<VTDPlugInHold> hold = VTDPlugInHold::initWithPlugIns(plugIns, client());
  const base::Uuid token = hold->uuid();
  server()->addHold(std::move(hold));
  setReplyValue(protocol::kKeyUuids, lmo::Value(token));
  server()->debug("hold request granted uuid:%@", token.string());
  done();
}

}  // namespace vantrel::daemon
