#include "platform/Digest.h"

#include <openssl/evp.h>
#include <openssl/hmac.h>

#include <climits>

#include "base/Check.h"

namespace vantrel::platform {

Sha1Digest sha1(const void* data, size_t size) {
  static const uint8_t kEmpty = 0;
  Sha1Digest digest{};
  unsigned int length = 0;
  const int ok =
      EVP_Digest(size == 0 ? &kEmpty : data, size, digest.data(), &length, EVP_sha1(), nullptr);
  // Only an allocation failure inside libcrypto can make a one-shot digest fail.
  VT_CHECK(ok == 1 && length == digest.size(), "SHA-1 digest failed");
  return digest;
}

HmacSha256 hmacSha256(std::string_view key, std::string_view data) {
  VT_CHECK(key.size() <= INT_MAX, "HMAC key too long");
  static const uint8_t kEmpty = 0;
  HmacSha256 mac{};
  unsigned int length = 0;
  const auto* bytes = data.empty() ? &kEmpty : reinterpret_cast<const uint8_t*>(data.data());
  const void* keyBytes = key.empty() ? static_cast<const void*>(&kEmpty) : key.data();
  const uint8_t* result = HMAC(EVP_sha256(), keyBytes, static_cast<int>(key.size()), bytes,
                               data.size(), mac.data(), &length);
  VT_CHECK(result != nullptr && length == mac.size(), "HMAC-SHA256 failed");
  return mac;
}

std::string hexString(const uint8_t* data, size_t size) {
  static const char kDigits[] = "0123456789abcdef";
  std::string text(size * 2, '0');
  for (size_t i = 0; i < size; ++i) {
    text[2 * i] = kDigits[data[i] >> 4];
    text[2 * i + 1] = kDigits[data[i] & 0xf];
  }
  return text;
}

}  // namespace vantrel::platform
