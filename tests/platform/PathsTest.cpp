#include "platform/Paths.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <optional>

#include "tests/platform/Helpers.h"

namespace vantrel::platform {
namespace {

TEST(Paths, DirectoriesFollowTheEnvironment) {
  ScopedEnvironment state("VANTREL_STATE_DIR", std::nullopt), xdg("XDG_STATE_HOME", "/xdg"),
      home("HOME", "/home/u"), runtime("VANTREL_RUNTIME_DIR", std::nullopt),
      xdgRuntime("XDG_RUNTIME_DIR", std::nullopt);
  const bool root = ::geteuid() == 0;
  EXPECT_EQ(stateDirectory(), root ? "/var/lib/vantrel" : "/xdg/vantrel");
  EXPECT_EQ(runtimeDirectory(),
            root ? "/run/vantrel" : "/tmp/vantrel-" + std::to_string(::geteuid()));
  {
    ScopedEnvironment noXdg("XDG_STATE_HOME", std::nullopt),
        xdgRun("XDG_RUNTIME_DIR", "/run/user/5");
    EXPECT_EQ(stateDirectory(), root ? "/var/lib/vantrel" : "/home/u/.local/state/vantrel");
    EXPECT_EQ(runtimeDirectory(), root ? "/run/vantrel" : "/run/user/5/vantrel");
  }
  ScopedEnvironment override("VANTREL_STATE_DIR", "/s"), runOverride("VANTREL_RUNTIME_DIR", "/r");
  EXPECT_EQ(stateDirectory(), "/s");
  EXPECT_EQ(runtimeDirectory(), "/r");

  ScopedEnvironment sdks("VANTREL_SDK_DIRS", ":/a::/b:");
  EXPECT_EQ(sdkDirectories(), (std::vector<std::string>{"/a", "/b"}));
  ScopedEnvironment noSdks("VANTREL_SDK_DIRS", std::nullopt);
  EXPECT_EQ(sdkDirectories(), std::vector<std::string>{"/usr/share/vantrel/sdks"});
}

TEST(Paths, EnsureDirectoryCreatesMissingLevelsWithTheMode) {
  testing::TempDir dir;
  const mode_t old = ::umask(077);
  ASSERT_TRUE(ensureDirectory(dir.file("a/b/c/"), 0750).has_value());
  ::umask(old);
  for (const char* level : {"a", "a/b", "a/b/c"})
    EXPECT_EQ(modeOf(dir.file(level)), 0750u) << level;
  // Existing directories are used as they are.
  ::chmod(dir.file("a").c_str(), 0755);
  EXPECT_TRUE(ensureDirectory(dir.file("a/b"), 0700).has_value());
  EXPECT_EQ(modeOf(dir.file("a")), 0755u);

  dir.write("file", "x");
  for (const char* bad : {"file", "file/sub"}) {
    auto result = ensureDirectory(dir.file(bad), 0700);
    ASSERT_FALSE(result.has_value()) << bad;
    EXPECT_EQ(result.error().domain, "POSIX");
    EXPECT_EQ(result.error().code, ENOTDIR) << bad;
  }
}

}  // namespace
}  // namespace vantrel::platform
