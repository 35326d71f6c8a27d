// vantrelctl monitor: plug-ins installed, removed and changed, elections and
// holds, as they happen.
//
// Annotation changes and holds post the daemon's notification; installs by
// the registry's scanner post nothing. So the monitor both watches the
// notification and polls, and prints what differs between two looks at the
// daemon.

#include <poll.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <cstdio>
#include <map>

#include "lmo/Protocol.h"
#include "lmo/ServicePath.h"
#include "tools/vantrelctl/Command.h"
#include "tools/vantrelctl/ExitStatus.h"
#include "tools/vantrelctl/Output.h"
#include "tools/vantrelctl/Signals.h"

namespace vantrel::ctl {
namespace {

using lmo::Dictionary;
using lmo::Value;
using protocol::DiscoveryFlags;

// How long the monitor waits for a notification before it looks anyway.
constexpr int kPollIntervalMs = 1000;

// The event names of --json lines.
constexpr const char* kEventInstalled = "installed";
constexpr const char* kEventRemoved = "removed";
constexpr const char* kEventChanged = "changed";
constexpr const char* kEventElected = "elected";
constexpr const char* kEventHoldTaken = "hold-taken";
constexpr const char* kEventHoldReleased = "hold-released";

struct PlugInState {
  Value identifier, version, path, lastModified;
  int64_t election = 0;
};

struct HoldState {
  Value token, pid, count;
};

struct Snapshot {
  std::map<std::string, PlugInState> plugIns;  // by UUID text
  std::map<std::string, HoldState> holds;      // by token, or pid and creation date
};

// The daemon's notifications are files in <runtime dir>/notify, one per
// name, replaced on every post. The platform layer owns that convention but
// a client must not link it, so the directory is derived here from the same
// runtime directory the socket lives in.
std::string notificationDirectory() {
  return lmo::serviceRuntimeDirectory() + "/notify";
}

class Monitor {
 public:
  Monitor(Context& context) : context_(context), session_(context.session) {}

  int run() {
    InterruptSignals signals;
    const int inotify = ::inotify_init1(IN_CLOEXEC | IN_NONBLOCK);
    std::optional<Snapshot> current = look();
    if (!current) return status_;
    if (!context_.global.json) {
      std::fprintf(stderr, "Monitoring vantreld at %s; interrupt (Ctrl-C) to stop.\n",
                   session_.socketPath().c_str());
    }
    bool watching = false;
    for (;;) {
      if (!watching && inotify >= 0) {
        watching = ::inotify_add_watch(inotify, notificationDirectory().c_str(),
                                       IN_CLOSE_WRITE | IN_MOVED_TO | IN_CREATE) >= 0;
      }
      pollfd fds[2] = {{signals.fd(), POLLIN, 0}, {inotify, POLLIN, 0}};
      if (::poll(fds, 2, kPollIntervalMs) > 0) {
        if ((fds[0].revents & POLLIN) != 0 && signals.take()) break;
        if ((fds[1].revents & POLLIN) != 0) drain(inotify);
      }
      std::optional<Snapshot> next = look();
      if (!next) {
        if (inotify >= 0) ::close(inotify);
        return status_;
      }
      report(*current, *next);
      current = std::move(next);
    }
    if (inotify >= 0) ::close(inotify);
    return kExitOk;
  }

 private:
  // Reads every pending inotify event; any of them is only a reason to look.
  static void drain(int fd) {
    alignas(inotify_event) char buffer[4096];
    while (::read(fd, buffer, sizeof buffer) > 0) {
    }
  }

  // The daemon's plug-ins and holds now; nullopt (status_ set, complaint
  // printed) when it cannot be asked.
  std::optional<Snapshot> look() {
    Snapshot snapshot;
    // Every registration, as privileged discovery sees them when this user
    // may ask for it, else as discovery offers them to this process.
    const DiscoveryFlags base = DiscoveryFlags::kVersions | DiscoveryFlags::kDuplicates;
    Answer match = ask(
        Session::request(protocol::kRequestMatch)
            .setting(protocol::kKeyFlags, Value::unsignedInteger(protocol::bits(
                                              privileged_ ? base | DiscoveryFlags::kAll : base))));
    if (privileged_ && match.code == protocol::kErrorAccessDenied) {
      privileged_ = false;
      return look();
    }
    if (!match.ok()) return fail(match);
    if (const lmo::Array* forms = match.reply.get(protocol::kKeyMatches).getIfArray()) {
      for (const Value& value : *forms) {
        const Dictionary* form = value.getIfDictionary();
        if (form == nullptr) continue;
        const Dictionary* annotations = form->get(protocol::kFormAnnotations).getIfDictionary();
        snapshot.plugIns[cell(form->get(protocol::kFormUuid))] = PlugInState{
            form->get(protocol::kFormIdentifier), form->get(protocol::kFormVersion),
            form->get(protocol::kFormPath), form->get(protocol::kFormLastModified),
            annotations ? annotations->get(protocol::kAnnotationElection).integerValue() : 0};
      }
    }
    Answer status = ask(Session::request(protocol::kRequestExplain));
    if (!status.ok()) return fail(status);
    const Dictionary* s = status.reply.get(protocol::kKeyStatus).getIfDictionary();
    const lmo::Array* holds = s ? s->get(protocol::kKeyHolds).getIfArray() : nullptr;
    for (const Value& value : holds ? *holds : lmo::Array()) {
      const Dictionary* h = value.getIfDictionary();
      if (h == nullptr) continue;
      const Value& token = h->get(protocol::kKeyToken);
      const std::string key = token.isNull() ? cell(h->get(protocol::kKeyPid)) + "@" +
                                                   cell(h->get(protocol::kKeyCreated))
                                             : cell(token);
      snapshot.holds[key] =
          HoldState{token, h->get(protocol::kKeyPid), h->get(protocol::kKeyPlugInCount)};
    }
    return snapshot;
  }

  Answer ask(const Dictionary& message) { return session_.call(message); }

  std::nullopt_t fail(const Answer& answer) {
    status_ = session_.complain(answer);
    return std::nullopt;
  }

  // Whether the plug-in is still registered though discovery no longer
  // offers it (a hold, for one, hides it).
  bool stillRegistered(const std::string& uuid) {
    std::optional<base::Uuid> parsed = base::Uuid::parse(uuid);
    if (!parsed) return false;
    Answer answer = ask(
        Session::request(protocol::kRequestExplain).setting(protocol::kKeyUuid, Value(*parsed)));
    const lmo::Array* found = answer.reply.get(protocol::kKeyPlugIns).getIfArray();
    return answer.ok() && found != nullptr && !found->empty();
  }

  void emit(const char* event, Dictionary fields, const std::string& line) {
    if (context_.global.json) {
      printJsonLine(Value(fields.setting(kJsonEvent, Value(event))));
    } else {
      std::printf("%s\n", line.c_str());
      std::fflush(stdout);
    }
  }

  void emitPlugIn(const char* event, const std::string& uuid, const PlugInState& p) {
    emit(
        event,
        {{protocol::kKeyUuid, Value(uuid)},
         {protocol::kKeyIdentifier, p.identifier},
         {protocol::kKeyVersion, p.version},
         {protocol::kKeyPath, p.path}},
        std::string(event) + " " + cell(p.identifier) + " " + cell(p.version) + " " + cell(p.path));
  }

  void report(const Snapshot& before, Snapshot& after) {
    for (const auto& [uuid, old] : before.plugIns) {
      auto it = after.plugIns.find(uuid);
      if (it == after.plugIns.end()) {
        if (stillRegistered(uuid)) {
          after.plugIns[uuid] = old;  // hidden, not gone: keep what we knew
        } else {
          emitPlugIn(kEventRemoved, uuid, old);
        }
        continue;
      }
      const PlugInState& now = it->second;
      if (!(now.version == old.version) || !(now.path == old.path) ||
          !(now.lastModified == old.lastModified)) {
        emitPlugIn(kEventChanged, uuid, now);
      }
      if (now.election != old.election) {
        emit(kEventElected,
             {{protocol::kKeyUuid, Value(uuid)},
              {protocol::kKeyIdentifier, now.identifier},
              {kJsonOld, Value::integer(old.election)},
              {protocol::kKeyElection, Value::integer(now.election)}},
             "elected " + cell(now.identifier) + " " + std::to_string(old.election) + " -> " +
                 std::to_string(now.election));
      }
    }
    for (const auto& [uuid, now] : after.plugIns) {
      if (!before.plugIns.contains(uuid)) emitPlugIn(kEventInstalled, uuid, now);
    }
    for (const auto& [key, hold] : after.holds) {
      if (before.holds.contains(key)) continue;
      emit(kEventHoldTaken,
           {{protocol::kKeyToken, hold.token},
            {protocol::kKeyPid, hold.pid},
            {protocol::kKeyPlugInCount, hold.count}},
           "hold taken " + cell(hold.token) + " pid " + cell(hold.pid) + " (" + cell(hold.count) +
               " plug-ins)");
    }
    for (const auto& [key, hold] : before.holds) {
      if (after.holds.contains(key)) continue;
      emit(kEventHoldReleased, {{protocol::kKeyToken, hold.token}, {protocol::kKeyPid, hold.pid}},
           "hold released " + cell(hold.token));
    }
  }

  Context& context_;
  Session& session_;
  bool privileged_ = true;  // until the daemon refuses privileged discovery
  int status_ = kExitOk;
};

int run(Context& context) {
  return Monitor(context).run();
}

}  // namespace

Command monitorCommand() {
  return {"monitor",
          "monitor",
          "print plug-in, election and hold changes as they happen",
          "Prints one line per event until interrupted (Ctrl-C, exit 0):\n"
          "  installed IDENTIFIER VERSION PATH\n"
          "  removed IDENTIFIER VERSION PATH\n"
          "  changed IDENTIFIER VERSION PATH\n"
          "  elected IDENTIFIER OLD -> NEW\n"
          "  hold taken TOKEN pid PID (N plug-ins)\n"
          "  hold released TOKEN\n"
          "It watches the daemon's annotation-change notification and looks again\n"
          "every second (the registry's own scans post nothing). Plug-ins are the\n"
          "ones discovery returns to vantrelctl (all of them for a manager); hold\n"
          "tokens show as \"-\" unless the daemon shows them to this user. --json\n"
          "prints one JSON object per line, with \"event\" one of installed,\n"
          "removed, changed, elected, hold-taken, hold-released.\n"
          "\n"
          "Example:\n"
          "  vantrelctl monitor --json\n",
          {},
          0,
          0,
          &run};
}

}  // namespace vantrel::ctl
