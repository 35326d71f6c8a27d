// vantrelctl add / remove: register and unregister plug-in bundles, one
// request per path so that each path gets its own outcome.

#include <cstdio>
#include <filesystem>

#include "lmo/Protocol.h"
#include "tools/vantrelctl/Command.h"
#include "tools/vantrelctl/ExitStatus.h"
#include "tools/vantrelctl/Output.h"

namespace vantrel::ctl {
namespace {

using lmo::Dictionary;
using lmo::Value;

int registration(Context& context, const char* request, const char* done) {
  int status = kExitOk;
  std::vector<Value> outcomes;
  for (const std::string& operand : context.arguments.operands()) {
    std::error_code ec;
    const std::filesystem::path absolute = std::filesystem::absolute(operand, ec);
    const std::string path = ec ? operand : absolute.lexically_normal().string();
    Answer answer = context.session.call(
        Session::request(request).setting(protocol::kKeyPaths, Value(lmo::Array{Value(path)})));
    if (answer.status == kExitUnreachable) return context.session.complain(answer);
    Dictionary outcome{{protocol::kKeyPath, Value(path)}, {kJsonOk, Value::boolean(answer.ok())}};
    if (!answer.ok()) {
      status = kExitRefused;
      outcome = outcome.setting(protocol::kKeyErrorCode, Value::integer(answer.code))
                    .setting(protocol::kKeyError, answer.reply.get(protocol::kKeyError));
      if (!context.global.json) context.session.complain(answer);
    } else if (!context.global.json) {
      std::printf("%s %s\n", done, path.c_str());
    }
    outcomes.push_back(Value(outcome));
  }
  if (context.global.json) printJson(Value(lmo::Array(std::move(outcomes))));
  return status;
}

int add(Context& context) {
  return registration(context, protocol::kRequestAdd, "added");
}
int remove(Context& context) {
  return registration(context, protocol::kRequestRemove, "removed");
}

}  // namespace

Command addCommand() {
  return {"add",
          "add PATH...",
          "register plug-in bundles",
          "Registers the plug-in bundle at each PATH, one request per path, and\n"
          "reports each outcome (\"added PATH\", or the daemon's refusal on standard\n"
          "error). Exits 1 when any path failed. --json prints one {\"path\", \"ok\",\n"
          "\"errorcode\", \"error\"} per path.\n"
          "\n"
          "Example:\n"
          "  vantrelctl add ./build/MyWidget.appex\n",
          {},
          1,
          static_cast<size_t>(-1),
          &add};
}

Command removeCommand() {
  return {"remove",
          "remove PATH...",
          "unregister plug-in bundles",
          "Unregisters the plug-in bundle at each PATH, one request per path, and\n"
          "reports each outcome as \"add\" does. Exits 1 when any path failed.\n"
          "\n"
          "Example:\n"
          "  vantrelctl remove ./build/MyWidget.appex\n",
          {},
          1,
          static_cast<size_t>(-1),
          &remove};
}

}  // namespace vantrel::ctl
