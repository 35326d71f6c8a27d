#include "platform/SandboxExtensionService.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <set>
#include <thread>
#include <vector>

#include "tests/platform/Helpers.h"

namespace vantrel::platform {
namespace {

class SandboxExtension : public ::testing::Test {
 protected:
  std::string secretFile() const { return stateDir_ + "/" + kSandboxSecretFileName; }
  // Consumes token and returns what reading the handle's descriptor gives.
  std::string readThrough(const std::string& token) {
    const int64_t handle = sandbox_extension_consume(token);
    EXPECT_GE(handle, 3);
    if (handle < 0) return "(consume failed)";
    char buffer[256];
    const ssize_t n = ::pread(sandbox_extension_descriptor(handle), buffer, sizeof buffer, 0);
    EXPECT_EQ(sandbox_extension_release(handle), 0);
    return n < 0 ? "(read failed)" : std::string(buffer, static_cast<size_t>(n));
  }

  vantrel::testing::TempDir dir_;
  // Each test gets its own state directory, and so its own secret.
  const std::string stateDir_ = dir_.file("state");
  ScopedEnvironment stateDirectory_{"VANTREL_STATE_DIR", stateDir_};
};

TEST_F(SandboxExtension, IssuedTokenOpensThePathReadOnly) {
  const std::string file = dir_.write("data/some file;%\n.txt", "payload");
  auto token = sandbox_extension_issue_file(file);
  ASSERT_TRUE(token.has_value()) << strerror(errno);
  for (char c : *token) EXPECT_TRUE(c > ' ' && c < 0x7f) << *token;
  EXPECT_EQ(readThrough(*token), "payload");

  const int64_t handle = sandbox_extension_consume(*token);  // a token may be used again
  ASSERT_GE(handle, 3);
  EXPECT_EQ(::write(sandbox_extension_descriptor(handle), "x", 1), -1);  // read-only
  EXPECT_EQ(sandbox_extension_release(handle), 0);
  EXPECT_EQ(sandbox_extension_descriptor(handle), -1);
  errno = 0;
  EXPECT_EQ(sandbox_extension_release(handle), -1);
  EXPECT_EQ(errno, EBADF);
  EXPECT_EQ(sandbox_extension_release(0), -1);  // never ours: standard input stays open

  auto dirToken = sandbox_extension_issue_file(dir_.file("data"));
  ASSERT_TRUE(dirToken.has_value());
  const int64_t dirHandle = sandbox_extension_consume(*dirToken);
  EXPECT_GE(dirHandle, 3);
  EXPECT_EQ(sandbox_extension_release(dirHandle), 0);
}

TEST_F(SandboxExtension, RefusesMalformedAndForgedTokens) {
  const std::string file = dir_.write("f", "x");
  const std::string other = dir_.write("g", "y");
  const std::string token = sandbox_extension_issue_file(file).value();
  std::string foreign;  // made with another installation's secret
  {
    ScopedEnvironment otherInstallation("VANTREL_STATE_DIR", dir_.file("other-state"));
    foreign = sandbox_extension_issue_file(file).value();
  }
  // "1;<32 hex>;<64 hex>;<path>"
  const size_t macAt = 2 + 32 + 1, pathAt = macAt + 64 + 1;
  auto flipped = [&](size_t at) {
    std::string t = token;
    t[at] = t[at] == '0' ? '1' : '0';
    return t;
  };
  const std::string cases[] = {
      "",
      token.substr(0, pathAt - 1),
      token.substr(0, token.size() - 1),  // the path shortened
      token.substr(0, pathAt) + other,    // the path changed
      flipped(macAt),
      flipped(2),  // the nonce
      "2" + token.substr(1),
      token.substr(0, pathAt) + "relative",
      token.substr(0, pathAt) + "/bad%G1",
      token.substr(0, pathAt) + "/nul%00",
      token + std::string(kMaxSandboxTokenLength, 'x'),
      foreign,
  };
  for (const std::string& forged : cases) {
    errno = 0;
    EXPECT_EQ(sandbox_extension_consume(forged), -1) << forged;
    EXPECT_EQ(errno, EINVAL) << forged;
  }
}

TEST_F(SandboxExtension, IssueFailsForPathsThatCannotBeRead) {
  errno = 0;
  EXPECT_FALSE(sandbox_extension_issue_file(dir_.file("missing")).has_value());
  EXPECT_EQ(errno, ENOENT);
  if (::geteuid() != 0) {  // root reads anything
    const std::string secretive = dir_.write("secretive", "x");
    ::chmod(secretive.c_str(), 0);
    errno = 0;
    EXPECT_FALSE(sandbox_extension_issue_file(secretive).has_value());
    EXPECT_EQ(errno, EACCES);
  }
  // A consumed path that has gone away reports the open's error.
  const std::string gone = dir_.write("gone", "x");
  const std::string token = sandbox_extension_issue_file(gone).value();
  std::filesystem::remove(gone);
  EXPECT_EQ(sandbox_extension_consume(token), -1);
  EXPECT_EQ(errno, ENOENT);
}

TEST_F(SandboxExtension, SecretIsPrivateMadeOnceAndReused) {
  const std::string file = dir_.write("f", "contents");
  // What a creation killed half-way left goes when the secret is made.
  ASSERT_EQ(::mkdir(stateDir_.c_str(), 0700), 0);
  const std::string leftover = stateDir_ + "/" + temporaryOf(kSandboxSecretFileName, deadPid(), 1);
  std::ofstream(leftover) << "partial";
  // Racing first uses agree on one secret.
  std::vector<std::string> tokens(8);
  std::vector<std::thread> threads;
  for (std::string& t : tokens) {
    threads.emplace_back([&t, &file] { t = sandbox_extension_issue_file(file).value_or(""); });
  }
  for (std::thread& t : threads) t.join();
  for (const std::string& t : tokens) EXPECT_EQ(readThrough(t), "contents");

  EXPECT_EQ(modeOf(secretFile()), 0600u);
  EXPECT_EQ(modeOf(stateDir_), 0700u);
  const std::string before = contentsOf(secretFile());
  EXPECT_EQ(before.size(), kSandboxSecretBytes);
  EXPECT_EQ(entryCount(stateDir_), 1);  // no temporaries left behind
  EXPECT_TRUE(sandbox_extension_issue_file(file).has_value());
  EXPECT_EQ(contentsOf(secretFile()), before);

  // The secret is kept in memory only while its file is unchanged: a new
  // one, even of the same size written in place, revokes earlier tokens.
  std::string other = before;
  other[0] = static_cast<char>(other[0] ^ 1);
  {
    std::ofstream rewrite(secretFile(), std::ios::binary | std::ios::trunc);
    rewrite << other;
  }
  EXPECT_EQ(sandbox_extension_consume(tokens[0]), -1);
  EXPECT_EQ(errno, EINVAL);
  ::unlink(secretFile().c_str());
  const std::string fresh = sandbox_extension_issue_file(file).value_or("");
  EXPECT_EQ(readThrough(fresh), "contents");
  EXPECT_NE(contentsOf(secretFile()), before);
  EXPECT_EQ(sandbox_extension_consume(tokens[1]), -1);

  // A secret that others can read could be used to forge: refuse it.
  ::chmod(secretFile().c_str(), 0644);
  EXPECT_FALSE(sandbox_extension_issue_file(file).has_value());
  EXPECT_EQ(errno, EACCES);
  EXPECT_EQ(sandbox_extension_consume(fresh), -1);
}

TEST_F(SandboxExtension, ABatchReadsTheSecretOnceAndNeverRepeatsANonce) {
  const std::string file = dir_.write("f", "contents");
  const std::string canonical = canonicalPath(file).value();
  std::set<std::string> tokens;
  {
    SandboxTokenBatch batch;
    // More tokens than one draw of nonces holds.
    for (int i = 0; i < 150; ++i) {
      tokens.insert(sandbox_extension_issue_canonical_file(canonical).value_or(""));
    }
    // The secret read at the batch's first token stands until it ends...
    const std::string before = contentsOf(secretFile());
    ::unlink(secretFile().c_str());
    const std::string late = sandbox_extension_issue_canonical_file(canonical).value_or("");
    EXPECT_FALSE(std::filesystem::exists(secretFile()));
    tokens.insert(late);
    // ...and a path that does not exist still gets no token.
    errno = 0;
    EXPECT_FALSE(sandbox_extension_issue_canonical_file(dir_.file("missing")).has_value());
    EXPECT_EQ(errno, ENOENT);
    std::ofstream(secretFile(), std::ios::binary) << before;
    ::chmod(secretFile().c_str(), 0600);
  }
  EXPECT_EQ(tokens.size(), 151u) << "a nonce came twice";
  for (const std::string& token : tokens) EXPECT_EQ(readThrough(token), "contents");
}

TEST_F(SandboxExtension, TokenForASymlinkNamesTheCanonicalTarget) {
  const std::string target = dir_.write("real/target", "through the link");
  std::filesystem::create_directory_symlink(dir_.file("real"), dir_.file("alias"));
  std::filesystem::create_symlink(dir_.file("alias/target"), dir_.file("link"));
  const std::string token = sandbox_extension_issue_file(dir_.file("link")).value();
  EXPECT_EQ(token.substr(token.rfind(';') + 1), target);
  // Moving the link does not move the token.
  std::filesystem::remove(dir_.file("link"));
  EXPECT_EQ(readThrough(token), "through the link");
}

}  // namespace
}  // namespace vantrel::platform
