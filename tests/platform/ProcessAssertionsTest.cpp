#include "platform/ProcessAssertions.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <string>
#include <vector>

#include "tests/platform/PeerBundles.h"

namespace vantrel::platform {
namespace {

namespace fs = std::filesystem;
using lmo::Dictionary;
using lmo::Value;

Dictionary instance(const char* identifier, pid_t pid, const std::string& bundle) {
  return Dictionary{{kInstanceBundleIdentifierKey, Value(identifier)},
                    {kInstancePidKey, Value::integer(pid)},
                    {kInstanceBundlePathKey, Value(bundle)}};
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
  const std::vector<Dictionary> both{instance("com.example.p", first->pid(), bundle),
                                     instance("com.example.p", second->pid(), bundle)};
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
       {instance("com.example.p", first->pid(), tmp.file("A.app")),
        instance("com.example.p", second->pid(), tmp.file("A.app")),
        instance("com.example.p", other->pid(), tmp.file("A.app"))}},
      {"executable-itself", {exe}, {}},
      {"none", {}, {}},
      {"missing", {tmp.file("gone.appex")}, {}},
  };
  for (const Case& c : cases) {
    std::vector<Dictionary> expected = c.expected;
    std::sort(expected.begin(), expected.end(), [](const Dictionary& a, const Dictionary& b) {
      return a.get(kInstancePidKey).integerValue() < b.get(kInstancePidKey).integerValue();
    });
    EXPECT_EQ(runningInstances("com.example.p", c.paths), expected) << c.name;
  }
}

TEST(ProcessAssertions, AnInstanceCountsUntilItExitsEvenWhenItsExecutableIsGone) {
  testing::TempDir tmp;
  const std::string bundle = tmp.file("P.appex");
  const std::string exe = makePeerBundle(tmp, "P.appex", "com.example.p");
  auto peer = startSleepingPeer(exe);
  ASSERT_TRUE(peer);
  const std::vector<Dictionary> running{instance("com.example.p", peer->pid(), bundle)};
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
