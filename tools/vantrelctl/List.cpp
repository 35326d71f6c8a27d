// vantrelctl list: the plug-ins discovery offers to this process.

#include "lmo/Protocol.h"
#include "tools/vantrelctl/Discovery.h"
#include "tools/vantrelctl/PlugIn.h"

namespace vantrel::ctl {
namespace {

int run(Context& context) {
  lmo::Dictionary rules;
  if (std::optional<std::string> point = context.arguments.value("point")) {
    // The rule key reads the plug-in's extension attribute or Info key of
    // that name, which is where the extension point is declared.
    rules = rules.setting(kExtensionPointKey, lmo::Value(*point));
  }
  return runMatch(context, rules, discoveryFlags(context.arguments));
}

}  // namespace

Command listCommand() {
  std::vector<OptionSpec> options = discoveryOptions(true);
  options.push_back({"point", 0, true});
  return {"list",
          "list [--point ID] [--versions] [--duplicates] [--system] [--all]",
          "list the plug-ins discovery offers",
          std::string("Lists the plug-ins a \"match\" returns to this process, as a table of\n"
                      "IDENTIFIER, VERSION, POINT (extension point), ELECTION, WHERE (\"system\"\n"
                      "or the containing application) and PATH. --json prints the plug-in\n"
                      "forms as an array.\n"
                      "  --point ID    only plug-ins of the extension point ID\n") +
              kDiscoveryFlagHelp + allFlagHelp() +
              "\nExample:\n"
              "  vantrelctl list --point com.karvo.share-services --versions\n",
          options,
          0,
          0,
          &run};
}

}  // namespace vantrel::ctl
