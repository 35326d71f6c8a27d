// vantrelctl why: whether a host is offered a plug-in, filter by filter.

#include <cstdio>
#include <cstdlib>
#include <filesystem>

#include "lmo/Json.h"
#include "lmo/Protocol.h"
#include "tools/vantrelctl/Discovery.h"
#include "tools/vantrelctl/ExitStatus.h"
#include "tools/vantrelctl/Output.h"
#include "tools/vantrelctl/PlugIn.h"

namespace vantrel::ctl {
namespace {

using lmo::Dictionary;
using lmo::Value;

// The request keys that name the host, the rules and the flags; nullopt
// after a usage complaint.
std::optional<Dictionary> explainRequest(const Arguments& arguments) {
  Dictionary request;
  const std::optional<std::string> host = arguments.value("host");
  const std::optional<std::string> bundle = arguments.value("host-bundle");
  if (host && bundle) {
    std::fputs("vantrelctl: name the host by --host or by --host-bundle, not both\n", stderr);
    return std::nullopt;
  }
  if (host) {
    char* end = nullptr;
    const unsigned long long pid = std::strtoull(host->c_str(), &end, 10);
    if (host->empty() || *end != '\0' || (*host)[0] == '-' || pid == 0) {
      std::fprintf(stderr, "vantrelctl: --host wants a process id, not \"%s\"\n", host->c_str());
      return std::nullopt;
    }
    request = request.setting(protocol::kKeyPid, Value::unsignedInteger(pid));
  }
  if (bundle) {
    std::error_code ec;
    const std::filesystem::path absolute = std::filesystem::absolute(*bundle, ec);
    request = request.setting(protocol::kKeyHostPath,
                              Value(ec ? *bundle : absolute.lexically_normal().string()));
  }
  Dictionary rules;
  if (std::optional<std::string> point = arguments.value("point")) {
    rules = rules.setting(kExtensionPointKey, Value(*point));
  }
  std::optional<Dictionary> all = addRuleOptions(rules, arguments);
  if (!all) return std::nullopt;
  if (!all->empty()) request = request.setting(protocol::kKeyRules, Value(*all));
  const protocol::DiscoveryFlags flags = discoveryFlags(arguments);
  if (flags != protocol::DiscoveryFlags::kNone) {
    request = request.setting(protocol::kKeyFlags, Value::unsignedInteger(protocol::bits(flags)));
  }
  return request;
}

void printDetails(const Dictionary& e) {
  if (const Dictionary* hold = e.get(protocol::kKeyHold).getIfDictionary()) {
    std::printf("Hold:       token %s, holder pid %s\n",
                cell(hold->get(protocol::kKeyToken)).c_str(),
                cell(hold->get(protocol::kKeyPid)).c_str());
  }
  if (const Dictionary* beat = e.get(protocol::kKeyBeatenBy).getIfDictionary()) {
    std::printf(
        "Beaten by:  %s version %s at %s (rule %s)\n", cell(beat->get(protocol::kKeyUuid)).c_str(),
        cell(beat->get(protocol::kKeyVersion)).c_str(), cell(beat->get(protocol::kKeyPath)).c_str(),
        cell(beat->get(protocol::kKeyRule)).c_str());
  }
  if (const Value* exclusion = e.find(protocol::kKeyExclusion)) {
    std::printf("Exclusion:  %s\n", lmo::toJson(*exclusion).c_str());
  }
}

int run(Context& context) {
  std::optional<Dictionary> request = explainRequest(context.arguments);
  if (!request) return kExitUsage;
  Resolution resolved = resolvePlugIn(context.session, context.arguments.operands()[0], *request);
  if (!resolved.explanation) return resolved.status;
  const Dictionary& e = *resolved.explanation;
  if (context.global.json) {
    printJson(Value(e));
    return kExitOk;
  }
  const bool offered = e.get(protocol::kKeyOffered).boolValue();
  std::printf(
      "%s %s (%s): %s: %s\n", cell(e.get(protocol::kKeyIdentifier)).c_str(),
      cell(e.get(protocol::kKeyVersion)).c_str(), cell(e.get(protocol::kKeyUuid)).c_str(),
      offered ? "offered" : ("not offered (" + cell(e.get(protocol::kKeyReason)) + ")").c_str(),
      cell(e.get(protocol::kKeyText)).c_str());
  Table steps({"FILTER", "RESULT", "DETAIL"});
  if (const lmo::Array* list = e.get(protocol::kKeySteps).getIfArray()) {
    for (const Value& step : *list) {
      const Dictionary* s = step.getIfDictionary();
      if (s == nullptr) continue;
      steps.add({cell(s->get(protocol::kKeyFilter)),
                 s->get(protocol::kKeyPassed).boolValue() ? "passed" : "failed",
                 cell(s->get(protocol::kKeyText))});
    }
  }
  if (!steps.empty()) {
    std::printf("\n");
    steps.print(stdout, !context.global.noLegend);
  }
  const bool details = e.contains(protocol::kKeyHold) || e.contains(protocol::kKeyBeatenBy) ||
                       e.contains(protocol::kKeyExclusion);
  if (details) std::printf("\n");
  printDetails(e);
  return kExitOk;
}

}  // namespace

Command whyCommand() {
  std::vector<OptionSpec> options = discoveryOptions(false);
  options.insert(
      options.end(),
      {{"host", 0, true}, {"host-bundle", 0, true}, {"point", 0, true}, {"rule", 0, true}});
  return {
      "why",
      "why PLUGIN [--host PID | --host-bundle PATH] [--point ID] [--rule KEY=PATTERN]... "
      "[--versions] [--duplicates] [--system]",
      "explain whether a host is offered a plug-in, and why not",
      std::string("Runs, for one plug-in, every filter that discovery runs, and prints the\n"
                  "verdict first, then each filter with passed or failed and its detail,\n"
                  "then what stands in the way: the hold (token and holder pid), the\n"
                  "registration that beats a duplicate and by which rule, the user's\n"
                  "exclusion that matched. --json prints the daemon's explanation.\n"
                  "Exits 0 whenever an explanation was produced, offered or not; 1 when\n"
                  "PLUGIN names no registration (the reason is printed) or several.\n"
                  "  --host PID          explain for that process (default: vantrelctl itself;\n"
                  "                      another process needs the manager entitlement)\n"
                  "  --host-bundle PATH  explain for that application bundle as if it ran\n"
                  "                      (needs the manager entitlement)\n"
                  "  --point ID          the host asks for extension point ID\n"
                  "  --rule KEY=PATTERN  one more rule of the host's (repeatable)\n") +
          kDiscoveryFlagHelp +
          "\nExample:\n"
          "  vantrelctl why com.example.notes.share --point com.karvo.share-services\n",
      options,
      1,
      1,
      &run};
}

}  // namespace vantrel::ctl
