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
#include "client/VTDaemonClient.h"
#include "daemon/Transaction.h"
#include "daemon/VTDLmoClient.h"
#include "daemon/VTDServer.h"
#include "lmo/Message.h"
#include "model/VersionComparison.h"
#include "platform/Probes.h"
#include "platform/SandboxCheck.h"

namespace vantrel::daemon {

// A form in the result list. Shared, so that the replacement table and the
// list see the same object when step 7 marks replaced and replacing forms.
struct Form {
  lmo::Dictionary body;
  std::string_view identifier() const {
    const std::string* id = body.get("identifier").getIfString();
    return id ? std::string_view(*id) : std::string_view();
  }
};
using FormPtr = std::shared_ptr<Form>;

struct MatchState {
  uint64_t flags = 0;
  std::vector<FormPtr> results;
  // Replaced identifier -> the form of the plug-in that replaces it.
  std::map<std::string, FormPtr, std::less<>> replacements;
  lmo::Array exclusions;
};

namespace {

// Discovery flags; other bits are ignored.
constexpr uint64_t kDiscoverVersions = 0x1;
constexpr uint64_t kDiscoverDuplicates = 0x4;
constexpr uint64_t kDiscoverSystemOnly = 0x8;
constexpr uint64_t kDiscoverAll = 0x200;

constexpr std::string_view kManagerEntitlement = "com.karvo.private.vantrel.manager";

std::string versionText(const lmo::Value& version) {
  const std::string* text = version.getIfString();
  return text ? *text : std::string();
}

// Whether P beats an earlier result E of its identifier and version.
bool isNewer(const registry::VTDPlugIn& plugIn, const Form& earlier) {
  if (plugIn.onSystemVolume() &&
      !(earlier.body.get("systemResident") == lmo::Value::boolean(true))) {
    return true;
  }
  return plugIn.lastModified() > earlier.body.get("lastmodified").integerValue();
}

// Duplicate resolution: true when P is to be kept (an earlier result it
// beats has then left the list).
bool resolveDuplicates(const registry::VTDPlugIn& plugIn, const std::string& identifier,
                       MatchState& state) {
  const std::string version = versionText(plugIn.version());
  const bool keepVersions = (state.flags & kDiscoverVersions) != 0;
  const bool keepDuplicates = keepVersions && (state.flags & kDiscoverDuplicates) != 0;
  for (size_t i = 0; i < state.results.size(); ++i) {
    const Form& earlier = *state.results[i];
    if (earlier.identifier() != identifier) continue;
    const int c = model::compareVersionString(version, versionText(earlier.body.get("version")));
    if (keepVersions && (c != 0 || keepDuplicates)) continue;
    const bool replaceEarlier = c > 0 || (c == 0 && isNewer(plugIn, earlier));
    if (replaceEarlier) state.results.erase(state.results.begin() + static_cast<ptrdiff_t>(i));
    return replaceEarlier;
  }
  return true;
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

void Transaction::addAnnotationForPlugIn(const registry::VTDPlugIn& plugIn, lmo::Dictionary& in) {
  in = in.setting("annotations", server()->annotationForPlugIn(plugIn).value_or(lmo::Dictionary()));
}

bool Transaction::keepCandidate(const registry::VTDPlugIn& plugIn, uint64_t flags,
                                const lmo::Array& exclusions,
                                const std::optional<lmo::Dictionary>& rules) {
  const bool all = (flags & kDiscoverAll) != 0;
  if (!all) {
    if (!plugIn.onSystemVolume() &&
        (!plugIn.containingUrl() || (flags & kDiscoverSystemOnly) != 0)) {
      return false;
    }
    if (plugIn.isDedicated()) {
      const auto& bundle = client()->bundle();
      const std::optional<std::string> plugIns = bundle ? bundle->plugInsPath() : std::nullopt;
      const std::optional<std::string> path = plugIn.path();
      if (!plugIns || !path || !path->starts_with(*plugIns)) return false;
    }
    if (server()->holdOnPlugIn(plugIn)) return false;
  }
  if (!plugIn.match(rules)) return false;
  for (const lmo::Value& exclusion : exclusions) {
    const lmo::Dictionary* rule = exclusion.getIfDictionary();
    if (rule != nullptr && plugIn.match(*rule)) {
      server()->debug("client %d plugin %@ excluded", client()->pid(), plugIn.identifier());
      return false;
    }
  }
  if (!all) {
    if (std::optional<std::string> reason = plugIn.allowForClient(*client())) {
      server()->debug("client %d cannot use plugin %@: %@", client()->pid(), plugIn.identifier(),
                      *reason);
      return false;
    }
  }
  return true;
}

void Transaction::visitCandidate(const registry::VTDPlugIn& plugIn, MatchState& state,
                                 const std::optional<lmo::Dictionary>& rules) {
  if (!keepCandidate(plugIn, state.flags, state.exclusions, rules)) return;
  base::Error error;
  lmo::Dictionary form = plugIn.exportForm(&error);
  if (!error.domain.empty()) server()->log("error matching %@: %@", plugIn.path(), error);
  if (form.empty()) return;
  if (!resolveDuplicates(plugIn, plugIn.identifier().value_or(""), state)) return;
  addAnnotationForPlugIn(plugIn, form);
  plugIn.augmentForm(form);
  auto kept = std::make_shared<Form>(Form{std::move(form)});
  state.results.push_back(kept);
  noteReplacements(plugIn, kept, state);
}

void Transaction::matchPlugIns() {
  std::optional<lmo::Dictionary> rules;
  if (const lmo::Value* given = request().find("rules")) {
    const lmo::Dictionary* dictionary = given->getIfDictionary();
    if (dictionary == nullptr) {
      failMessage(base::kErrorBadRequest, "invalid request format (bad rules dictionary)");
      return;
    }
    rules = lmo::propertyListFromMessage(*dictionary);
  }
  MatchState state;
  state.flags = request().get("flags").getIfUInt64().value_or(0);
  if ((state.flags & kDiscoverAll) != 0) {
    const std::shared_ptr<lmo::Connection> peer = connection();
    if (!client()->hasEntitlement(kManagerEntitlement) ||
        platform::processIsSandboxed(client()->pid(), peer ? peer->pidfd() : -1)) {
      failMessage(base::kErrorAccessDenied, "unauthorized discovery flag (VTDiscoverAll)");
      return;
    }
  }
  // Read once per request: another process may rewrite the preferences
  // between two requests, never within one.
  const lmo::Value exclusions = server()->userPrefs()->exclusions();
  if (const lmo::Array* list = exclusions.getIfArray()) {
    state.exclusions = *list;
  }
  std::optional<registry::VTDatabase::PlugInList> candidates = server()->findPlugIns(rules);
  probes::discoverRaw(candidates ? static_cast<unsigned>(candidates->size()) : 0u);
  if (candidates) {
    for (const registry::VTDPlugInPtr& plugIn : *candidates) visitCandidate(*plugIn, state, rules);
  }
  for (const FormPtr& form : state.results) {
    auto replacing = state.replacements.find(form->identifier());
    if (replacing == state.replacements.end()) continue;
    form->body = form->body.setting("overrider", replacing->second->body.get("uuid"));
    replacing->second->body =
        replacing->second->body.setting("overriding", lmo::Value(std::string(form->identifier())));
  }
  std::vector<lmo::Value> forms;
  forms.reserve(state.results.size());
  for (const FormPtr& form : state.results) forms.emplace_back(form->body);
  // A version-2 client gets no "matches": it cannot read the forms.
  if (std::optional<lmo::Value> matches = client::VTDaemonClient::convertToLMO(
          lmo::Value(lmo::Array(std::move(forms))), version())) {
    setReplyValue("matches", std::move(*matches));
  }
  done();
}

}  // namespace vantrel::daemon
