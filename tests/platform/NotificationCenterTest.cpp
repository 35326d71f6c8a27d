#include "platform/NotificationCenter.h"

#include <gtest/gtest.h>
#include <sys/inotify.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <thread>
#include <vector>

#include "platform/AtomicFile.h"
#include "tests/platform/Helpers.h"

namespace vantrel::platform {
namespace {

class NotificationCenterTest : public ::testing::Test {
 protected:
  testing::TempDir dir_;
  ScopedEnvironment runtimeDirectory_{"VANTREL_RUNTIME_DIR", dir_.path().string()};
};

TEST_F(NotificationCenterTest, PostsCountPerNameAndAreSeenByInotify) {
  EXPECT_EQ(notificationCount("a"), 0u);
  ASSERT_EQ(postNotification("a").value(), 1u);
  const int inotify = ::inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
  ASSERT_GE(inotify, 0);
  ASSERT_GE(::inotify_add_watch(inotify, dir_.file("notify").c_str(), IN_MOVED_TO), 0);

  EXPECT_EQ(postNotification("a").value(), 2u);
  EXPECT_EQ(postNotification("b").value(), 1u);
  EXPECT_EQ(notificationCount("a"), 2u);
  EXPECT_EQ(std::filesystem::file_size(dir_.file("notify/a")), 2u);  // "2\n"

  alignas(inotify_event) char buffer[4096];
  const ssize_t n = ::read(inotify, buffer, sizeof buffer);
  ::close(inotify);
  ASSERT_GT(n, 0);
  EXPECT_STREQ(reinterpret_cast<const inotify_event*>(buffer)->name, "a");
}

TEST_F(NotificationCenterTest, MakesDirectoryAndFilesWithTheirModes) {
  const mode_t saved = ::umask(077);
  const auto posted = postNotification("a");
  ::umask(saved);
  ASSERT_EQ(posted.value(), 1u);
  for (const auto& [file, mode] :
       {std::pair{"notify", 0755u}, {"notify/a", 0644u}, {"notify/.lock", 0644u}}) {
    EXPECT_EQ(modeOf(dir_.file(file)), mode) << file;
  }
}

TEST_F(NotificationCenterTest, StartsByRemovingTheTemporariesOfInterruptedPosts) {
  const pid_t dead = ::fork();
  if (dead == 0) ::_exit(0);
  ::waitpid(dead, nullptr, 0);
  const std::string marker(kTemporaryFileMarker);
  const std::string stale[] = {"notify/.a" + marker + std::to_string(dead) + "-4",
                               "notify/.b" + marker + std::to_string(::getpid()) + "-999999"};
  for (const std::string& name : stale) dir_.write(name, "7");
  ASSERT_EQ(postNotification("a").value(), 1u);
  for (const std::string& name : stale) {
    EXPECT_FALSE(std::filesystem::exists(dir_.file(name))) << name;
  }
}

TEST_F(NotificationCenterTest, RefusesNamesThatAreNotOneFileName) {
  const std::string longest(kMaxNotificationNameLength, 'n'), tooLong = longest + "n";
  using namespace std::literals;
  for (const std::string_view name :
       {""sv, "."sv, ".."sv, "a/b"sv, "/a"sv, "a\0b"sv, std::string_view(tooLong)}) {
    const auto posted = postNotification(name);
    ASSERT_FALSE(posted.has_value()) << name;
    EXPECT_EQ(posted.error().code, EINVAL);
    EXPECT_EQ(notificationCount(name), 0u);
  }
  EXPECT_EQ(postNotification(longest).value(), 1u);
  EXPECT_EQ(postNotification("..a").value(), 1u);
}

TEST_F(NotificationCenterTest, ConcurrentPostsFromThreadsAndAProcessLoseNothing) {
  constexpr int kThreads = 8, kPostsEach = 25;
  ASSERT_EQ(postNotification("c").value(), 1u);  // makes the directory before forking
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    for (int i = 0; i < kPostsEach; ++i) {
      if (!postNotification("c").has_value()) ::_exit(1);
    }
    ::_exit(0);
  }
  std::vector<std::vector<uint64_t>> seen(kThreads);
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&seen, t] {
      for (int i = 0; i < kPostsEach; ++i) seen[t].push_back(postNotification("c").value());
    });
  }
  for (std::thread& t : threads) t.join();
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);

  EXPECT_EQ(notificationCount("c"), 1u + (kThreads + 1) * kPostsEach);
  std::vector<uint64_t> all;
  for (const auto& s : seen) all.insert(all.end(), s.begin(), s.end());
  std::sort(all.begin(), all.end());
  EXPECT_EQ(std::adjacent_find(all.begin(), all.end()), all.end())
      << "a value was handed out twice";
}

}  // namespace
}  // namespace vantrel::platform
