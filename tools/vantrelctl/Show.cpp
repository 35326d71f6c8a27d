// vantrelctl show: one plug-in in full.

#include <cstdio>

#include "lmo/Json.h"
#include "lmo/Protocol.h"
#include "tools/vantrelctl/Command.h"
#include "tools/vantrelctl/ExitStatus.h"
#include "tools/vantrelctl/Output.h"
#include "tools/vantrelctl/PlugIn.h"

namespace vantrel::ctl {
namespace {

using lmo::Dictionary;
using lmo::Value;

void field(const char* name, const std::string& value) {
  std::printf("%-14s %s\n", name, value.c_str());
}

// A map nested below a field, indented to the field's value column.
void mapField(const char* name, const Value& value) {
  const Dictionary* d = value.getIfDictionary();
  field(name, d == nullptr || d->empty() ? std::string("-")
                                         : lmo::toJson(value, lmo::JsonStyle::kPretty, 15));
}

std::string holdText(const Dictionary& explanation) {
  const Dictionary* hold = explanation.get(protocol::kKeyHold).getIfDictionary();
  if (hold == nullptr) return "no";
  return "yes, hold " + cell(hold->get(protocol::kKeyToken)) + " taken by pid " +
         cell(hold->get(protocol::kKeyPid));
}

int run(Context& context) {
  Resolution resolved = resolvePlugIn(context.session, context.arguments.operands()[0]);
  if (!resolved.explanation) return resolved.status;
  const Dictionary& e = *resolved.explanation;
  if (context.global.json) {
    printJson(Value(e));
    return kExitOk;
  }
  const Dictionary* formValue = e.get(protocol::kKeyForm).getIfDictionary();
  const Dictionary form = formValue != nullptr ? *formValue : Dictionary();
  field("Identifier:", cell(e.get(protocol::kKeyIdentifier)));
  field("UUID:", cell(e.get(protocol::kKeyUuid)));
  field("Version:", cell(e.get(protocol::kKeyVersion)));
  field("Path:", cell(e.get(protocol::kKeyPath)));
  if (formValue != nullptr) {
    field("Point:", formPoint(form));
    field("Where:", formWhere(form));
  }
  field("Election:", cell(e.get(protocol::kKeyElection)));
  field("Container:", cell(e.get(protocol::kKeyContainer)));
  field("On hold:", holdText(e));
  field("Offered:", std::string(e.get(protocol::kKeyOffered).boolValue() ? "yes" : "no") + " (" +
                        cell(e.get(protocol::kKeyText)) + ")");
  mapField("Annotations:", e.get(protocol::kKeyAnnotations));
  mapField("Entitlements:", e.get(protocol::kKeyEntitlements));
  mapField("Form:", e.get(protocol::kKeyForm));
  return kExitOk;
}

}  // namespace

Command showCommand() {
  return {"show",
          "show PLUGIN",
          "show one plug-in in full",
          "Shows one plug-in: its registration, extension point, election, data\n"
          "container, whether it is on hold and by whom, whether it is offered to\n"
          "this process, its annotations, the entitlements it declares and its\n"
          "form. --json prints the daemon's whole explanation.\n"
          "\n"
          "PLUGIN is a bundle path (starting with \"/\" or \".\"), a UUID, or an\n"
          "identifier; an identifier registered more than once must be named by\n"
          "UUID or path instead.\n"
          "\n"
          "Example:\n"
          "  vantrelctl show com.example.notes.widget\n",
          {},
          1,
          1,
          &run};
}

}  // namespace vantrel::ctl
