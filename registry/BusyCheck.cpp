// Whether a plug-in is running: the busy check a hold makes before it is
// granted.

#include <string>
#include <vector>

#include "base/Log.h"
#include "lmo/Protocol.h"
#include "platform/ProcessAssertions.h"
#include "registry/VTDPlugIn.h"

namespace vantrel::registry {

namespace {

constexpr const char* kBundleIdentifierKey = "KBBundleIdentifier";

// Every registered bundle that carries bundleIdentifier: an instance of any
// of them is an instance of the plug-in as far as a hold is concerned.
std::vector<std::string> bundlesWithIdentifier(omnidex::Workspace& registry,
                                               const std::string& bundleIdentifier) {
  std::vector<std::string> paths;
  const auto installed = registry.installedPlugIns();
  if (!installed) return paths;
  for (const omnidex::PlugInRecordPtr& record : *installed) {
    if (record->bundleIdentifier == bundleIdentifier && record->bundlePath) {
      paths.push_back(*record->bundlePath);
    }
  }
  return paths;
}

}  // namespace

std::optional<lmo::Dictionary> VTDPlugIn::checkBusy(omnidex::Workspace& registry) const {
  if (!infoKey(kBundleIdentifierKey).getIfString()) return std::nullopt;  // no /proc scan
  return checkBusy(registry, platform::ProcessSnapshot::take());
}

std::optional<lmo::Dictionary> VTDPlugIn::checkBusy(
    omnidex::Workspace& registry, const platform::ProcessSnapshot& processes) const {
  const lmo::Value identifierValue = infoKey(kBundleIdentifierKey);
  const std::string* bundleIdentifier = identifierValue.getIfString();
  if (bundleIdentifier == nullptr) return std::nullopt;
  const std::vector<lmo::Dictionary> instances = platform::runningInstances(
      *bundleIdentifier, bundlesWithIdentifier(registry, *bundleIdentifier), processes);
  for (const lmo::Dictionary& instance : instances) {
    const lmo::Value& running = instance.get(platform::kInstanceBundleIdentifierKey);
    if (running.getIfString() != nullptr) {
      return lmo::Dictionary{{protocol::kKeyConflictBundleIdentifier, running}};
    }
    base::vtlog("tavold reported incomplete bundle for plug-in %@", identifier());
  }
  return std::nullopt;
}

}  // namespace vantrel::registry
