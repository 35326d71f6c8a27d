#include "platform/Digest.h"

#include <gtest/gtest.h>

namespace vantrel::platform {
namespace {

template <size_t N>
std::string hex(const std::array<uint8_t, N>& bytes) {
  return hexString(bytes.data(), bytes.size());
}

TEST(Digest, Sha1MatchesFips180Vectors) {
  struct Case {
    std::string input, digest;
  } cases[] = {
      {"abc", "a9993e364706816aba3e25717850c26c9cd0d89d"},
      {"", "da39a3ee5e6b4b0d3255bfef95601890afd80709"},
      {"abcdbcdecdefdefgefghfghighijhijkijkljklmklmnlmnomnopnopq",
       "84983e441c3bd26ebaae4aa1f95129e5e54670f1"},
  };
  for (const Case& c : cases) EXPECT_EQ(hex(sha1(c.input.data(), c.input.size())), c.digest);
  EXPECT_EQ(hex(sha1(nullptr, 0)), cases[1].digest);
}

TEST(Digest, HmacSha256MatchesRfc4231Vectors) {
  struct Case {
    std::string key, data, mac;
  } cases[] = {
      {std::string(20, '\x0b'), "Hi There",
       "b0344c61d8db38535ca8afceaf0bf12b881dc200c9833da726e9376c2e32cff7"},
      {"Jefe", "what do ya want for nothing?",
       "5bdcc146bf60754e6a042426089575c75a003f089d2739839dec58b964ec3843"},
      // A key longer than the block size is hashed first.
      {std::string(131, '\xaa'), "Test Using Larger Than Block-Size Key - Hash Key First",
       "60e431591ee0b67f0d8a26aacbf5b77f8e0bc6213728c5140546040f0ee37f54"},
  };
  for (const Case& c : cases) EXPECT_EQ(hex(hmacSha256(c.key, c.data)), c.mac);
}

}  // namespace
}  // namespace vantrel::platform
