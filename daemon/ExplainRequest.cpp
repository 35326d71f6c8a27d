// "explain": why a host is or is not offered a plug-in, filter by filter,
// and, without a plug-in, the daemon's own state. Every filter is the one
// "match" runs (daemon/MatchFilters.h), so an explanation cannot drift from
// what discovery does.

#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/Format.h"
#include "daemon/MatchFilters.h"
#include "daemon/Transaction.h"
#include "daemon/VTDLmoClient.h"
#include "daemon/VTDPlugInHold.h"
#include "daemon/VTDServer.h"
#include "lmo/Message.h"
#include "lmo/Protocol.h"
#include "platform/CodeSigning.h"
#include "platform/ScopedFd.h"
#include "registry/Discovery.h"

namespace vantrel::daemon {

namespace {

using lmo::Array;
using lmo::Dictionary;
using lmo::Value;
using protocol::DiscoveryFlags;

// A host that is not the requesting client: another running process, or an
// application bundle as if it ran.
class NamedHost : public registry::VTDHost {
 public:
  explicit NamedHost(platform::CodeSigningTaskPtr task) : task_(std::move(task)) {}
  pid_t pid() const override { return task_->pid(); }
  Value entitlementValueForKey(std::string_view key) const override {
    return task_->entitlements().get(key);
  }
  bool hasEntitlement(std::string_view key) const override {
    return granted(entitlementValueForKey(key));
  }

 private:
  const platform::CodeSigningTaskPtr task_;
};

struct Step {
  const char* filter;
  bool passed;
  std::string text;
  const char* reason;  // the verdict when this is the first step that fails
};

Value stepsValue(const std::vector<Step>& steps) {
  std::vector<Value> out;
  out.reserve(steps.size());
  for (const Step& step : steps) {
    out.emplace_back(Dictionary{{protocol::kKeyFilter, Value(step.filter)},
                                {protocol::kKeyPassed, Value::boolean(step.passed)},
                                {protocol::kKeyText, Value(step.text)}});
  }
  return Value(Array(std::move(out)));
}

std::string describeRule(const Dictionary& rule) {
  return lmo::describe(Value(rule));
}

std::string electionDescription(int64_t election) {
  return election == 0 ? std::string("0 (not elected)") : std::to_string(election);
}

// The empty-result reply's reason and text for a selector that names
// nothing registered.
Dictionary notFound(const char* reason, std::string text) {
  return Dictionary{{protocol::kKeyPlugIns, Value(Array())},
                    {protocol::kKeyReason, Value(reason)},
                    {protocol::kKeyText, Value(std::move(text))}};
}

}  // namespace

void Transaction::explainPlugIn() {
  const Dictionary& body = request();
  const Value* uuid = body.find(protocol::kKeyUuid);
  const Value* path = body.find(protocol::kKeyPath);
  const Value* identifier = body.find(protocol::kKeyIdentifier);
  const int selectors = (uuid != nullptr) + (path != nullptr) + (identifier != nullptr);
  if (selectors > 1 || (uuid != nullptr && uuid->getIfUuid() == nullptr) ||
      (path != nullptr && path->getIfString() == nullptr) ||
      (identifier != nullptr && identifier->getIfString() == nullptr)) {
    failMessage(protocol::kErrorBadRequest,
                "invalid request format (name one plug-in by uuid, path or identifier)");
    return;
  }
  if (selectors == 0) {
    setReplyValue(protocol::kKeyStatus, Value(explainStatus()));
    done();
    return;
  }

  std::optional<Dictionary> rules;
  MatchState state;
  if (!readMatchInput(rules, state)) return;

  // The host: the sender, unless another process or a bundle is named,
  // which only a manager may ask about.
  const Value* pidValue = body.find(protocol::kKeyPid);
  const Value* hostPathValue = body.find(protocol::kKeyHostPath);
  const std::optional<uint64_t> pid = pidValue ? pidValue->getIfUInt64() : std::nullopt;
  const std::string* hostPath = hostPathValue ? hostPathValue->getIfString() : nullptr;
  if ((pidValue != nullptr && !pid) || (hostPathValue != nullptr && hostPath == nullptr) ||
      (pid && hostPath != nullptr)) {
    failMessage(protocol::kErrorBadRequest,
                "invalid request format (name the host by pid or by hostpath)");
    return;
  }
  const bool otherHost =
      hostPath != nullptr || (pid && *pid != static_cast<uint64_t>(client()->pid()));
  if (otherHost && !client()->hasEntitlement(protocol::kManagerEntitlement)) {
    failMessage(protocol::kErrorAccessDenied,
                base::format("explaining for another host requires the \"%s\" entitlement",
                             std::string(protocol::kManagerEntitlement).c_str()));
    return;
  }
  std::unique_ptr<NamedHost> named;
  std::shared_ptr<model::VTBundle> hostBundle = client()->bundle();
  if (otherHost) {
    const pid_t hostPid = static_cast<pid_t>(pid.value_or(0));
    base::Result<platform::CodeSigningTaskPtr> task = [&] {
      if (hostPath != nullptr) return platform::CodeSigningTask::createForBundle(*hostPath);
      platform::ScopedFd pidfd(static_cast<int>(::syscall(SYS_pidfd_open, hostPid, 0)));
      return platform::CodeSigningTask::create(hostPid, pidfd.get());
    }();
    if (!task.has_value()) {
      failMessage(protocol::kErrorBadRequest,
                  base::format("cannot identify the host: %@", task.error().description()));
      return;
    }
    hostBundle = hostPath != nullptr
                     ? model::VTBundle::initWithPath(*hostPath)
                     : model::VTBundle::initWithExecutableURL(
                           model::FileUrl::fromPath(task.value()->executablePath()));
    named = std::make_unique<NamedHost>(std::move(task).value());
  }
  const MatchHost host{named ? static_cast<const registry::VTDHost&>(*named)
                             : static_cast<const registry::VTDHost&>(*client()),
                       hostBundle};

  // The registrations the selector names, in the registry's order.
  std::vector<omnidex::PlugInRecordPtr> records;
  omnidex::Workspace& registry = *server()->workspace();
  if (uuid != nullptr) {
    if (omnidex::PlugInRecordPtr record = registry.plugInForUuid(*uuid->getIfUuid())) {
      records.push_back(std::move(record));
    }
  } else if (path != nullptr) {
    const std::optional<std::string> canonical = canonicalPath(*path->getIfString(), *connection());
    if (!canonical) {
      replyWith(notFound(protocol::kReasonNotInstalled,
                         base::format("nothing is installed at %@", *path->getIfString())));
      return;
    }
    if (omnidex::PlugInRecordPtr record = registry.plugInForUrl(*canonical)) {
      records.push_back(std::move(record));
    } else {
      replyWith(notFound(protocol::kReasonNotRegistered,
                         base::format("the bundle at %@ is not registered", *canonical)));
      return;
    }
  } else if (std::optional<std::vector<omnidex::PlugInRecordPtr>> all =
                 registry.installedPlugIns()) {
    for (omnidex::PlugInRecordPtr& record : *all) {
      if (record->identifier == *identifier->getIfString()) records.push_back(std::move(record));
    }
  }
  if (records.empty()) {
    const std::string name =
        uuid != nullptr ? uuid->getIfUuid()->string() : *identifier->getIfString();
    replyWith(
        notFound(protocol::kReasonNotInstalled, base::format("no plug-in %@ is installed", name)));
    return;
  }
  std::vector<Value> explanations;
  for (const omnidex::PlugInRecordPtr& record : records) {
    explanations.emplace_back(explainRecord(record, rules, state, host));
  }
  setReplyValue(protocol::kKeyPlugIns, Value(Array(std::move(explanations))));
  done();
}

void Transaction::replyWith(const lmo::Dictionary& keys) {
  for (const auto& [key, value] : keys) setReplyValue(key, value);
  done();
}

Dictionary Transaction::explainStatus() {
  // Hold tokens release holds whoever presents them, so only the daemon's
  // own user, root and managers see them.
  const std::shared_ptr<lmo::Connection> peer = connection();
  const uid_t uid = peer ? peer->uid() : static_cast<uid_t>(-1);
  const bool seesTokens =
      uid == 0 || uid == ::geteuid() || client()->hasEntitlement(protocol::kManagerEntitlement);
  std::vector<Value> holds;
  for (const VTDPlugInHoldPtr& hold : server()->holds()) {
    const std::shared_ptr<VTDLmoClient> holder = hold->client();
    Dictionary entry{{protocol::kKeyPid,
                      Value::unsignedInteger(static_cast<uint64_t>(holder ? holder->pid() : 0))},
                     {protocol::kKeyPlugInCount, Value::unsignedInteger(hold->blocked().size())},
                     {protocol::kKeyCreated, Value(hold->created())}};
    if (seesTokens) entry = entry.setting(protocol::kKeyToken, Value(hold->uuid()));
    holds.emplace_back(std::move(entry));
  }
  const std::optional<std::vector<omnidex::PlugInRecordPtr>> installed =
      server()->workspace()->installedPlugIns();
  return Dictionary{
      {protocol::kKeyVersion, Value::unsignedInteger(protocol::kCurrentVersion)},
      {protocol::kKeyInstalled, Value::unsignedInteger(installed ? installed->size() : 0)},
      {protocol::kKeyHolds, Value(Array(std::move(holds)))}};
}

Dictionary Transaction::explainRecord(const omnidex::PlugInRecordPtr& record,
                                      const std::optional<Dictionary>& rules, MatchState& state,
                                      const MatchHost& host) {
  Dictionary out{{protocol::kKeyUuid, Value(record->uuid)},
                 {protocol::kKeyPath, Value(record->bundlePath.value_or(""))},
                 {protocol::kKeyIdentifier, Value(record->identifier.value_or(""))},
                 {protocol::kKeyEntitlements, Value(record->entitlements)}};
  if (record->dataContainerPath) {
    out = out.setting(protocol::kKeyContainer, Value(*record->dataContainerPath));
  }
  const registry::VTDPlugInPtr plugIn = server()->plugInForProxy(record);
  if (!plugIn) {
    const std::optional<base::Error> problem = registry::VTDPlugIn::recordProblem(record);
    return out.setting(protocol::kKeyOffered, Value::boolean(false))
        .setting(protocol::kKeyReason, Value(protocol::kReasonMisconfigured))
        .setting(protocol::kKeyText,
                 Value(base::format("mis-configured: %@",
                                    problem ? problem->description() : std::string("unknown"))))
        .setting(protocol::kKeySteps, Value(Array()));
  }
  base::Error exportError;
  out = out.setting(protocol::kKeyForm, Value(plugIn->exportForm(&exportError)))
            .setting(protocol::kKeyVersion, plugIn->version());
  const Dictionary annotation = server()->annotationForPlugIn(*plugIn).value_or(Dictionary());
  const int64_t election = annotation.get(protocol::kAnnotationElection).integerValue();
  out = out.setting(protocol::kKeyAnnotations, Value(annotation))
            .setting(protocol::kKeyElection, Value::integer(election));

  const bool all = protocol::has(state.flags, DiscoveryFlags::kAll);
  const std::string skipped = "not applied: all plug-ins were asked for";
  std::vector<Step> steps;

  // The registry's election filter comes first in discovery.
  {
    const std::optional<std::vector<std::string>> filter =
        registry::electionFilterFor(rules ? rules->get(registry::kUserElectionKey) : Value());
    const bool passed =
        !filter || registry::electionFilterAccepts(*filter, record->identifier.value_or(""),
                                                   record->entitlements, *server()->annotations());
    steps.push_back(
        {protocol::kFilterElection, passed,
         filter
             ? base::format("election %@; the rules ask for %@", electionDescription(election),
                            rules->get(registry::kUserElectionKey))
             : base::format("election %@; the rules ask for none", electionDescription(election)),
         protocol::kReasonElection});
  }
  {
    const bool passed = all || passesLocation(*plugIn, state.flags);
    std::string text =
        all                        ? skipped
        : plugIn->onSystemVolume() ? std::string("on the system volume")
        : plugIn->containingUrl()
            ? (passed ? base::format("inside the application %@", plugIn->containingUrl()->path())
                      : std::string("inside an application, but only system plug-ins were "
                                    "asked for"))
            : std::string("outside any application and not on the system volume");
    steps.push_back(
        {protocol::kFilterLocation, passed, std::move(text), protocol::kReasonLocation});
  }
  {
    const bool passed = all || passesDedication(*plugIn, host);
    std::string text = all                      ? skipped
                       : !plugIn->isDedicated() ? std::string("not dedicated")
                       : passed
                           ? std::string("dedicated to the host's own application")
                           : base::format("dedicated to its application %@",
                                          plugIn->containingUrl() ? plugIn->containingUrl()->path()
                                                                  : std::string("(none)"));
    steps.push_back(
        {protocol::kFilterDedication, passed, std::move(text), protocol::kReasonDedicated});
  }
  {
    const VTDPlugInHoldPtr hold = all ? nullptr : server()->holdFor(*plugIn);
    std::string text = all ? skipped : std::string("no hold");
    if (hold) {
      const std::shared_ptr<VTDLmoClient> holder = hold->client();
      const pid_t holderPid = holder ? holder->pid() : 0;
      text = base::format("on hold %@ taken by pid %d", hold->uuid().string(), holderPid);
      out = out.setting(
          protocol::kKeyHold,
          Value(Dictionary{
              {protocol::kKeyToken, Value(hold->uuid())},
              {protocol::kKeyPid, Value::unsignedInteger(static_cast<uint64_t>(holderPid))}}));
    }
    steps.push_back(
        {protocol::kFilterHold, hold == nullptr, std::move(text), protocol::kReasonOnHold});
  }
  {
    const bool passed = plugIn->match(rules);
    steps.push_back({protocol::kFilterRules, passed,
                     !rules || rules->empty() ? std::string("no rules given")
                     : passed                 ? base::format("matches %@", Value(*rules))
                                              : base::format("does not match %@", Value(*rules)),
                     protocol::kReasonRules});
  }
  {
    const Dictionary* exclusion = matchingExclusion(*plugIn, state.exclusions);
    if (exclusion != nullptr) out = out.setting(protocol::kKeyExclusion, Value(*exclusion));
    steps.push_back({protocol::kFilterExclusions, exclusion == nullptr,
                     exclusion
                         ? base::format("excluded by the user's rule %@", describeRule(*exclusion))
                         : std::string("matches none of the user's exclusions"),
                     protocol::kReasonExcluded});
  }
  {
    const std::optional<std::string> refusal =
        all ? std::nullopt : plugIn->allowForClient(host.host);
    steps.push_back({protocol::kFilterAuthorisation, !refusal,
                     all       ? skipped
                     : refusal ? *refusal
                               : std::string("the host may use it"),
                     protocol::kReasonHostAuthorisation});
  }
  const auto failed =
      std::find_if(steps.begin(), steps.end(), [](const Step& s) { return !s.passed; });
  if (failed == steps.end()) {
    // Passing every filter, it is offered unless another registration of
    // its identifier wins: run the match for that identifier as match would.
    MatchState run;
    run.flags = state.flags;
    run.exclusions = state.exclusions;
    const std::string id = plugIn->identifier().value_or("");
    runMatch(run, rules, host, FormDetail::kExportOnly, id);
    const std::string mine = plugIn->uuid() ? plugIn->uuid()->string() : std::string();
    const FormPtr* winner = nullptr;
    bool kept = false;
    for (const FormPtr& form : run.results) {
      if (form->identifier() != id) continue;
      const std::string* uuidText = form->body.get(protocol::kFormUuid).getIfString();
      if (uuidText != nullptr && *uuidText == mine) {
        kept = true;
        break;
      }
      if (winner == nullptr) winner = &form;
    }
    std::string text = "no other registration of its identifier beats it";
    if (!kept && winner != nullptr) {
      const Form& beat = **winner;
      const char* rule = duplicateRule(beat, *plugIn);
      text = base::format("another registration of %@ is offered instead: %@ (%@), by %s", id,
                          beat.body.get(protocol::kFormPath), beat.body.get(protocol::kFormVersion),
                          rule);
      out = out.setting(
          protocol::kKeyBeatenBy,
          Value(Dictionary{{protocol::kKeyUuid, beat.body.get(protocol::kFormUuid)},
                           {protocol::kKeyPath, beat.body.get(protocol::kFormPath)},
                           {protocol::kKeyVersion, beat.body.get(protocol::kFormVersion)},
                           {protocol::kKeyRule, Value(rule)}}));
    }
    steps.push_back({protocol::kFilterDuplicates, kept || winner == nullptr, std::move(text),
                     protocol::kReasonDuplicate});
  }
  const auto first =
      std::find_if(steps.begin(), steps.end(), [](const Step& s) { return !s.passed; });
  const bool offered = first == steps.end();
  return out.setting(protocol::kKeyOffered, Value::boolean(offered))
      .setting(protocol::kKeyReason, Value(offered ? protocol::kReasonOffered : first->reason))
      .setting(protocol::kKeyText,
               Value(offered ? std::string("offered to the host") : first->text))
      .setting(protocol::kKeySteps, stepsValue(steps));
}

}  // namespace vantrel::daemon
