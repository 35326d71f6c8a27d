#include "lmo/ServicePath.h"

#include <unistd.h>

#include <cstdlib>

namespace vantrel::lmo {
namespace {

// An environment variable that is set and not empty.
const char* environment(const char* name) {
  const char* value = std::getenv(name);
  return value != nullptr && *value != '\0' ? value : nullptr;
}

}  // namespace

std::string serviceRuntimeDirectory() {
  if (const char* dir = environment("VANTREL_RUNTIME_DIR")) return dir;
  if (::geteuid() == 0) return "/run/vantrel";
  if (const char* dir = environment("XDG_RUNTIME_DIR")) return std::string(dir) + "/vantrel";
  return "/tmp/vantrel-" + std::to_string(::geteuid());
}

std::string socketPathForService(std::string_view name) {
  if (!name.empty() && name.front() == '/') return std::string(name);
  return serviceRuntimeDirectory() + "/" + std::string(name);
}

}  // namespace vantrel::lmo
