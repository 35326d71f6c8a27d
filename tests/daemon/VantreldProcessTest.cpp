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
#include "lmo/Value.h"
#include "tests/support/PeerProcess.h"
#include "tests/support/TempDir.h"

namespace vantrel::daemon {
namespace {

using namespace std::chrono_literals;
using Bytes = std::vector<uint8_t>;
using lmo::Dictionary;
using lmo::FrameKind;
using lmo::Value;
using vantrel::testing::PeerProcess;

constexpr const char* kUsage = "Usage: vantreld [-S servicename] [-v]\n";
constexpr auto kDeadline = 10s;
constexpr uint64_t kUnrecognizedRequest = 4;
constexpr uint64_t kVersionMismatch = 7;

// Polls until condition holds or the deadline passes; whether it held.
bool eventually(const std::function<bool()>& condition) {
  const auto deadline = std::chrono::steady_clock::now() + kDeadline;
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(10ms);
  }
  return true;
}

// The text of a regular file (a pipe is not read: that could block).
std::string readFile(const std::string& path) {
  std::error_code ec;
  if (!std::filesystem::is_regular_file(path, ec)) return "(not a regular file)";
  std::ifstream in(path, std::ios::binary);
  std::ostringstream text;
  text << in.rdbuf();
  return text.str();
}

// The complete lines of a log file (a line still being written is left out).
std::vector<std::string> logLines(const std::string& path) {
  std::vector<std::string> lines;
  const std::string text = readFile(path);
  size_t start = 0;
  for (size_t end; (end = text.find('\n', start)) != std::string::npos; start = end + 1) {
    lines.push_back(text.substr(start, end - start));
  }
  return lines;
}

size_t countLines(const std::string& path, const std::string& prefix) {
  size_t count = 0;
  for (const std::string& line : logLines(path)) count += line.starts_with(prefix) ? 1 : 0;
  return count;
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

bool isRunning(PeerProcess& child) {
  return !exitStatus(child, 0ms).has_value();
}

void putBigEndian(Bytes& out, uint64_t value, int bytes) {
  for (int shift = (bytes - 1) * 8; shift >= 0; shift -= 8) {
    out.push_back(static_cast<uint8_t>(value >> shift));
  }
}

struct RawHeader {
  uint8_t version = lmo::kFrameVersion;
  uint8_t kind = static_cast<uint8_t>(FrameKind::kRequest);
  uint16_t reserved = 0;
  uint64_t id = 1;
  uint64_t inReplyTo = 0;
};

// A frame written field by field, so that any field can be wrong; length
// replaces the length prefix (otherwise header plus body).
Bytes rawFrame(const RawHeader& h, const Bytes& body,
               std::optional<uint64_t> length = std::nullopt) {
  Bytes out;
  putBigEndian(out, length.value_or(lmo::kFrameHeaderSize + body.size()), 4);
  out.push_back(h.version);
  out.push_back(h.kind);
  putBigEndian(out, h.reserved, 2);
  putBigEndian(out, h.id, 8);
  putBigEndian(out, h.inReplyTo, 8);
  out.insert(out.end(), body.begin(), body.end());
  return out;
}

Bytes cbor(const Dictionary& body) {
  return lmo::encodeCbor(Value(body)).value();
}

// depth maps, each the only value of the one before: {"a": {"a": ... {}}}.
Bytes nestedMaps(int depth) {
  Bytes out;
  for (int i = 1; i < depth; ++i) out.insert(out.end(), {0xA1, 0x61, 'a'});
  out.push_back(0xA0);
  return out;
}

Dictionary request(const char* type, uint64_t version) {
  return {{"request", type}, {"version", Value::unsignedInteger(version)}};
}

// A plain socket to the daemon: frames (or garbage) out, frames back.
class RawClient {
 public:
  explicit RawClient(const std::string& path) {
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    if (path.size() >= sizeof addr.sun_path) return;
    std::memcpy(addr.sun_path, path.data(), path.size());
    fd_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd_ >= 0 && ::connect(fd_, reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0) close();
  }
  ~RawClient() { close(); }
  RawClient(const RawClient&) = delete;
  RawClient& operator=(const RawClient&) = delete;

  bool connected() const { return fd_ >= 0; }

  bool write(const Bytes& bytes) {
    for (size_t sent = 0; sent < bytes.size();) {
      const ssize_t n = ::send(fd_, bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) return false;
      sent += static_cast<size_t>(n);
    }
    return true;
  }
  bool send(FrameKind kind, uint64_t id, const Dictionary& body) {
    return write(lmo::encodeFrame({kind, id, 0, body}).value());
  }

  // The next frame; nullopt at end of stream, on a bad frame or when none
  // comes within the deadline.
  std::optional<lmo::Frame> readFrame() {
    const auto deadline = std::chrono::steady_clock::now() + kDeadline;
    for (;;) {
      if (auto frame = reader_.next()) {
        if (frame->has_value()) return std::move(*frame).value();
        ADD_FAILURE() << "bad frame from the daemon: " << frame->error().description();
        return std::nullopt;
      }
      uint8_t buffer[4096];
      const ssize_t n = receive(buffer, sizeof buffer, deadline);
      if (n <= 0) return std::nullopt;
      reader_.feed(buffer, static_cast<size_t>(n));
    }
  }

  // Whether the daemon ends the connection (end of stream or reset) within
  // the deadline without sending anything first.
  ::testing::AssertionResult closedByDaemon() {
    const auto deadline = std::chrono::steady_clock::now() + kDeadline;
    uint8_t buffer[4096];
    const ssize_t n = receive(buffer, sizeof buffer, deadline);
    if (n == 0 || (n < 0 && errno == ECONNRESET)) return ::testing::AssertionSuccess();
    if (n > 0) return ::testing::AssertionFailure() << "the daemon answered " << n << " bytes";
    return ::testing::AssertionFailure() << "connection still open: " << std::strerror(errno);
  }

  // Whether the daemon has ended its side within the deadline (for a
  // socket that no longer reads).
  bool hungUpByDaemon() {
    pollfd p{fd_, POLLHUP, 0};
    return eventually([&] { return ::poll(&p, 1, 0) == 1 && (p.revents & POLLHUP) != 0; });
  }

  void shutdown(int how) { ::shutdown(fd_, how); }
  void close() {
    if (fd_ >= 0) ::close(fd_);
    fd_ = -1;
  }

 private:
  // recv with a deadline: the byte count, 0 at end of stream, -1 with errno
  // (ETIMEDOUT when nothing came).
  ssize_t receive(uint8_t* buffer, size_t size, std::chrono::steady_clock::time_point deadline) {
    for (;;) {
      const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
          deadline - std::chrono::steady_clock::now());
      pollfd p{fd_, POLLIN, 0};
      const int ready = left.count() > 0 ? ::poll(&p, 1, static_cast<int>(left.count())) : 0;
      if (ready < 0 && errno == EINTR) continue;
      if (ready <= 0) {
        errno = ETIMEDOUT;
        return -1;
      }
      const ssize_t n = ::recv(fd_, buffer, size, 0);
      if (n < 0 && errno == EINTR) continue;
      return n;
    }
  }

  int fd_ = -1;
  lmo::FrameReader reader_;
};

// An unknown request type, answered with code 4: proof that the daemon
// serves this connection, and a request that logs nothing at verbosity 0.
::testing::AssertionResult ping(RawClient& client, uint64_t id) {
  if (!client.send(FrameKind::kRequest, id, request("ping", 3))) {
    return ::testing::AssertionFailure() << "cannot send ping " << id;
  }
  const std::optional<lmo::Frame> reply = client.readFrame();
  if (!reply) return ::testing::AssertionFailure() << "no reply to ping " << id;
  if (reply->kind != FrameKind::kReply || reply->inReplyTo != id ||
      reply->body.get("errorcode").getIfUInt64() != kUnrecognizedRequest) {
    return ::testing::AssertionFailure() << "ping " << id << " got reply to " << reply->inReplyTo
                                         << ": " << lmo::describe(reply->body);
  }
  return ::testing::AssertionSuccess();
}

struct Daemon {
  std::unique_ptr<PeerProcess> process;
  std::string log;  // its standard error, hence its log lines
};

// How a daemon is started, beyond its arguments.
struct Launch {
  std::vector<std::string> environment;  // on top of the fixture's
  std::string prelude;                   // shell commands run before the exec
  const char* shell = "/bin/sh";
  std::string stderrPath;  // empty: a fresh log file
};

// SIGPIPE at its default action while it lives, so that a child started
// meanwhile does not inherit an ignored one from whatever ran the tests.
class DefaultSigpipe {
 public:
  DefaultSigpipe() {
    struct sigaction action {};
    action.sa_handler = SIG_DFL;
    ::sigaction(SIGPIPE, &action, &saved_);
  }
  ~DefaultSigpipe() { ::sigaction(SIGPIPE, &saved_, nullptr); }
  DefaultSigpipe(const DefaultSigpipe&) = delete;
  DefaultSigpipe& operator=(const DefaultSigpipe&) = delete;

 private:
  struct sigaction saved_ {};
};

class VantreldProcess : public ::testing::Test {
 protected:
  VantreldProcess() {
    for (const char* dir : {"apps", "plugins", "home"}) {
      std::filesystem::create_directories(tmp_.path() / dir);
    }
  }

  // The daemon's environment: everything it may write or read points into
  // the temporary directory, and its log goes to standard error.
  std::vector<std::string> environment() const {
    return {"VANTREL_RUNTIME_DIR=" + tmp_.file("run"),
            "VANTREL_STATE_DIR=" + tmp_.file("state"),
            "VANTREL_APP_DIRS=" + tmp_.file("apps"),
            "VANTREL_PLUGIN_DIRS=" + tmp_.file("plugins"),
            "VANTREL_PREFERENCES_DIR=" + tmp_.file("prefs"),
            "VANTREL_SDK_DIRS=" + tmp_.file("sdks"),
            "XDG_STATE_HOME=" + tmp_.file("xdg-state"),
            "XDG_CONFIG_HOME=" + tmp_.file("xdg-config"),
            "HOME=" + tmp_.file("home"),
            "VANTREL_LOG=stderr",
            "LISTEN_PID=",
            "LISTEN_FDS="};
  }

  // Starts vantreld with args through a shell that runs the prelude and
  // sends the daemon's standard error to a file of its own (a pipe nobody
  // drains could stall a chatty daemon). The shell execs the daemon, so the
  // child's pid is the daemon's.
  Daemon start(const std::vector<std::string>& args, const Launch& launch = {}) {
    Daemon daemon;
    daemon.log = launch.stderrPath.empty()
                     ? tmp_.file("vantreld-" + std::to_string(++started_) + ".log")
                     : launch.stderrPath;
    std::vector<std::string> shellArgs{"-c",
                                       launch.prelude + "exec 2>\"$1\"; shift; exec \"$0\" \"$@\"",
                                       VANTRELD_PATH, daemon.log};
    shellArgs.insert(shellArgs.end(), args.begin(), args.end());
    std::vector<std::string> fullEnv = environment();
    fullEnv.insert(fullEnv.end(), launch.environment.begin(), launch.environment.end());
    DefaultSigpipe sigpipe;
    daemon.process = PeerProcess::start(launch.shell, shellArgs, fullEnv);
    EXPECT_NE(daemon.process, nullptr);
    // Exits are watched through the pidfd.
    if (daemon.process != nullptr) {
      EXPECT_GE(daemon.process->pidfd(), 0);
    }
    return daemon;
  }

  // A daemon on socket, answering a first ping. Fails the test (and
  // returns a daemon that may not run) otherwise.
  Daemon startServing(const std::string& socket, std::vector<std::string> extraArgs = {},
                      const Launch& launch = {}) {
    std::vector<std::string> args{"-S", socket, "-d", tmp_.file("Annotations")};
    args.insert(args.end(), extraArgs.begin(), extraArgs.end());
    Daemon daemon = start(args, launch);
    if (daemon.process == nullptr) return daemon;
    std::unique_ptr<RawClient> client;
    const bool up = eventually([&] {
      client = std::make_unique<RawClient>(socket);
      return client->connected() || !isRunning(*daemon.process);
    });
    EXPECT_TRUE(up && client->connected()) << "not serving; its log:\n" << readFile(daemon.log);
    if (client->connected()) {
      EXPECT_TRUE(ping(*client, 1));
    }
    return daemon;
  }

  vantrel::testing::TempDir tmp_;
  std::string socket_ = tmp_.file("vantreld.socket");

 private:
  int started_ = 0;
};

TEST_F(VantreldProcess, BadCommandLinePrintsUsageAndExits2) {
  const std::vector<std::vector<std::string>> commandLines = {
      {"-x"},                            // unknown option
      {"-vx"},                           // unknown option in a cluster
      {"-S"},                            // final -S without a name
      {"-c"},                            // final -c without a number
      {"-v", "-S", socket_, "operand"},  // operand after the options
      {"operand", "-S", socket_},        // operand first
  };
  for (const auto& args : commandLines) {
    std::string shown;
    for (const std::string& arg : args) shown += arg + " ";
    SCOPED_TRACE(shown);
    Daemon daemon = start(args);
    ASSERT_NE(daemon.process, nullptr);
    const std::optional<int> status = exitStatus(*daemon.process, kDeadline);
    ASSERT_TRUE(status.has_value()) << "still running";
    EXPECT_TRUE(WIFEXITED(*status) && WEXITSTATUS(*status) == 2) << "wait status " << *status;
    EXPECT_EQ(readFile(daemon.log), kUsage);
    EXPECT_FALSE(std::filesystem::exists(socket_));
  }
}

TEST_F(VantreldProcess, ReplacesAStaleSocketButNeverALiveOneOrAFile) {
  // A socket file whose listener is gone, as a killed daemon leaves it.
  {
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::memcpy(addr.sun_path, socket_.data(), socket_.size());
    ASSERT_EQ(::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
    ::close(fd);
    ASSERT_TRUE(std::filesystem::is_socket(socket_));
  }
  Daemon first = startServing(socket_);
  ASSERT_TRUE(isRunning(*first.process));
  struct stat before {};
  ASSERT_EQ(::stat(socket_.c_str(), &before), 0);
  EXPECT_EQ(before.st_mode & 0777, 0666u);

  // A second daemon on the live socket gives up and leaves it alone.
  Daemon second = start({"-S", socket_, "-d", tmp_.file("Annotations2")});
  ASSERT_NE(second.process, nullptr);
  std::optional<int> status = exitStatus(*second.process, kDeadline);
  ASSERT_TRUE(status.has_value()) << "the second daemon still runs";
  EXPECT_TRUE(WIFEXITED(*status) && WEXITSTATUS(*status) == 1) << "wait status " << *status;
  EXPECT_EQ(countLines(second.log, "unable to construct server"), 1u) << readFile(second.log);
  struct stat after {};
  ASSERT_EQ(::stat(socket_.c_str(), &after), 0);
  EXPECT_EQ(after.st_ino, before.st_ino);
  RawClient client(socket_);
  ASSERT_TRUE(client.connected());
  EXPECT_TRUE(ping(client, 2));
  EXPECT_TRUE(isRunning(*first.process));

  // Something that is not a socket is never taken for a stale one.
  const std::string file = tmp_.write("not-a-socket", "precious");
  Daemon third = start({"-S", file});
  ASSERT_NE(third.process, nullptr);
  status = exitStatus(*third.process, kDeadline);
  ASSERT_TRUE(status.has_value()) << "the daemon on a plain file still runs";
  EXPECT_TRUE(WIFEXITED(*status) && WEXITSTATUS(*status) == 1) << "wait status " << *status;
  EXPECT_EQ(countLines(third.log, "unable to construct server"), 1u) << readFile(third.log);
  EXPECT_EQ(readFile(file), "precious");
}

TEST_F(VantreldProcess, RepliesToRequestsAndNotToMessages) {
  Daemon daemon = startServing(socket_);
  RawClient client(socket_);
  ASSERT_TRUE(client.connected());

  struct Case {
    uint64_t version;
    std::optional<uint64_t> errorcode;  // nullopt: an empty reply
    const char* error;
  };
  const Case cases[] = {
      {3, std::nullopt, nullptr},
      {2, std::nullopt, nullptr},
      {1, kVersionMismatch, "unsupported protocol version 1 (current 3)"},
  };
  uint64_t id = 100;
  for (const Case& c : cases) {
    SCOPED_TRACE(c.version);
    ++id;
    ASSERT_TRUE(client.send(FrameKind::kRequest, id, request("bulk", c.version)));
    const std::optional<lmo::Frame> reply = client.readFrame();
    ASSERT_TRUE(reply.has_value());
    EXPECT_EQ(reply->kind, FrameKind::kReply);
    EXPECT_EQ(reply->inReplyTo, id);
    if (!c.errorcode) {
      EXPECT_TRUE(reply->body.empty()) << lmo::describe(reply->body);
    } else {
      EXPECT_EQ(reply->body.get("errorcode").getIfUInt64(), c.errorcode);
      EXPECT_EQ(reply->body.get("error"), Value(c.error));
    }
  }

  // Messages that expect no reply get none, a failing one included. Requests
  // are served in order, so the next frame must answer the request after them.
  ASSERT_TRUE(client.send(FrameKind::kMessage, 201, request("bulk", 3)));
  ASSERT_TRUE(client.send(FrameKind::kMessage, 202, request("bulk", 1)));
  ASSERT_TRUE(client.send(FrameKind::kRequest, 203, request("bulk", 3)));
  const std::optional<lmo::Frame> reply = client.readFrame();
  ASSERT_TRUE(reply.has_value());
  EXPECT_EQ(reply->inReplyTo, 203u);
  EXPECT_TRUE(ping(client, 204));
}

TEST_F(VantreldProcess, DropsMalformedPeersAndKeepsServingOthers) {
  Daemon daemon = startServing(socket_);
  RawClient good(socket_);
  ASSERT_TRUE(good.connected());
  ASSERT_TRUE(ping(good, 1));

  const Bytes wellFormed = cbor(request("ping", 3));
  const Bytes valid = rawFrame({}, wellFormed);
  RawHeader version2, kind4, reserved, idZero, requestWithReplyTo, strayReply;
  version2.version = 2;
  kind4.kind = 4;
  reserved.reserved = 1;
  idZero.id = 0;
  requestWithReplyTo.inReplyTo = 5;
  strayReply.kind = static_cast<uint8_t>(FrameKind::kReply);
  strayReply.inReplyTo = 999;

  struct Case {
    const char* name;
    Bytes bytes;
    const char* reason;  // a fragment of the logged reason; null: answered
    bool closeAfterWriting = false;
  };
  const Case cases[] = {
      // Frames built the same way but well formed are served: the rows
      // below fail for their one fault, not for the way they are built.
      {"well formed", valid, nullptr},
      {"nested exactly 64 deep", rawFrame({}, nestedMaps(lmo::kMaxCborDepth)), nullptr},
      {"length above 16 MiB", rawFrame({}, {}, lmo::kMaxFrameLength + 1), "exceeds the limit"},
      {"length below the header", rawFrame({}, {}, lmo::kFrameHeaderSize - 1), "shorter"},
      {"truncated, then closed", Bytes(valid.begin(), valid.begin() + 10), "truncated", true},
      {"unknown version", rawFrame(version2, wellFormed), "version"},
      {"unknown kind", rawFrame(kind4, wellFormed), "kind"},
      {"non-zero reserved field", rawFrame(reserved, wellFormed), "reserved"},
      {"id 0", rawFrame(idZero, wellFormed), "id 0"},
      {"request with an in-reply-to", rawFrame(requestWithReplyTo, wellFormed), "in-reply-to"},
      {"reply to nothing sent", rawFrame(strayReply, wellFormed), "reply to unknown message"},
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
    RawClient bad(socket_);
    ASSERT_TRUE(bad.connected());
    ASSERT_TRUE(bad.write(c.bytes));
    if (c.closeAfterWriting) bad.shutdown(SHUT_WR);
    if (c.reason == nullptr) {
      const std::optional<lmo::Frame> reply = bad.readFrame();
      ASSERT_TRUE(reply.has_value());
      EXPECT_EQ(reply->inReplyTo, 1u);
    } else {
      EXPECT_TRUE(bad.closedByDaemon());
      EXPECT_TRUE(eventually([&] { return logLines(daemon.log).size() > linesBefore; }));
    }
    ASSERT_TRUE(isRunning(*daemon.process)) << readFile(daemon.log);
    EXPECT_TRUE(ping(good, ++pingId));
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
  enum class Leave { kClose, kStopReading };
  uint64_t id = 10;
  for (Leave leave : {Leave::kClose, Leave::kStopReading}) {
    SCOPED_TRACE(leave == Leave::kClose ? "closes" : "stops reading");
    RawClient client(socket_);
    ASSERT_TRUE(client.connected());
    ASSERT_TRUE(client.send(FrameKind::kRequest, ++id, request("bulk", 3)));
    if (leave == Leave::kClose) {
      client.close();
    } else {
      // The socket stays open but refuses input: the reply's write fails
      // with a broken pipe, and the daemon drops the connection.
      client.shutdown(SHUT_RD);
      EXPECT_TRUE(client.hungUpByDaemon());
    }
    RawClient next(socket_);
    ASSERT_TRUE(next.connected());
    EXPECT_TRUE(ping(next, ++id));
    ASSERT_TRUE(isRunning(*daemon.process)) << readFile(daemon.log);
  }
  // A peer that leaves is no misbehaving peer.
  EXPECT_EQ(countLines(daemon.log, "closing connection"), 0u) << readFile(daemon.log);

  // The reader of its log goes away: the next log line ("bulk options ...")
  // is written into a broken pipe.
  const std::string fifo = tmp_.file("log.fifo");
  ASSERT_EQ(::mkfifo(fifo.c_str(), 0600), 0);
  int reader = ::open(fifo.c_str(), O_RDONLY | O_NONBLOCK | O_CLOEXEC);
  ASSERT_GE(reader, 0);
  const std::string socket = tmp_.file("unlogged.socket");
  Daemon unlogged = startServing(socket, {}, {.stderrPath = fifo});
  ::close(reader);
  RawClient client(socket);
  ASSERT_TRUE(client.connected());
  ASSERT_TRUE(client.send(FrameKind::kRequest, 1, request("bulk", 3)));
  EXPECT_TRUE(client.readFrame().has_value());
  EXPECT_TRUE(ping(client, 2));
  EXPECT_TRUE(isRunning(*unlogged.process));
}

TEST_F(VantreldProcess, ServesTheSocketHandedOverByTheServiceManager) {
  struct Case {
    const char* name;
    const char* listenPid;  // shell text for LISTEN_PID
    bool served;            // whether the daemon takes descriptor 3
  };
  const Case cases[] = {
      {"for this process", "$$", true},
      {"for another process", "1", false},
  };
  int row = 0;
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    ++row;
    const std::string handed = tmp_.file("handed-" + std::to_string(row) + ".socket");
    const std::string own = tmp_.file("own-" + std::to_string(row) + ".socket");
    // Inherited on purpose: no close-on-exec. The shell moves it to 3.
    int fd = ::socket(AF_UNIX, SOCK_STREAM, 0);
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::memcpy(addr.sun_path, handed.data(), handed.size());
    ASSERT_EQ(::bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof addr), 0);
    ASSERT_EQ(::listen(fd, 16), 0);
    const std::string n = std::to_string(fd);
    std::string prelude = fd == 3 ? "" : "exec 3<&" + n + " " + n + "<&-; ";
    prelude += std::string("LISTEN_PID=") + c.listenPid + "; export LISTEN_PID; ";
    // bash: dash takes only one-digit descriptors in redirections.
    Daemon daemon =
        start({"-S", own, "-d", tmp_.file("Annotations")},
              {.environment = {"LISTEN_FDS=1"}, .prelude = prelude, .shell = "/bin/bash"});
    ::close(fd);
    ASSERT_NE(daemon.process, nullptr);
    const std::string& served = c.served ? handed : own;
    std::unique_ptr<RawClient> client;
    ASSERT_TRUE(eventually([&] {
      client = std::make_unique<RawClient>(served);
      return client->connected() || !isRunning(*daemon.process);
    }));
    ASSERT_TRUE(client->connected()) << readFile(daemon.log);
    EXPECT_TRUE(ping(*client, 1)) << readFile(daemon.log);
    EXPECT_EQ(std::filesystem::exists(own), !c.served);
  }
}

TEST_F(VantreldProcess, VerbosityAddsDebugLinesThenDumps) {
  struct Case {
    std::vector<std::string> flags;
    bool debugLines;
    bool dumps;
  };
  const Case cases[] = {
      {{}, false, false},
      {{"-v"}, true, false},
      {{"-vv"}, true, true},
      {{"-v", "-v"}, true, true},
  };
  const std::string pid = std::to_string(::getpid());
  int row = 0;
  for (const Case& c : cases) {
    SCOPED_TRACE(::testing::PrintToString(c.flags));
    const std::string socket = tmp_.file("verbose-" + std::to_string(++row) + ".socket");
    Daemon daemon = startServing(socket, c.flags);
    RawClient client(socket);
    ASSERT_TRUE(client.connected());
    ASSERT_TRUE(client.send(FrameKind::kRequest, 7, request("bulk", 3)));
    ASSERT_TRUE(client.readFrame().has_value());
    // The lines of a request are written before its reply is sent.
    const std::string log = daemon.log;
    EXPECT_EQ(countLines(log, "client " + pid + " request bulk") != 0, c.debugLines)
        << readFile(log);
    EXPECT_EQ(countLines(log, "incoming request ") != 0, c.dumps) << readFile(log);
    EXPECT_EQ(countLines(log, "Replying ") != 0, c.dumps) << readFile(log);
  }
}

}  // namespace
}  // namespace vantrel::daemon
