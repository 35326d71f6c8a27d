#include "platform/PeerPaths.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <memory>

#include "tests/support/TempDir.h"

namespace vantrel::platform {
namespace {

namespace fs = std::filesystem;

std::optional<std::string> realPath(const std::string& path) {
  std::unique_ptr<char, decltype(&std::free)> resolved(::realpath(path.c_str(), nullptr),
                                                       &std::free);
  if (!resolved) return std::nullopt;
  return std::string(resolved.get());
}

// open/ is 0755, closed/ 0700 (root's), shared/ 0710 with group 4242.
class PeerPaths : public ::testing::Test {
 protected:
  void SetUp() override {
    ::chmod(tmp_.path().c_str(), 0755);
    fs::create_directories(root_ + "/open/app/sub");
    fs::create_directories(root_ + "/closed/secret");
    fs::create_directories(root_ + "/shared/inner");
    ::chmod((root_ + "/closed").c_str(), 0700);
    ::chmod((root_ + "/shared").c_str(), 0710);
    ASSERT_EQ(::chown((root_ + "/shared").c_str(), 0, 4242), 0);
    fs::create_symlink("../closed/secret", root_ + "/open/into-closed");
    fs::create_symlink("app/sub", root_ + "/open/relative");
    fs::create_symlink(root_ + "/open/app", root_ + "/open/absolute");
    fs::create_symlink("loop-b", root_ + "/open/loop-a");
    fs::create_symlink("loop-a", root_ + "/open/loop-b");
  }

  testing::TempDir tmp_;
  const std::string root_ = realPath(tmp_.path().string()).value();
};

TEST_F(PeerPaths, ResolvesAsRealpathWhereThePeerMayLookAndNowhereElse) {
  const LookupCredentials root{0, 0, {}};
  const LookupCredentials nobody{65534, 65534, {}};
  const LookupCredentials member{65534, 65534, {100, 4242}};
  const struct {
    const char* path;
    const LookupCredentials& who;
    bool resolves;
  } cases[] = {
      {"/open/app/sub", nobody, true},
      {"/open/./app//sub/", nobody, true},
      {"/open/app/../app/sub", nobody, true},
      {"/open/relative", nobody, true},
      {"/open/absolute/sub", nobody, true},
      {"/open/missing", nobody, false},
      {"/open/app/sub/..", nobody, true},
      // Behind a closed directory, what exists and what does not look alike.
      {"/closed/secret", nobody, false},
      {"/closed/missing", nobody, false},
      {"/open/into-closed", nobody, false},
      {"/closed/secret/..", nobody, false},
      {"/closed/secret", root, true},
      {"/open/into-closed", root, true},
      // Group search rights, through a supplementary group.
      {"/shared/inner", member, true},
      {"/shared/inner", nobody, false},
      {"/open/loop-a", root, false},
      {"/open/app/sub/file-not-dir/x", root, false},
  };
  for (const auto& c : cases) {
    const std::string path = root_ + c.path;
    const std::optional<std::string> resolved = canonicalPathFor(path, c.who);
    EXPECT_EQ(resolved.has_value(), c.resolves) << c.path << " for uid " << c.who.uid;
    // Where it resolves, it resolves as the kernel does.
    if (resolved) {
      EXPECT_EQ(resolved, realPath(path)) << c.path;
    }
  }
  EXPECT_EQ(canonicalPathFor("relative/path", root), std::nullopt);
  EXPECT_EQ(canonicalPathFor("/", nobody), "/");
}

}  // namespace
}  // namespace vantrel::platform
