// vantrelctl hold / release: holds keep plug-ins out of discovery and use
// while their bundles are replaced.

#include <poll.h>

#include <cstdio>
#include <filesystem>

#include "lmo/Protocol.h"
#include "tools/vantrelctl/Command.h"
#include "tools/vantrelctl/ExitStatus.h"
#include "tools/vantrelctl/Output.h"
#include "tools/vantrelctl/Signals.h"

namespace vantrel::ctl {
namespace {

using lmo::Dictionary;
using lmo::Value;
using protocol::HoldFlags;

// How often a waiting hold checks that the daemon (and so the hold) is
// still there.
constexpr int kLivenessIntervalMs = 1000;

std::string absolutePath(const std::string& path) {
  std::error_code ec;
  std::filesystem::path absolute = std::filesystem::absolute(path, ec);
  return ec ? path : absolute.lexically_normal().string();
}

Answer release(Session& session, const base::Uuid& token) {
  return session.call(Session::request(protocol::kRequestLock)
                          .setting(protocol::kKeyUuids, Value(lmo::Array{Value(token)})));
}

int hold(Context& context) {
  // Before the first request starts the client library's threads.
  InterruptSignals signals;
  Session& session = context.session;
  std::vector<Value> paths;
  for (const std::string& path : context.arguments.operands()) {
    paths.push_back(Value(absolutePath(path)));
  }
  const HoldFlags flags =
      context.arguments.has("app") ? HoldFlags::kApplication : HoldFlags::kPlugIn;
  Answer taken = session.call(
      Session::request(protocol::kRequestLock)
          .setting(protocol::kKeyPaths, Value(lmo::Array(paths)))
          .setting(protocol::kKeyFlags, Value::unsignedInteger(protocol::bits(flags))));
  if (!taken.ok()) {
    const int status = session.complain(taken);
    if (const lmo::Array* conflicts = taken.reply.get(protocol::kKeyConflicts).getIfArray()) {
      for (const Value& c : *conflicts) {
        const Dictionary* d = c.getIfDictionary();
        if (d == nullptr) continue;
        std::fprintf(stderr, "vantrelctl: running: %s\n",
                     cell(d->get(protocol::kKeyConflictBundleIdentifier)).c_str());
      }
    }
    return status;
  }
  const base::Uuid* token = taken.reply.get(protocol::kKeyUuids).getIfUuid();
  if (token == nullptr) {
    std::fputs("vantrelctl: the daemon's reply carries no hold token\n", stderr);
    return kExitRefused;
  }
  if (context.global.json) {
    printJsonLine(Value(Dictionary{{protocol::kKeyToken, Value(*token)},
                                   {protocol::kKeyPaths, Value(lmo::Array(paths))}}));
  } else {
    std::printf("%s\n", token->string().c_str());
    std::fprintf(stderr, "Holding %zu bundle%s; interrupt (Ctrl-C) to release.\n", paths.size(),
                 paths.size() == 1 ? "" : "s");
    std::fflush(stdout);
  }

  // The hold lasts as long as this connection: wait for an interruption,
  // checking now and then that the daemon has not gone (and the hold with
  // it).
  for (;;) {
    pollfd p{signals.fd(), POLLIN, 0};
    const int ready = ::poll(&p, 1, kLivenessIntervalMs);
    if (ready > 0 && signals.take()) break;
    Answer alive = session.call(Session::request(protocol::kRequestExplain));
    if (alive.status == kExitUnreachable) {
      session.complain(alive);
      std::fputs("vantrelctl: the hold ended with the connection\n", stderr);
      return kExitUnreachable;
    }
  }
  Answer released = release(session, *token);
  if (!released.ok()) return session.complain(released);
  if (!context.global.json) std::fprintf(stderr, "Released %s.\n", token->string().c_str());
  return kExitOk;
}

int releaseToken(Context& context) {
  const std::string& text = context.arguments.operands()[0];
  std::optional<base::Uuid> token = base::Uuid::parse(text);
  if (!token) {
    std::fprintf(stderr, "vantrelctl: not a hold token (a UUID): %s\n", text.c_str());
    return kExitUsage;
  }
  Answer answer = release(context.session, *token);
  if (!answer.ok()) return context.session.complain(answer);
  if (context.global.json) {
    printJson(Value(Dictionary{{protocol::kKeyToken, Value(*token)}}));
  } else {
    std::printf("released %s\n", token->string().c_str());
  }
  return kExitOk;
}

}  // namespace

Command holdCommand() {
  return {"hold",
          "hold PATH... [--app]",
          "hold plug-ins until interrupted",
          "Takes a hold on the plug-in bundles at PATH (with --app: on every plug-in\n"
          "of the application bundles at PATH; refused while one of them runs),\n"
          "prints its token and keeps it until interrupted (SIGINT or SIGTERM),\n"
          "then releases it and exits 0. A held plug-in is neither discovered nor\n"
          "readied. A hold ends with the connection that took it: if vantrelctl is\n"
          "killed, or the daemon goes away (exit 3), the hold is gone too.\n"
          "  --app   each PATH is an application bundle\n"
          "\n"
          "Example:\n"
          "  vantrelctl hold /Applications/Notes.app --app\n",
          {{"app", 0, false}},
          1,
          static_cast<size_t>(-1),
          &hold};
}

Command releaseCommand() {
  return {"release",
          "release TOKEN",
          "release a hold by its token",
          "Releases the hold whose token is TOKEN, whoever took it. A token that\n"
          "names no hold releases nothing, and is not an error.\n"
          "\n"
          "Example:\n"
          "  vantrelctl release 5B1E0C2A-7F1D-4C55-9E0B-2D8F1A6C3B44\n",
          {},
          1,
          1,
          &releaseToken};
}

}  // namespace vantrel::ctl
