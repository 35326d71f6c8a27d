#include "tools/vantrelctl/Discovery.h"

#include <algorithm>
#include <cstdio>
#include <utility>

#include "tools/vantrelctl/ExitStatus.h"
#include "tools/vantrelctl/Output.h"
#include "tools/vantrelctl/PlugIn.h"

namespace vantrel::ctl {

using lmo::Dictionary;
using lmo::Value;
using protocol::DiscoveryFlags;

std::vector<OptionSpec> discoveryOptions(bool withAll) {
  std::vector<OptionSpec> specs = {
      {"versions", 0, false}, {"duplicates", 0, false}, {"system", 0, false}};
  if (withAll) specs.push_back({"all", 0, false});
  return specs;
}

DiscoveryFlags discoveryFlags(const Arguments& arguments) {
  DiscoveryFlags flags = DiscoveryFlags::kNone;
  if (arguments.has("versions")) flags = flags | DiscoveryFlags::kVersions;
  // Equal versions are only kept among all versions.
  if (arguments.has("duplicates")) {
    flags = flags | DiscoveryFlags::kVersions | DiscoveryFlags::kDuplicates;
  }
  if (arguments.has("system")) flags = flags | DiscoveryFlags::kSystemOnly;
  if (arguments.has("all")) flags = flags | DiscoveryFlags::kAll;
  return flags;
}

std::optional<lmo::Dictionary> addRuleOptions(lmo::Dictionary rules, const Arguments& arguments) {
  for (const std::string& rule : arguments.values("rule")) {
    const size_t eq = rule.find('=');
    if (eq == std::string::npos || eq == 0) {
      std::fprintf(stderr, "vantrelctl: --rule wants KEY=PATTERN, not \"%s\"\n", rule.c_str());
      return std::nullopt;
    }
    rules = rules.setting(rule.substr(0, eq), Value(rule.substr(eq + 1)));
  }
  return rules;
}

int runMatch(Context& context, const lmo::Dictionary& rules, DiscoveryFlags flags) {
  Dictionary message =
      Session::request(protocol::kRequestMatch)
          .setting(protocol::kKeyRules, Value(rules))
          .setting(protocol::kKeyFlags, Value::unsignedInteger(protocol::bits(flags)));
  Answer answer = context.session.call(message);
  if (!answer.ok()) {
    const int status = context.session.complain(answer);
    if (answer.code == protocol::kErrorAccessDenied && protocol::has(flags, DiscoveryFlags::kAll)) {
      std::fprintf(stderr,
                   "vantrelctl: --all needs the entitlement \"%s\" and an unsandboxed process\n",
                   std::string(protocol::kManagerEntitlement).c_str());
    }
    return status;
  }
  const lmo::Array* matches = answer.reply.get(protocol::kKeyMatches).getIfArray();
  const lmo::Array forms = matches != nullptr ? *matches : lmo::Array();
  if (context.global.json) {
    printJson(Value(forms));
    return kExitOk;
  }
  // People read the table by identifier; the daemon's order is the
  // registry's.
  std::vector<Dictionary> sorted;
  for (const Value& value : forms) {
    if (const Dictionary* form = value.getIfDictionary()) sorted.push_back(*form);
  }
  std::stable_sort(sorted.begin(), sorted.end(), [](const Dictionary& a, const Dictionary& b) {
    return std::make_pair(cell(a.get(protocol::kFormIdentifier)),
                          cell(a.get(protocol::kFormPath))) <
           std::make_pair(cell(b.get(protocol::kFormIdentifier)), cell(b.get(protocol::kFormPath)));
  });
  Table table({"IDENTIFIER", "VERSION", "POINT", "ELECTION", "WHERE", "PATH"});
  for (const Dictionary& entry : sorted) {
    const Dictionary* form = &entry;
    table.add({cell(form->get(protocol::kFormIdentifier)), cell(form->get(protocol::kFormVersion)),
               formPoint(*form), std::to_string(formElection(*form)), formWhere(*form),
               cell(form->get(protocol::kFormPath))});
  }
  table.print(stdout, !context.global.noLegend);
  if (!context.global.noLegend) {
    std::printf("\n%zu plug-in%s listed.\n", forms.size(), forms.size() == 1 ? "" : "s");
  }
  return kExitOk;
}

}  // namespace vantrel::ctl
