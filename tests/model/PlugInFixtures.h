#pragma once
// Building blocks for plug-in model tests.

#include <memory>
#include <string>

#include "lmo/Value.h"
#include "model/VTPlugInCore.h"

namespace vantrel::model::testing {

inline lmo::Value I(int64_t i) {
  return lmo::Value::integer(i);
}

// A bundle info dictionary whose "QXExtension" is extension, plus extras.
inline lmo::Dictionary bundleInfo(lmo::Dictionary extension, lmo::Dictionary extras = {}) {
  return extras.setting("QXExtension", lmo::Value(std::move(extension)));
}

// A record named "p" built from bundle info at path; null when that fails.
inline std::shared_ptr<VTPlugInCore> recordAt(const std::string& path, lmo::Dictionary info,
                                              std::optional<base::Uuid> uuid = std::nullopt) {
  return VTPlugInCore::initWithName("p", FileUrl::fromPath(path), lmo::Value(std::move(info)),
                                    lmo::Value(), uuid);
}

}  // namespace vantrel::model::testing
