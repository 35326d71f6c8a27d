// vantrelctl status: whether the daemon answers, and what it holds.

#include <cstdio>

#include "lmo/Protocol.h"
#include "tools/vantrelctl/Command.h"
#include "tools/vantrelctl/ExitStatus.h"
#include "tools/vantrelctl/Output.h"

namespace vantrel::ctl {
namespace {

using lmo::Dictionary;
using lmo::Value;

int run(Context& context) {
  Session& session = context.session;
  Answer answer = session.call(Session::request(protocol::kRequestExplain));
  const Dictionary* status = answer.reply.get(protocol::kKeyStatus).getIfDictionary();
  const std::optional<pid_t> pid = session.daemonPid();

  if (context.global.json) {
    Dictionary out{{kJsonSocket, Value(session.socketPath())},
                   {kJsonAnswering, Value::boolean(answer.ok() && status != nullptr)}};
    if (pid) out = out.setting(protocol::kKeyPid, Value::integer(*pid));
    if (status != nullptr) {
      for (const auto& [key, value] : *status) out = out.setting(key, value);
    }
    printJson(Value(out));
  } else {
    std::printf("Socket:     %s\n", session.socketPath().c_str());
    if (answer.ok() && status != nullptr) {
      std::printf("Daemon:     answering (pid %s)\n", pid ? std::to_string(*pid).c_str() : "-");
      std::printf("Protocol:   %s\n", cell(status->get(protocol::kKeyVersion)).c_str());
      std::printf("Installed:  %s plug-ins\n", cell(status->get(protocol::kKeyInstalled)).c_str());
      const lmo::Array* holds = status->get(protocol::kKeyHolds).getIfArray();
      std::printf("Holds:      %zu\n", holds != nullptr ? holds->size() : 0);
      if (holds != nullptr && !holds->empty()) {
        Table table({"TOKEN", "PID", "PLUG-INS", "CREATED"});
        for (const Value& hold : *holds) {
          const Dictionary* h = hold.getIfDictionary();
          if (h == nullptr) continue;
          table.add({cell(h->get(protocol::kKeyToken)), cell(h->get(protocol::kKeyPid)),
                     cell(h->get(protocol::kKeyPlugInCount)), cell(h->get(protocol::kKeyCreated))});
        }
        std::printf("\n");
        table.print(stdout, !context.global.noLegend);
      }
    } else {
      std::printf("Daemon:     not answering\n");
    }
  }
  if (!answer.ok()) return session.complain(answer);
  return kExitOk;
}

}  // namespace

Command statusCommand() {
  return {"status",
          "status",
          "show whether the daemon answers, and what it holds",
          "Prints the socket tried, whether vantreld answers there, its pid, its\n"
          "protocol version, how many plug-ins are installed and the holds in place\n"
          "(their tokens only for the daemon's own user, root or a manager).\n"
          "Exits 3 when the daemon cannot be reached.\n"
          "\n"
          "Example:\n"
          "  vantrelctl status --json\n",
          {},
          0,
          0,
          &run};
}

}  // namespace vantrel::ctl
