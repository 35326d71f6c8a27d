// The real vantreld as a child process: its command line, its socket, and
// what it does with peers that send garbage or vanish. Every daemon here
// lives in the test's temporary directory (socket, state, preferences,
// annotations) and writes its log lines to a file there.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <optional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "lmo/Cbor.h"
#include "lmo/Frame.h"
#include "lmo/Protocol.h"
#include "lmo/Value.h"
#include "tests/support/PeerProcess.h"
#include "tests/support/RawClient.h"
#include "tests/support/TempDir.h"

namespace vantrel::daemon {
namespace {

using namespace std::chrono_literals;
using Bytes = std::vector<uint8_t>;
using lmo::Dictionary;
using lmo::FrameKind;
using lmo::Value;
using vantrel::testing::PeerProcess;

constexpr auto kDeadline = 10s;

// Polls until condition holds or the deadline passes; whether it held.
bool eventually(const std::function<bool()>& condition) {
  const auto deadline = std::chrono::steady_clock::now() + kDeadline;
  for (; !condition(); std::this_thread::sleep_for(10ms)) {
    if (std::chrono::steady_clock::now() > deadline) return false;
  }
  return true;
}

// The text of a regular file (a pipe is not read: that could block).
std::string readFile(const std::string& path) {
  std::error_code ec;
  if (!std::filesystem::is_regular_file(path, ec)) return "(not a regular file)";
  std::ostringstream text;
  text << std::ifstream(path, std::ios::binary).rdbuf();
  return text.str();
}

// The complete lines of a log file that begin with prefix (a line still being
// written is left out).
std::vector<std::string> logLines(const std::string& path, std::string_view prefix = "") {
  std::vector<std::string> lines;
  std::istringstream in(readFile(path));
  for (std::string line; std::getline(in, line) && !in.eof();) {
    if (line.starts_with(prefix)) lines.push_back(line);
  }
  return lines;
}

// The child's wait status once it has exited within timeout; nullopt while
// it runs.
std::optional<int> exitStatus(PeerProcess& child, std::chrono::milliseconds timeout) {
  pollfd p{child.pidfd(), POLLIN, 0};
  int ready;
  while ((ready = ::poll(&p, 1, static_cast<int>(timeout.count()))) < 0 && errno == EINTR) {
  }
  if (ready != 1) return std::nullopt;
  return child.wait();
}

struct RawHeader {
  uint8_t version = lmo::kFrameVersion;
  uint8_t kind = static_cast<uint8_t>(FrameKind::kRequest);
  uint16_t reserved = 0;
  uint64_t id = 1;
  uint64_t inReplyTo = 0;
};

Bytes operator+(Bytes a, const Bytes& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

// A frame written field by field, so that any field can be wrong; length
// replaces the length prefix (otherwise header plus body).
Bytes rawFrame(const RawHeader& h, const Bytes& body,
               std::optional<uint64_t> length = std::nullopt) {
  Bytes out;
  const auto put = [&out](uint64_t value, int bytes) {
    while (bytes-- > 0) out.push_back(static_cast<uint8_t>(value >> (8 * bytes)));
  };
  put(length.value_or(lmo::kFrameHeaderSize + body.size()), 4);
  put(h.version, 1);
  put(h.kind, 1);
  put(h.reserved, 2);
  put(h.id, 8);
  put(h.inReplyTo, 8);
  return out + body;
}

// depth maps, each the only value of the one before: {"a": {"a": ... {}}}.
Bytes nestedMaps(int depth) {
  Bytes out;
  for (int i = 1; i < depth; ++i) out.insert(out.end(), {0xA1, 0x61, 'a'});
  out.push_back(0xA0);
  return out;
}

Dictionary request(const char* type, uint64_t version) {
  return {{protocol::kKeyRequest, type}, {protocol::kKeyVersion, Value::unsignedInteger(version)}};
}

Bytes cbor(const Dictionary& body) {
  return lmo::encodeCbor(Value(body)).value();
}

sockaddr_un socketAddress(const std::string& path) {
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  path.copy(addr.sun_path, sizeof addr.sun_path - 1);
  return addr;
}

// A socket bound to path, or -1. Inheritable: a child may be handed it.
int bindSocket(const std::string& path) {
  const sockaddr_un addr = socketAddress(path);
  const int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
  if (fd >= 0 && ::bind(fd, reinterpret_cast<const sockaddr*>(&addr), sizeof addr) == 0) return fd;
  if (fd >= 0) ::close(fd);
  return -1;
}

using vantrel::testing::RawClient;

// The next frame from the daemon (a read gives up after kDeadline); a bad
// frame fails the test.
std::optional<lmo::Frame> nextFrame(RawClient& client) {
  std::optional<base::Result<lmo::Frame>> frame = client.readFrame();
  if (!frame) return std::nullopt;
  if (frame->has_value()) return std::move(*frame).value();
  ADD_FAILURE() << "bad frame from the daemon: " << frame->error().description();
  return std::nullopt;
}

// Whether the daemon ends the connection (end of stream or reset) in time
// without sending anything first.
::testing::AssertionResult closedByDaemon(RawClient& client) {
  uint8_t buffer[4096];
  const ssize_t n = client.receive(buffer, sizeof buffer);
  if (n == 0 || (n < 0 && errno == ECONNRESET)) return ::testing::AssertionSuccess();
  if (n > 0) return ::testing::AssertionFailure() << "the daemon answered " << n << " bytes";
  return ::testing::AssertionFailure() << "connection still open: " << std::strerror(errno);
}

// Whether the daemon has ended its side in time (for a socket that no longer
// reads).
bool hungUpByDaemon(const RawClient& client) {
  pollfd p{client.fd(), POLLHUP, 0};
  return eventually([&] { return ::poll(&p, 1, 0) == 1 && (p.revents & POLLHUP) != 0; });
}

// An unknown request type, answered with code 4: proof that the daemon
// serves this connection, and a request that logs nothing at verbosity 0.
::testing::AssertionResult ping(RawClient& client, uint64_t id) {
  std::optional<lmo::Frame> reply;
  if (client.send(FrameKind::kRequest, id, request("ping", protocol::kCurrentVersion)))
    reply = nextFrame(client);
  if (!reply) return ::testing::AssertionFailure() << "no reply to ping " << id;
  if (reply->kind != FrameKind::kReply || reply->inReplyTo != id ||
      reply->body.get(protocol::kKeyErrorCode).getIfUInt64() !=
          static_cast<uint64_t>(protocol::kErrorBadRequest)) {
    return ::testing::AssertionFailure() << "ping " << id << " got reply to " << reply->inReplyTo
                                         << ": " << lmo::describe(reply->body);
  }
  return ::testing::AssertionSuccess();
}

struct Daemon {
  std::unique_ptr<PeerProcess> process;
  std::string log;                    // its standard error, hence its log lines
  std::unique_ptr<RawClient> client;  // set by startServing: answered a first ping
};

// Whether the daemon exits with code within the deadline.
::testing::AssertionResult exitsWith(Daemon& daemon, int code) {
  if (!daemon.process) return ::testing::AssertionFailure() << "not started";
  const std::optional<int> status = exitStatus(*daemon.process, kDeadline);
  if (!status) return ::testing::AssertionFailure() << "still running";
  if (WIFEXITED(*status) && WEXITSTATUS(*status) == code) return ::testing::AssertionSuccess();
  return ::testing::AssertionFailure() << "wait status " << *status << ", log:\n"
                                       << readFile(daemon.log);
}

// A connection to socket once the daemon serves it; null (after a test
// failure) when it exits first or does not serve in time.
std::unique_ptr<RawClient> connectWhenUp(const std::string& socket, Daemon& daemon) {
  if (!daemon.process) return nullptr;
  std::unique_ptr<RawClient> client;
  eventually([&] {
    client = std::make_unique<RawClient>(socket, kDeadline);
    return client->connected() || exitStatus(*daemon.process, 0ms).has_value();
  });
  if (client->connected()) return client;
  ADD_FAILURE() << "not serving " << socket << "; its log:\n" << readFile(daemon.log);
  return nullptr;
}

class VantreldProcess : public ::testing::Test {
 protected:
  VantreldProcess() {
    for (const char* dir : {"apps", "plugins", "home"}) {
      std::filesystem::create_directories(tmp_.path() / dir);
    }
  }

  // Starts vantreld with args through a shell that runs the prelude and
  // sends the daemon's standard error to log (by default a fresh file: a
  // pipe nobody drains could stall a chatty daemon). The shell execs the
  // daemon, so the child's pid is the daemon's. Everything the daemon may
  // write or read points into the temporary directory.
  Daemon start(const std::vector<std::string>& args, const std::string& prelude = "",
               std::string log = "") {
    Daemon daemon;
    daemon.log = log.empty() ? tmp_.file("vantreld-" + std::to_string(++started_) + ".log") : log;
    std::vector<std::string> shellArgs{"-c", prelude + "exec 2>\"$1\"; shift; exec \"$0\" \"$@\"",
                                       VANTRELD_PATH, daemon.log};
    shellArgs.insert(shellArgs.end(), args.begin(), args.end());
    std::vector<std::string> environment{"VANTREL_LOG=stderr", "LISTEN_PID=", "LISTEN_FDS="};
    for (const std::string entry :
         {"VANTREL_RUNTIME_DIR=run", "VANTREL_STATE_DIR=state", "VANTREL_APP_DIRS=apps",
          "VANTREL_PLUGIN_DIRS=plugins", "VANTREL_PREFERENCES_DIR=prefs", "VANTREL_SDK_DIRS=sdks",
          "XDG_STATE_HOME=xdg-state", "XDG_CONFIG_HOME=xdg-config", "HOME=home"}) {
      const size_t value = entry.find('=') + 1;
      environment.push_back(entry.substr(0, value) + tmp_.file(entry.substr(value)));
    }
    // The child gets SIGPIPE at its default action even when whatever ran
    // the tests ignores it: the daemon has to ignore it itself.
    struct sigaction defaultAction {};
    struct sigaction saved {};
    defaultAction.sa_handler = SIG_DFL;
    ::sigaction(SIGPIPE, &defaultAction, &saved);
    // bash: dash takes only one-digit descriptors in redirections.
    daemon.process = PeerProcess::start("/bin/bash", shellArgs, environment);
    ::sigaction(SIGPIPE, &saved, nullptr);
    // Exits are watched through the pidfd.
    EXPECT_TRUE(daemon.process && daemon.process->pidfd() >= 0);
    return daemon;
  }

  // A daemon on socket whose client has answered a first ping. Fails the
  // test (and leaves client null) otherwise.
  Daemon startServing(const std::string& socket, std::vector<std::string> args = {},
                      const std::string& log = "") {
    args.insert(args.begin(), {"-S", socket, "-d", tmp_.file("Annotations")});
    Daemon daemon = start(args, "", log);
    daemon.client = connectWhenUp(socket, daemon);
    if (daemon.client && !ping(*daemon.client, 1)) daemon.client.reset();
    return daemon;
  }

  vantrel::testing::TempDir tmp_;
  std::string socket_ = tmp_.file("vantreld.socket");

 private:
  int started_ = 0;
};

TEST_F(VantreldProcess, BadCommandLinePrintsUsageAndExits2) {
  // An unknown option, alone and in a cluster; a final option without its
  // value; an operand after the options and before them.
  const std::vector<std::vector<std::string>> commandLines = {{"-x"},
                                                              {"-vx"},
                                                              {"-S"},
                                                              {"-c"},
                                                              {"-v", "-S", socket_, "operand"},
                                                              {"operand", "-S", socket_}};
  for (const auto& args : commandLines) {
    SCOPED_TRACE(::testing::PrintToString(args));
    Daemon daemon = start(args);
    EXPECT_TRUE(exitsWith(daemon, 2));
    EXPECT_EQ(readFile(daemon.log), "Usage: vantreld [-S servicename] [-v]\n");
    EXPECT_FALSE(std::filesystem::exists(socket_));
  }
}

TEST_F(VantreldProcess, ReplacesAStaleSocketButNeverALiveOneOrAFile) {
  // A socket file whose listener is gone, as a killed daemon leaves it.
  const int stale = bindSocket(socket_);
  ASSERT_GE(stale, 0);
  ::close(stale);
  Daemon first = startServing(socket_);
  ASSERT_TRUE(first.client);
  struct stat before {};
  ASSERT_EQ(::stat(socket_.c_str(), &before), 0);
  EXPECT_EQ(before.st_mode & 0777, 0666u);

  // A daemon on the live socket, or on something that is no socket at all,
  // gives up and leaves it alone.
  const std::string file = tmp_.write("not-a-socket", "precious");
  for (const std::string& taken : {socket_, file}) {
    SCOPED_TRACE(taken);
    Daemon other = start({"-S", taken, "-d", tmp_.file("Annotations2")});
    EXPECT_TRUE(exitsWith(other, 1));
    EXPECT_EQ(logLines(other.log, "unable to construct server").size(), 1u) << readFile(other.log);
  }
  EXPECT_EQ(readFile(file), "precious");
  struct stat after {};
  ASSERT_EQ(::stat(socket_.c_str(), &after), 0);
  EXPECT_EQ(after.st_ino, before.st_ino);
  // Still served, by the first daemon: the others have exited.
  RawClient client(socket_, kDeadline);
  EXPECT_TRUE(ping(client, 2));
}

TEST_F(VantreldProcess, ServesWellFormedFramesAndDropsMalformedPeers) {
  Daemon daemon = startServing(socket_);
  ASSERT_TRUE(daemon.client);
  const Bytes body = cbor(request("ping", protocol::kCurrentVersion));
  const Bytes valid = rawFrame({}, body);
  const uint8_t kMessage = static_cast<uint8_t>(FrameKind::kMessage);
  const uint8_t kReply = static_cast<uint8_t>(FrameKind::kReply);
  // Messages get no reply, a failing one included. Requests are served in
  // order, so the first frame back must answer the request after them.
  const Bytes messages =
      rawFrame({.kind = kMessage, .id = 5},
               cbor(request(protocol::kRequestAnnotate, protocol::kCurrentVersion)
                        .setting(protocol::kKeyAnnotations, Dictionary()))) +
      rawFrame({.kind = kMessage, .id = 6}, cbor(request("ping", 1)));
  struct Case {
    const char* name;
    Bytes bytes;
    const char* reason;  // a fragment of the logged reason; null: request 1 answered
    bool closeAfterWriting = false;
  };
  const Case cases[] = {
      // Frames built the same way but well formed are served: the rows
      // below fail for their one fault, not for the way they are built.
      {"well formed", valid, nullptr},
      {"nested exactly 64 deep", rawFrame({}, nestedMaps(lmo::kMaxCborDepth)), nullptr},
      {"messages, then a request", messages + valid, nullptr},
      {"length above 16 MiB", rawFrame({}, {}, lmo::kMaxFrameLength + 1), "exceeds the limit"},
      {"length below the header", rawFrame({}, {}, lmo::kFrameHeaderSize - 1), "shorter"},
      {"truncated, then closed", Bytes(valid.begin(), valid.begin() + 10), "truncated", true},
      {"unknown version", rawFrame({.version = 2}, body), "version"},
      {"unknown kind", rawFrame({.kind = 4}, body), "kind"},
      {"non-zero reserved field", rawFrame({.reserved = 1}, body), "reserved"},
      {"id 0", rawFrame({.id = 0}, body), "id 0"},
      {"request with an in-reply-to", rawFrame({.inReplyTo = 5}, body), "in-reply-to"},
      {"reply to nothing sent", rawFrame({.kind = kReply, .inReplyTo = 999}, body),
       "reply to unknown message"},
      {"body is an array", rawFrame({}, {0x80}), "not a map"},
      {"nested 65 deep", rawFrame({}, nestedMaps(lmo::kMaxCborDepth + 1)), "deeper than 64"},
      {"unknown tag", rawFrame({}, {0xA1, 0x61, 'a', 0xD8, 0x63, 0x00}), "tag"},
      {"integer key", rawFrame({}, {0xA1, 0x01, 0x00}), "key"},
      {"duplicate key", rawFrame({}, {0xA2, 0x61, 'a', 0x00, 0x61, 'a', 0x01}), "duplicate"},
      {"invalid UTF-8", rawFrame({}, {0xA1, 0x61, 'a', 0x62, 0xC3, 0x28}), "UTF-8"},
  };
  const std::string closing = "closing connection from pid " + std::to_string(::getpid()) + ": ";
  uint64_t pingId = 1;
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    const size_t linesBefore = logLines(daemon.log).size();
    RawClient bad(socket_, kDeadline);
    ASSERT_TRUE(bad.write(c.bytes));
    if (c.closeAfterWriting) bad.shutdown(SHUT_WR);
    if (c.reason == nullptr) {
      const std::optional<lmo::Frame> reply = nextFrame(bad);
      ASSERT_TRUE(reply.has_value());
      EXPECT_EQ(reply->inReplyTo, 1u);
    } else {
      EXPECT_TRUE(closedByDaemon(bad));
      EXPECT_TRUE(eventually([&] { return logLines(daemon.log).size() > linesBefore; }));
    }
    ASSERT_TRUE(ping(*daemon.client, ++pingId)) << readFile(daemon.log);
    // Exactly one line for the bad peer, and none for a good one.
    const std::vector<std::string> lines = logLines(daemon.log);
    ASSERT_EQ(lines.size(), linesBefore + (c.reason ? 1 : 0)) << readFile(daemon.log);
    if (c.reason) {
      EXPECT_TRUE(lines.back().starts_with(closing)) << lines.back();
      EXPECT_NE(lines.back().find(c.reason), std::string::npos) << lines.back();
    }
  }
}

TEST_F(VantreldProcess, SurvivesBrokenPipes) {
  Daemon daemon = startServing(socket_);
  uint64_t id = 10;
  for (const bool stopReading : {false, true}) {
    SCOPED_TRACE(stopReading ? "stops reading" : "closes");
    RawClient client(socket_, kDeadline);
    ASSERT_TRUE(client.send(FrameKind::kRequest, ++id,
                            request(protocol::kRequestBulk, protocol::kCurrentVersion)));
    if (stopReading) {
      // The socket stays open but refuses input: the reply's write fails
      // with a broken pipe, and the daemon drops the connection.
      client.shutdown(SHUT_RD);
      EXPECT_TRUE(hungUpByDaemon(client));
    } else {
      client.close();
    }
    RawClient next(socket_, kDeadline);
    ASSERT_TRUE(ping(next, ++id)) << readFile(daemon.log);
  }
  // A peer that leaves is no misbehaving peer.
  EXPECT_EQ(logLines(daemon.log, "closing connection").size(), 0u) << readFile(daemon.log);

  // The reader of its log goes away: the next log line ("bulk options ...")
  // is written into a broken pipe. The daemon before it gives up the state
  // directory first: one daemon may hold it at a time.
  daemon.process.reset();
  const std::string fifo = tmp_.file("log.fifo");
  ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
  const int reader = ::open(fifo.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC);
  ASSERT_GE(reader, 0);
  Daemon unlogged = startServing(tmp_.file("unlogged.socket"), {}, fifo);
  ::close(reader);
  ASSERT_TRUE(unlogged.client);
  ASSERT_TRUE(unlogged.client->send(FrameKind::kRequest, 2,
                                    request(protocol::kRequestBulk, protocol::kCurrentVersion)));
  EXPECT_TRUE(nextFrame(*unlogged.client).has_value());
  EXPECT_TRUE(ping(*unlogged.client, 3));
}

TEST_F(VantreldProcess, ServesTheSocketHandedOverByTheServiceManager) {
  // The daemon takes descriptor 3 only when LISTEN_PID (shell text) names it.
  for (const std::string listenPid : {"$$", "1"}) {
    SCOPED_TRACE("LISTEN_PID=" + listenPid);
    const bool served = listenPid == "$$";
    const std::string handed = tmp_.file("handed-" + std::to_string(served) + ".socket");
    const std::string own = tmp_.file("own-" + std::to_string(served) + ".socket");
    // Inherited on purpose; the shell moves it to 3.
    const int fd = bindSocket(handed);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(::listen(fd, 16), 0);
    const std::string n = std::to_string(fd);
    const std::string prelude = (fd == 3 ? "" : "exec 3<&" + n + " " + n + "<&-; ") +
                                "export LISTEN_FDS=1 LISTEN_PID=" + listenPid + "; ";
    Daemon daemon = start({"-S", own, "-d", tmp_.file("Annotations")}, prelude);
    ::close(fd);
    const std::unique_ptr<RawClient> client = connectWhenUp(served ? handed : own, daemon);
    ASSERT_TRUE(client);
    EXPECT_TRUE(ping(*client, 1)) << readFile(daemon.log);
    EXPECT_EQ(std::filesystem::exists(own), !served);
  }
}

TEST_F(VantreldProcess, VerbosityAddsDebugLinesThenDumps) {
  struct Case {
    std::vector<std::string> flags;
    size_t debugLines;
    bool dumps;
  };
  const Case cases[] = {
      {{}, 0, false}, {{"-v"}, 1, false}, {{"-vv"}, 1, true}, {{"-v", "-v"}, 1, true}};
  const std::string requestLine = "client " + std::to_string(::getpid()) + " request bulk";
  int row = 0;
  for (const Case& c : cases) {
    SCOPED_TRACE(::testing::PrintToString(c.flags));
    Daemon daemon =
        startServing(tmp_.file("verbose-" + std::to_string(++row) + ".socket"), c.flags);
    ASSERT_TRUE(daemon.client);
    ASSERT_TRUE(daemon.client->send(FrameKind::kRequest, 7,
                                    request(protocol::kRequestBulk, protocol::kCurrentVersion)));
    ASSERT_TRUE(nextFrame(*daemon.client).has_value());
    // The lines of a request are written before its reply is sent.
    EXPECT_EQ(logLines(daemon.log, requestLine).size(), c.debugLines) << readFile(daemon.log);
    EXPECT_EQ(logLines(daemon.log, "bulk options 0x0 not supported").size(), 1u);
    EXPECT_NE(logLines(daemon.log, "incoming request ").empty(), c.dumps);
    EXPECT_NE(logLines(daemon.log, "Replying ").empty(), c.dumps);
  }
}

}  // namespace
}  // namespace vantrel::daemon
