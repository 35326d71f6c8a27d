#pragma once
// Reading bundles for the registry: a plug-in bundle's Info dictionary and
// trusted entitlements, an application's Info dictionary, and the cheap
// fingerprints that tell whether a bundle may have changed since it was read.
//
// Files are opened without following a symbolic link in their last component
// and without blocking on a FIFO, and are read up to the bounds of Limits.h.
// Every fingerprint is taken before the bytes are read, so a stored
// fingerprint never claims a state newer than the bytes stored with it.

#include <optional>
#include <string>
#include <string_view>

#include "base/Result.h"
#include "lmo/Value.h"
#include "platform/Digest.h"

namespace vantrel::omnidex {

inline constexpr const char* kInfoPlistName = "Info.plist";
inline constexpr const char* kEntitlementsPlistName = "Entitlements.plist";

// What the registry takes from a plug-in's Info dictionary.
struct PlugInInfo {
  lmo::Dictionary info;
  // "QXExtension", or the old-style "Vantrel" dictionary.
  lmo::Dictionary extension;
  // "QXExtensionIdentifier" of the extension dictionary, else the bundle's
  // "KBBundleIdentifier"; never empty.
  std::string identifier;
};

// Parses Info.plist bytes of the plug-in at bundlePath (for messages only).
// Errors (domain "Omnidex"): kOmnidexMalformedBundle (not a property list,
// not a dictionary), kOmnidexNotAPlugIn, kOmnidexNoIdentifier.
base::Result<PlugInInfo> parsePlugInInfo(const std::string& bundlePath, std::string_view bytes);

// Parses stored entitlements bytes; empty bytes are empty entitlements.
base::Result<lmo::Dictionary> parseEntitlements(std::string_view bytes);

// Tells two reads of a bundle apart by content.
struct ContentDigest {
  platform::Sha1Digest info{};
  platform::Sha1Digest entitlements{};
  bool operator==(const ContentDigest&) const = default;
};
ContentDigest contentDigest(std::string_view infoBytes, std::string_view entitlementsBytes);

struct PlugInBundle {
  std::string path;
  PlugInInfo metadata;
  // From Entitlements.plist when that file is trusted (owned by root or by
  // this process's effective user, not writable by group or others, not a
  // symbolic link); else empty.
  lmo::Dictionary entitlements;
  std::string infoBytes;
  std::string entitlementsBytes;  // empty unless the entitlements were trusted
  std::string fingerprint;
  ContentDigest digest;
};

// Reads the plug-in bundle at path (a normal path; a symbolic link to a
// directory is followed, since the caller named it). Errors (domain
// "Omnidex"): kOmnidexNotABundle (no directory, no Info.plist),
// kOmnidexMalformedBundle, kOmnidexNotAPlugIn, kOmnidexNoIdentifier.
// Untrusted or unreadable entitlements are not an error: they read as
// empty, after one log line saying why.
base::Result<PlugInBundle> readPlugInBundle(const std::string& path);

// The plug-in bundle's current fingerprint (its Info.plist and
// Entitlements.plist as lstat sees them), comparable with
// PlugInBundle::fingerprint.
std::string plugInFingerprint(const std::string& path);

struct ApplicationBundle {
  std::string path;
  // nullopt while the application has no readable Info dictionary.
  std::optional<lmo::Dictionary> info;
  std::optional<std::string> infoBytes;
  std::string fingerprint;
  std::optional<platform::Sha1Digest> digest;  // of infoBytes
};

// Reads the application at path. Never fails: an application without a
// readable Info dictionary (being copied in, or broken) has none.
ApplicationBundle readApplicationBundle(const std::string& path);

// Parses stored application Info.plist bytes; nullopt when they are not a
// dictionary.
std::optional<lmo::Dictionary> parseApplicationInfo(std::string_view bytes);

// The application's current fingerprint, comparable with
// ApplicationBundle::fingerprint.
std::string applicationFingerprint(const std::string& path);

}  // namespace vantrel::omnidex
