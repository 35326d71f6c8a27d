#pragma once
// Where a named service's socket lives. The IPC layer sits below platform/,
// so it reads the runtime directory from the environment itself, with the
// same rule as platform::runtimeDirectory().

#include <string>
#include <string_view>

namespace vantrel::lmo {

// VANTREL_RUNTIME_DIR if set; else /run/vantrel as root; else
// $XDG_RUNTIME_DIR/vantrel (/tmp/vantrel-<uid> when XDG_RUNTIME_DIR is unset).
std::string serviceRuntimeDirectory();

// The socket path of the service: name itself when it begins with "/",
// otherwise <serviceRuntimeDirectory()>/<name>.
std::string socketPathForService(std::string_view name);

}  // namespace vantrel::lmo
