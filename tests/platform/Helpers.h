#pragma once
// What several platform tests share: environment variables set for a scope,
// property lists as bytes, file metadata, and bundles whose executable is a
// copy of the test peer.

#include <gtest/gtest.h>
#include <plist/plist.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <initializer_list>
#include <iterator>
#include <memory>
#include <optional>
#include <string>
#include <utility>

#include "platform/AtomicFile.h"
#include "tests/support/PeerProcess.h"
#include "tests/support/ScopedEnvironment.h"
#include "tests/support/TempDir.h"

namespace vantrel::platform {

using vantrel::testing::ScopedEnvironment;

inline std::string xmlPlist(const std::string& body) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">" + body + "</plist>";
}

// An XML property list holding one dictionary of strings.
inline std::string stringsPlist(std::initializer_list<std::pair<std::string, std::string>> dict) {
  std::string body = "<dict>";
  for (const auto& [key, value] : dict)
    body += "<key>" + key + "</key><string>" + value + "</string>";
  return xmlPlist(body + "</dict>");
}

// libplist's own binary form of root, which it frees.
inline std::string libplistBinary(plist_t root) {
  char* bytes = nullptr;
  uint32_t length = 0;
  plist_to_bin(root, &bytes, &length);
  std::string out(bytes, length);
  plist_to_bin_free(bytes);
  plist_free(root);
  return out;
}

// stat(2) of path; zeroed, with a test failure, when there is nothing there.
inline struct stat statOf(const std::string& path) {
  struct stat st {};
  EXPECT_EQ(::stat(path.c_str(), &st), 0) << path;
  return st;
}

inline mode_t modeOf(const std::string& path) {
  return statOf(path).st_mode & 07777;
}

inline std::string contentsOf(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), {});
}

inline long entryCount(const std::filesystem::path& dir) {
  return std::distance(std::filesystem::directory_iterator(dir),
                       std::filesystem::directory_iterator());
}

inline constexpr const char* kPeerExecutableName = "peer";

// A bundle at tmp/relative whose executable is a copy of the test peer;
// returns the executable's path.
inline std::string makePeerBundle(const testing::TempDir& tmp, const std::string& relative,
                                  const std::string& identifier) {
  tmp.write(relative + "/Info.plist", stringsPlist({{"KBBundleExecutable", kPeerExecutableName},
                                                    {"KBBundleIdentifier", identifier}}));
  const std::string exe = tmp.file(relative + "/" + kPeerExecutableName);
  EXPECT_TRUE(testing::installTestPeer(exe)) << exe;
  return exe;
}

// The peer at exe in "sleep" mode, once it has said it runs (so that its
// /proc entry shows the peer and not the test that started it); null after
// a test failure when it does not start.
inline std::unique_ptr<testing::PeerProcess> startSleepingPeer(const std::string& exe) {
  std::unique_ptr<testing::PeerProcess> peer = testing::PeerProcess::start(exe, {"sleep"});
  if (!peer || peer->readLine() != std::optional<std::string>("ready")) {
    ADD_FAILURE() << exe << " did not start";
    return nullptr;
  }
  return peer;
}

// The pid of a process that has exited and been reaped.
inline pid_t deadPid() {
  const pid_t child = ::fork();
  if (child == 0) ::_exit(0);
  ::waitpid(child, nullptr, 0);
  return child;
}

// The name writeFileAtomically gives its temporaries.
inline std::string temporaryOf(const std::string& file, pid_t pid, int sequence) {
  return "." + file + std::string(kTemporaryFileMarker) + std::to_string(pid) + "-" +
         std::to_string(sequence);
}

}  // namespace vantrel::platform
