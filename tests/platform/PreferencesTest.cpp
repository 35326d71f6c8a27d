#include "platform/Preferences.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <thread>

#include "base/Log.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"
#include "tests/platform/Helpers.h"

namespace vantrel::platform {
namespace {

constexpr const char* kDomain = "com.example.prefs";

class PreferencesTest : public ::testing::Test {
 protected:
  testing::TempDir dir_;
  ScopedEnvironment preferencesDirectory_{"VANTREL_PREFERENCES_DIR", dir_.path().string()};
};

TEST_F(PreferencesTest, SeesWhatAnotherProcessWroteAtTheNextSynchronize) {
  Preferences prefs(kDomain);
  char host[HOST_NAME_MAX + 1] = {};
  ASSERT_EQ(::gethostname(host, HOST_NAME_MAX), 0);
  ASSERT_EQ(prefs.path(), dir_.file(std::string(host) + "/" + kDomain + ".plist"));
  EXPECT_TRUE(prefs.valueForKey("k").isNull());  // no file: an empty domain
  dir_.write(std::string(host) + "/" + kDomain + ".plist", stringsPlist({{"k", "one"}}));
  EXPECT_TRUE(prefs.valueForKey("k").isNull()) << "read again without synchronize";
  prefs.synchronize();
  EXPECT_EQ(prefs.valueForKey("k"), lmo::Value("one"));

  // Rewritten in place: same inode, same size, and the modification time
  // put back. The change time still tells the two versions apart.
  const struct stat before = statOf(prefs.path());
  std::ofstream(prefs.path(), std::ios::trunc) << stringsPlist({{"k", "two"}});
  const struct timespec times[2] = {before.st_atim, before.st_mtim};
  ASSERT_EQ(::utimensat(AT_FDCWD, prefs.path().c_str(), times, 0), 0);
  prefs.synchronize();
  EXPECT_EQ(prefs.valueForKey("k"), lmo::Value("two"));

  ASSERT_EQ(::unlink(prefs.path().c_str()), 0);
  prefs.synchronize();
  EXPECT_TRUE(prefs.valueForKey("k").isNull());
}

TEST_F(PreferencesTest, UnusableFilesAreAnEmptyDomainLoggedOnceAndNeverReplaced) {
  Preferences prefs(kDomain);
  ASSERT_TRUE(ensureDirectory(prefs.path().substr(0, prefs.path().rfind('/')), 0700).has_value());
  const std::pair<const char*, void (*)(const std::string&)> cases[] = {
      {"not a property list", [](const std::string& p) { std::ofstream(p) << "<plist>oops"; }},
      {"too large",
       [](const std::string& p) {
         std::ofstream(p) << "<plist><dict/></plist>";
         ASSERT_EQ(::truncate(p.c_str(), kMaxPropertyListBytes + 1), 0);
       }},
      {"a directory", [](const std::string& p) { ::mkdir(p.c_str(), 0700); }},
      {"a FIFO", [](const std::string& p) { ::mkfifo(p.c_str(), 0600); }},
  };
  for (const auto& [what, make] : cases) {
    std::filesystem::remove_all(prefs.path());
    std::ofstream(prefs.path()) << stringsPlist({{"k", "good"}});
    prefs.synchronize();
    ASSERT_EQ(prefs.valueForKey("k"), lmo::Value("good"));
    std::filesystem::remove(prefs.path());
    make(prefs.path());

    base::LogCapture log;
    prefs.synchronize();
    prefs.synchronize();
    EXPECT_TRUE(prefs.valueForKey("k").isNull()) << what;
    EXPECT_EQ(log.lines().size(), 1u) << what;
    EXPECT_TRUE(log.contains(prefs.path())) << what;

    // Replacing would give the path a new inode.
    const ino_t inode = statOf(prefs.path()).st_ino;
    EXPECT_FALSE(prefs.setValue("k", lmo::Value("new")).has_value()) << what;
    EXPECT_EQ(statOf(prefs.path()).st_ino, inode) << what;
  }
}

TEST_F(PreferencesTest, ConcurrentWritersLoseNoUpdate) {
  // Each thread has its own object, as separate processes would: every write
  // must start from the file as the previous writer left it.
  constexpr int kWriters = 4, kKeysEach = 10;
  // What a writer killed half-way left goes at the next write.
  const std::string hostDirectory = dir_.file(preferencesHostName());
  std::filesystem::create_directories(hostDirectory);
  const std::string leftover =
      hostDirectory + "/" + temporaryOf(std::string(kDomain) + ".plist", deadPid(), 1);
  std::ofstream(leftover) << "partial";
  std::vector<std::thread> threads;
  for (int t = 0; t < kWriters; ++t) {
    threads.emplace_back([t] {
      Preferences mine(kDomain);
      for (int i = 0; i < kKeysEach; ++i) {
        EXPECT_TRUE(
            mine.setValue(std::to_string(t * kKeysEach + i), lmo::Value::integer(i)).has_value());
      }
    });
  }
  for (std::thread& t : threads) t.join();
  EXPECT_FALSE(std::filesystem::exists(leftover));
  Preferences reader(kDomain);
  for (int k = 0; k < kWriters * kKeysEach; ++k) {
    EXPECT_EQ(reader.valueForKey(std::to_string(k)), lmo::Value::integer(k % kKeysEach)) << k;
  }
}

}  // namespace
}  // namespace vantrel::platform
