#pragma once
// One plug-in bundle as vantrel-inspect sees it: the record the model builds
// from the bundle's Info.plist, the validation verdict and the exported form,
// plus every system-log line written while it was built.

#include <optional>
#include <string>
#include <vector>

#include "base/Error.h"
#include "lmo/Value.h"

namespace vantrel::tools {

struct Inspection {
  std::string path;
  // Set when a record could be built; otherwise `failure` says why not.
  bool built = false;
  std::string failure;

  std::string identifier;
  std::string version;
  std::string protocol;
  std::string extensionPoint;
  std::string style;
  std::string containingApp;  // empty for a plug-in that stands alone

  std::optional<base::Error> verdict;  // nullopt: valid
  lmo::Dictionary form;
  std::vector<std::string> log;
};

// Builds the record for the plug-in bundle at path:
//  1. the record from the bundle's Info dictionary (an old-style bundle, whose
//     metadata sits under "Vantrel", is read the way the registry presents it:
//     that dictionary as the extension dictionary);
//  2. its extension point's SDK merged in, when one is registered;
//  3. validation, on the metadata as the bundle and SDK declare it;
//  4. canonicalisation and export of the form.
Inspection inspectBundle(const std::string& path);

// The plug-in bundles under each directory of roots: a directory that is a
// plug-in bundle itself, or every bundle in the PlugIns directory of an
// application (*.app) found there. Sorted by path.
std::vector<std::string> findPlugInBundles(const std::string& root);

}  // namespace vantrel::tools
