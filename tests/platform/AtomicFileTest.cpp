#include "platform/AtomicFile.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <sstream>

#include "tests/support/TempDir.h"

namespace vantrel::platform {
namespace {

std::string contents(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream out;
  out << in.rdbuf();
  return out.str();
}

size_t entries(const std::filesystem::path& dir) {
  size_t n = 0;
  for (auto it = std::filesystem::directory_iterator(dir);
       it != std::filesystem::directory_iterator(); ++it) {
    ++n;
  }
  return n;
}

TEST(AtomicFile, ReplacesContentsWithTheGivenMode) {
  testing::TempDir dir;
  const std::string path = dir.write("f", "old");
  ::umask(022);
  ASSERT_TRUE(writeFileAtomically(path, std::string("new\0bytes", 9), 0640).has_value());
  EXPECT_EQ(contents(path), std::string("new\0bytes", 9));
  struct stat st;
  ASSERT_EQ(::stat(path.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0640u);
  // The mode is exact, not filtered by the umask.
  const mode_t old = ::umask(077);
  ASSERT_TRUE(writeFileAtomically(path, "", 0666).has_value());
  ::umask(old);
  ASSERT_EQ(::stat(path.c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0666u);
  EXPECT_EQ(contents(path), "");
  EXPECT_EQ(entries(dir.path()), 1u);
}

TEST(AtomicFile, FailureLeavesTheOldFileAndNoTemporaries) {
  testing::TempDir dir;
  const std::string old = dir.write("d/keep", "old contents");
  std::filesystem::create_directory(dir.file("d/subdir"));
  struct Case {
    const char* name;
    std::string path;
    int err;
  } cases[] = {
      {"missing directory", dir.file("d/missing/f"), ENOENT},
      {"directory in place of the file", dir.file("d/subdir"), EISDIR},
      {"empty path", "", EINVAL},
  };
  for (const Case& c : cases) {
    auto result = writeFileAtomically(c.path, "new");
    ASSERT_FALSE(result.has_value()) << c.name;
    EXPECT_EQ(result.error().domain, "POSIX") << c.name;
    EXPECT_EQ(result.error().code, c.err) << c.name;
    EXPECT_NE(result.error().description().find(c.path), std::string::npos) << c.name;
    EXPECT_EQ(entries(dir.file("d")), 2u) << c.name;  // keep and subdir, nothing else
  }
  EXPECT_TRUE(std::filesystem::is_directory(dir.file("d/subdir")));
  EXPECT_EQ(contents(old), "old contents");

  // Permissions do not bind root; as anyone else an unwritable directory fails.
  if (::geteuid() != 0) {
    ::chmod(dir.file("d").c_str(), 0500);
    auto result = writeFileAtomically(old, "new");
    ::chmod(dir.file("d").c_str(), 0700);
    ASSERT_FALSE(result.has_value());
    EXPECT_EQ(result.error().code, EACCES);
    EXPECT_EQ(contents(old), "old contents");
    EXPECT_EQ(entries(dir.file("d")), 2u);
  }
}

}  // namespace
}  // namespace vantrel::platform
