#include "base/Log.h"

#include <syslog.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>

namespace vantrel::base {
namespace {

void defaultSink(LogLevel level, std::string_view line) {
  static const bool toStderr = [] {
    const char* v = std::getenv("VANTREL_LOG");
    return v != nullptr && std::strcmp(v, "stderr") == 0;
  }();
  if (toStderr) {
    std::string text(line);
    text += '\n';
    std::fwrite(text.data(), 1, text.size(), stderr);
    return;
  }
  static std::once_flag opened;
  std::call_once(opened, [] { openlog("vantreld", LOG_PID | LOG_NDELAY, LOG_DAEMON); });
  std::string text(line);
  syslog(static_cast<int>(level), "%s", text.c_str());
}

std::mutex& sinkMutex() {
  static std::mutex m;
  return m;
}

LogSink& currentSink() {
  static LogSink sink;  // Guarded by sinkMutex(); empty means the default.
  return sink;
}

thread_local LogBudget* tlsBudget = nullptr;

void writeToSink(LogLevel level, std::string_view line) {
  LogSink sink;
  {
    std::lock_guard lock(sinkMutex());
    sink = currentSink();
  }
  if (sink) {
    sink(level, line);
  } else {
    defaultSink(level, line);
  }
}

}  // namespace

void writeLog(LogLevel level, std::string_view line) {
  if (tlsBudget != nullptr && static_cast<int>(level) <= static_cast<int>(LogLevel::kNotice)) {
    size_t dropped = 0;
    if (!tlsBudget->admit(LogBudget::Clock::now(), &dropped)) return;
    if (dropped != 0) writeToSink(LogLevel::kNotice, tlsBudget->suppressedLine(dropped));
  }
  writeToSink(level, line);
}

LogBudget::LogBudget(std::string label, size_t burst, size_t perSecond)
    : label_(std::move(label)),
      burst_(static_cast<double>(burst)),
      perSecond_(static_cast<double>(perSecond)),
      tokens_(static_cast<double>(burst)),
      last_(Clock::now()) {}

LogBudget::~LogBudget() {
  if (dropped_ != 0) writeToSink(LogLevel::kNotice, suppressedLine(dropped_));
}

bool LogBudget::admit(Clock::time_point now, size_t* droppedBefore) {
  std::lock_guard lock(mutex_);
  if (now > last_) {
    const double seconds = std::chrono::duration<double>(now - last_).count();
    tokens_ = std::min(burst_, tokens_ + seconds * perSecond_);
    last_ = now;
  }
  if (tokens_ < 1.0) {
    ++dropped_;
    return false;
  }
  tokens_ -= 1.0;
  *droppedBefore = dropped_;
  dropped_ = 0;
  return true;
}

std::string LogBudget::suppressedLine(size_t dropped) const {
  return format("%u log lines of %@ suppressed (more than %u a second)", dropped, label_,
                static_cast<size_t>(perSecond_));
}

LogBudgetScope::LogBudgetScope(LogBudget* budget) : previous_(tlsBudget) {
  tlsBudget = budget;
}

LogBudgetScope::~LogBudgetScope() {
  tlsBudget = previous_;
}

LogSink setLogSink(LogSink sink) {
  std::lock_guard lock(sinkMutex());
  LogSink previous = std::move(currentSink());
  currentSink() = std::move(sink);
  return previous;
}

LogCapture::LogCapture() : state_(std::make_shared<State>()) {
  previous_ = setLogSink([state = state_](LogLevel, std::string_view line) {
    std::lock_guard lock(state->mutex);
    state->lines.emplace_back(line);
  });
}

LogCapture::~LogCapture() {
  setLogSink(std::move(previous_));
}

std::vector<std::string> LogCapture::lines() const {
  std::lock_guard lock(state_->mutex);
  return state_->lines;
}

size_t LogCapture::count(std::string_view line) const {
  std::lock_guard lock(state_->mutex);
  return static_cast<size_t>(std::count(state_->lines.begin(), state_->lines.end(), line));
}

bool LogCapture::contains(std::string_view fragment) const {
  std::lock_guard lock(state_->mutex);
  return std::any_of(state_->lines.begin(), state_->lines.end(),
                     [&](const std::string& l) { return l.find(fragment) != std::string::npos; });
}

void LogCapture::clear() {
  std::lock_guard lock(state_->mutex);
  state_->lines.clear();
}

}  // namespace vantrel::base
