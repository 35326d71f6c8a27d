#include "platform/SandboxCheck.h"

#include <charconv>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "base/Format.h"
#include "platform/ProcessInfo.h"
#include "platform/SmallFile.h"

namespace vantrel::platform {
namespace {

constexpr std::string_view kStateField = "State:";
constexpr std::string_view kNoNewPrivsField = "NoNewPrivs:";
constexpr std::string_view kSeccompField = "Seccomp:";
constexpr std::string_view kBlanks = " \t";

// The value of the first line "<field> <value>" of a status text, without
// the blanks around it; nullopt when no line starts with field. The kernel
// escapes newlines in the one free-text field (Name), so a process cannot
// forge a line of its own.
std::optional<std::string_view> fieldValue(std::string_view status, std::string_view field) {
  size_t at = 0;
  while (at < status.size()) {
    size_t end = status.find('\n', at);
    if (end == std::string_view::npos) end = status.size();
    std::string_view line = status.substr(at, end - at);
    if (line.substr(0, field.size()) == field) {
      line.remove_prefix(field.size());
      const size_t first = line.find_first_not_of(kBlanks);
      if (first == std::string_view::npos) return std::string_view();
      const size_t last = line.find_last_not_of(kBlanks);
      return line.substr(first, last - first + 1);
    }
    at = end + 1;
  }
  return std::nullopt;
}

std::optional<uint64_t> decimalField(std::string_view status, std::string_view field) {
  std::optional<std::string_view> text = fieldValue(status, field);
  if (!text || text->empty()) return std::nullopt;
  uint64_t value = 0;
  const auto [end, error] = std::from_chars(text->data(), text->data() + text->size(), value);
  if (error != std::errc() || end != text->data() + text->size()) return std::nullopt;
  return value;
}

// Whether a status text shows a confined process; true too when it does not
// say (a field missing or unreadable) or shows a process that has exited.
bool statusShowsSandbox(std::string_view status) {
  std::optional<std::string_view> state = fieldValue(status, kStateField);
  if (!state || state->empty() || state->front() == 'Z' || state->front() == 'X') return true;
  std::optional<uint64_t> noNewPrivs = decimalField(status, kNoNewPrivsField);
  std::optional<uint64_t> seccomp = decimalField(status, kSeccompField);
  if (!noNewPrivs || !seccomp) return true;
  return *noNewPrivs != 0 || *seccomp != 0;
}

}  // namespace

bool processIsSandboxed(pid_t pid, int pidfd) {
  if (!checkProcessIdentity(pid, pidfd).has_value()) return true;
  const SmallFileRead r =
      readSmallFile(base::format("/proc/%d/status", static_cast<int>(pid)), kMaxProcessStatusBytes);
  // Checked again after the read: only a process still alive under pid
  // proves that the status read was its own and not that of a process the
  // pid was handed to meanwhile.
  if (!checkProcessIdentity(pid, pidfd).has_value()) return true;
  if (smallFileProblem(r, kMaxProcessStatusBytes)) return true;
  return statusShowsSandbox(r.bytes);
}

}  // namespace vantrel::platform
