#pragma once
// Where the daemon keeps its state. Every function reads the environment on
// each call, so a test (or a tool) can point them elsewhere at any time.

#include <sys/types.h>

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
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

// Where the preferences store keeps its domains: VANTREL_PREFERENCES_DIR if
// set; else ${XDG_CONFIG_HOME:-$HOME/.config}/vantrel/preferences. Each host
// has its own directory below it (see platform/Preferences.h).
std::string preferencesDirectory();

// The read-only system volume: bundles below it are system-resident, and
// stand-alone plug-ins are accepted only there. VANTREL_SYSTEM_DIR if set
// (an image mounted elsewhere, or a test's tree); default "/System". Always
// absolute and without a trailing slash.
std::string systemVolumeDirectory();

// Whether path lies below systemVolumeDirectory(). A plain prefix test with
// the separator: the directory itself, or "/Systemic/x", is not below it.
bool isOnSystemVolume(std::string_view path);

// VANTREL_SDK_DIRS split on ':' (empty parts dropped); default
// {"/usr/share/vantrel/sdks"}.
std::vector<std::string> sdkDirectories();

// The path made absolute (against the working directory) and lexically
// normal, without a trailing slash ("/" stays "/"). nullopt for an empty path,
// one holding NUL, or one longer than maxLength before or after.
std::optional<std::string> normalizePath(std::string_view path, size_t maxLength);

// A colon-separated list of directories split into its parts, empty parts
// dropped.
std::vector<std::string> splitPathList(std::string_view list);

// Whether name can be used as one file name inside a directory: not empty,
// not "." or "..", no '/' or NUL, and at most maxLength bytes.
bool isSinglePathComponent(std::string_view name, size_t maxLength);

// mkdir -p with the given mode for directories it creates; directories that
// already exist keep their mode. Errors: domain "POSIX" (ENOTDIR when a
// component exists and is not a directory).
base::Result<void> ensureDirectory(const std::string& path, mode_t mode);

}  // namespace vantrel::platform
