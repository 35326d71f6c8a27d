#include <cstdlib>
#include <string_view>

#include "omnidex/Omnidex.h"
#include "platform/Paths.h"

namespace vantrel::omnidex {
namespace {

// The colon-separated list in the variable, empty parts dropped; fallback
// when the variable is unset. Set but empty means "no directories", which is
// how a test or a tool turns scanning off.
std::vector<std::string> directoryList(const char* variable, std::vector<std::string> fallback) {
  const char* value = std::getenv(variable);
  if (value == nullptr) return fallback;
  return platform::splitPathList(value);
}

}  // namespace

OmnidexConfig OmnidexConfig::fromEnvironment() {
  OmnidexConfig config;
  config.stateDirectory = platform::stateDirectory();
  const std::string system = platform::systemVolumeDirectory();
  config.applicationDirectories =
      directoryList("VANTREL_APP_DIRS", {"/Applications", system + "/Applications"});
  config.plugInDirectories = directoryList("VANTREL_PLUGIN_DIRS", {system + "/Library/PlugIns"});
  return config;
}

}  // namespace vantrel::omnidex
