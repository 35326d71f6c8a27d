#include "platform/SdkRegistry.h"

#include <sys/stat.h>

#include <string_view>

#include "platform/Paths.h"
#include "platform/PropertyList.h"

namespace vantrel::platform {
namespace {

constexpr std::string_view kSdkFileSuffix = ".plist";

// The name becomes one file name inside an SDK directory; anything that could
// name a different place (a separator, a dot entry, a NUL that would cut the
// path short) is refused.
bool isAcceptableSdkName(const std::string& name) {
  if (name.empty() || name.size() > kMaxSdkNameLength) return false;
  if (name == "." || name == "..") return false;
  return name.find('/') == std::string::npos && name.find('\0') == std::string::npos;
}

bool isRegularFile(const std::string& path) {
  struct stat st;
  return ::stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode);
}

}  // namespace

std::optional<lmo::Dictionary> lookupExtensionSdk(const std::string& name) {
  if (!isAcceptableSdkName(name)) return std::nullopt;
  for (const std::string& dir : sdkDirectories()) {
    std::string path = dir + "/" + name + std::string(kSdkFileSuffix);
    // Only regular files: a FIFO under the name would block the reader.
    if (!isRegularFile(path)) continue;
    base::Result<lmo::Value> value = readPropertyListFile(path);
    if (!value.has_value()) continue;
    if (const lmo::Dictionary* dict = value->getIfDictionary()) return *dict;
  }
  return std::nullopt;
}

}  // namespace vantrel::platform
