#include "platform/DeviceRestrictions.h"

#include <cmath>
#include <limits>
#include <memory>
#include <mutex>

#include "lmo/Value.h"
#include "platform/Preferences.h"

namespace vantrel::platform {
namespace {

// The restrictions domain for the current preferences location. One object
// is kept, so that an unreadable file is logged once per version rather than
// at every check; it is replaced when the location changed (the environment
// that names the preferences directory, or the host name).
std::shared_ptr<Preferences> restrictionsDomain() {
  struct Cache {
    std::mutex mutex;
    std::shared_ptr<Preferences> domain;  // Guarded by mutex.
  };
  // Never destroyed: a check may still run on another thread during exit.
  static Cache* const cache = new Cache();
  auto fresh = std::make_shared<Preferences>(kRestrictionsDomain);
  std::lock_guard lock(cache->mutex);
  if (!cache->domain || cache->domain->path() != fresh->path()) cache->domain = std::move(fresh);
  return cache->domain;
}

std::optional<int64_t> ratingOf(const lmo::Value& value) {
  if (std::optional<int64_t> exact = value.getIfInt64()) return exact;
  if (value.getIfUInt64()) return std::numeric_limits<int64_t>::max();
  if (const double* real = value.getIfReal()) {
    if (std::isnan(*real)) return std::nullopt;
    // 2^63 is exactly representable; every double below it converts.
    constexpr double kLimit = 9223372036854775808.0;
    if (*real >= kLimit) return std::numeric_limits<int64_t>::max();
    if (*real < -kLimit) return std::numeric_limits<int64_t>::min();
    return static_cast<int64_t>(std::trunc(*real));
  }
  return std::nullopt;
}

}  // namespace

namespace {

// This thread's DeviceRestrictionsReadOnce: whether one is open, and the
// answer once read.
struct ReadOnce {
  bool active = false;
  std::optional<std::optional<int64_t>> rating;
};
thread_local ReadOnce tlsReadOnce;

std::optional<int64_t> readMaximumApplicationRating() {
  std::shared_ptr<Preferences> domain = restrictionsDomain();
  domain->synchronize();
  return ratingOf(domain->valueForKey(kMaxApplicationRatingKey));
}

}  // namespace

std::optional<int64_t> maximumApplicationRating() {
  if (!tlsReadOnce.active) return readMaximumApplicationRating();
  if (!tlsReadOnce.rating) tlsReadOnce.rating = readMaximumApplicationRating();
  return *tlsReadOnce.rating;
}

DeviceRestrictionsReadOnce::DeviceRestrictionsReadOnce() : outermost_(!tlsReadOnce.active) {
  if (outermost_) tlsReadOnce.active = true;
}

DeviceRestrictionsReadOnce::~DeviceRestrictionsReadOnce() {
  if (outermost_) tlsReadOnce = ReadOnce{};
}

base::Result<void> setMaximumApplicationRating(std::optional<int64_t> rating) {
  return restrictionsDomain()->setValue(kMaxApplicationRatingKey,
                                        rating ? lmo::Value::integer(*rating) : lmo::Value());
}

}  // namespace vantrel::platform
