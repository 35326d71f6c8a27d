#include "tools/vantrelctl/PlugIn.h"

#include <cstdio>
#include <filesystem>

#include "lmo/Protocol.h"
#include "tools/vantrelctl/ExitStatus.h"
#include "tools/vantrelctl/Output.h"

namespace vantrel::ctl {

using lmo::Array;
using lmo::Dictionary;
using lmo::Value;

lmo::Dictionary selectorFor(const std::string& plugIn) {
  if (plugIn.starts_with("/") || plugIn.starts_with(".")) {
    std::error_code ec;
    std::filesystem::path absolute = std::filesystem::absolute(plugIn, ec);
    return {{protocol::kKeyPath, Value(ec ? plugIn : absolute.lexically_normal().string())}};
  }
  if (std::optional<base::Uuid> uuid = base::Uuid::parse(plugIn)) {
    return {{protocol::kKeyUuid, Value(*uuid)}};
  }
  return {{protocol::kKeyIdentifier, Value(plugIn)}};
}

Resolution resolvePlugIn(Session& session, const std::string& plugIn,
                         const lmo::Dictionary& request) {
  Dictionary message = Session::request(protocol::kRequestExplain);
  for (const auto& [key, value] : request) message = message.setting(key, value);
  for (const auto& [key, value] : selectorFor(plugIn)) message = message.setting(key, value);
  Answer answer = session.call(message);
  if (!answer.ok()) return {std::nullopt, session.complain(answer)};
  const Array* found = answer.reply.get(protocol::kKeyPlugIns).getIfArray();
  if (found == nullptr || found->empty()) {
    const std::string text = cell(answer.reply.get(protocol::kKeyText));
    // The daemon's sentence names what it looked for.
    std::fprintf(stderr, "vantrelctl: %s\n", text.c_str());
    return {std::nullopt, kExitRefused};
  }
  if (found->size() > 1) {
    std::fprintf(stderr, "vantrelctl: %s names %zu registrations; name one by UUID or path:\n",
                 plugIn.c_str(), found->size());
    Table table({"UUID", "VERSION", "PATH"});
    for (const Value& e : *found) {
      const Dictionary* d = e.getIfDictionary();
      if (d == nullptr) continue;
      table.add({cell(d->get(protocol::kKeyUuid)), cell(d->get(protocol::kKeyVersion)),
                 cell(d->get(protocol::kKeyPath))});
    }
    table.print(stderr, true);
    return {std::nullopt, kExitRefused};
  }
  const Dictionary* only = found->at(0).getIfDictionary();
  if (only == nullptr) {
    std::fputs("vantrelctl: the daemon's explanation is not a dictionary\n", stderr);
    return {std::nullopt, kExitRefused};
  }
  return {*only, kExitOk};
}

std::string formPoint(const lmo::Dictionary& form) {
  const Dictionary* info = form.get(protocol::kFormInfo).getIfDictionary();
  return info != nullptr ? cell(info->get(kExtensionPointKey)) : std::string("-");
}

std::string formWhere(const lmo::Dictionary& form) {
  if (form.get(protocol::kFormSystemResident).boolValue()) return "system";
  if (const std::string* name = form.get(protocol::kFormContainingName).getIfString();
      name != nullptr && !name->empty()) {
    return *name;
  }
  return cell(form.get(protocol::kFormContainingPath));
}

int64_t formElection(const lmo::Dictionary& form) {
  const Dictionary* annotations = form.get(protocol::kFormAnnotations).getIfDictionary();
  return annotations != nullptr ? annotations->get(protocol::kAnnotationElection).integerValue()
                                : 0;
}

}  // namespace vantrel::ctl
