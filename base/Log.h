#pragma once
// The system log: one sink for every line the system writes.
//
// By default lines go to syslog(3) with the ident "vantreld". With the
// environment variable VANTREL_LOG=stderr they go to standard error instead
// (foreground runs, demos). Tests install a capturing sink (LogCapture) and
// assert on exact lines.

#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "base/Format.h"

namespace vantrel::base {

// syslog priorities, by number, so callers need not include <syslog.h>.
enum class LogLevel : int { kError = 3, kWarning = 4, kNotice = 5, kInfo = 6, kDebug = 7 };

using LogSink = std::function<void(LogLevel, std::string_view)>;

// Writes one already-built line. The text is never used as a format again.
void writeLog(LogLevel level, std::string_view line);

// vtlog("text with %@", args...): formats with base::format and writes the
// line at notice level. The lines that the model and registry write straight
// to the system log, whatever the daemon's verbosity, go through here.
template <typename... Args>
void vtlog(std::string_view fmt, const Args&... args) {
  writeLog(LogLevel::kNotice, format(fmt, args...));
}

// Replaces the process's sink; returns the previous one. An empty sink
// restores the default (syslog, or stderr under VANTREL_LOG=stderr).
LogSink setLogSink(LogSink sink);

// How many lines one source (a peer's connection) may make the log take: a
// burst, then a steady rate. A line over the budget is dropped and counted;
// the next line admitted is preceded by one saying how many were dropped,
// and so is the budget's end when lines were still being dropped. Shared by
// the threads that write on the source's behalf.
class LogBudget {
 public:
  using Clock = std::chrono::steady_clock;
  // label names the source in the "suppressed" line ("client 123").
  LogBudget(std::string label, size_t burst, size_t perSecond);
  ~LogBudget();
  LogBudget(const LogBudget&) = delete;
  LogBudget& operator=(const LogBudget&) = delete;

  // Charges one line at `now`. Returns whether it may be written; when it
  // may, *droppedBefore is how many lines were dropped since the last one
  // admitted.
  bool admit(Clock::time_point now, size_t* droppedBefore);
  // The line that reports `dropped` lines of this source as suppressed.
  std::string suppressedLine(size_t dropped) const;

 private:
  const std::string label_;
  const double burst_;
  const double perSecond_;
  std::mutex mutex_;
  double tokens_;           // Guarded by mutex_.
  Clock::time_point last_;  // Guarded by mutex_.
  size_t dropped_ = 0;      // Guarded by mutex_.
};

// While it lives, lines of notice level or above that this thread writes are
// charged to budget (null: none). Lines at info and debug level, which only
// an operator's -v asks for, are not. Nests: the innermost scope charges.
class LogBudgetScope {
 public:
  explicit LogBudgetScope(LogBudget* budget);
  ~LogBudgetScope();
  LogBudgetScope(const LogBudgetScope&) = delete;
  LogBudgetScope& operator=(const LogBudgetScope&) = delete;

 private:
  LogBudget* previous_;
};

// Captures every line written while it lives (tests). Not nestable with
// another sink change on a different thread.
class LogCapture {
 public:
  LogCapture();
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  std::vector<std::string> lines() const;
  // How many captured lines equal `line` exactly.
  size_t count(std::string_view line) const;
  // Whether some captured line contains `fragment`.
  bool contains(std::string_view fragment) const;
  void clear();

 private:
  struct State {
    std::mutex mutex;
    std::vector<std::string> lines;  // Guarded by mutex.
  };
  // Shared with the installed sink, so a writer that picked the sink up just
  // before this capture ended still writes into live memory.
  std::shared_ptr<State> state_;
  LogSink previous_;
};

}  // namespace vantrel::base
