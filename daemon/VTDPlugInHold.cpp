#include "daemon/VTDPlugInHold.h"

#include <chrono>

#include "base/Check.h"

namespace vantrel::daemon {

std::shared_ptr<VTDPlugInHold> VTDPlugInHold::initWithPlugIns(
    const std::vector<registry::VTDPlugInPtr>& plugIns,
    const std::shared_ptr<VTDLmoClient>& client) {
  std::shared_ptr<VTDPlugInHold> hold(new VTDPlugInHold());
  hold->uuid_ = base::Uuid::random();
  for (const registry::VTDPlugInPtr& plugIn : plugIns) {
    const std::optional<base::Uuid> uuid = plugIn->uuid();
    VT_CHECK(uuid.has_value(), "a held plug-in has no UUID");
    hold->blocked_.emplace(*uuid, plugIn);
  }
  hold->client_ = client;
  const auto now = std::chrono::system_clock::now().time_since_epoch();
  hold->created_ = lmo::Date{std::chrono::duration<double>(now).count()};
  return hold;
}

bool VTDPlugInHold::blocks(const registry::VTDPlugIn& plugIn) const {
  const std::optional<base::Uuid> uuid = plugIn.uuid();
  VT_CHECK(uuid.has_value(), "a plug-in without a UUID was compared with a hold");
  return blocked_.contains(*uuid);
}

}  // namespace vantrel::daemon
