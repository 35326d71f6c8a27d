// Validation of a plug-in's configuration: the metadata rules every plug-in
// must meet on this platform.

#include "lmo/Protocol.h"
#include "model/MetadataKeys.h"
#include "model/VTPlugInCore.h"

namespace vantrel::model {

using lmo::Value;

namespace {

base::Error invalid(const char* message) {
  return base::error_with_code(protocol::kErrorInvalidPlugIn, message);
}

base::Error missingKey(std::string_view key) {
  return base::error_with_code_and_format(protocol::kErrorInvalidPlugIn,
                                          "missing \"%@\" key in Info.plist or SDK", key);
}

}  // namespace

std::optional<base::Error> VTPlugInCore::diagnose() const {
  if (!identifier()) {
    return invalid("missing identifier (no QXExtensionIdentifier, nor even KBBundleIdentifier)");
  }
  if (protocolSpec().isNull()) return missingKey(kProtocolKey);
  if (!attributes()) return missingKey(kAttributesKey);
  if (isAppExtension() && principalSpec() != Value(kDefaultObjectClass)) {
    return base::error_with_code_and_format(protocol::kErrorInvalidPlugIn,
                                            "Application Extensions may not use the \"%@\" key",
                                            kPrincipalClassKey);
  }
  if (!pluginKey(kPassProxyKey).isNull()) {
    return base::error_with_code_and_format(protocol::kErrorInvalidPlugIn,
                                            "the \"%@\" key is not supported on this platform",
                                            kPassProxyKey);
  }
  if (isHybrid()) return invalid("hybrid plug-ins are not supported on this platform");
  return std::nullopt;
}

}  // namespace vantrel::model
