#pragma once
// The outstanding-work marker: a process-wide count of work in progress that
// must finish before the process may be stopped. A service manager (or the
// daemon's own idle logic) reads it; nothing here stops the process.

#include <cstdint>

namespace vantrel::lmo {

class OutstandingWork {
 public:
  // Raises the count by one.
  static void begin();
  // Lowers it by one; ending more than was begun stops the process.
  static void end();
  static uint64_t count();
};

// Holds one unit of outstanding work for its lifetime.
class OutstandingWorkScope {
 public:
  OutstandingWorkScope() { OutstandingWork::begin(); }
  ~OutstandingWorkScope() { OutstandingWork::end(); }
  OutstandingWorkScope(const OutstandingWorkScope&) = delete;
  OutstandingWorkScope& operator=(const OutstandingWorkScope&) = delete;
};

}  // namespace vantrel::lmo
