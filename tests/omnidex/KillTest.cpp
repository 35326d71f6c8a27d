// The registry's database against SIGKILL: a child process reconciles a
// changing tree, or records consent answers, and is killed at varied
// instants. After every kill the database must open as the daemon opens it,
// pass SQLite's integrity check, and hold every consent answer the child saw
// acknowledged; a reconcile then brings it back to exactly what is on disk.

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <optional>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "omnidex/Omnidex.h"
#include "omnidex/Store.h"
#include "tests/omnidex/OmnidexFixtures.h"

namespace vantrel::omnidex {
namespace {

namespace fs = std::filesystem;
using testing::plugInInfo;
using testing::RegistryTree;
using testing::writeBundle;

constexpr int kKills = 8;
constexpr int kApps = 10;
constexpr int kPlugInsPerApp = 10;
constexpr int kServices = 8;
constexpr const char* kApplication = "com.kill.app";

std::string appPath(const RegistryTree& tree, int app) {
  return tree.apps() + "/App" + std::to_string(app) + ".app";
}

// Sequence numbers the child reports through a pipe: k once the k-th change
// was acknowledged.
class Child {
 public:
  // Runs body(report) in a forked child that never returns.
  template <typename Body>
  explicit Child(Body body) {
    int fds[2];
    if (::pipe2(fds, O_CLOEXEC) != 0) return;
    pid_ = ::fork();
    if (pid_ == 0) {
      ::close(fds[0]);
      body([fd = fds[1]](uint32_t k) { (void)!::write(fd, &k, sizeof k); });
      ::_exit(0);
    }
    ::close(fds[1]);
    read_ = fds[0];
  }
  ~Child() {
    if (read_ >= 0) ::close(read_);
  }
  bool started() const { return pid_ > 0; }
  // Kills the child after delay and returns the last number it reported.
  std::optional<uint32_t> killAfter(std::chrono::milliseconds delay) {
    std::this_thread::sleep_for(delay);
    ::kill(pid_, SIGKILL);
    int status = 0;
    ::waitpid(pid_, &status, 0);
    std::optional<uint32_t> last;
    for (uint32_t k; ::read(read_, &k, sizeof k) == static_cast<ssize_t>(sizeof k);) last = k;
    return last;
  }

 private:
  pid_t pid_ = -1;
  int read_ = -1;
};

// Opens the database as the daemon does and runs SQLite's integrity check.
std::shared_ptr<Omnidex> openChecked(const RegistryTree& tree, int round) {
  std::shared_ptr<Omnidex> registry = tree.open();
  if (!registry) return nullptr;
  sqlite3* db = nullptr;
  EXPECT_EQ(sqlite3_open_v2((tree.state() + "/" + kStoreFileName).c_str(), &db,
                            SQLITE_OPEN_READONLY, nullptr),
            SQLITE_OK)
      << round;
  sqlite3_stmt* check = nullptr;
  std::string verdict;
  if (sqlite3_prepare_v2(db, "PRAGMA integrity_check", -1, &check, nullptr) == SQLITE_OK &&
      sqlite3_step(check) == SQLITE_ROW) {
    verdict = reinterpret_cast<const char*>(sqlite3_column_text(check, 0));
  }
  sqlite3_finalize(check);
  sqlite3_close(db);
  EXPECT_EQ(verdict, "ok") << round;
  return registry;
}

TEST(DatabaseKill, AKilledReconcileLeavesADatabaseThatOpensAndRecovers) {
  RegistryTree tree;
  for (int app = 0; app < kApps; ++app) {
    writeBundle(appPath(tree, app), {{"KBBundleIdentifier", "com.kill.app" + std::to_string(app)}});
    for (int p = 0; p < kPlugInsPerApp; ++p) {
      writeBundle(appPath(tree, app) + "/PlugIns/P" + std::to_string(p) + ".appex",
                  plugInInfo("com.kill.p" + std::to_string(app) + "." + std::to_string(p),
                             "com.kill.point"));
    }
  }
  for (int round = 0; round < kKills; ++round) {
    // Every reconcile of the child has work to write: half the applications
    // leave or come back between two.
    Child child([&](const auto& report) {
      base::Result<std::shared_ptr<Omnidex>> opened = Omnidex::open(tree.config());
      if (!opened.has_value()) ::_exit(1);
      const std::shared_ptr<Omnidex> registry = opened.value();
      for (uint32_t k = 0;; ++k) {
        for (int app = 0; app < kApps; app += 2) {
          const std::string path = appPath(tree, app);
          const std::string away = tree.file("away/App" + std::to_string(app) + ".app");
          fs::create_directories(tree.file("away"));
          std::error_code ec;
          if (k % 2 == 0) {
            fs::rename(path, away, ec);
          } else {
            fs::rename(away, path, ec);
          }
        }
        registry->reconcile();
        report(k);
      }
    });
    ASSERT_TRUE(child.started());
    (void)child.killAfter(std::chrono::milliseconds(10 + 37 * round));

    std::shared_ptr<Omnidex> registry = openChecked(tree, round);
    ASSERT_TRUE(registry) << round;
    registry->reconcile();
    // Exactly the bundles on disk now, each once.
    std::set<std::string> onDisk, registered;
    for (const auto& entry : fs::recursive_directory_iterator(tree.apps())) {
      if (entry.path().extension() == ".appex") onDisk.insert(entry.path().string());
    }
    std::set<base::Uuid> uuids;
    const std::vector<PlugInRecordPtr> installed = registry->installedPlugIns().value();
    for (const PlugInRecordPtr& record : installed) {
      registered.insert(*record->bundlePath);
      uuids.insert(record->uuid);
    }
    EXPECT_EQ(registered, onDisk) << round;
    EXPECT_EQ(uuids.size(), onDisk.size()) << round;
  }
}

TEST(DatabaseKill, AcknowledgedConsentAnswersSurviveSigkill) {
  RegistryTree tree;
  // The answer service i was last acknowledged with; the one in flight at
  // the kill may also have been stored.
  std::vector<std::optional<bool>> acknowledged(kServices);
  uint32_t next = 0;
  const auto serviceOf = [](uint32_t k) {
    return "com.kill.service" + std::to_string(k % kServices);
  };
  const auto answerOf = [](uint32_t k) { return (k / kServices) % 2 == 0; };
  for (int round = 0; round < kKills; ++round) {
    const uint32_t first = next;
    Child child([&](const auto& report) {
      base::Result<std::shared_ptr<Omnidex>> opened = Omnidex::open(tree.config());
      if (!opened.has_value()) ::_exit(1);
      const std::shared_ptr<Omnidex> registry = opened.value();
      for (uint32_t k = first;; ++k) {
        const base::Result<void> stored = answerOf(k)
                                              ? registry->grantConsent(kApplication, serviceOf(k))
                                              : registry->revokeConsent(kApplication, serviceOf(k));
        if (!stored.has_value()) ::_exit(2);
        report(k);
      }
    });
    ASSERT_TRUE(child.started());
    const std::optional<uint32_t> last =
        child.killAfter(std::chrono::milliseconds(10 + 23 * round));
    const uint32_t inFlight = last ? *last + 1 : first;
    for (uint32_t k = first; last && k <= *last; ++k) acknowledged[k % kServices] = answerOf(k);

    std::shared_ptr<Omnidex> registry = openChecked(tree, round);
    ASSERT_TRUE(registry) << round;
    const std::vector<ConsentEntry> entries =
        registry->privacyConsentEntries(kApplication).value_or(std::vector<ConsentEntry>());
    for (uint32_t i = 0; i < kServices; ++i) {
      const auto found = std::find_if(entries.begin(), entries.end(), [&](const ConsentEntry& e) {
        return e.service == serviceOf(i);
      });
      const std::optional<bool> stored =
          found == entries.end() ? std::nullopt : std::optional<bool>(found->granted);
      if (inFlight % kServices == i && stored == answerOf(inFlight)) {
        acknowledged[i] = stored;  // stored; only its acknowledgement was lost
      } else {
        EXPECT_EQ(stored, acknowledged[i]) << round << " service " << i;
      }
    }
    next = inFlight + 1;
  }
}

}  // namespace
}  // namespace vantrel::omnidex
