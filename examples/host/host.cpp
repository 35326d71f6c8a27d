// A small host: finds the plug-ins of one extension point, readies the first
// one for this process and starts it.
//
//   vantrel-example-host EXTENSION-POINT [SERVICE]
//
// Exit status 0 when the plug-in ran and exited 0; 1 when the daemon refused
// or no plug-in was found; 2 for a bad command line.

#include <sys/wait.h>

#include <chrono>
#include <cstdio>
#include <string>

#include "client/VTDaemonClient.h"
#include "client/VTPlugInLauncher.h"
#include "lmo/Protocol.h"

using namespace vantrel;

namespace {

constexpr std::chrono::seconds kTimeout{10};

// Runs one request and returns its reply, or prints why there is none.
std::optional<lmo::Dictionary> ask(client::VTDaemonClient& daemon,
                                   const client::VTDaemonClient::RequestStarter& start) {
  base::Result<lmo::Event> event = daemon.sendSyncWith(start, kTimeout);
  if (!event.has_value()) {
    std::fprintf(stderr, "host: %s\n", event.error().description().c_str());
    return std::nullopt;
  }
  if (std::optional<base::Error> error = client::VTDaemonClient::errorInReply(event.value())) {
    std::fprintf(stderr, "host: %s (code %lld)\n", error->description().c_str(),
                 static_cast<long long>(error->code));
    return std::nullopt;
  }
  return event.value().message()->body();
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 2 || argc > 3) {
    std::fprintf(stderr, "usage: %s EXTENSION-POINT [SERVICE]\n", argv[0]);
    return 2;
  }
  client::VTDaemonClientPtr daemon =
      client::VTDaemonClient::initWithServiceName(argc == 3 ? argv[2] : nullptr);

  // Discovery: every plug-in of the extension point this host may use.
  const lmo::Dictionary rules{{"QXExtensionPointIdentifier", lmo::Value(argv[1])}};
  std::optional<lmo::Dictionary> found = ask(*daemon, [&](auto reply) {
    return daemon->matchPlugIns(rules, protocol::DiscoveryFlags::kNone, reply);
  });
  const lmo::Array* forms = found ? found->get(protocol::kKeyMatches).getIfArray() : nullptr;
  if (forms == nullptr || forms->empty()) {
    std::fprintf(stderr, "host: no plug-in of %s\n", argv[1]);
    return 1;
  }
  const lmo::Dictionary& form = *(*forms)[0].getIfDictionary();
  const std::string* uuidText = form.get(protocol::kFormUuid).getIfString();
  const std::optional<base::Uuid> uuid = uuidText ? base::Uuid::parse(*uuidText) : std::nullopt;
  const lmo::Dictionary* info = form.get(protocol::kFormBundleInfo).getIfDictionary();
  const std::string* bundleIdentifier =
      info ? info->get("KBBundleIdentifier").getIfString() : nullptr;
  if (!uuid || bundleIdentifier == nullptr) {
    std::fprintf(stderr, "host: the daemon sent a form without uuid or bundle identifier\n");
    return 1;
  }
  std::printf("found %s at %s\n", form.get(protocol::kFormIdentifier).getIfString()->c_str(),
              form.get(protocol::kFormPath).getIfString()->c_str());
  std::fflush(stdout);  // before the plug-in writes to the same output

  // Use: the daemon enables the plug-in for this process, then it starts.
  if (!ask(*daemon, [&](auto reply) { return daemon->readyPlugIns({*uuid}, 0, reply); })) {
    return 1;
  }
  base::Result<pid_t> pid = client::VTPlugInLauncher::launch(*bundleIdentifier);
  if (!pid.has_value()) {
    std::fprintf(stderr, "host: %s\n", pid.error().description().c_str());
    return 1;
  }
  int status = 0;
  ::waitpid(pid.value(), &status, 0);
  std::printf("plug-in %s exited with status %d\n", bundleIdentifier->c_str(),
              WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status));
  return WIFEXITED(status) && WEXITSTATUS(status) == 0 ? 0 : 1;
}
