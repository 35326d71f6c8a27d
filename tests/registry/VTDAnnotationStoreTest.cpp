#include "registry/VTDAnnotationStore.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "base/Log.h"
#include "platform/AtomicFile.h"
#include "platform/PropertyList.h"
#include "tests/registry/RegistryFixtures.h"

namespace vantrel::registry {
namespace {

using lmo::Dictionary;
using lmo::Value;
using testing::election;

class VTDAnnotationStoreTest : public testing::RegistryTest {
 protected:
  std::string file() const { return tmp_.file("Annotations"); }
  VTDPlugInPtr a_ = VTDPlugIn::initWithOXData(testing::record("com.x.a"));
};

TEST_F(VTDAnnotationStoreTest, LoadResetAndSave) {
  // {file contents (none: no file), start of the logged error (none: no log)}
  const std::pair<std::optional<std::string>, std::optional<std::string>> cases[] = {
      {std::nullopt, std::nullopt},
      {"<plist><dict><key>version</key><integer>15</integer><key>data</key><dict><key>k</key>"
       "<dict/></dict></dict></plist>",
       "found database version 15 needed version 16"},
      {"not a property list", "not a valid property list"},
      {"<plist><dict><key>version</key><integer>16</integer><key>data</key><string>x</string>"
       "</dict></plist>",
       std::nullopt},
  };
  for (const auto& [contents, logged] : cases) {
    std::filesystem::remove(file());
    if (contents) tmp_.write("Annotations", *contents);
    base::LogCapture log;
    auto store = VTDAnnotationStore::initWithDatabase(file());
    EXPECT_TRUE(store->annotations().empty());
    ASSERT_EQ(log.lines().size(), logged ? 1u : 0u);
    if (logged) {
      EXPECT_TRUE(log.lines()[0].starts_with("unable to load annotation database:file://" + file() +
                                             " error:" + *logged));
      EXPECT_TRUE(log.lines()[0].ends_with(" (resetting)"));
    }
    store->setAnnotation(election(1), *a_);
    EXPECT_EQ(platform::readPropertyListFile(file()).value(),
              Value(Dictionary{{"version", Value::integer(16)},
                               {"data", Dictionary{{"com.x.a", election(1)}}}}));
  }
}

TEST_F(VTDAnnotationStoreTest, MergeRemoveSharedKeysAndFailedSave) {
  auto store = VTDAnnotationStore::initWithDatabase(file());
  const Dictionary extension{{"client", "data"}};
  store->setAnnotation(election(1).setting("other", "o"), *a_);
  store->setAnnotation(election(2).setting(protocol::kAnnotationExtension, extension), *a_);
  EXPECT_EQ(store->annotationForPlugIn(*a_),
            election(2).setting(protocol::kAnnotationExtension, extension).setting("other", "o"));
  store->setAnnotation(std::nullopt, *a_);
  EXPECT_EQ(store->annotationForPlugIn(*a_), std::nullopt);

  const Dictionary replaces{{"com.karvo.developer.replace-plugin", "com.x.old"}};
  store->setAnnotation(election(1),
                       *VTDPlugIn::initWithOXData(testing::record("com.x.one", replaces)));
  auto second = VTDPlugIn::initWithOXData(testing::record("com.x.two", replaces));
  EXPECT_EQ(store->annotationForPlugIn(*second), election(1));
  EXPECT_EQ(VTDAnnotationStore::initWithDatabase(file())->annotations(),
            (Dictionary{{"com.x.old", election(1)}}));

  // The path is the file itself: its missing directory is not made, so every
  // save fails (a read-only directory would not stop root).
  const std::string path = tmp_.file("missing/Annotations");
  store = VTDAnnotationStore::initWithDatabase(path);
  base::LogCapture log;
  store->setAnnotation(election(3), *a_);
  EXPECT_EQ(store->annotationForPlugIn(*a_), election(3));
  ASSERT_EQ(log.lines().size(), 1u);
  EXPECT_TRUE(log.lines()[0].starts_with("unable to save annotations:file://" + path + " error:"));
}

TEST_F(VTDAnnotationStoreTest, OpeningRemovesTheTemporariesOfInterruptedSaves) {
  // This process's own, which no save in progress uses, as a crashed daemon
  // with this pid would have left them; and another file's, which stays.
  const std::string temporary = "." + std::string("Annotations") +
                                std::string(platform::kTemporaryFileMarker) +
                                std::to_string(::getpid()) + "-999999";
  const std::string othersTemporary = ".Other" + std::string(platform::kTemporaryFileMarker) +
                                      std::to_string(::getpid()) + "-999999";
  tmp_.write(temporary, "<plist");
  tmp_.write(othersTemporary, "<plist");
  auto store = VTDAnnotationStore::initWithDatabase(file());
  EXPECT_FALSE(std::filesystem::exists(tmp_.file(temporary)));
  EXPECT_TRUE(std::filesystem::exists(tmp_.file(othersTemporary)));
  const mode_t saved = ::umask(0);
  store->setAnnotation(election(1), *a_);
  ::umask(saved);
  struct stat st {};
  EXPECT_TRUE(::stat(file().c_str(), &st) == 0 && (st.st_mode & 07777) == 0600);
}

TEST_F(VTDAnnotationStoreTest, DefaultLocation) {
  const std::string dir = tmp_.file("xdg/com.karvo.vantrel");
  EXPECT_EQ(VTDAnnotationStore::initWithDatabase(std::nullopt)->annotationsURL().path(),
            dir + "/Annotations");
  struct stat st {};
  EXPECT_TRUE(::stat(dir.c_str(), &st) == 0 && (st.st_mode & 07777) == 0700);
  // HOME stands in for a relative XDG_STATE_HOME; with neither, or a path too
  // long for the buffer, the daemon stops.
  ::setenv("XDG_STATE_HOME", "relative", 1);
  ::setenv("HOME", tmp_.file("home").c_str(), 1);
  EXPECT_EQ(VTDAnnotationStore::defaultDatabaseURL().path(),
            tmp_.file("home") + "/.local/state/com.karvo.vantrel/Annotations");
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  ::setenv("HOME", "", 1);
  EXPECT_DEATH(VTDAnnotationStore::defaultDatabaseURL(), "user directory: errno 2");
  ::setenv("XDG_STATE_HOME", ("/" + std::string(1022, 'x')).c_str(), 1);
  EXPECT_DEATH(VTDAnnotationStore::defaultDatabaseURL(), "user directory: errno 36");
}

}  // namespace
}  // namespace vantrel::registry
