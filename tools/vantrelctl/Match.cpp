// vantrelctl match: discovery with a rule dictionary of the caller's.

#include <cstdio>
#include <iostream>
#include <iterator>

#include "tools/vantrelctl/Discovery.h"
#include "tools/vantrelctl/ExitStatus.h"
#include "tools/vantrelctl/JsonReader.h"

namespace vantrel::ctl {
namespace {

int run(Context& context) {
  lmo::Dictionary rules;
  const std::vector<std::string>& operands = context.arguments.operands();
  if (!operands.empty()) {
    std::string text = operands[0];
    if (text == "-") {
      text.assign(std::istreambuf_iterator<char>(std::cin), std::istreambuf_iterator<char>());
    }
    base::Result<lmo::Value> parsed = readJson(text);
    if (!parsed.has_value()) {
      std::fprintf(stderr, "vantrelctl: malformed rules: %s\n",
                   parsed.error().description().c_str());
      return kExitUsage;
    }
    const lmo::Dictionary* dictionary = parsed->getIfDictionary();
    if (dictionary == nullptr) {
      std::fputs("vantrelctl: malformed rules: not a JSON object\n", stderr);
      return kExitUsage;
    }
    rules = *dictionary;
  }
  std::optional<lmo::Dictionary> all = addRuleOptions(rules, context.arguments);
  if (!all) return kExitUsage;
  return runMatch(context, *all, discoveryFlags(context.arguments));
}

}  // namespace

Command matchCommand() {
  std::vector<OptionSpec> options = discoveryOptions(true);
  options.push_back({"rule", 0, true});
  return {"match",
          "match [RULES | -] [--rule KEY=PATTERN]... [--versions] [--duplicates] [--system] "
          "[--all]",
          "list the plug-ins a rule dictionary selects",
          std::string("Sends \"match\" with the rule dictionary RULES, a JSON object given on the\n"
                      "command line or read from standard input (\"-\"), plus one rule per\n"
                      "--rule KEY=PATTERN (PATTERN as a string; a --rule wins over RULES).\n"
                      "Prints what \"list\" prints. Malformed JSON is a usage error (exit 2)\n"
                      "that names the byte where it went wrong. The rule language is in\n"
                      "docs/match-rules.md.\n"
                      "  --rule KEY=PATTERN  one rule (repeatable)\n") +
              kDiscoveryFlagHelp + allFlagHelp() +
              "\nExamples:\n"
              "  vantrelctl match '{\"QXExtensionPointIdentifier\": \"com.karvo.widget\"}'\n"
              "  vantrelctl match --rule QXUserElection=1\n",
          options,
          0,
          1,
          &run};
}

}  // namespace vantrel::ctl
