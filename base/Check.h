#pragma once
// Internal-consistency checks. A broken invariant is a bug in this program, not
// a condition to report to a peer: the process stops with a message naming the
// invariant, so that the fault is found where it happens.

namespace vantrel::base {

// Writes "internal inconsistency: <what> (<file>:<line>)" to the system log and
// to standard error, then aborts. Never returns.
[[noreturn]] void internalInconsistency(const char* what, const char* file, int line);

}  // namespace vantrel::base

// VT_CHECK(cond, "text"): stops the process with "text" when cond is false.
#define VT_CHECK(cond, what)                                              \
  do {                                                                    \
    if (!(cond)) [[unlikely]]                                             \
      ::vantrel::base::internalInconsistency((what), __FILE__, __LINE__); \
  } while (0)
