// The annotation store against SIGKILL: the real vantreld is killed at varied
// instants while a client changes elections, and after every kill the file
// must load as the daemon loads it and hold every change the client saw
// acknowledged. The daemon is then started again on the same state, so it
// also opens a registry database whose process was killed, some kills landing
// in its start-up (opening the database, reconciling the bundles).

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <optional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "lmo/Frame.h"
#include "lmo/Protocol.h"
#include "platform/AtomicFile.h"
#include "registry/VTDAnnotationStore.h"
#include "tests/omnidex/OmnidexFixtures.h"
#include "tests/support/PeerProcess.h"
#include "tests/support/RawClient.h"
#include "tests/support/TempDir.h"

namespace vantrel::daemon {
namespace {

using namespace std::chrono_literals;
using lmo::Dictionary;
using lmo::Value;
using vantrel::testing::PeerProcess;

constexpr int kPlugIns = 4;
constexpr int kKills = 10;

std::string identifierOf(int plugIn) {
  return "com.crash.p" + std::to_string(plugIn);
}

// One blocking connection: a request out, its reply back. Any failure (the
// daemon was killed) leaves it unusable and every later call null.
using Client = vantrel::testing::RawClient;

int64_t electionOf(const std::map<std::string, int64_t>& elections, const std::string& identifier) {
  const auto found = elections.find(identifier);
  return found == elections.end() ? 0 : found->second;
}

class CrashSafety : public ::testing::Test {
 protected:
  CrashSafety() {
    omnidex::testing::writeBundle(tmp_.file("apps/Host.app"),
                                  {{"KBBundleIdentifier", "com.crash.host"}});
    for (int i = 0; i < kPlugIns; ++i) {
      omnidex::testing::writeBundle(
          tmp_.file("apps/Host.app/PlugIns/P" + std::to_string(i) + ".appex"),
          omnidex::testing::plugInInfo(identifierOf(i), "com.crash.point"));
    }
  }

  // vantreld on the test's tree, its standard error in a log file.
  std::unique_ptr<PeerProcess> start() {
    log_ = tmp_.file("vantreld-" + std::to_string(++started_) + ".log");
    std::vector<std::string> environment{"VANTREL_LOG=stderr", "LISTEN_PID=", "LISTEN_FDS="};
    for (const std::string entry :
         {"VANTREL_RUNTIME_DIR=run", "VANTREL_STATE_DIR=state", "VANTREL_APP_DIRS=apps",
          "VANTREL_PLUGIN_DIRS=plugins", "VANTREL_PREFERENCES_DIR=prefs", "VANTREL_SDK_DIRS=sdks",
          "VANTREL_SYSTEM_DIR=system", "XDG_STATE_HOME=xdg-state", "HOME=home"}) {
      const size_t value = entry.find('=') + 1;
      environment.push_back(entry.substr(0, value) + tmp_.file(entry.substr(value)));
    }
    return PeerProcess::start("/bin/bash",
                              {"-c", "exec 2>\"$1\"; shift; exec \"$0\" \"$@\"", VANTRELD_PATH,
                               log_, "-S", socket_, "-d", annotations_},
                              environment);
  }

  std::string logText() const {
    std::ostringstream text;
    text << std::ifstream(log_).rdbuf();
    return text.str();
  }

  // A connection once the daemon serves one, and the UUIDs of the plug-ins;
  // null (after a failure) when it does not serve in time.
  std::unique_ptr<Client> connect(std::map<std::string, Value>& uuids,
                                  std::map<std::string, int64_t>& served) {
    const auto deadline = std::chrono::steady_clock::now() + 30s;
    for (; std::chrono::steady_clock::now() < deadline; std::this_thread::sleep_for(20ms)) {
      auto client = std::make_unique<Client>(socket_);
      if (!client->connected()) continue;
      const std::optional<Dictionary> reply = client->call(protocol::kRequestMatch);
      const lmo::Array* forms = reply ? reply->get(protocol::kKeyMatches).getIfArray() : nullptr;
      if (forms == nullptr) continue;
      for (const Value& form : *forms) {
        const Dictionary& d = *form.getIfDictionary();
        const std::string identifier = lmo::describe(d.get(protocol::kFormIdentifier));
        const std::optional<base::Uuid> uuid =
            base::Uuid::parse(*d.get(protocol::kFormUuid).getIfString());
        if (uuid) uuids[identifier] = Value(*uuid);
        const Dictionary* annotations = d.get(protocol::kFormAnnotations).getIfDictionary();
        served[identifier] = annotations->get(protocol::kAnnotationElection).integerValue();
      }
      if (uuids.size() == kPlugIns) return client;
    }
    ADD_FAILURE() << "vantreld does not serve; its log:\n" << logText();
    return nullptr;
  }

  // The temporaries of interrupted writes in directory whose writer is gone.
  static int deadWritersTemporaries(const std::string& directory) {
    int count = 0;
    std::error_code ec;
    for (const auto& entry : std::filesystem::directory_iterator(directory, ec)) {
      const auto writer = platform::temporaryFileWriter(entry.path().filename().string());
      if (writer && ::kill(*writer, 0) != 0 && errno == ESRCH) ++count;
    }
    return count;
  }

  vantrel::testing::TempDir tmp_;
  std::string socket_ = tmp_.file("vantreld.socket");
  std::string annotations_ = tmp_.file("annotations/Annotations");
  std::string log_;
  int started_ = 0;
};

TEST_F(CrashSafety, AcknowledgedElectionsSurviveSigkill) {
  std::filesystem::create_directories(tmp_.file("annotations"));
  // The election each plug-in was last acknowledged with, and the one a
  // request in flight at the kill may have stored.
  std::map<std::string, int64_t> acknowledged;
  std::optional<std::pair<std::string, int64_t>> inFlight;
  int64_t nextElection = 1;
  int temporariesLeft = 0;

  for (int round = 0; round < kKills; ++round) {
    std::unique_ptr<PeerProcess> daemon = start();
    ASSERT_TRUE(daemon);
    const bool duringStartUp = round % 4 == 3;
    if (duringStartUp) {
      // Killed while it opens its state and reconciles the bundles.
      std::this_thread::sleep_for(std::chrono::milliseconds(5 * round));
    } else {
      std::map<std::string, Value> uuids;
      std::map<std::string, int64_t> served;
      std::unique_ptr<Client> client = connect(uuids, served);
      ASSERT_TRUE(client);
      // What the restarted daemon serves is what the file holds.
      for (int i = 0; i < kPlugIns; ++i) {
        EXPECT_EQ(served[identifierOf(i)], electionOf(acknowledged, identifierOf(i))) << round;
      }
      // The store removed what the killed daemon's saves left behind.
      EXPECT_EQ(deadWritersTemporaries(tmp_.file("annotations")), 0) << round;
      std::thread killer([&, delay = std::chrono::milliseconds(5 + 23 * round)] {
        std::this_thread::sleep_for(delay);
        daemon->kill();
      });
      bool first = true;
      for (int64_t k = 0;; ++k) {
        const std::string identifier = identifierOf(int(k % kPlugIns));
        inFlight = {identifier, nextElection++};
        const Dictionary change{{protocol::kAnnotationElection, Value::integer(inFlight->second)}};
        const std::optional<Dictionary> reply = client->call(
            protocol::kRequestAnnotate, {{protocol::kKeyAnnotations, change},
                                         {protocol::kKeyUuids, lmo::Array{uuids[identifier]}}});
        if (!reply) break;
        ASSERT_FALSE(reply->contains(protocol::kKeyErrorCode)) << lmo::describe(*reply);
        acknowledged[identifier] = inFlight->second;
        inFlight.reset();
        if (first) {
          // The notification center has started: the killed daemon's posts
          // left nothing behind.
          EXPECT_EQ(deadWritersTemporaries(tmp_.file("run/notify")), 0) << round;
          first = false;
        }
      }
      killer.join();
    }
    daemon->kill();
    daemon->wait();
    temporariesLeft += deadWritersTemporaries(tmp_.file("annotations"));

    // Loaded as the daemon loads it, without the clean-up its start does.
    registry::VTDAnnotationStore store;
    store.setAnnotationsURL(model::FileUrl::fromPath(annotations_));
    base::Error error;
    if (!store.loadDb(&error)) {
      // No file is right only while nothing has been saved.
      ASSERT_EQ(error.code, registry::kFileNotFoundErrorCode)
          << round << ": " << error.description();
      ASSERT_TRUE(acknowledged.empty()) << round;
    }
    for (int i = 0; i < kPlugIns; ++i) {
      const std::string identifier = identifierOf(i);
      const auto annotation = store.annotationForIdentifier(identifier);
      const int64_t stored =
          annotation ? annotation->get(protocol::kAnnotationElection).integerValue() : 0;
      if (inFlight && inFlight->first == identifier && stored == inFlight->second) {
        acknowledged[identifier] = stored;  // saved; only its reply was lost
      } else {
        EXPECT_EQ(stored, electionOf(acknowledged, identifier)) << round << " " << identifier;
      }
    }
    inFlight.reset();
  }
  // Not every kill lands inside a save; the count only says how many did.
  RecordProperty("temporaries_left_by_kills", temporariesLeft);
}

}  // namespace
}  // namespace vantrel::daemon
