#pragma once
// vantrelctl's exit statuses, the part of its interface that scripts test.

namespace vantrel::ctl {

// The command did what it was asked (for "why": an explanation was produced,
// whether or not the plug-in is offered).
inline constexpr int kExitOk = 0;
// The daemon refused a request, or a named plug-in does not resolve to one
// registration.
inline constexpr int kExitRefused = 1;
// Unknown command or option, a missing or malformed argument.
inline constexpr int kExitUsage = 2;
// The daemon cannot be reached, went away, or did not answer in time.
inline constexpr int kExitUnreachable = 3;

}  // namespace vantrel::ctl
