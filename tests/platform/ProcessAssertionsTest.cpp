#include "platform/ProcessAssertions.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <string>
#include <vector>

#include "tests/platform/Helpers.h"

namespace vantrel::platform {
namespace {

namespace fs = std::filesystem;
using lmo::Dictionary;
using lmo::Value;

// The instances of com.example.p with these pids in bundle, in pid order.
std::vector<Dictionary> instances(const std::string& bundle, std::vector<pid_t> pids) {
  std::sort(pids.begin(), pids.end());
  std::vector<Dictionary> out;
  for (pid_t pid : pids) {
    out.push_back(Dictionary{{kInstanceBundleIdentifierKey, Value("com.example.p")},
                             {kInstancePidKey, Value::integer(pid)},
                             {kInstanceBundlePathKey, Value(bundle)}});
  }
  return out;
}

TEST(ProcessAssertions, RunningInstancesAreTheProcessesStartedFromInsideTheBundle) {
  testing::TempDir tmp;
  const std::string bundle = tmp.file("A.app/PlugIns/P.appex");
  const std::string exe = makePeerBundle(tmp, "A.app/PlugIns/P.appex", "com.example.p");
  // A sibling whose name merely starts with the bundle's.
  const std::string sibling = makePeerBundle(tmp, "A.app/PlugIns/P.appex2", "com.example.p2");
  fs::create_directory_symlink(bundle, tmp.file("link.appex"));

  auto first = startSleepingPeer(exe);
  auto second = startSleepingPeer(exe);
  auto other = startSleepingPeer(sibling);
  ASSERT_TRUE(first && second && other);
  const std::vector<Dictionary> both = instances(bundle, {first->pid(), second->pid()});
  struct Case {
    const char* name;
    std::vector<std::string> paths;
    std::vector<Dictionary> expected;
  };
  const Case cases[] = {
      {"bundle", {bundle}, both},
      {"through-symbolic-link", {tmp.file("link.appex")}, both},
      {"not-normal", {bundle + "/./Sub/..//"}, both},
      {"missing-and-bundle", {tmp.file("gone.appex"), bundle}, both},
      {"application-around-it",
       {tmp.file("A.app")},
       instances(tmp.file("A.app"), {first->pid(), second->pid(), other->pid()})},
      {"executable-itself", {exe}, {}},
      {"none", {}, {}},
      {"missing", {tmp.file("gone.appex")}, {}},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(runningInstances("com.example.p", c.paths), c.expected) << c.name;
  }
}

TEST(ProcessAssertions, AnInstanceCountsUntilItExitsEvenWhenItsExecutableIsGone) {
  testing::TempDir tmp;
  const std::string bundle = tmp.file("P.appex");
  const std::string exe = makePeerBundle(tmp, "P.appex", "com.example.p");
  auto peer = startSleepingPeer(exe);
  ASSERT_TRUE(peer);
  const std::vector<Dictionary> running = instances(bundle, {peer->pid()});
  EXPECT_EQ(runningInstances("com.example.p", {bundle}), running);

  // A bundle being replaced: the old executable still runs.
  ASSERT_EQ(::unlink(exe.c_str()), 0);
  EXPECT_EQ(runningInstances("com.example.p", {bundle}), running);

  peer->closeStdin();
  EXPECT_EQ(peer->wait(), 0);
  EXPECT_TRUE(runningInstances("com.example.p", {bundle}).empty());
}

}  // namespace
}  // namespace vantrel::platform
