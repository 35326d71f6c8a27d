#include "platform/CodeSigning.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <string>

#include "platform/PropertyList.h"
#include "tests/platform/PeerBundles.h"

namespace vantrel::platform {
namespace {

namespace fs = std::filesystem;
using lmo::Dictionary;
using lmo::Value;

const Dictionary kGranted{
    {"com.karvo.private.vantrel.manager", Value::boolean(true)},
    {"com.karvo.developer.vantrel.allowedplugins",
     Value(Dictionary{{"QXExtensionPointIdentifier", Value("com.example.point")}})},
};

void writeEntitlements(const std::string& file, mode_t mode) {
  ASSERT_TRUE(writePropertyListFile(file, Value(kGranted), mode).has_value()) << file;
}

TEST(CodeSigning, EntitlementsComeOnlyFromATrustedFileThatBelongsToTheExecutable) {
  ASSERT_EQ(::geteuid(), 0u) << "the ownership case needs root";
  struct Case {
    const char* name;
    bool inBundle;
    // Prepares the entitlements around the bundle directory (or, for a loose
    // executable, its directory) and the executable.
    std::function<void(const std::string& dir, const std::string& exe)> prepare;
    bool granted;
    const char* problem;  // null: no error
  };
  const Case cases[] = {
      {"bundle-trusted", true,
       [](const std::string& dir, const std::string&) {
         writeEntitlements(dir + "/Entitlements.plist", 0644);
       },
       true, nullptr},
      {"bundle-none", true, [](const std::string&, const std::string&) {}, false, nullptr},
      {"bundle-group-writable", true,
       [](const std::string& dir, const std::string&) {
         writeEntitlements(dir + "/Entitlements.plist", 0664);
       },
       false, "it is writable by group or others"},
      {"bundle-other-owner", true,
       [](const std::string& dir, const std::string&) {
         writeEntitlements(dir + "/Entitlements.plist", 0644);
         ASSERT_EQ(::chown((dir + "/Entitlements.plist").c_str(), 12345, 12345), 0);
       },
       false, "it is owned by uid 12345"},
      {"bundle-symbolic-link", true,
       [](const std::string& dir, const std::string&) {
         writeEntitlements(dir + "/real.plist", 0644);
         fs::create_symlink("real.plist", dir + "/Entitlements.plist");
       },
       false, "it is a symbolic link"},
      {"bundle-not-a-dictionary", true,
       [](const std::string& dir, const std::string&) {
         ASSERT_TRUE(writePropertyListFile(dir + "/Entitlements.plist", Value(lmo::Array{"x"}))
                         .has_value());
       },
       false, "it is not a dictionary"},
      // A bundled executable reads its bundle's file, not the loose one.
      {"bundle-ignores-loose-file", true,
       [](const std::string&, const std::string& exe) {
         writeEntitlements(exe + ".entitlements.plist", 0644);
       },
       false, nullptr},
      {"loose-trusted", false,
       [](const std::string&, const std::string& exe) {
         writeEntitlements(exe + ".entitlements.plist", 0644);
       },
       true, nullptr},
      {"loose-none", false, [](const std::string&, const std::string&) {}, false, nullptr},
      {"loose-world-writable", false,
       [](const std::string&, const std::string& exe) {
         writeEntitlements(exe + ".entitlements.plist", 0646);
       },
       false, "it is writable by group or others"},
      // Without an Info.plist naming it, the executable has no bundle.
      {"loose-ignores-bundle-file", false,
       [](const std::string& dir, const std::string&) {
         writeEntitlements(dir + "/Entitlements.plist", 0644);
       },
       false, nullptr},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    testing::TempDir tmp;
    const std::string dir = tmp.file(c.name);
    std::string exe;
    if (c.inBundle) {
      exe = makePeerBundle(tmp, c.name, std::string("com.example.") + c.name);
    } else {
      exe = dir + "/tool";
      ASSERT_TRUE(testing::installTestPeer(exe));
    }
    c.prepare(dir, exe);
    auto peer = startSleepingPeer(exe);
    ASSERT_TRUE(peer);

    base::Result<CodeSigningTaskPtr> task = CodeSigningTask::create(peer->pid(), peer->pidfd());
    ASSERT_TRUE(task.has_value()) << task.error().description();
    const CodeSigningTask& t = *task.value();
    EXPECT_EQ(t.executablePath(), exe);
    EXPECT_EQ(t.bundlePath(), c.inBundle ? std::optional<std::string>(dir) : std::nullopt);
    EXPECT_EQ(t.entitlements(), c.granted ? kGranted : Dictionary());

    const CodeSigningTask::Entitlement manager =
        t.copyValueForEntitlement("com.karvo.private.vantrel.manager");
    EXPECT_EQ(manager.value, c.granted ? Value::boolean(true) : Value());
    EXPECT_TRUE(t.copyValueForEntitlement("com.karvo.developer.replace-plugin").value.isNull());
    if (c.problem == nullptr) {
      EXPECT_FALSE(manager.error.has_value()) << manager.error->description();
    } else {
      ASSERT_TRUE(manager.error.has_value());
      EXPECT_EQ(manager.error->domain, kCodeSigningErrorDomain);
      EXPECT_EQ(manager.error->code, kCodeSigningBadEntitlements);
      EXPECT_NE(manager.error->description().find(c.problem), std::string::npos)
          << manager.error->description();
      EXPECT_EQ(t.entitlementsError(), manager.error);
    }
  }
}

// What create() says for a process it must not vouch for.
int64_t refusalCode(pid_t pid, int pidfd) {
  base::Result<CodeSigningTaskPtr> task = CodeSigningTask::create(pid, pidfd);
  if (task.has_value()) return 0;
  EXPECT_EQ(task.error().domain, kCodeSigningErrorDomain);
  return task.error().code;
}

TEST(CodeSigning, AProcessIsIdentifiedOnlyWhileItsPidfdStandsForIt) {
  testing::TempDir tmp;
  const std::string exe = makePeerBundle(tmp, "P.appex", "com.example.p");
  auto first = startSleepingPeer(exe);
  auto second = startSleepingPeer(exe);
  ASSERT_TRUE(first && second);

  // The peer's own view of its pid matches what the kernel gave us.
  auto printer = testing::PeerProcess::start(exe, {"print-pid"});
  ASSERT_TRUE(printer);
  EXPECT_EQ(printer->readLine(), std::to_string(printer->pid()));

  EXPECT_EQ(refusalCode(first->pid(), first->pidfd()), 0);
  // Another live process's pidfd does not vouch for this pid.
  EXPECT_EQ(refusalCode(first->pid(), second->pidfd()), kCodeSigningNoProcess);
  // Nor does a descriptor that is no pidfd at all, or none.
  const int devNull = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
  ASSERT_GE(devNull, 0);
  EXPECT_EQ(refusalCode(first->pid(), devNull), kCodeSigningNoProcess);
  ::close(devNull);
  EXPECT_EQ(refusalCode(first->pid(), -1), kCodeSigningNoProcess);

  // An exited process: still a zombie, then reaped (its pid free for reuse).
  const pid_t gone = second->pid();
  second->kill();
  siginfo_t info{};
  ASSERT_EQ(::waitid(P_PID, static_cast<id_t>(gone), &info, WEXITED | WNOWAIT), 0);
  EXPECT_NE(refusalCode(gone, second->pidfd()), 0);
  second->wait();
  EXPECT_EQ(refusalCode(gone, second->pidfd()), kCodeSigningNoProcess);
}

TEST(CodeSigning, AnExecutableNoLongerAtItsPathIsNotVouchedFor) {
  testing::TempDir tmp;
  const std::string exe = makePeerBundle(tmp, "P.appex", "com.example.p");
  writeEntitlements(tmp.file("P.appex/Entitlements.plist"), 0644);
  auto replaced = startSleepingPeer(exe);
  ASSERT_TRUE(replaced);
  // Another file now at the path must not lend the old process its bundle.
  ASSERT_EQ(::unlink(exe.c_str()), 0);
  ASSERT_TRUE(testing::installTestPeer(exe));
  EXPECT_EQ(refusalCode(replaced->pid(), replaced->pidfd()), kCodeSigningNoExecutable);

  auto deleted = startSleepingPeer(exe);
  ASSERT_TRUE(deleted);
  ASSERT_EQ(::unlink(exe.c_str()), 0);
  EXPECT_EQ(refusalCode(deleted->pid(), deleted->pidfd()), kCodeSigningNoExecutable);
}

}  // namespace
}  // namespace vantrel::platform
