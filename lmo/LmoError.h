#pragma once
// Errors of the IPC layer: domain "LMO". Peers never see these objects; they
// explain in a log line why a connection was closed or a message not sent.

#include <cstdint>

#include "base/Error.h"
#include "base/Format.h"

namespace vantrel::lmo {

inline constexpr const char* kLmoErrorDomain = "LMO";

enum LmoErrorCode : int64_t {
  kLmoMalformed = 1,      // bytes that are not a valid frame or CBOR item
  kLmoLimitExceeded = 2,  // a size, depth or count above its bound
  kLmoTransport = 3,      // the socket itself failed
};

base::Error lmoError(int64_t code, std::string text);

template <typename... Args>
base::Error lmoErrorf(int64_t code, const char* fmt, const Args&... args) {
  return lmoError(code, base::format(fmt, args...));
}

}  // namespace vantrel::lmo
