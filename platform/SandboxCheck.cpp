#include "platform/SandboxCheck.h"

#include <charconv>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/ProcessInfo.h"

namespace vantrel::platform {
namespace {

constexpr std::string_view kStateField = "State:";
constexpr std::string_view kNoNewPrivsField = "NoNewPrivs:";
constexpr std::string_view kSeccompField = "Seccomp:";

std::optional<uint64_t> decimalField(std::string_view status, std::string_view field) {
  std::optional<std::string_view> text = processStatusField(status, field);
  if (!text || text->empty()) return std::nullopt;
  uint64_t value = 0;
  const auto [end, error] = std::from_chars(text->data(), text->data() + text->size(), value);
  if (error != std::errc() || end != text->data() + text->size()) return std::nullopt;
  return value;
}

// Whether a status text shows a confined process; true too when it does not
// say (a field missing or unreadable) or shows a process that has exited.
bool statusShowsSandbox(std::string_view status) {
  std::optional<std::string_view> state = processStatusField(status, kStateField);
  if (!state || state->empty() || state->front() == 'Z' || state->front() == 'X') return true;
  std::optional<uint64_t> noNewPrivs = decimalField(status, kNoNewPrivsField);
  std::optional<uint64_t> seccomp = decimalField(status, kSeccompField);
  if (!noNewPrivs || !seccomp) return true;
  return *noNewPrivs != 0 || *seccomp != 0;
}

}  // namespace

bool processIsSandboxed(pid_t pid, int pidfd) {
  if (!checkProcessIdentity(pid, pidfd).has_value()) return true;
  const std::optional<std::string> status = readProcessStatus(pid);
  // Checked again after the read: only a process still alive under pid
  // proves that the status read was its own and not that of a process the
  // pid was handed to meanwhile.
  if (!checkProcessIdentity(pid, pidfd).has_value()) return true;
  return !status || statusShowsSandbox(*status);
}

}  // namespace vantrel::platform
