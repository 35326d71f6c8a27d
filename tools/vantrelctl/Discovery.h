#pragma once
// What list, match, why and monitor share: the discovery flag options, the
// rules of --rule KEY=PATTERN, and the table of plug-in forms.

#include <optional>
#include <string>
#include <vector>

#include "lmo/Protocol.h"
#include "lmo/Value.h"
#include "tools/vantrelctl/Command.h"

namespace vantrel::ctl {

// --versions, --duplicates, --system (and --all where allowed).
std::vector<OptionSpec> discoveryOptions(bool withAll);
protocol::DiscoveryFlags discoveryFlags(const Arguments& arguments);

// rules plus each "--rule KEY=PATTERN" (a later one wins); nullopt after a
// usage complaint for a --rule without "=".
std::optional<lmo::Dictionary> addRuleOptions(lmo::Dictionary rules, const Arguments& arguments);

// Sends "match" and prints the forms found (table or JSON array). Returns
// the exit status; a refused --all says what it needs.
int runMatch(Context& context, const lmo::Dictionary& rules, protocol::DiscoveryFlags flags);

// Help text shared by list and match for the flags.
inline constexpr const char* kDiscoveryFlagHelp =
    "  --versions    keep every version of an identifier, not only the highest\n"
    "  --duplicates  with --versions, keep registrations of equal versions too\n"
    "  --system      only plug-ins on the system volume\n";
inline std::string allFlagHelp() {
  return "  --all         skip the location, dedication, hold and authorisation filters\n"
         "                (needs the entitlement \"" +
         std::string(protocol::kManagerEntitlement) +
         "\"\n"
         "                and an unsandboxed process)\n";
}

}  // namespace vantrel::ctl
