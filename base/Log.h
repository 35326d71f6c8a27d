#pragma once
// The system log: one sink for every line the system writes.
//
// By default lines go to syslog(3) with the ident "vantreld". With the
// environment variable VANTREL_LOG=stderr they go to standard error instead
// (foreground runs, demos). Tests install a capturing sink (LogCapture) and
// assert on exact lines.

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
