#include "platform/AtomicFile.h"

#include <gtest/gtest.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <thread>

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

TEST(AtomicFile, CreatesOnlyWhatDoesNotExistAndLeavesNoTemporary) {
  testing::TempDir dir;
  const std::string path = dir.file("secret");
  ::umask(022);
  ASSERT_TRUE(createFileAtomically(path, std::string("one\0", 4), 0640).has_value());
  EXPECT_EQ(contentsOf(path), std::string("one\0", 4));
  EXPECT_EQ(modeOf(path), 0640u);
  const auto again = createFileAtomically(path, "two");
  ASSERT_FALSE(again.has_value());
  EXPECT_EQ(again.error().code, EEXIST);
  EXPECT_EQ(contentsOf(path), std::string("one\0", 4));
  EXPECT_EQ(entryCount(dir.path()), 1);
  EXPECT_EQ(createFileAtomically(dir.file("missing/f"), "x").error().code, ENOENT);
}

TEST(AtomicFile, WritesUnderARecognisableTemporaryName) {
  testing::TempDir dir;
  const int inotify = ::inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
  ASSERT_GE(inotify, 0);
  ASSERT_GE(::inotify_add_watch(inotify, dir.path().c_str(), IN_CREATE), 0);
  ASSERT_TRUE(writeFileAtomically(dir.file("f"), "x").has_value());
  alignas(inotify_event) char buffer[4096];
  const ssize_t n = ::read(inotify, buffer, sizeof buffer);
  ::close(inotify);
  ASSERT_GT(n, 0);
  const std::string created = reinterpret_cast<const inotify_event*>(buffer)->name;
  EXPECT_TRUE(created.starts_with(".f" + std::string(kTemporaryFileMarker))) << created;
  EXPECT_EQ(temporaryFileWriter(created), ::getpid()) << created;

  const std::string self = std::to_string(::getpid());
  const std::pair<std::string, std::optional<pid_t>> names[] = {
      {temporaryOf("Annotations", 42, 7), 42},
      {temporaryOf("a.vt-tmp-1-1", 43, 0), 43},
      {".Annotations.abc123", std::nullopt},  // mkstemp's kind: could be anybody's
      {"Annotations" + std::string(kTemporaryFileMarker) + self + "-1", std::nullopt},
      {"." + std::string(kTemporaryFileMarker) + self + "-1", std::nullopt},
      {".f" + std::string(kTemporaryFileMarker) + self + "-", std::nullopt},
      {".f" + std::string(kTemporaryFileMarker) + "-1", std::nullopt},
      {".f" + std::string(kTemporaryFileMarker) + "0-1", std::nullopt},
      {".f" + std::string(kTemporaryFileMarker) + "1x-1", std::nullopt},
  };
  for (const auto& [name, writer] : names) EXPECT_EQ(temporaryFileWriter(name), writer) << name;
}

TEST(AtomicFile, RemovesOnlyStaleTemporaries) {
  testing::TempDir dir;
  const pid_t dead = deadPid(), self = ::getpid();
  // A file name too long to be kept whole in its temporaries' names.
  const std::string longName(250, 'L');
  const std::string suffix = std::string(kTemporaryFileMarker) + std::to_string(dead) + "-1";
  // The sweep after which each file is gone: 0 for the file "Annotations",
  // 1 for longName, 2 for every file, 3 never.
  const std::pair<std::string, int> cases[] = {
      {temporaryOf("Annotations", dead, 3), 0},
      {temporaryOf("Annotations", self, 999999), 0},  // no write of ours uses it
      {temporaryOf("Annotations", 1, 0), 3},          // its writer still runs
      {temporaryOf("Other", dead, 1), 2},
      {"." + longName.substr(0, 254 - suffix.size()) + suffix, 1},
      {"." + longName.substr(0, 200) + suffix, 2},  // not cut short: another file's
      {".Annotations.abc123", 3},
      {"Annotations", 3},
  };
  for (const auto& [name, sweep] : cases) dir.write(name, "partial");
  const std::string sweeps[] = {"Annotations", longName, ""};
  for (int sweep = 0; sweep < 3; ++sweep) {
    const auto removed = removeStaleTemporaryFiles(dir.path().string(), sweeps[sweep]);
    ASSERT_TRUE(removed.has_value()) << sweep;
    EXPECT_EQ(removed.value(),
              size_t(std::count_if(std::begin(cases), std::end(cases),
                                   [&](const auto& c) { return c.second == sweep; })));
    for (const auto& [name, gone] : cases) {
      EXPECT_EQ(std::filesystem::exists(dir.file(name)), gone > sweep) << sweep << " " << name;
    }
  }
  EXPECT_EQ(removeStaleTemporaryFiles(dir.file("missing"), "f").error().code, ENOENT);
}

TEST(AtomicFile, RemovingStaleTemporariesSparesWritesInProgress) {
  testing::TempDir dir;
  std::atomic<bool> writing = true;
  std::thread cleaner([&] {
    while (writing) ASSERT_TRUE(removeStaleTemporaryFiles(dir.path().string()).has_value());
  });
  int failed = 0;
  for (int i = 0; i < 100; ++i)
    failed += writeFileAtomically(dir.file("f"), "x").has_value() ? 0 : 1;
  writing = false;
  cleaner.join();
  EXPECT_EQ(failed, 0);
  EXPECT_EQ(entryCount(dir.path()), 1);
}

}  // namespace
}  // namespace vantrel::platform
