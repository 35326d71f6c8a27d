#pragma once
// The filters of discovery, one function each, shared by "match" (which
// stops at the first a candidate fails) and "explain" (which runs them all
// and says which failed), so that the two can never disagree.

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "lmo/Protocol.h"
#include "lmo/Value.h"
#include "model/VTBundle.h"
#include "registry/VTDHost.h"
#include "registry/VTDPlugIn.h"

namespace vantrel::daemon {

// Who a match is made for: the requesting client, or, for "explain",
// another process or an application bundle.
struct MatchHost {
  const registry::VTDHost& host;
  // The host's executable bundle; null when it has none (then no dedicated
  // plug-in is offered to it).
  std::shared_ptr<model::VTBundle> bundle;
};

// A form in the result list. Shared, so that the replacement table and the
// list see the same object when replaced and replacing forms are marked.
struct Form {
  lmo::Dictionary body;
  std::string_view identifier() const;
};
using FormPtr = std::shared_ptr<Form>;

// One match request's working state, dropped at its end.
struct MatchState {
  protocol::DiscoveryFlags flags = protocol::DiscoveryFlags::kNone;
  std::vector<FormPtr> results;
  // Form identifier -> its forms in results, in results' order: duplicate
  // resolution looks only at these, not at every form so far.
  std::unordered_map<std::string, std::vector<FormPtr>> byIdentifier;
  // Replaced identifier -> the form of the plug-in that replaces it.
  std::map<std::string, FormPtr, std::less<>> replacements;
  lmo::Array exclusions;
};

// How much of a form a kept candidate gets: everything a reply carries
// (annotations, read tokens), or only the exported form, enough for
// duplicate resolution.
enum class FormDetail { kReply, kExportOnly };

// ---- The filters, in the order match applies them after the registry's
// election filter. Each is true when the plug-in passes. ----

// On the system volume, or inside an application unless only system
// plug-ins are asked for.
bool passesLocation(const registry::VTDPlugIn& plugIn, protocol::DiscoveryFlags flags);
// Not dedicated, or dedicated to the host's own application.
bool passesDedication(const registry::VTDPlugIn& plugIn, const MatchHost& host);
// The first of the user's exclusion rules the plug-in matches, or null.
const lmo::Dictionary* matchingExclusion(const registry::VTDPlugIn& plugIn,
                                         const lmo::Array& exclusions);

// ---- Duplicates ----

// Whether plugIn is to be kept in state's results: the first earlier result
// of its identifier that it does not sit beside is either beaten (and has
// then left the list) or beats it.
bool resolveDuplicates(const registry::VTDPlugIn& plugIn, const std::string& identifier,
                       MatchState& state);
// Why winner, a result of plugIn's identifier, beat plugIn: one of the
// protocol::kRuleX names.
const char* duplicateRule(const Form& winner, const registry::VTDPlugIn& plugIn);

}  // namespace vantrel::daemon
