#pragma once
// Making the registry's records from what was read from a bundle or the
// store. Records are immutable: every change makes a new one.

#include <optional>
#include <string>

#include "base/Uuid.h"
#include "lmo/Value.h"
#include "omnidex/BundleReader.h"
#include "omnidex/Records.h"

namespace vantrel::omnidex {

// What the registry assigns to a plug-in rather than reads from it.
struct PlugInIdentity {
  base::Uuid uuid;
  std::string originalIdentifier;
  lmo::Date registrationDate;
};

PlugInRecordPtr makePlugInRecord(const std::string& path, const PlugInInfo& metadata,
                                 const lmo::Dictionary& entitlements,
                                 const PlugInIdentity& identity,
                                 ApplicationRecordPtr containingApplication,
                                 std::optional<std::string> dataContainerPath);

// A copy of record that belongs to application (which may be null) and, when
// date is given, carries that registration date.
PlugInRecordPtr rebuildPlugInRecord(const PlugInRecord& record,
                                    ApplicationRecordPtr containingApplication,
                                    std::optional<lmo::Date> date = std::nullopt);

// An application record; info nullopt makes a placeholder.
ApplicationRecordPtr makeApplicationRecord(const std::string& path,
                                           const std::optional<lmo::Dictionary>& info);

// Now, as a registration date.
lmo::Date currentDate();

}  // namespace vantrel::omnidex
