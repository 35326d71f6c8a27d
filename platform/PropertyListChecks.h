#pragma once
// Checks that property-list input must pass before libplist parses it, and
// the errors they and the reader share. Internal to the property-list reader.

#include <optional>
#include <string>
#include <string_view>

#include "base/Result.h"
#include "platform/PropertyList.h"

namespace vantrel::platform::plist_checks {

base::Error plistError(int64_t code, std::string message);
base::Error malformed(const char* what);
base::Error tooDeep();
base::Error tooManyObjects();

// XML: checked against the property-list grammar with nesting bounded, and
// returned rewritten without comments, processing instructions or document
// type, so that libplist parses only markup this check has understood.
base::Result<std::string> preflightXml(std::string_view input);

// Binary: the object graph walked without recursion, depth and expanded
// object count bounded, scalars checked. nullopt when libplist may parse it.
std::optional<base::Error> preflightBinary(std::string_view input);

}  // namespace vantrel::platform::plist_checks
