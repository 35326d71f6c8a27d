#pragma once
// The application registry's records: one immutable snapshot per installed
// plug-in and per application. A record never changes once made; when the
// registry learns something new about a bundle (its Info.plist changed, say)
// it makes a new record with the same UUID. Records are shared as
// std::shared_ptr<const ...> and are safe to read from any thread.

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "base/Uuid.h"
#include "lmo/Value.h"

namespace vantrel::omnidex {

// One application bundle (a "*.app" directory).
struct ApplicationRecord {
  std::string bundlePath;  // absolute, lexically normal
  // "KBBundleDisplayName", else "KBBundleName", else the bundle directory's
  // name without its extension.
  std::optional<std::string> localizedName;
  std::optional<std::string> bundleIdentifier;
  // True while the application has no readable Info dictionary: it is being
  // copied in (or is broken), so its plug-ins are not offered to hosts.
  bool placeholder = false;
  // The directory that holds the application bundle.
  std::string bundleContainerPath;
};
using ApplicationRecordPtr = std::shared_ptr<const ApplicationRecord>;

// Where keyed() looks a key up.
enum class LookupScope : int {
  kAttributes = 0,  // the extension dictionary's "QXExtensionAttributes"
  kExtension = 1,   // the extension dictionary
  kInfo = 2,        // the bundle's Info dictionary, then the extension dictionary
};

// One registered plug-in.
struct PlugInRecord {
  base::Uuid uuid;
  // The plug-in bundle's path; every record the registry makes has one, but
  // readers treat nullopt as "no bundle URL".
  std::optional<std::string> bundlePath;
  // "QXExtensionIdentifier" of the extension dictionary, else the bundle's
  // "KBBundleIdentifier".
  std::optional<std::string> identifier;
  // The identifier at the path's first registration.
  std::optional<std::string> originalIdentifier;
  // The "QXExtension" dictionary of the Info dictionary, or the old-style
  // "Vantrel" dictionary.
  lmo::Dictionary extensionDictionary;
  lmo::Dictionary infoDictionary;
  // From the bundle's Entitlements.plist when that file can be trusted, else
  // empty.
  lmo::Dictionary entitlements;
  std::optional<lmo::Date> registrationDate;
  bool onSystemPartition = false;              // platform::isOnSystemVolume(bundle path)
  ApplicationRecordPtr containingApplication;  // null for a stand-alone plug-in
  // "KBBundleDisplayName", else "KBBundleName", else the bundle directory's
  // name without its extension.
  std::optional<std::string> localizedName;
  // "KBBundleName", else localizedName.
  std::optional<std::string> localizedShortName;
  std::optional<std::string> bundleIdentifier;  // "KBBundleIdentifier"
  std::optional<std::string> bundleVersion;     // "KBBundleVersion"
  // The plug-in's data container directory, "<state>/containers/<UUID>";
  // nullopt when it could not be made.
  std::optional<std::string> dataContainerPath;

  // The value of key in the scope's dictionary; null when absent. Scope
  // kInfo falls back to the extension dictionary for a key absent from the
  // Info dictionary, so that a rule on "QXExtensionPointIdentifier" tests the
  // extension point the plug-in declares.
  lmo::Value keyed(std::string_view key, LookupScope scope) const;
};
using PlugInRecordPtr = std::shared_ptr<const PlugInRecord>;

}  // namespace vantrel::omnidex
