#pragma once
// Where the daemon keeps its state. Every function reads the environment on
// each call, so a test (or a tool) can point them elsewhere at any time.

#include <sys/types.h>

#include <string>
#include <vector>

#include "base/Result.h"

namespace vantrel::platform {

// VANTREL_STATE_DIR if set; else /var/lib/vantrel when the effective uid is 0;
// else ${XDG_STATE_HOME:-$HOME/.local/state}/vantrel.
std::string stateDirectory();

// VANTREL_RUNTIME_DIR if set; else /run/vantrel as root; else
// $XDG_RUNTIME_DIR/vantrel (falling back to /tmp/vantrel-<uid> when
// XDG_RUNTIME_DIR is unset).
std::string runtimeDirectory();

// VANTREL_SDK_DIRS split on ':' (empty parts dropped); default
// {"/usr/share/vantrel/sdks"}.
std::vector<std::string> sdkDirectories();

// mkdir -p with the given mode for directories it creates; directories that
// already exist keep their mode. Errors: domain "POSIX" (ENOTDIR when a
// component exists and is not a directory).
base::Result<void> ensureDirectory(const std::string& path, mode_t mode);

}  // namespace vantrel::platform
