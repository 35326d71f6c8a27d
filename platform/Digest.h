#pragma once
// Message digests and MACs, through OpenSSL's libcrypto.

#include <array>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace vantrel::platform {

using Sha1Digest = std::array<uint8_t, 20>;
using HmacSha256 = std::array<uint8_t, 32>;

// SHA-1 of size bytes at data (data may be null when size is 0).
Sha1Digest sha1(const void* data, size_t size);

// HMAC-SHA256 of data under key.
HmacSha256 hmacSha256(std::string_view key, std::string_view data);

// Lower-case hexadecimal, two digits per byte.
std::string hexString(const uint8_t* data, size_t size);

}  // namespace vantrel::platform
