#include "platform/CodeSigning.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <string>

#include "lmo/Protocol.h"
#include "platform/PropertyList.h"
#include "tests/platform/Helpers.h"

namespace vantrel::platform {
namespace {

namespace fs = std::filesystem;
using lmo::Dictionary;
using lmo::Value;

const Dictionary kGranted{
    {std::string(protocol::kManagerEntitlement), Value::boolean(true)},
    {"com.karvo.developer.vantrel.allowedplugins",
     Value(Dictionary{{"QXExtensionPointIdentifier", Value("com.example.point")}})},
};

void writeEntitlements(const std::string& file, mode_t mode) {
  ASSERT_TRUE(writePropertyListFile(file, Value(kGranted), mode).has_value()) << file;
}

TEST(CodeSigning, EntitlementsComeOnlyFromATrustedFileThatBelongsToTheExecutable) {
  ASSERT_EQ(::geteuid(), 0u) << "the ownership case needs root";
  // How the entitlements file is made: kGranted written with the mode, then
  // handed to another owner, reached through a symbolic link, or replaced by
  // an array.
  enum class Make { kPlain, kOtherOwner, kLink, kArray };
  const struct {
    const char* name;
    bool inBundle;     // the executable "peer" of a bundle, or a loose "tool"
    const char* file;  // relative to the directory of both; null: none
    mode_t mode;
    Make make;
    bool granted;
    const char* problem;  // null: no error
  } cases[] = {
      {"bundle-trusted", true, "Entitlements.plist", 0644, Make::kPlain, true, nullptr},
      {"bundle-none", true, nullptr, 0, Make::kPlain, false, nullptr},
      {"bundle-group-writable", true, "Entitlements.plist", 0664, Make::kPlain, false,
       "it is writable by group or others"},
      {"bundle-other-owner", true, "Entitlements.plist", 0644, Make::kOtherOwner, false,
       "it is owned by uid 12345"},
      {"bundle-symbolic-link", true, "Entitlements.plist", 0644, Make::kLink, false,
       "it is a symbolic link"},
      {"bundle-not-a-dictionary", true, "Entitlements.plist", 0644, Make::kArray, false,
       "it is not a dictionary"},
      // A bundled executable reads its bundle's file, not the loose one.
      {"bundle-ignores-loose-file", true, "peer.entitlements.plist", 0644, Make::kPlain, false,
       nullptr},
      {"loose-trusted", false, "tool.entitlements.plist", 0644, Make::kPlain, true, nullptr},
      {"loose-world-writable", false, "tool.entitlements.plist", 0646, Make::kPlain, false,
       "it is writable by group or others"},
      // Without an Info.plist naming it, the executable has no bundle.
      {"loose-ignores-bundle-file", false, "Entitlements.plist", 0644, Make::kPlain, false,
       nullptr},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    testing::TempDir tmp;
    const std::string dir = tmp.file(c.name);
    const std::string exe =
        c.inBundle ? makePeerBundle(tmp, c.name, "com.example.b") : dir + "/tool";
    if (!c.inBundle) {
      ASSERT_TRUE(testing::installTestPeer(exe));
    }
    const std::string file = c.file ? dir + "/" + c.file : "";
    if (c.make == Make::kLink) {
      writeEntitlements(dir + "/real.plist", c.mode);
      fs::create_symlink("real.plist", file);
    } else if (c.make == Make::kArray) {
      ASSERT_TRUE(writePropertyListFile(file, Value(lmo::Array{"x"}), c.mode).has_value());
    } else if (c.file) {
      writeEntitlements(file, c.mode);
      if (c.make == Make::kOtherOwner) {
        ASSERT_EQ(::chown(file.c_str(), 12345, 12345), 0);
      }
    }
    auto peer = startSleepingPeer(exe);
    ASSERT_TRUE(peer);

    base::Result<CodeSigningTaskPtr> task = CodeSigningTask::create(peer->pid(), peer->pidfd());
    ASSERT_TRUE(task.has_value()) << task.error().description();
    const CodeSigningTask& t = *task.value();
    EXPECT_EQ(t.executablePath(), exe);
    EXPECT_EQ(t.bundlePath(), c.inBundle ? std::optional<std::string>(dir) : std::nullopt);
    EXPECT_EQ(t.entitlements(), c.granted ? kGranted : Dictionary());

    const CodeSigningTask::Entitlement manager =
        t.copyValueForEntitlement(protocol::kManagerEntitlement);
    EXPECT_EQ(manager.value, c.granted ? Value::boolean(true) : Value());
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

TEST(CodeSigning, AProcessIsVouchedForOnlyWhileItsPidfdAndItsExecutableStandForIt) {
  testing::TempDir tmp;
  const std::string exe = makePeerBundle(tmp, "P.appex", "com.example.p");
  writeEntitlements(tmp.file("P.appex/Entitlements.plist"), 0644);
  auto first = startSleepingPeer(exe);
  auto second = startSleepingPeer(exe);
  ASSERT_TRUE(first && second);

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

  // Another file now at the path must not lend the old process its bundle.
  ASSERT_EQ(::unlink(exe.c_str()), 0);
  ASSERT_TRUE(testing::installTestPeer(exe));
  EXPECT_EQ(refusalCode(first->pid(), first->pidfd()), kCodeSigningNoExecutable);
  // Nor does a deleted one.
  auto deleted = startSleepingPeer(exe);
  ASSERT_TRUE(deleted);
  ASSERT_EQ(::unlink(exe.c_str()), 0);
  EXPECT_EQ(refusalCode(deleted->pid(), deleted->pidfd()), kCodeSigningNoExecutable);
}

}  // namespace
}  // namespace vantrel::platform
