// "match": discovery. Every installed plug-in that satisfies the host's
// rules, that the host may use and that the user has not excluded, one form
// per identifier unless the flags ask for more.

#include <functional>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "base/Log.h"
#include "daemon/Limits.h"
#include "daemon/MatchFilters.h"
#include "daemon/Transaction.h"
#include "daemon/VTDLmoClient.h"
#include "daemon/VTDServer.h"
#include "lmo/Message.h"
#include "lmo/Protocol.h"
#include "model/VersionComparison.h"
#include "platform/Probes.h"
#include "platform/SandboxCheck.h"

namespace vantrel::daemon {

using protocol::DiscoveryFlags;

std::string_view Form::identifier() const {
  const std::string* id = body.get(protocol::kFormIdentifier).getIfString();
  return id ? std::string_view(*id) : std::string_view();
}

namespace {

std::string versionText(const lmo::Value& version) {
  const std::string* text = version.getIfString();
  return text ? *text : std::string();
}

bool isSystemResident(const Form& form) {
  return form.body.get(protocol::kFormSystemResident) == lmo::Value::boolean(true);
}

// Whether P beats an earlier result E of its identifier and version.
bool isNewer(const registry::VTDPlugIn& plugIn, const Form& earlier) {
  if (plugIn.onSystemVolume() && !isSystemResident(earlier)) return true;
  return plugIn.lastModified() > earlier.body.get(protocol::kFormLastModified).integerValue();
}

void noteReplacements(const registry::VTDPlugIn& plugIn, const FormPtr& form, MatchState& state) {
  const lmo::Value replaced = plugIn.valueForEntitlement(registry::kReplacePlugInEntitlement);
  if (const std::string* one = replaced.getIfString()) {
    state.replacements[*one] = form;
  } else if (const lmo::Array* several = replaced.getIfArray()) {
    for (const lmo::Value& element : *several) {
      if (const std::string* id = element.getIfString()) state.replacements[*id] = form;
    }
  }
}

}  // namespace

bool passesLocation(const registry::VTDPlugIn& plugIn, DiscoveryFlags flags) {
  if (plugIn.onSystemVolume()) return true;
  return plugIn.containingUrl().has_value() && !protocol::has(flags, DiscoveryFlags::kSystemOnly);
}

bool passesDedication(const registry::VTDPlugIn& plugIn, const MatchHost& host) {
  if (!plugIn.isDedicated()) return true;
  const std::optional<std::string> plugIns =
      host.bundle ? host.bundle->plugInsPath() : std::nullopt;
  const std::optional<std::string> path = plugIn.path();
  return plugIns && path && path->starts_with(*plugIns);
}

const lmo::Dictionary* matchingExclusion(const registry::VTDPlugIn& plugIn,
                                         const lmo::Array& exclusions) {
  for (const lmo::Value& exclusion : exclusions) {
    const lmo::Dictionary* rule = exclusion.getIfDictionary();
    if (rule != nullptr && plugIn.match(*rule)) return rule;
  }
  return nullptr;
}

bool resolveDuplicates(const registry::VTDPlugIn& plugIn, const std::string& identifier,
                       MatchState& state) {
  const std::string version = versionText(plugIn.version());
  const bool keepVersions = protocol::has(state.flags, DiscoveryFlags::kVersions);
  const bool keepDuplicates =
      keepVersions && protocol::has(state.flags, DiscoveryFlags::kDuplicates);
  const auto same = state.byIdentifier.find(identifier);
  if (same == state.byIdentifier.end()) return true;
  std::vector<FormPtr>& forms = same->second;
  for (size_t i = 0; i < forms.size(); ++i) {
    const Form& earlier = *forms[i];
    const int c =
        model::compareVersionString(version, versionText(earlier.body.get(protocol::kFormVersion)));
    if (keepVersions && (c != 0 || keepDuplicates)) continue;
    const bool replaceEarlier = c > 0 || (c == 0 && isNewer(plugIn, earlier));
    if (replaceEarlier) {
      std::erase(state.results, forms[i]);
      forms.erase(forms.begin() + static_cast<ptrdiff_t>(i));
    }
    return replaceEarlier;
  }
  return true;
}

const char* duplicateRule(const Form& winner, const registry::VTDPlugIn& plugIn) {
  const int c = model::compareVersionString(versionText(winner.body.get(protocol::kFormVersion)),
                                            versionText(plugIn.version()));
  if (c > 0) return protocol::kRuleHigherVersion;
  if (isSystemResident(winner) && !plugIn.onSystemVolume()) return protocol::kRuleSystemVolume;
  if (winner.body.get(protocol::kFormLastModified).integerValue() > plugIn.lastModified()) {
    return protocol::kRuleMoreRecent;
  }
  return protocol::kRuleFoundFirst;
}

void Transaction::addAnnotationForPlugIn(const registry::VTDPlugIn& plugIn, lmo::Dictionary& in) {
  in = in.setting(protocol::kKeyAnnotations,
                  server()->annotationForPlugIn(plugIn).value_or(lmo::Dictionary()));
}

bool Transaction::keepCandidate(const registry::VTDPlugIn& plugIn, const MatchState& state,
                                const std::optional<lmo::Dictionary>& rules,
                                const MatchHost& host) {
  const bool all = protocol::has(state.flags, DiscoveryFlags::kAll);
  if (!all) {
    if (!passesLocation(plugIn, state.flags) || !passesDedication(plugIn, host) ||
        server()->holdOnPlugIn(plugIn)) {
      return false;
    }
  }
  if (!plugIn.match(rules)) return false;
  if (matchingExclusion(plugIn, state.exclusions) != nullptr) {
    server()->debug("client %d plugin %@ excluded", client()->pid(), plugIn.identifier());
    return false;
  }
  if (!all) {
    if (std::optional<std::string> reason = plugIn.allowForClient(host.host)) {
      server()->debug("client %d cannot use plugin %@: %@", client()->pid(), plugIn.identifier(),
                      *reason);
      return false;
    }
  }
  return true;
}

void Transaction::visitCandidate(const registry::VTDPlugIn& plugIn, MatchState& state,
                                 const std::optional<lmo::Dictionary>& rules, const MatchHost& host,
                                 FormDetail detail) {
  if (!keepCandidate(plugIn, state, rules, host)) return;
  base::Error error;
  lmo::Dictionary form = plugIn.exportForm(&error);
  if (!error.domain.empty()) server()->log("error matching %@: %@", plugIn.path(), error);
  if (form.empty()) return;
  if (!resolveDuplicates(plugIn, plugIn.identifier().value_or(""), state)) return;
  if (detail == FormDetail::kReply) {
    addAnnotationForPlugIn(plugIn, form);
    plugIn.augmentForm(form);
  }
  auto kept = std::make_shared<Form>(Form{std::move(form)});
  state.results.push_back(kept);
  state.byIdentifier[std::string(kept->identifier())].push_back(kept);
  noteReplacements(plugIn, kept, state);
}

bool Transaction::readMatchInput(std::optional<lmo::Dictionary>& rules, MatchState& state) {
  if (const lmo::Value* given = request().find(protocol::kKeyRules)) {
    const lmo::Dictionary* dictionary = given->getIfDictionary();
    if (dictionary == nullptr) {
      failMessage(protocol::kErrorBadRequest, "invalid request format (bad rules dictionary)");
      return false;
    }
    rules = lmo::propertyListFromMessage(*dictionary);
    if (!withinLimit(kRuleKeysName, rules->size(), kMaxRuleKeys)) return false;
    for (const auto& [key, pattern] : *rules) {
      const lmo::Array* list = pattern.getIfArray();
      const lmo::Dictionary* items = pattern.getIfDictionary();
      const size_t elements = list ? list->size() : items ? items->size() : 1;
      if (!withinLimit(kPatternElementsName, elements, kMaxPatternElements)) return false;
    }
  }
  state.flags =
      static_cast<DiscoveryFlags>(request().get(protocol::kKeyFlags).getIfUInt64().value_or(0));
  if (protocol::has(state.flags, DiscoveryFlags::kAll)) {
    const std::shared_ptr<lmo::Connection> peer = connection();
    if (!client()->hasEntitlement(protocol::kManagerEntitlement) ||
        platform::processIsSandboxed(client()->pid(), peer ? peer->pidfd() : -1)) {
      failMessage(protocol::kErrorAccessDenied, "unauthorized discovery flag (VTDiscoverAll)");
      return false;
    }
  }
  // Read once per request: another process may rewrite the preferences
  // between two requests, never within one.
  const lmo::Value exclusions = server()->userPrefs()->exclusions();
  if (const lmo::Array* list = exclusions.getIfArray()) state.exclusions = *list;
  return true;
}

void Transaction::runMatch(MatchState& state, const std::optional<lmo::Dictionary>& rules,
                           const MatchHost& host, FormDetail detail,
                           std::string_view onlyIdentifier) {
  std::optional<registry::VTDatabase::PlugInList> candidates = server()->findPlugIns(rules);
  probes::discoverRaw(candidates ? static_cast<unsigned>(candidates->size()) : 0u);
  if (!candidates) return;
  for (const registry::VTDPlugInPtr& plugIn : *candidates) {
    if (!onlyIdentifier.empty() && plugIn->identifier() != onlyIdentifier) continue;
    visitCandidate(*plugIn, state, rules, host, detail);
  }
}

void Transaction::matchPlugIns() {
  std::optional<lmo::Dictionary> rules;
  MatchState state;
  if (!readMatchInput(rules, state)) return;
  runMatch(state, rules, MatchHost{*client(), client()->bundle()}, FormDetail::kReply);
  for (const FormPtr& form : state.results) {
    auto replacing = state.replacements.find(form->identifier());
    if (replacing == state.replacements.end()) continue;
    form->body = form->body.setting(protocol::kKeyOverrider, replacing->second->body.get("uuid"));
    replacing->second->body = replacing->second->body.setting(
        protocol::kKeyOverriding, lmo::Value(std::string(form->identifier())));
  }
  std::vector<lmo::Value> forms;
  forms.reserve(state.results.size());
  for (const FormPtr& form : state.results) forms.emplace_back(form->body);
  // A version-2 client gets no "matches": it cannot read the forms.
  if (std::optional<lmo::Value> matches =
          lmo::convertToLMO(lmo::Value(lmo::Array(std::move(forms))), version())) {
    setReplyValue(protocol::kKeyMatches, std::move(*matches));
  }
  done();
}

}  // namespace vantrel::daemon
