#pragma once
// Process-wide notifications without payload. A notification is a file whose
// contents change on every post, so any process, in any language, can watch
// it with inotify (IN_MOVED_TO on the notify directory) and need not link us.

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "base/Result.h"

namespace vantrel::platform {

// Longest notification name: one file name, with room to spare in NAME_MAX
// (255) for the atomic writer's temporaries beside it.
inline constexpr size_t kMaxNotificationNameLength = 240;

// <runtimeDirectory()>/notify: where the counter files live.
std::string notificationDirectory();

// Posts a named notification without payload: atomically replaces
// <runtimeDirectory()>/notify/<name> with the next value of a 64-bit counter
// (decimal text + newline), so any process can watch it with inotify.
// Returns the new counter value. Posts from several threads or processes are
// serialised by an flock on <notify>/.lock and never lose an increment. A
// process's first post into a directory removes the temporaries that posts
// interrupted by a crash or a kill left there.
// Errors: the name is not a valid single path component (empty, ".", "..",
// contains '/' or NUL, or longer than kMaxNotificationNameLength): domain
// "POSIX", EINVAL; or I/O: domain "POSIX" with the errno. On error the counter
// is unchanged. With times, that many posts in one write: the counter moves
// by times, as if each had been made.
base::Result<uint64_t> postNotification(std::string_view name, uint64_t times = 1);

// The current counter of a notification; 0 when never posted, when the name is
// invalid, or when the file cannot be read or does not hold a number.
uint64_t notificationCount(std::string_view name);

}  // namespace vantrel::platform
