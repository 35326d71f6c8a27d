#include "bench/load/DaemonProcess.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <string_view>
#include <thread>

#include "bench/load/Workers.h"

extern char** environ;

namespace vantrel::bench::load {
namespace {

using Clock = std::chrono::steady_clock;
using namespace std::chrono_literals;

// How often a start-up is polled: connecting, and asking again after an
// incomplete answer. Short next to the shortest goal (50 ms).
constexpr auto kPollInterval = 1ms;
// How much of the log an error message shows.
constexpr size_t kLogTailLines = 20;

// Variables of the caller's environment that would reach outside the run,
// or hand the daemon a socket that is not ours; the daemon gets its own.
constexpr std::string_view kReplacedVariables[] = {
    "VANTREL_", "XDG_STATE_HOME=", "XDG_CONFIG_HOME=", "HOME=", "LISTEN_", "NOTIFY_SOCKET="};

base::Error failure(std::string text) {
  return base::Error{"LoadBench", 1, std::move(text)};
}

std::vector<std::string> environmentFor(const DaemonConfig& config) {
  std::vector<std::string> environment;
  for (char** entry = environ; *entry != nullptr; ++entry) {
    const std::string_view variable(*entry);
    bool replaced = false;
    for (std::string_view prefix : kReplacedVariables) replaced |= variable.starts_with(prefix);
    if (!replaced) environment.emplace_back(variable);
  }
  const std::string empty = config.runDir + "/empty";
  const std::string state = config.stateDir;
  for (const std::string& entry : {
           std::string("VANTREL_LOG=stderr"),
           "VANTREL_RUNTIME_DIR=" + config.runDir + "/runtime",
           "VANTREL_STATE_DIR=" + state + "/state",
           "VANTREL_PREFERENCES_DIR=" + state + "/preferences",
           "XDG_STATE_HOME=" + state + "/xdg-state",
           "XDG_CONFIG_HOME=" + state + "/xdg-config",
           "HOME=" + state + "/home",
           "VANTREL_APP_DIRS=" + config.appsDir,
           // Nothing but the tree: no stand-alone plug-ins, no system volume.
           "VANTREL_PLUGIN_DIRS=" + empty,
           "VANTREL_SYSTEM_DIR=" + empty,
           "VANTREL_SDK_DIRS=" + empty,
       }) {
    environment.push_back(entry);
  }
  return environment;
}

std::vector<char*> pointers(std::vector<std::string>& strings) {
  std::vector<char*> out;
  for (std::string& s : strings) out.push_back(s.data());
  out.push_back(nullptr);
  return out;
}

}  // namespace

base::Result<std::unique_ptr<DaemonProcess>> DaemonProcess::start(const DaemonConfig& config) {
  static int started = 0;
  const std::string name = "vantreld-" + std::to_string(++started);
  std::error_code ec;
  for (const std::string& dir :
       {config.runDir + "/runtime", config.runDir + "/empty", config.stateDir + "/home"}) {
    std::filesystem::create_directories(dir, ec);
    if (ec) return failure("cannot make " + dir + ": " + ec.message());
  }
  std::unique_ptr<DaemonProcess> daemon(new DaemonProcess());
  daemon->socket_ = config.runDir + "/" + name + ".socket";
  daemon->log_ = config.runDir + "/" + name + ".log";
  const std::string annotations = config.stateDir + "/Annotations";
  const std::string cache = std::to_string(config.cacheLimit);
  daemon->arguments_ = {config.vantreld, "-S", daemon->socket_, "-d", annotations, "-c", cache};

  // Everything the child needs is made before the fork.
  std::vector<std::string> environment = environmentFor(config);
  std::vector<std::string> arguments = daemon->arguments_;
  const std::vector<char*> argv = pointers(arguments);
  const std::vector<char*> envp = pointers(environment);
  const int log = ::open(daemon->log_.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  const int input = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
  if (log < 0 || input < 0) return failure("cannot open " + daemon->log_);

  daemon->started_ = Clock::now();
  const pid_t parent = ::getpid();
  daemon->pid_ = ::fork();
  if (daemon->pid_ == 0) {
    // A benchmark that dies (a sanitizer's report ends it at once) must not
    // leave its daemon behind, holding the pipe a test runner reads to its
    // end.
    dieWithParent(parent);
    // The benchmark ignores SIGPIPE; the daemon must be seen to cope alone.
    ::signal(SIGPIPE, SIG_DFL);
    ::dup2(input, STDIN_FILENO);
    ::dup2(log, STDOUT_FILENO);
    ::dup2(log, STDERR_FILENO);
    ::execve(argv[0], argv.data(), envp.data());
    ::_exit(127);
  }
  ::close(log);
  ::close(input);
  if (daemon->pid_ < 0) return failure("cannot fork");
  return daemon;
}

DaemonProcess::~DaemonProcess() {
  stop();
}

base::Result<double> DaemonProcess::firstCompleteAnswer(const Bytes& request, uint64_t expected,
                                                        std::chrono::milliseconds timeout) {
  const Clock::time_point deadline = started_ + timeout;
  Bytes frame = request;
  uint64_t id = 0;
  std::optional<uint64_t> last;
  std::unique_ptr<FrameSocket> socket;
  for (;; std::this_thread::sleep_for(kPollInterval)) {
    int status = 0;
    if (pid_ > 0 && ::waitpid(pid_, &status, WNOHANG) == pid_) {
      pid_ = -1;
      return failure("vantreld exited (wait status " + std::to_string(status) +
                     ") before a complete answer; its log ends:\n" + logTail());
    }
    if (pid_ <= 0) return failure("vantreld is not running");
    if (Clock::now() > deadline) {
      return failure("no complete answer within " + std::to_string(timeout.count()) +
                     " ms (the last had " + (last ? std::to_string(*last) : "no") + " of " +
                     std::to_string(expected) + " forms); the log ends:\n" + logTail());
    }
    if (!socket) {
      const int fd = connectTo(socket_);
      if (fd < 0) continue;
      socket = std::make_unique<FrameSocket>(fd);
    }
    setFrameId(frame, ++id);
    std::span<uint8_t> reply;
    if (socket->send(frame)) reply = socket->receive();
    if (reply.empty()) {
      socket.reset();
      continue;
    }
    const std::optional<uint64_t> count = matchCount(frameBody(reply));
    if (count && *count < expected && frameInReplyTo(reply) == id) {
      last = count;
      continue;
    }
    if (auto wrong = checkReply(reply, id, ReplyCheck{expected})) {
      return failure("vantreld answered the start-up \"match\" with " + *wrong);
    }
    return std::chrono::duration<double>(Clock::now() - started_).count();
  }
}

std::optional<DaemonProcess::Memory> DaemonProcess::memory() const {
  if (pid_ <= 0) return std::nullopt;
  std::ifstream status("/proc/" + std::to_string(pid_) + "/status");
  Memory memory;
  bool resident = false;
  bool peak = false;
  for (std::string line; std::getline(status, line);) {
    std::istringstream fields(line);
    std::string key;
    uint64_t kib = 0;
    if (!(fields >> key >> kib)) continue;
    if (key == "VmRSS:") {
      memory.residentKiB = kib;
      resident = true;
    } else if (key == "VmHWM:") {
      memory.peakKiB = kib;
      peak = true;
    }
  }
  if (!resident || !peak) return std::nullopt;
  return memory;
}

void DaemonProcess::stop() {
  stopChild(pid_);
  pid_ = -1;
}

std::string DaemonProcess::logTail() const {
  std::ifstream in(log_);
  std::vector<std::string> lines;
  for (std::string line; std::getline(in, line);) lines.push_back(line);
  std::string tail;
  const size_t first = lines.size() > kLogTailLines ? lines.size() - kLogTailLines : 0;
  for (size_t i = first; i < lines.size(); ++i) tail += lines[i] + "\n";
  return tail.empty() ? "(nothing)\n" : tail;
}

}  // namespace vantrel::bench::load
