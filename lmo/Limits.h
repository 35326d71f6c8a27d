#pragma once
// Every bound the IPC layer puts on what a peer can make this process hold.
// docs/protocol.md lists them with what a peer sees when it hits one.

#include <chrono>
#include <cstddef>

namespace vantrel::lmo {

// The largest frame (header plus body) a peer may send or receive.
inline constexpr size_t kMaxFrameLength = 16 * 1024 * 1024;
// Arrays and maps may nest this deep in a body; a top-level map is at depth 1.
inline constexpr int kMaxCborDepth = 64;

// Open connections beyond which new peers are accepted and closed at once.
inline constexpr size_t kMaxOpenConnections = 4096;
// Of those, the ones kept for root and for this process's own user, so that
// the administrator and the daemon's user can always connect.
inline constexpr size_t kReservedConnections = 64;
// Connections one other user may hold at once: taking every slot takes
// several users.
inline constexpr size_t kMaxConnectionsPerUser = 512;

// Unsent output a peer may leave queued before it is disconnected.
inline constexpr size_t kMaxPendingOutput = 64 * 1024 * 1024;

// Requests received on one connection whose replies have not been written
// out yet (and messages not yet handled), past which the connection is not
// read: a peer that pipelines without reading its replies waits on its own
// socket buffers instead of growing this process's queues or its output.
// Reading resumes below the bound.
inline constexpr size_t kMaxUnansweredRequests = 64;

// Once a frame has begun, the rest must arrive within this time; a peer
// that stalls mid-frame is disconnected.
inline constexpr std::chrono::seconds kFrameDeadline{10};
// Bytes of unfinished frames held for all peers together; a peer whose
// input would pass it is disconnected.
inline constexpr size_t kMaxUnfinishedInput = 64 * 1024 * 1024;

}  // namespace vantrel::lmo
