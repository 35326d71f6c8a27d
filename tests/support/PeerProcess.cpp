#include "tests/support/PeerProcess.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string_view>
#include <system_error>

extern char** environ;

namespace vantrel::testing {

std::string testPeerPath() {
  if (const char* path = std::getenv("VANTREL_TEST_PEER"); path != nullptr && *path != '\0') {
    return path;
  }
  return VANTREL_TEST_PEER_PATH;
}

bool installTestPeer(const std::string& path) {
  namespace fs = std::filesystem;
  std::error_code ec;
  fs::create_directories(fs::path(path).parent_path(), ec);
  if (ec) return false;
  fs::copy_file(testPeerPath(), path, fs::copy_options::overwrite_existing, ec);
  if (ec) return false;
  return ::chmod(path.c_str(), 0755) == 0;
}

namespace {

// The name part of a "NAME=value" entry.
std::string_view variableName(std::string_view entry) {
  return entry.substr(0, entry.find('='));
}

// This process's environment with the entries of extra applied in order.
std::vector<std::string> mergedEnvironment(const std::vector<std::string>& extra) {
  std::vector<std::string> merged;
  for (char** entry = environ; *entry != nullptr; ++entry) merged.emplace_back(*entry);
  for (const std::string& entry : extra) {
    std::erase_if(merged, [&](const std::string& existing) {
      return variableName(existing) == variableName(entry);
    });
    merged.push_back(entry);
  }
  return merged;
}

}  // namespace

std::unique_ptr<PeerProcess> PeerProcess::start(const std::string& executable,
                                                const std::vector<std::string>& args) {
  return start(executable, args, {});
}

std::unique_ptr<PeerProcess> PeerProcess::start(const std::string& executable,
                                                const std::vector<std::string>& args,
                                                const std::vector<std::string>& environment) {
  int in[2];
  int out[2];
  if (::pipe2(in, O_CLOEXEC) != 0) return nullptr;
  if (::pipe2(out, O_CLOEXEC) != 0) {
    ::close(in[0]);
    ::close(in[1]);
    return nullptr;
  }
  std::vector<std::string> argvStrings{executable};
  argvStrings.insert(argvStrings.end(), args.begin(), args.end());
  std::vector<char*> argv;
  for (std::string& s : argvStrings) argv.push_back(s.data());
  argv.push_back(nullptr);
  std::vector<std::string> envStrings = mergedEnvironment(environment);
  std::vector<char*> envp;
  for (std::string& s : envStrings) envp.push_back(s.data());
  envp.push_back(nullptr);

  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, in[0], STDIN_FILENO);
  posix_spawn_file_actions_adddup2(&actions, out[1], STDOUT_FILENO);
  pid_t pid = -1;
  const int rc =
      ::posix_spawn(&pid, executable.c_str(), &actions, nullptr, argv.data(), envp.data());
  posix_spawn_file_actions_destroy(&actions);
  ::close(in[0]);
  ::close(out[1]);
  if (rc != 0) {
    std::fprintf(stderr, "cannot start %s: %s\n", executable.c_str(), std::strerror(rc));
    ::close(in[1]);
    ::close(out[0]);
    return nullptr;
  }
  // Through syscall(2): glibc 2.36 declares pidfd_open without C linkage
  // for C++.
  const int pidfd = static_cast<int>(::syscall(SYS_pidfd_open, pid, 0));
  if (pidfd < 0) std::fprintf(stderr, "pidfd_open(%d): %s\n", pid, std::strerror(errno));
  return std::unique_ptr<PeerProcess>(new PeerProcess(pid, pidfd, in[1], out[0]));
}

PeerProcess::PeerProcess(pid_t pid, int pidfd, int stdinFd, int stdoutFd)
    : pid_(pid), pidfd_(pidfd), stdin_(stdinFd), stdout_(stdoutFd) {}

PeerProcess::~PeerProcess() {
  kill();
  wait();
  closeStdin();
  if (stdout_ >= 0) ::close(stdout_);
  if (pidfd_ >= 0) ::close(pidfd_);
}

std::optional<std::string> PeerProcess::readLine(std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  std::string line;
  for (;;) {
    const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    if (left.count() <= 0) return std::nullopt;
    pollfd p{stdout_, POLLIN, 0};
    const int ready = ::poll(&p, 1, static_cast<int>(left.count()));
    if (ready < 0 && errno == EINTR) continue;
    if (ready <= 0) return std::nullopt;
    char c;
    const ssize_t n = ::read(stdout_, &c, 1);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return std::nullopt;
    if (c == '\n') return line;
    line += c;
  }
}

void PeerProcess::closeStdin() {
  if (stdin_ >= 0) ::close(stdin_);
  stdin_ = -1;
}

int PeerProcess::wait() {
  if (reaped_) return -1;
  int status = 0;
  while (::waitpid(pid_, &status, 0) < 0) {
    if (errno != EINTR) return -1;
  }
  reaped_ = true;
  return status;
}

void PeerProcess::kill() {
  if (!reaped_) ::kill(pid_, SIGKILL);
}

}  // namespace vantrel::testing
