#include "platform/AtomicFile.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "tests/platform/Helpers.h"

namespace vantrel::platform {
namespace {

TEST(AtomicFile, ReplacesContentsWithTheGivenMode) {
  testing::TempDir dir;
  const std::string path = dir.write("f", "old");
  ::umask(022);
  ASSERT_TRUE(writeFileAtomically(path, std::string("new\0bytes", 9), 0640).has_value());
  EXPECT_EQ(contentsOf(path), std::string("new\0bytes", 9));
  EXPECT_EQ(modeOf(path), 0640u);
  // The mode is exact, not filtered by the umask.
  const mode_t old = ::umask(077);
  ASSERT_TRUE(writeFileAtomically(path, "", 0666).has_value());
  ::umask(old);
  EXPECT_EQ(modeOf(path), 0666u);
  EXPECT_EQ(contentsOf(path), "");
  EXPECT_EQ(entryCount(dir.path()), 1);
}

TEST(AtomicFile, FailureLeavesTheOldFileAndNoTemporaries) {
  testing::TempDir dir;
  const std::string old = dir.write("d/keep", "old contents");
  std::filesystem::create_directory(dir.file("d/subdir"));
  // A missing directory, a directory in place of the file, no path at all.
  const std::pair<std::string, int> cases[] = {
      {dir.file("d/missing/f"), ENOENT}, {dir.file("d/subdir"), EISDIR}, {"", EINVAL}};
  for (const auto& [path, err] : cases) {
    auto result = writeFileAtomically(path, "new");
    ASSERT_FALSE(result.has_value()) << path;
    EXPECT_EQ(result.error().domain, "POSIX") << path;
    EXPECT_EQ(result.error().code, err) << path;
    EXPECT_NE(result.error().description().find(path), std::string::npos) << path;
    EXPECT_EQ(entryCount(dir.file("d")), 2) << path;  // keep and subdir, nothing else
  }
  EXPECT_TRUE(std::filesystem::is_directory(dir.file("d/subdir")));
  EXPECT_EQ(contentsOf(old), "old contents");

  // Permissions do not bind root; as anyone else an unwritable directory fails.
  if (::geteuid() != 0) {
    ::chmod(dir.file("d").c_str(), 0500);
    auto result = writeFileAtomically(old, "new");
    ::chmod(dir.file("d").c_str(), 0700);
    ASSERT_FALSE(result.has_value());
    EXPECT_EQ(result.error().code, EACCES);
    EXPECT_EQ(contentsOf(old), "old contents");
    EXPECT_EQ(entryCount(dir.file("d")), 2);
  }
}

}  // namespace
}  // namespace vantrel::platform
