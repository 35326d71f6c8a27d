#include "platform/ServiceManager.h"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <future>

#include "base/Log.h"
#include "base/SerialQueue.h"
#include "platform/PropertyList.h"
#include "tests/support/TempDir.h"

namespace vantrel::platform {
namespace {

ExternalServiceRegistration service(const char* identifier, const char* version,
                                    pid_t pid = ::getpid()) {
  return {identifier, version, pid, "/apps/Host.app/PlugIns/P.appex/P",
          lmo::Dictionary{{"KBBundlePackageType", "LMO!"}}};
}

// Removes and waits for the reply, which must arrive on replyQueue.
int remove(ServiceManager& manager, const char* identifier, const char* version) {
  base::SerialQueue replyQueue("reply");
  std::promise<int> result;
  manager.removeExternalService(identifier, version, replyQueue, [&](int code) {
    EXPECT_TRUE(replyQueue.isCurrent());
    result.set_value(code);
  });
  return result.get_future().get();
}

TEST(ServiceManager, RemovesEveryRegistrationOfAVersionAndRepliesWithACode) {
  testing::TempDir dir;
  ServiceManager manager(dir.path().string());
  ASSERT_TRUE(manager.registerExternalService(service("a", "1")).has_value());
  ASSERT_TRUE(manager.registerExternalService(service("a", "1", 1)).has_value());
  ASSERT_TRUE(manager.registerExternalService(service("a", "2")).has_value());
  ASSERT_TRUE(manager.registerExternalService(service("b", "1")).has_value());

  EXPECT_EQ(remove(manager, "a", "1"), 0);
  EXPECT_EQ(manager.registrations(),
            (std::vector<ExternalServiceRegistration>{service("a", "2"), service("b", "1")}));
  EXPECT_EQ(remove(manager, "a", "1"), ESRCH);
  EXPECT_EQ(remove(manager, "c", "2"), ESRCH);
  EXPECT_EQ(remove(manager, "b", "1"), 0);

  // Enabling the same plug-in for the same host again replaces the entry.
  ExternalServiceRegistration updated = service("a", "2");
  updated.description = lmo::Dictionary{{"_SandboxProfile", "p"}};
  ASSERT_TRUE(manager.registerExternalService(updated).has_value());
  EXPECT_EQ(manager.registrations(), std::vector<ExternalServiceRegistration>{updated});
  EXPECT_EQ(manager.registerExternalService(service("", "1")).error().code, EINVAL);
}

TEST(ServiceManager, TheTableOutlivesTheInstanceButNotItsHosts) {
  testing::TempDir dir;
  const pid_t gone = ::fork();
  ASSERT_GE(gone, 0);
  if (gone == 0) ::_exit(0);
  ASSERT_EQ(::waitpid(gone, nullptr, 0), gone);
  {
    ServiceManager first(dir.path().string());
    ASSERT_TRUE(first.registerExternalService(service("a", "1")).has_value());
    ASSERT_TRUE(first.registerExternalService(service("b", "1", gone)).has_value());
  }
  EXPECT_EQ(ServiceManager(dir.path().string()).registrations(),
            std::vector<ExternalServiceRegistration>{service("a", "1")});
  // The pruned table was written back: the file alone no longer names b.
  const lmo::Value file = readPropertyListFile(dir.file("services.plist")).value();
  EXPECT_EQ(file.getIfDictionary()->get("services").getIfArray()->size(), 1u);
}

TEST(ServiceManager, AnUnreadableTableStartsEmptyAndIsReplacedAtTheNextChange) {
  testing::TempDir dir;
  dir.write("services.plist",
            "<plist><dict><key>formatVersion</key><integer>1</integer><key>services</key><array>"
            "<dict><key>bundleIdentifier</key><string>a</string></dict></array></dict></plist>");
  base::LogCapture log;
  ServiceManager manager(dir.path().string());
  EXPECT_TRUE(manager.registrations().empty());
  EXPECT_EQ(log.lines().size(), 1u);
  ASSERT_TRUE(manager.registerExternalService(service("a", "1")).has_value());
  EXPECT_EQ(ServiceManager(dir.path().string()).registrations().size(), 1u);
}

TEST(ServiceManager, AFailedWriteChangesNothing) {
  testing::TempDir dir;
  ServiceManager manager(dir.path().string());
  ASSERT_TRUE(manager.registerExternalService(service("a", "1")).has_value());
  // A directory where the file should be: the rename over it fails.
  std::filesystem::remove(manager.path());
  std::filesystem::create_directory(manager.path());

  EXPECT_FALSE(manager.registerExternalService(service("b", "1")).has_value());
  const int result = remove(manager, "a", "1");
  EXPECT_NE(result, 0);
  EXPECT_NE(result, ESRCH);
  EXPECT_EQ(manager.registrations(), std::vector<ExternalServiceRegistration>{service("a", "1")});
}

}  // namespace
}  // namespace vantrel::platform
