#include "client/VTPlugInLauncher.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/landlock.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/AtomicFile.h"
#include "platform/ServiceManager.h"
#include "tests/support/PeerProcess.h"
#include "tests/support/TempDir.h"

namespace vantrel::client {
namespace {

namespace fs = std::filesystem;

bool landlockAvailable() {
  return ::syscall(SYS_landlock_create_ruleset, nullptr, 0, LANDLOCK_CREATE_RULESET_VERSION) >= 0;
}

// The lines a finished child wrote to fd, which is then closed.
std::vector<std::string> readLines(int fd) {
  FILE* in = ::fdopen(fd, "r");
  if (in == nullptr) return {"(fdopen: " + std::to_string(errno) + ")"};
  std::vector<std::string> lines;
  char* line = nullptr;
  size_t capacity = 0;
  for (ssize_t n; (n = ::getline(&line, &capacity, in)) > 0;) {
    lines.emplace_back(line, n - (line[n - 1] == '\n'));
  }
  std::free(line);
  std::fclose(in);
  return lines;
}

// Points the runtime directory at a temporary one while a test runs, with a
// service manager over it that can enable plug-ins for this process.
class VTPlugInLauncherTest : public ::testing::Test {
 protected:
  void SetUp() override {
    if (const char* previous = std::getenv(kVariable)) previous_ = previous;
    ::setenv(kVariable, runtime_.path().c_str(), 1);
    manager_ = std::make_unique<platform::ServiceManager>(runtime_.path().string());
    selfPidfd_ = static_cast<int>(::syscall(SYS_pidfd_open, ::getpid(), 0));
  }
  void TearDown() override {
    manager_.reset();
    ::close(selfPidfd_);
    previous_ ? ::setenv(kVariable, previous_->c_str(), 1) : ::unsetenv(kVariable);
  }

  // Enables id for this process (or for host) with the environment, which
  // also names its data container (HOME), under profile.
  base::Result<void> enable(const char* id, const lmo::Dictionary& environment, const char* profile,
                            std::string executable = VANTREL_ENV_REPORTER_PATH,
                            const testing::PeerProcess* host = nullptr) {
    const lmo::Dictionary service{{"EnvironmentVariables", environment},
                                  {"_SandboxProfile", profile}};
    platform::ExternalServiceRegistration registration{id, "1", host ? host->pid() : ::getpid(),
                                                       std::move(executable),
                                                       lmo::Dictionary{{"LMOService", service}}};
    if (const std::string* home = environment.get("HOME").getIfString()) {
      registration.dataContainer = *home;
    }
    return manager_->registerExternalService(std::move(registration),
                                             host ? host->pidfd() : selfPidfd_);
  }

  std::string descriptionPath(const char* id) const {
    return platform::launchDescriptionPath(runtime_.path().string(), ::getpid(), id);
  }

  // Launches id with its output on a pipe and returns what it wrote.
  std::vector<std::string> run(const char* id, std::vector<std::string> arguments) {
    int out[2];
    if (::pipe2(out, O_CLOEXEC) != 0) return {"(no pipe)"};
    base::Result<pid_t> pid =
        VTPlugInLauncher::launch(id, {.arguments = std::move(arguments), .standardOutput = out[1]});
    ::close(out[1]);
    if (!pid.has_value()) {
      ::close(out[0]);
      return {pid.error().description()};
    }
    std::vector<std::string> lines = readLines(out[0]);
    int status = 0;
    ::waitpid(pid.value(), &status, 0);
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) lines.push_back("(failed)");
    return lines;
  }

  static constexpr const char* kVariable = "VANTREL_RUNTIME_DIR";
  testing::TempDir runtime_;
  testing::TempDir files_;
  std::unique_ptr<platform::ServiceManager> manager_;
  std::optional<std::string> previous_;
  int selfPidfd_ = -1;
};

TEST_F(VTPlugInLauncherTest, StartsThePlugInExactlyAsDescribed) {
  const bool confined = landlockAvailable();
  struct Case {
    const char* profile;
    bool outsideWritable;
  };
  for (const Case& c : {Case{"plugin", !confined}, Case{"keyboard", true}}) {
    SCOPED_TRACE(c.profile);
    const std::string container = files_.file(std::string("container-") + c.profile);
    fs::create_directories(container);
    const std::string outside = files_.file(std::string("outside-") + c.profile);
    const std::string inside = container + "/inside";
    ASSERT_TRUE(enable("com.example.reporter",
                       lmo::Dictionary{{"HOME", container},
                                       {"TMPDIR", container + "/tmp"},
                                       {"GREETING", "hello world"}},
                       c.profile)
                    .has_value());

    const std::vector<std::string> lines =
        run("com.example.reporter", {"write", outside, "write", inside});
    std::vector<std::string> environment;
    for (const std::string& line : lines) {
      if (line.rfind("env ", 0) == 0) environment.push_back(line.substr(4));
    }
    std::sort(environment.begin(), environment.end());
    // Exactly the description's variables: nothing of this process's own.
    EXPECT_EQ(environment, (std::vector<std::string>{"GREETING=hello world", "HOME=" + container,
                                                     "TMPDIR=" + container + "/tmp"}));
    const std::vector<std::string> expected{
        "cwd " + container,
        "nnp 1",
        "write " + outside + (c.outsideWritable ? " ok" : " 13"),
        "write " + inside + " ok",
        "end",
    };
    EXPECT_EQ(std::vector<std::string>(lines.begin() + static_cast<long>(environment.size()),
                                       lines.end()),
              expected);
  }
}

TEST_F(VTPlugInLauncherTest, RefusesWhatItCannotStartAndLeavesNoChildBehind) {
  const std::string copied = files_.file("copied-reporter");
  fs::copy_file(VANTREL_ENV_REPORTER_PATH, copied);
  const std::string container = files_.file("container");
  fs::create_directories(container);
  std::unique_ptr<testing::PeerProcess> other =
      testing::PeerProcess::start(testing::testPeerPath(), {"sleep"});
  ASSERT_TRUE(other && other->readLine() == "ready");

  ASSERT_TRUE(enable("com.example.theirs", {}, "plugin", copied, other.get()).has_value());
  for (const char* id : {"com.example.gw", "com.example.bad", "com.example.out"}) {
    ASSERT_TRUE(enable(id, {}, "plugin").has_value());
  }
  ASSERT_TRUE(enable("com.example.gone", {{"HOME", container}}, "plugin", copied).has_value());
  ASSERT_TRUE(
      enable("com.example.nowhere", {{"HOME", container + "/none"}}, "keyboard").has_value());
  fs::permissions(descriptionPath("com.example.gw"), fs::perms::group_write, fs::perm_options::add);
  ASSERT_TRUE(platform::writeFileAtomically(descriptionPath("com.example.bad"), "<plist", 0600)
                  .has_value());
  fs::remove(copied);

  struct Case {
    const char* name;
    const char* id;
    int standardOutput;
    const char* domain;
    int64_t code;
  };
  const char* const kLauncher = kPlugInLauncherErrorDomain;
  const char* const kPosix = platform::kPosixErrorDomain;
  const Case cases[] = {
      {"never enabled", "com.example.absent", -1, kLauncher, kLaunchNotEnabled},
      {"enabled for another process", "com.example.theirs", -1, kLauncher, kLaunchNotEnabled},
      {"not a file name", "a/b", -1, kPosix, EINVAL},
      {"writable by the group", "com.example.gw", -1, kLauncher, kLaunchUntrustedDescription},
      {"not a property list", "com.example.bad", -1, kLauncher, kLaunchMalformedDescription},
      {"executable gone", "com.example.gone", -1, kPosix, ENOENT},
      {"working directory gone", "com.example.nowhere", -1, kPosix, ENOENT},
      {"closed output", "com.example.out", 1000, kPosix, EBADF},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    base::Result<pid_t> pid = VTPlugInLauncher::launch(c.id, {.standardOutput = c.standardOutput});
    ASSERT_FALSE(pid.has_value());
    EXPECT_EQ(pid.error().domain, c.domain);
    EXPECT_EQ(pid.error().code, c.code) << pid.error().description();
    // A child that failed before its exec has been reaped: none is waiting.
    EXPECT_EQ(::waitpid(-1, nullptr, WNOHANG), 0);
  }
  EXPECT_EQ(VTPlugInLauncher::launch("com.example.absent").error().description(),
            "no launch description for com.example.absent (not enabled for this process)");
}

}  // namespace
}  // namespace vantrel::client
