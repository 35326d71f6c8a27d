// vantrelctl elect / unelect / reset: the user's election of plug-ins,
// through "annotate".

#include <cstdio>

#include "lmo/Protocol.h"
#include "tools/vantrelctl/Command.h"
#include "tools/vantrelctl/ExitStatus.h"
#include "tools/vantrelctl/Output.h"
#include "tools/vantrelctl/PlugIn.h"

namespace vantrel::ctl {
namespace {

using lmo::Dictionary;
using lmo::Value;

// Resolves every PLUGIN first, so that nothing is changed when one of them
// does not name exactly one plug-in; then stores election for all of them in
// one request.
int setElection(Context& context, int64_t election) {
  std::vector<Value> uuids;
  std::vector<Value> done;
  for (const std::string& plugIn : context.arguments.operands()) {
    Resolution resolved = resolvePlugIn(context.session, plugIn);
    if (!resolved.explanation) return resolved.status;
    const Value& uuid = resolved.explanation->get(protocol::kKeyUuid);
    uuids.push_back(uuid);
    done.push_back(Value(
        Dictionary{{protocol::kKeyUuid, uuid},
                   {protocol::kKeyIdentifier, resolved.explanation->get(protocol::kKeyIdentifier)},
                   {protocol::kKeyElection, Value::integer(election)},
                   {kJsonOld, resolved.explanation->get(protocol::kKeyElection)}}));
  }
  Dictionary message =
      Session::request(protocol::kRequestAnnotate)
          .setting(protocol::kKeyUuids, Value(lmo::Array(std::move(uuids))))
          .setting(protocol::kKeyAnnotations,
                   Value(Dictionary{{protocol::kAnnotationElection, Value::integer(election)}}));
  Answer answer = context.session.call(message);
  if (!answer.ok()) return context.session.complain(answer);
  if (context.global.json) {
    printJson(Value(lmo::Array(std::move(done))));
    return kExitOk;
  }
  for (const Value& entry : done) {
    const Dictionary& d = *entry.getIfDictionary();
    std::printf("%s %s: election %s -> %lld\n", cell(d.get(protocol::kKeyIdentifier)).c_str(),
                cell(d.get(protocol::kKeyUuid)).c_str(), cell(d.get(kJsonOld)).c_str(),
                static_cast<long long>(election));
  }
  return kExitOk;
}

int elect(Context& context) {
  return setElection(context, 1);
}
int unelect(Context& context) {
  return setElection(context, 0);
}

constexpr const char* kPlugInHelp =
    "PLUGIN is a bundle path (starting with \"/\" or \".\"), a UUID, or an\n"
    "identifier registered once. All are resolved before anything changes.\n"
    "--json prints, per plug-in, its uuid, identifier, new and old election.\n";

}  // namespace

Command electCommand() {
  return {"elect",
          "elect PLUGIN...",
          "turn plug-ins on (election 1)",
          std::string("Stores the user's election 1 for each PLUGIN: the plug-ins a rule\n"
                      "\"QXUserElection\": \"1\" selects.\n") +
              kPlugInHelp + "\nExample:\n  vantrelctl elect com.example.notes.share\n",
          {},
          1,
          static_cast<size_t>(-1),
          &elect};
}

Command unelectCommand() {
  return {"unelect",
          "unelect PLUGIN...",
          "turn plug-ins off (election 0)",
          std::string("Stores the user's election 0 for each PLUGIN.\n") + kPlugInHelp +
              "\nExample:\n  vantrelctl unelect com.example.notes.share\n",
          {},
          1,
          static_cast<size_t>(-1),
          &unelect};
}

Command resetCommand() {
  return {"reset",
          "reset PLUGIN...",
          "forget the user's election of plug-ins",
          std::string("Returns each PLUGIN to \"no choice made\". The daemon reads an election\n"
                      "of 0 and no election alike, and \"annotate\" can only merge values into\n"
                      "a stored annotation, never remove a key: so reset stores election 0,\n"
                      "the same request as unelect, and the annotation keeps an \"election\"\n"
                      "key of 0 (its other keys stay as they are).\n") +
              kPlugInHelp +
              "\nExample:\n  vantrelctl reset /Applications/Notes.app/PlugIns/Share.appex\n",
          {},
          1,
          static_cast<size_t>(-1),
          &unelect};
}

}  // namespace vantrel::ctl
