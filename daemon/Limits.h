#pragma once
// Every bound the daemon puts on what one request, or one client, can make it
// do or keep. Each is far above what a real host asks for, and low enough
// that the largest request allowed is answered in well under a second and
// its reply fits in one frame. docs/protocol.md lists them with what a peer
// sees when it hits one; the texts below are those answers.

#include <cstddef>

#include "lmo/Limits.h"
#include "platform/SandboxExtensionService.h"

namespace vantrel::daemon {

// Compat: canonical paths this long or longer are treated as unresolvable,
// as a fixed buffer of that size would.
inline constexpr size_t kMaxCanonicalPathBytes = 1024;

// Paths in one "add", "remove" or "lock": each "add" reads a bundle and
// writes the registry.
inline constexpr size_t kMaxPathsPerRequest = 1024;
// UUIDs in one "ready", "access" or "annotate", and tokens in one release.
inline constexpr size_t kMaxUuidsPerRequest = 1024;
// Keys in a match request's "rules".
inline constexpr size_t kMaxRuleKeys = 256;
// Elements in one array pattern of a rule (and items in one dictionary
// pattern): each is tried against every candidate.
inline constexpr size_t kMaxPatternElements = 1024;

// Holds one client may keep at once (a "lock" with no paths is one too).
inline constexpr size_t kMaxHoldsPerClient = 64;
// Holds kept at once for every client together: every "ready" and match
// looks through them.
inline constexpr size_t kMaxHolds = 4096;

// One plug-in's "extension" annotation, measured as its encoding on the wire.
inline constexpr size_t kMaxExtensionAnnotationBytes = 64 * 1024;
// Plug-ins with an annotation the store keeps: every election change
// rewrites the whole file.
inline constexpr size_t kMaxAnnotations = 16384;

// Per-item log lines ("add" and "remove" paths, "annotate" elections) one
// request writes before the rest are summed up in one line.
inline constexpr size_t kMaxItemLogLinesPerRequest = 8;

// Lines one connection's messages and requests may make the daemon log: a
// burst, then this many a second; the lines over it are counted in one
// "<n> log lines of client <pid> suppressed" line. Info-level lines of -v
// are not counted.
inline constexpr size_t kPeerLogLinesBurst = 100;
inline constexpr size_t kPeerLogLinesPerSecond = 10;

// An "access" reply carries one token per UUID, each at most
// kMaxSandboxTokenLength long; with room for the rest of the reply, the
// largest allowed one fits in a frame.
inline constexpr size_t kAccessReplyOverheadPerUuid = 64;
static_assert(kMaxUuidsPerRequest *
                      (platform::kMaxSandboxTokenLength + kAccessReplyOverheadPerUuid) <
                  lmo::kMaxFrameLength - 4096,
              "an access reply for kMaxUuidsPerRequest plug-ins must fit in a frame");

// What a peer is told (code protocol::kErrorBadRequest unless noted).
// "too many <what>: <given> (the limit is <limit>)", where what is the
// request's key ("paths", "uuids") or one of the names below.
inline constexpr const char* kTooManyFormat = "too many %s: %u (the limit is %u)";
inline constexpr const char* kRuleKeysName = "rule keys";
inline constexpr const char* kPatternElementsName = "pattern elements";
// code protocol::kErrorAccessDenied
inline constexpr const char* kHoldsPerClientFormat =
    "hold refused: this client keeps %u holds (the limit is %u)";
inline constexpr const char* kHoldsFormat = "hold refused: %u holds are kept (the limit is %u)";
inline constexpr const char* kExtensionTooLargeFormat =
    "annotation extension of %u bytes exceeds the limit of %u";
inline constexpr const char* kTooManyAnnotationsFormat =
    "annotation refused: the store keeps %u annotations (the limit is %u)";

}  // namespace vantrel::daemon
