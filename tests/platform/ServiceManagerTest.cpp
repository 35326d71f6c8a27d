#include "platform/ServiceManager.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <filesystem>
#include <functional>
#include <future>
#include <optional>
#include <thread>
#include <tuple>

#include "base/Log.h"
#include "base/SerialQueue.h"
#include "lmo/IoLoop.h"
#include "platform/AtomicFile.h"
#include "platform/PropertyList.h"
#include "tests/platform/Helpers.h"

namespace vantrel::platform {
namespace {

namespace fs = std::filesystem;
using Registrations = std::vector<ExternalServiceRegistration>;
constexpr uid_t kNobody = 65534;

// A child that sleeps until killed, as this user or, when set, as uid.
struct HostProcess {
  explicit HostProcess(std::optional<uid_t> uid = std::nullopt) {
    int ready[2];
    if (::pipe2(ready, O_CLOEXEC) != 0 || (pid = ::fork()) < 0) std::abort();
    if (pid == 0) {
      // Raw system calls: the forked child of a threaded process has one
      // thread, and must not wait for the others' set-id handshake.
      if (uid && (::syscall(SYS_setresgid, *uid, *uid, *uid) != 0 ||
                  ::syscall(SYS_setresuid, *uid, *uid, *uid) != 0)) {
        ::_exit(1);
      }
      (void)!::write(ready[1], "r", 1);
      for (;;) ::pause();
    }
    char byte;
    // Once it has written, the child runs as it should.
    if (::close(ready[1]) != 0 || ::read(ready[0], &byte, 1) != 1) std::abort();
    ::close(ready[0]);
    pidfd = static_cast<int>(::syscall(SYS_pidfd_open, pid, 0));
  }
  ~HostProcess() {
    exit();
    ::close(pidfd);
  }
  HostProcess(const HostProcess&) = delete;
  HostProcess& operator=(const HostProcess&) = delete;

  // Kills and reaps it; the pidfd stays open.
  void exit() {
    if (std::exchange(reaped, true)) return;
    ::kill(pid, SIGKILL);
    ::waitpid(pid, nullptr, 0);
  }

  pid_t pid = -1;
  int pidfd = -1;
  bool reaped = false;
};

struct Fixture {
  testing::TempDir dir;
  std::string executable = dir.write("P.appex/P", "#!/bin/sh\n");
  Fixture() { fs::permissions(executable, fs::perms::owner_all); }

  ExternalServiceRegistration service(const char* identifier, const char* version,
                                      const HostProcess& host) const {
    return {identifier, version, host.pid, executable,
            lmo::Dictionary{{"KBBundlePackageType", "LMO!"}}};
  }
  bool add(ServiceManager& manager, const char* id, const char* version, const HostProcess& host) {
    return manager.registerExternalService(service(id, version, host), host.pidfd).has_value();
  }
  std::string launchFile(const HostProcess& host, const char* identifier) const {
    return launchDescriptionPath(dir.path().string(), host.pid, identifier);
  }
  bool hasLaunchDirectory(pid_t pid) const {
    return fs::exists(launchDirectoryPath(dir.path().string(), pid));
  }
};

// Removes and waits for the reply, which must arrive on replyQueue.
int remove(ServiceManager& manager, const char* identifier, const char* version) {
  base::SerialQueue replyQueue("reply");
  std::promise<int> result;
  manager.removeExternalService(identifier, version, replyQueue, [&](int code) {
    EXPECT_TRUE(replyQueue.isCurrent());
    result.set_value(code);
  });
  return result.get_future().get();
}

bool eventually(const std::function<bool()>& condition) {
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  while (!condition()) {
    if (std::chrono::steady_clock::now() > deadline) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return true;
}

LaunchDescription launchIn(const std::string& file) {
  base::Result<lmo::Value> read = readPropertyListFile(file);
  if (!read.has_value()) return {.version = "(unreadable)"};
  return decodeLaunchDescription(read.value()).value();
}

size_t servicesOnDisk(const ServiceManager& manager) {
  const lmo::Value file = readPropertyListFile(manager.path()).value();
  return file.getIfDictionary()->get("services").getIfArray()->size();
}

TEST(ServiceManager, RemovesEveryRegistrationOfAVersionWithItsLaunchDescriptions) {
  Fixture f;
  HostProcess host, other;
  ServiceManager manager(f.dir.path().string());
  ASSERT_TRUE(f.add(manager, "a", "1", host) && f.add(manager, "a", "1", other) &&
              f.add(manager, "a", "2", host) && f.add(manager, "b", "1", host));
  // Two versions for one host share the file; the later one is described.
  EXPECT_EQ(launchIn(f.launchFile(host, "a")).version, "2");

  EXPECT_EQ(remove(manager, "a", "1"), 0);
  EXPECT_EQ(manager.registrations(),
            (Registrations{f.service("a", "2", host), f.service("b", "1", host)}));
  EXPECT_FALSE(f.hasLaunchDirectory(other.pid));
  EXPECT_EQ(launchIn(f.launchFile(host, "a")).version, "2");
  EXPECT_EQ(remove(manager, "a", "1"), ESRCH);
  EXPECT_EQ(remove(manager, "a", "2"), 0);
  EXPECT_FALSE(fs::exists(f.launchFile(host, "a")));
  EXPECT_TRUE(fs::exists(f.launchFile(host, "b")));
  EXPECT_EQ(remove(manager, "b", "1"), 0);
  EXPECT_FALSE(f.hasLaunchDirectory(host.pid));

  // Enabling the same plug-in for the same host again replaces the entry.
  ASSERT_TRUE(f.add(manager, "a", "2", host));
  ExternalServiceRegistration updated = f.service("a", "2", host);
  updated.description = lmo::Dictionary{{"LMOService", lmo::Dictionary{{"_SandboxProfile", "p"}}}};
  ASSERT_TRUE(manager.registerExternalService(updated, host.pidfd).has_value());
  EXPECT_EQ(manager.registrations(), Registrations{updated});
  EXPECT_EQ(launchIn(f.launchFile(host, "a")).sandboxProfile, "p");
}

TEST(ServiceManager, PublishesALaunchDescriptionThatOnlyItsHostCanRead) {
  Fixture f;
  // As root the files go to the host's user; otherwise they stay ours.
  const bool root = ::geteuid() == 0;
  HostProcess host(root ? std::optional<uid_t>(kNobody) : std::nullopt);
  ServiceManager manager(f.dir.path().string());
  ExternalServiceRegistration r = f.service("com.example.p", "1.0", host);
  r.description = r.description.setting(
      "LMOService",
      lmo::Dictionary{{"EnvironmentVariables", lmo::Dictionary{{"HOME", "/home/elsewhere"},
                                                               {"LANG", "C"},
                                                               {"COUNT", lmo::Value::integer(3)},
                                                               {"A=B", "x"}}},
                      {"_SandboxProfile", "keyboard"}});
  r.dataContainer = "/data/p";
  ASSERT_TRUE(manager.registerExternalService(r, host.pidfd).has_value());

  const std::string file = f.launchFile(host, "com.example.p");
  const std::string hostDir = launchDirectoryPath(f.dir.path().string(), host.pid);
  EXPECT_EQ(modeOf(f.dir.file("services")), 0711u);
  EXPECT_EQ(modeOf(hostDir), 0700u);
  EXPECT_EQ(modeOf(file), 0600u);
  EXPECT_EQ(modeOf(manager.path()), 0600u);
  for (const std::string& path : {hostDir, file}) {
    EXPECT_EQ(statOf(path).st_uid, root ? kNobody : ::geteuid()) << path;
  }
  const LaunchDescription d = launchIn(file);
  EXPECT_EQ(d.bundleIdentifier, "com.example.p");
  EXPECT_EQ(d.version, "1.0");
  EXPECT_EQ(d.hostPid, host.pid);
  EXPECT_EQ(d.executablePath, f.executable);
  // A number and a name holding '=' cannot be environment entries.
  EXPECT_EQ(d.environment, (std::vector<std::string>{"HOME=/home/elsewhere", "LANG=C"}));
  EXPECT_EQ(d.sandboxProfile, "keyboard");
  // The container, not whatever the environment claims as home.
  EXPECT_EQ(d.workingDirectory, "/data/p");
}

TEST(ServiceManager, RefusesWithAnErrorNumberAndLeavesNothingBehind) {
  Fixture f;
  HostProcess host, other, dead;
  dead.exit();
  const std::string plainFile = f.dir.write("plain", "x");
  const std::string longIdentifier(kMaxPublishedBundleIdentifierLength + 1, 'a');
  lmo::Dictionary crowded;
  for (size_t i = 0; i <= kMaxLaunchEnvironmentVariables; ++i) {
    crowded = crowded.setting(base::format("V%u", i), "x");
  }
  const lmo::Dictionary crowdedService{
      {"LMOService", lmo::Dictionary{{"EnvironmentVariables", crowded}}}};
  using Reg = ExternalServiceRegistration;
  const struct {
    const char* name;
    std::function<void(Reg&, int& pidfd)> change;
    int error;
  } cases[] = {
      {"exited host",
       [&](Reg& r, int& fd) { std::tie(r.hostPid, fd) = std::tuple(dead.pid, dead.pidfd); }, ESRCH},
      {"pidfd of another process", [&](Reg&, int& fd) { fd = other.pidfd; }, ESRCH},
      {"no pidfd", [](Reg&, int& fd) { fd = -1; }, ESRCH},
      {"no executable", [&](Reg& r, int&) { r.executablePath = f.dir.file("none"); }, ENOENT},
      {"not executable", [&](Reg& r, int&) { r.executablePath = plainFile; }, EACCES},
      {"a directory", [&](Reg& r, int&) { r.executablePath = f.dir.path().string(); }, EACCES},
      {"identifier with a slash", [](Reg& r, int&) { r.bundleIdentifier = "a/b"; }, EINVAL},
      {"identifier too long", [&](Reg& r, int&) { r.bundleIdentifier = longIdentifier; }, EINVAL},
      {"service not a dictionary",
       [](Reg& r, int&) {
         r.description = lmo::Dictionary{{"LMOService", "x"}};
       },
       EINVAL},
      {"too many variables", [&](Reg& r, int&) { r.description = crowdedService; }, E2BIG},
  };
  ServiceManager manager(f.dir.path().string());
  for (const auto& c : cases) {
    Reg r = f.service("a", "1", host);
    int pidfd = host.pidfd;
    c.change(r, pidfd);
    base::Result<void> result = manager.registerExternalService(r, pidfd);
    ASSERT_FALSE(result.has_value()) << c.name;
    EXPECT_EQ(result.error().domain, kPosixErrorDomain) << c.name;
    EXPECT_EQ(result.error().code, c.error) << c.name << ": " << result.error().description();
    EXPECT_TRUE(manager.registrations().empty()) << c.name;
    EXPECT_FALSE(f.hasLaunchDirectory(r.hostPid)) << c.name;
  }
}

TEST(ServiceManager, AHostsExitRemovesItsRegistrationsAndFiles) {
  Fixture f;
  HostProcess leaving, staying;
  ServiceManager manager(f.dir.path().string());
  ASSERT_TRUE(f.add(manager, "a", "1", leaving) && f.add(manager, "b", "1", leaving) &&
              f.add(manager, "a", "1", staying));
  ASSERT_TRUE(f.hasLaunchDirectory(leaving.pid));

  leaving.exit();
  const Registrations rest{f.service("a", "1", staying)};
  ASSERT_TRUE(eventually([&] { return manager.registrations() == rest; }));
  EXPECT_FALSE(f.hasLaunchDirectory(leaving.pid));
  EXPECT_TRUE(fs::exists(f.launchFile(staying, "a")));
  EXPECT_EQ(servicesOnDisk(manager), 1u);
}

TEST(ServiceManager, RegisteringAndRemovingNeverWaitForTheIoThread) {
  // The daemon may run a request on the I/O thread; a request that
  // registers a service then waits for the manager's queue, which must not
  // be waiting for the I/O thread in turn.
  Fixture f;
  HostProcess host;
  ServiceManager manager(f.dir.path().string());
  std::promise<void> release;
  lmo::IoLoop::shared().post([held = release.get_future().share()] { held.wait(); });
  std::future<bool> changed = std::async(std::launch::async, [&] {
    return f.add(manager, "a", "1", host) && remove(manager, "a", "1") == 0;
  });
  const bool finished = changed.wait_for(std::chrono::seconds(10)) == std::future_status::ready;
  release.set_value();
  ASSERT_TRUE(finished) << "the service manager waited for the I/O thread";
  EXPECT_TRUE(changed.get());
  EXPECT_FALSE(f.hasLaunchDirectory(host.pid));
}

TEST(ServiceManager, TheTableOutlivesTheInstanceButNotItsHosts) {
  Fixture f;
  HostProcess live, gone;
  {
    ServiceManager first(f.dir.path().string());
    ASSERT_TRUE(f.add(first, "a", "1", live) && f.add(first, "b", "1", gone));
  }
  // Exits while no manager runs.
  gone.exit();
  fs::remove(f.launchFile(live, "a"));
  // What saves killed half-way left, of the table and of the live host's
  // description.
  const pid_t dead = deadPid();
  const std::string launchDirectory = launchDirectoryPath(f.dir.path().string(), live.pid);
  const std::string leftovers[] = {
      f.dir.write(temporaryOf("services.plist", dead, 1), "partial"),
      f.dir.write(fs::relative(launchDirectory, f.dir.path()).string() + "/" +
                      temporaryOf(fs::path(f.launchFile(live, "a")).filename().string(), dead, 2),
                  "partial")};
  ServiceManager second(f.dir.path().string());
  for (const std::string& leftover : leftovers) EXPECT_FALSE(fs::exists(leftover)) << leftover;
  EXPECT_EQ(second.registrations(), Registrations{f.service("a", "1", live)});
  // The pruned table was written back: the file alone no longer names b.
  EXPECT_EQ(servicesOnDisk(second), 1u);
  EXPECT_FALSE(f.hasLaunchDirectory(gone.pid));
  // The survivors' launch descriptions are published again, and watched.
  EXPECT_TRUE(fs::exists(f.launchFile(live, "a")));
  live.exit();
  EXPECT_TRUE(eventually([&] { return second.registrations().empty(); }));
}

TEST(ServiceManager, AnUnreadableTableStartsEmptyAndIsReplacedAtTheNextChange) {
  Fixture f;
  HostProcess host;
  f.dir.write("services.plist",
              "<plist><dict><key>formatVersion</key><integer>1</integer><key>services</key><array>"
              "<dict><key>bundleIdentifier</key><string>a</string></dict></array></dict></plist>");
  base::LogCapture log;
  ServiceManager manager(f.dir.path().string());
  EXPECT_TRUE(manager.registrations().empty());
  EXPECT_EQ(log.lines().size(), 1u);
  ASSERT_TRUE(f.add(manager, "a", "1", host));
  EXPECT_EQ(ServiceManager(f.dir.path().string()).registrations().size(), 1u);
}

TEST(ServiceManager, AFailedWriteChangesNothing) {
  Fixture f;
  HostProcess host;
  ServiceManager manager(f.dir.path().string());
  ASSERT_TRUE(f.add(manager, "a", "1", host));
  // A directory where the file should be: the rename over it fails.
  fs::remove(manager.path());
  fs::create_directory(manager.path());

  base::Result<void> refused =
      manager.registerExternalService(f.service("b", "1", host), host.pidfd);
  ASSERT_FALSE(refused.has_value());
  EXPECT_EQ(refused.error().domain, kPosixErrorDomain);
  EXPECT_FALSE(fs::exists(f.launchFile(host, "b")));
  const int result = remove(manager, "a", "1");
  EXPECT_NE(result, 0);
  EXPECT_NE(result, ESRCH);
  EXPECT_EQ(manager.registrations(), Registrations{f.service("a", "1", host)});
  EXPECT_TRUE(fs::exists(f.launchFile(host, "a")));
}

}  // namespace
}  // namespace vantrel::platform
