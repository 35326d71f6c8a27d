// "access" and "ready": read tokens for plug-in bundles, and enabling
// plug-ins for the requesting process.

#include <cerrno>
#include <set>
#include <vector>

#include "base/Log.h"
#include "daemon/Transaction.h"
#include "daemon/VTDLmoClient.h"
#include "daemon/VTDServer.h"
#include "model/SandboxExtensionIssue.h"
#include "platform/Probes.h"

namespace vantrel::daemon {

void Transaction::accessPlugIns() {
  std::vector<lmo::Value> tokens;
  const bool issued = processUuidList([&](const registry::VTDPlugInPtr& plugIn) {
    const std::optional<model::FileUrl> bundle = plugIn->url();
    errno = 0;
    std::optional<std::string> token = bundle ? model::issue_read_extension(*bundle) : std::nullopt;
    if (!token) {
      failMessage(protocol::kErrorBadRequest,
                  base::format("cannot create extension to %@: %d", plugIn->path(), errno));
      return false;
    }
    tokens.emplace_back(std::move(*token));
    return true;
  });
  if (!issued) return;
  setReplyValue(protocol::kKeyExtensions, lmo::Array(std::move(tokens)));
  done();
}

void Transaction::readyPlugIns() {
  // Every plug-in passes the hold and authorisation checks before any is
  // enabled: one refusal enables none.
  std::vector<registry::VTDPlugInPtr> accepted;
  std::set<base::Uuid> seen;
  const pid_t pid = client()->pid();
  const bool checked = processUuidList([&](const registry::VTDPlugInPtr& plugIn) {
    const std::string uuidText = plugIn->uuid()->string();
    probes::pluginReady(uuidText.c_str());
    if (server()->holdOnPlugIn(*plugIn)) {
      server()->debug("denied access to pid %d for plugin %@(%@): the plug-in is on hold", pid,
                      plugIn->identifier(), uuidText);
      failMessage(protocol::kErrorAccessDenied,
                  base::format("access to plugin %@ denied: %@", plugIn->identifier(),
                               "the plug-in is on hold"));
      return false;
    }
    if (plugIn->isData()) return true;
    if (std::optional<std::string> reason = plugIn->allowForClient(*client())) {
      server()->debug("denied access to pid %d for plugin %@(%@): %@", pid, plugIn->identifier(),
                      uuidText, *reason);
      failMessage(protocol::kErrorAccessDenied,
                  base::format("access to plugin %@ denied: %@", plugIn->identifier(), *reason));
      return false;
    }
    if (seen.insert(*plugIn->uuid()).second) accepted.push_back(plugIn);
    return true;
  });
  if (!checked) return;
  const std::shared_ptr<lmo::Connection> peer = connection();
  const int pidfd = peer ? peer->pidfd() : -1;
  for (const registry::VTDPlugInPtr& plugIn : accepted) {
    if (std::optional<base::Error> error = plugIn->enableForPid(pid, pidfd)) {
      failError(static_cast<int32_t>(error->code), *error);
      return;
    }
  }
  done();
}

}  // namespace vantrel::daemon
