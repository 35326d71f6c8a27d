#pragma once
// Bundles that hold a copy of the test peer, and peers started from them.

#include <gtest/gtest.h>

#include <memory>
#include <string>

#include "tests/support/PeerProcess.h"
#include "tests/support/TempDir.h"

namespace vantrel::platform {

inline constexpr const char* kPeerExecutableName = "peer";

inline std::string peerInfoPlist(const std::string& identifier) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
         "<plist version=\"1.0\"><dict>\n"
         "<key>KBBundleExecutable</key><string>" +
         std::string(kPeerExecutableName) +
         "</string>\n"
         "<key>KBBundleIdentifier</key><string>" +
         identifier + "</string>\n</dict></plist>\n";
}

// A bundle at tmp/relative whose executable is a copy of the test peer;
// returns the executable's path.
inline std::string makePeerBundle(const testing::TempDir& tmp, const std::string& relative,
                                  const std::string& identifier) {
  tmp.write(relative + "/Info.plist", peerInfoPlist(identifier));
  const std::string exe = tmp.file(relative + "/" + kPeerExecutableName);
  EXPECT_TRUE(testing::installTestPeer(exe)) << exe;
  return exe;
}

// The peer at exe in "sleep" mode, once it has said it runs (so that its
// /proc entry shows the peer and not the test that started it); null after
// a test failure when it does not start.
inline std::unique_ptr<testing::PeerProcess> startSleepingPeer(const std::string& exe) {
  std::unique_ptr<testing::PeerProcess> peer = testing::PeerProcess::start(exe, {"sleep"});
  if (!peer) {
    ADD_FAILURE() << "cannot start " << exe;
    return nullptr;
  }
  if (peer->readLine() != std::optional<std::string>("ready")) {
    ADD_FAILURE() << exe << " did not become ready";
    return nullptr;
  }
  return peer;
}

}  // namespace vantrel::platform
