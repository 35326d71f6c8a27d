#pragma once
// Path rules of the registry: how a caller's path becomes the key the
// registry files a bundle under, and which application a plug-in belongs to.
// Purely lexical: nothing here touches the file system except for the
// working directory of a relative path.

#include <optional>
#include <string>
#include <string_view>

namespace vantrel::omnidex {

// Absolute (against the working directory) and lexically normal, without a
// trailing slash ("/" stays "/"). Symbolic links are not resolved: a bundle
// is registered where the caller says it is. nullopt for an empty path, one
// holding a NUL, one longer than kMaxPathLength, or a relative path when the
// working directory cannot be read.
std::optional<std::string> normalizeBundlePath(std::string_view path);

// The application a plug-in at bundlePath belongs to: "<X>.app" when the
// bundle lies directly in "<X>.app/PlugIns/", else nullopt. bundlePath must
// be normal (normalizeBundlePath).
std::optional<std::string> containingApplicationPath(const std::string& bundlePath);
// The same, as a view into bundlePath (for loops over many bundles).
std::optional<std::string_view> containingApplicationPathView(std::string_view bundlePath);

// The bundle directory's name without its extension ("Notes" for
// "/Applications/Notes.app").
std::string bundleStem(const std::string& bundlePath);

// Whether path is dir itself or lies below it. Both must be normal.
bool isWithin(const std::string& path, const std::string& dir);

// dir + "/" + name, without doubling the slash of "/".
std::string childPath(const std::string& dir, std::string_view name);

}  // namespace vantrel::omnidex
