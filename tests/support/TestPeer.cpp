// vantrel-test-peer: a stand-in client process for tests. Copied into a
// temporary bundle (next to an Info.plist naming it as KBBundleExecutable and
// an Entitlements.plist), it gives tests a real peer with real entitlements.
//
// Modes (the first argument):
//   sleep      writes "ready\n" to standard output once running, then blocks
//              until it is killed or its standard input is closed; exit 0.
//   print-pid  writes its pid and "\n" to standard output; exit 0.
//   connect <service>
//              sends the daemon an "annotate" request with an empty
//              annotation (answered without any work) and waits for the
//              reply, so the daemon has certainly accepted the connection;
//              writes "connected\n", then blocks until standard input closes;
//              exit 0.
//   hold <service> <flags> [<path>...]
//              asks the daemon for a hold on the paths; writes
//              "held <token>\n" when granted or "error <code> <message>\n"
//              when refused, then blocks until standard input closes (the
//              hold lasts as long as the connection); exit 0.
//   request <service> <type> <flags> [<uuid>...]
//              sends {"request": type, "version": <current>, "flags": flags,
//              "uuids": [<uuid>...]} and writes the answer as one line:
//              "ok", followed for a reply with "matches" by " <count>
//              <identifier>,<identifier>..." in reply order, or
//              "error <code> <message>"; then blocks until standard input
//              closes (what the request set up for this process, such as an
//              enabled plug-in, lasts as long as it runs); exit 0.
//   explain <service> <path>
//              asks "explain" about the bundle at path and writes "ok
//              <reason> <text>" (the reply's "reason" and "text") or "error
//              <code> <message>"; exit 0.
//   exec <service> <program> [<arg>...]
//              connects with an inheritable socket, sends the empty
//              "annotate" of connect mode and waits for its reply (the daemon
//              has identified this process), then execs program with the
//              args, the socket's descriptor in $VANTREL_TEST_PEER_FD; on a
//              failure, "error ..." and exit 1.
//   race <service> <type> <flags> <program> [<arg>...]
//              connects with an inheritable socket and at once forks: the
//              child sends {"request": type, "version": <current>, "flags":
//              flags} on it and writes the answer as request mode does; the
//              parent execs program with the args without waiting.
//   inherited <type> <flags>
//              on the connection in $VANTREL_TEST_PEER_FD, sends {"request":
//              type, "version": <current>, "flags": flags} and writes the
//              answer as request mode does; exit 0.
//   read-token <token> <name>
//              consumes the file-access token as a host does, opens name
//              relative to the directory it opens and writes the file's
//              first kMaxTokenReadBytes bytes to standard output, with a
//              final "\n" added when they lack one; exit 0. A token that is
//              refused or a name that cannot be opened or read gives
//              "error <errno>\n" and exit 1.
// In the connect, hold and request modes a connection that fails or a daemon
// that does not answer within 30 s gives "error <code> <message>\n" and
// exit 1. Log lines go to standard error. Anything else: a usage line on
// standard error, exit 2.
//
// The project's libraries are linked statically, so copying the one file is
// still enough.

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/Log.h"
#include "client/VTDaemonClient.h"
#include "lmo/Protocol.h"
#include "platform/SandboxExtensionService.h"
#include "tests/support/RawClient.h"

namespace {

using vantrel::client::VTDaemonClient;
using vantrel::testing::RawClient;
namespace protocol = vantrel::protocol;

constexpr int kConnectionFailedExit = 1;
constexpr int kUsageExit = 2;
constexpr int kReadFailedExit = 1;
constexpr std::chrono::milliseconds kReplyTimeout = std::chrono::seconds(30);
constexpr const char* kInheritedFdVariable = "VANTREL_TEST_PEER_FD";
// The most of a file read through a token that is written out: a bundle's
// Info.plist is far smaller.
constexpr size_t kMaxTokenReadBytes = 64 * 1024;

int blockUntilStdinCloses() {
  char buffer[256];
  for (;;) {
    const ssize_t n = ::read(STDIN_FILENO, buffer, sizeof buffer);
    if (n == 0) return 0;
    if (n < 0 && errno != EINTR) return 0;
  }
}

void printLine(const std::string& line) {
  std::fputs(line.c_str(), stdout);
  std::fputc('\n', stdout);
  std::fflush(stdout);
}

void printError(const vantrel::base::Error& error) {
  printLine(vantrel::base::format("error %d %s", error.code, error.description()));
}

int sleepUntilStdinCloses() {
  printLine("ready");
  return blockUntilStdinCloses();
}

int printPid() {
  std::printf("%d\n", static_cast<int>(::getpid()));
  return std::fflush(stdout) == 0 ? 0 : 1;
}

// The failure that left no answer from the daemon: no reply in time, or the
// connection's error event instead of a reply.
std::optional<vantrel::base::Error> transportFailure(
    const vantrel::base::Result<vantrel::lmo::Event>& outcome) {
  if (!outcome.has_value()) return outcome.error();
  if (outcome.value().isError()) return VTDaemonClient::errorInReply(outcome.value());
  return std::nullopt;
}

int connectAndWait(const char* service) {
  auto client = VTDaemonClient::initWithServiceName(service);
  auto message = client->request(protocol::kRequestAnnotate)
                     .setting(protocol::kKeyAnnotations, vantrel::lmo::Dictionary());
  if (auto failure = transportFailure(client->sendSync(message, kReplyTimeout))) {
    printError(*failure);
    return kConnectionFailedExit;
  }
  printLine("connected");
  return blockUntilStdinCloses();
}

int holdAndWait(const char* service, uint64_t flags, std::vector<std::string> paths) {
  auto client = VTDaemonClient::initWithServiceName(service);
  auto outcome = client->sendSyncWith(
      [&](VTDaemonClient::ReplyHandler reply) {
        return client->holdPlugins(paths, static_cast<protocol::HoldFlags>(flags),
                                   std::move(reply));
      },
      kReplyTimeout);
  if (auto failure = transportFailure(outcome)) {
    printError(*failure);
    return kConnectionFailedExit;
  }
  if (auto refused = VTDaemonClient::errorInReply(outcome.value())) {
    printError(*refused);
  } else if (auto token = outcome.value().message()->body().get(protocol::kKeyUuids).getIfUuid()) {
    printLine("held " + token->string());
  } else {
    printError(
        vantrel::base::error_with_code(protocol::kErrorBadRequest, "hold granted without a token"));
  }
  return blockUntilStdinCloses();
}

// "ok", with the identifiers of the forms in a match reply's "matches".
std::string describeSuccess(const vantrel::lmo::Dictionary& reply) {
  const vantrel::lmo::Array* forms = reply.get(protocol::kKeyMatches).getIfArray();
  if (forms == nullptr) return "ok";
  std::string identifiers;
  for (const vantrel::lmo::Value& form : *forms) {
    const vantrel::lmo::Dictionary* fields = form.getIfDictionary();
    const std::string* identifier =
        fields ? fields->get(protocol::kFormIdentifier).getIfString() : nullptr;
    if (!identifiers.empty()) identifiers += ',';
    identifiers += identifier ? *identifier : "?";
  }
  return vantrel::base::format("ok %u %s", static_cast<unsigned>(forms->size()), identifiers);
}

int requestAndWait(const char* service, const char* type, uint64_t flags,
                   const std::vector<vantrel::base::Uuid>& uuids) {
  auto client = VTDaemonClient::initWithServiceName(service);
  const auto message =
      VTDaemonClient::set(client->request(type), uuids)
          .setting(protocol::kKeyFlags, vantrel::lmo::Value::unsignedInteger(flags));
  auto outcome = client->sendSync(message, kReplyTimeout);
  if (auto failure = transportFailure(outcome)) {
    printError(*failure);
    return kConnectionFailedExit;
  }
  if (auto refused = VTDaemonClient::errorInReply(outcome.value())) {
    printError(*refused);
  } else {
    printLine(describeSuccess(outcome.value().message()->body()));
  }
  return blockUntilStdinCloses();
}

// The answer line for a reply body: "ok ..." or "error <code> <message>".
std::string describeReply(const vantrel::lmo::Dictionary& reply) {
  const vantrel::lmo::Event event(vantrel::lmo::IncomingMessage(reply, 0, false));
  if (auto refused = VTDaemonClient::errorInReply(event)) {
    return vantrel::base::format("error %d %s", refused->code, refused->description());
  }
  return describeSuccess(reply);
}

int connectAndExec(const char* service, char** program) {
  RawClient connection(service, std::chrono::seconds(30), true);
  if (!connection.call(protocol::kRequestAnnotate,
                       vantrel::lmo::Dictionary().setting(protocol::kKeyAnnotations,
                                                          vantrel::lmo::Dictionary()))) {
    printError(vantrel::base::error_with_code(protocol::kErrorBadRequest, "no connection"));
    return kConnectionFailedExit;
  }
  ::setenv(kInheritedFdVariable, std::to_string(connection.fd()).c_str(), 1);
  ::execv(program[0], program);
  printLine(vantrel::base::format("error %d cannot run %s", errno, program[0]));
  return kConnectionFailedExit;
}

int raceExec(const char* service, const char* type, uint64_t flags, char** program) {
  RawClient connection(service, std::chrono::seconds(30), true);
  const pid_t child = ::fork();
  if (child < 0) return kConnectionFailedExit;
  if (child == 0) {
    const auto reply = connection.call(
        type, vantrel::lmo::Dictionary().setting(protocol::kKeyFlags,
                                                 vantrel::lmo::Value::unsignedInteger(flags)));
    printLine(reply ? describeReply(*reply) : "error 0 no reply to the child");
    ::_exit(0);
  }
  ::execv(program[0], program);
  printLine(vantrel::base::format("error %d cannot run %s", errno, program[0]));
  return kConnectionFailedExit;
}

int requestOnInherited(const char* type, uint64_t flags) {
  const char* fd = std::getenv(kInheritedFdVariable);
  RawClient connection = RawClient::adopt(fd ? std::atoi(fd) : -1);
  const auto reply =
      connection.call(type, vantrel::lmo::Dictionary().setting(
                                protocol::kKeyFlags, vantrel::lmo::Value::unsignedInteger(flags)));
  printLine(reply ? describeReply(*reply) : "error 0 no reply on the inherited connection");
  return 0;
}

int explainPath(const char* service, const char* path) {
  auto client = VTDaemonClient::initWithServiceName(service);
  const auto message = client->request(protocol::kRequestExplain)
                           .setting(protocol::kKeyPath, vantrel::lmo::Value(path));
  auto outcome = client->sendSync(message, kReplyTimeout);
  if (auto failure = transportFailure(outcome)) {
    printError(*failure);
    return kConnectionFailedExit;
  }
  if (auto refused = VTDaemonClient::errorInReply(outcome.value())) {
    printError(*refused);
    return 0;
  }
  const vantrel::lmo::Dictionary& body = outcome.value().message()->body();
  const std::string* reason = body.get(protocol::kKeyReason).getIfString();
  const std::string* text = body.get(protocol::kKeyText).getIfString();
  printLine("ok " + (reason ? *reason : "-") + " " + (text ? *text : "-"));
  return 0;
}

int readThroughToken(const std::string& token, const char* name) {
  namespace platform = vantrel::platform;
  const auto fail = [] {
    printLine(vantrel::base::format("error %d", errno));
    return kReadFailedExit;
  };
  const int64_t handle = platform::sandbox_extension_consume(token);
  if (handle < 0) return fail();
  const int fd =
      ::openat(platform::sandbox_extension_descriptor(handle), name, O_RDONLY | O_CLOEXEC);
  if (fd < 0) return fail();
  std::string text;
  char buffer[4096];
  for (ssize_t n = 1; n != 0 && text.size() < kMaxTokenReadBytes;) {
    n = ::read(fd, buffer, std::min(sizeof buffer, kMaxTokenReadBytes - text.size()));
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return fail();
    text.append(buffer, static_cast<size_t>(n));
  }
  ::close(fd);
  platform::sandbox_extension_release(handle);
  if (text.empty() || text.back() != '\n') text += '\n';
  std::fwrite(text.data(), 1, text.size(), stdout);
  return std::fflush(stdout) == 0 ? 0 : kReadFailedExit;
}

std::optional<std::vector<vantrel::base::Uuid>> parseUuids(char** first, char** last) {
  std::vector<vantrel::base::Uuid> uuids;
  for (char** arg = first; arg != last; ++arg) {
    auto uuid = vantrel::base::Uuid::parse(*arg);
    if (!uuid) return std::nullopt;
    uuids.push_back(*uuid);
  }
  return uuids;
}

std::optional<uint64_t> parseFlags(const char* text) {
  if (*text < '0' || *text > '9') return std::nullopt;
  char* end = nullptr;
  errno = 0;
  const unsigned long long value = std::strtoull(text, &end, 0);
  if (errno != 0 || *end != '\0') return std::nullopt;
  return value;
}

}  // namespace

int main(int argc, char** argv) {
  vantrel::base::setLogSink([](vantrel::base::LogLevel, std::string_view line) {
    std::fprintf(stderr, "%.*s\n", static_cast<int>(line.size()), line.data());
  });
  const std::string_view mode = argc >= 2 ? argv[1] : "";
  if (argc == 2 && mode == "sleep") return sleepUntilStdinCloses();
  if (argc == 2 && mode == "print-pid") return printPid();
  if (argc == 3 && mode == "connect") return connectAndWait(argv[2]);
  if (argc == 4 && mode == "read-token") return readThroughToken(argv[2], argv[3]);
  if (argc == 4 && mode == "explain") return explainPath(argv[2], argv[3]);
  if (argc >= 4 && mode == "exec") return connectAndExec(argv[2], argv + 3);
  if (argc >= 6 && mode == "race") {
    if (auto flags = parseFlags(argv[4])) return raceExec(argv[2], argv[3], *flags, argv + 5);
  }
  if (argc == 4 && mode == "inherited") {
    if (auto flags = parseFlags(argv[3])) return requestOnInherited(argv[2], *flags);
  }
  if (argc >= 4 && mode == "hold") {
    if (auto flags = parseFlags(argv[3])) {
      return holdAndWait(argv[2], *flags, std::vector<std::string>(argv + 4, argv + argc));
    }
  }
  if (argc >= 5 && mode == "request") {
    auto flags = parseFlags(argv[4]);
    auto uuids = parseUuids(argv + 5, argv + argc);
    if (flags && uuids) return requestAndWait(argv[2], argv[3], *flags, *uuids);
  }
  std::fprintf(stderr,
               "usage: %s sleep|print-pid|connect <service>|hold <service> <flags> [<path>...]"
               "|request <service> <type> <flags> [<uuid>...]|read-token <token> <name>\n",
               argc > 0 ? argv[0] : "vantrel-test-peer");
  return kUsageExit;
}
