#include "omnidex/BundleReader.h"

#include <sys/stat.h>

#include <cerrno>
#include <tuple>
#include <utility>

#include "base/Log.h"
#include "omnidex/BundlePaths.h"
#include "omnidex/Errors.h"
#include "omnidex/Limits.h"
#include "platform/PropertyList.h"
#include "platform/SmallFile.h"
#include "platform/TrustedFile.h"

namespace vantrel::omnidex {
namespace {

constexpr const char* kExtensionKey = "QXExtension";
constexpr const char* kOldStyleExtensionKey = "Vantrel";
constexpr const char* kExtensionIdentifierKey = "QXExtensionIdentifier";
constexpr const char* kBundleIdentifierKey = "KBBundleIdentifier";
// What a fingerprint says about a file that is not there.
constexpr const char* kNoFile = "-";

std::string stamp(const struct stat& st) {
  std::string s;
  s.reserve(80);
  s += std::to_string(st.st_ino);
  s += ':';
  s += std::to_string(st.st_size);
  s += ':';
  s += std::to_string(st.st_mtim.tv_sec);
  s += '.';
  s += std::to_string(st.st_mtim.tv_nsec);
  // The change time moves with every write, rename, chmod and chown, and
  // cannot be set back by a copy that preserves modification times.
  s += ':';
  s += std::to_string(st.st_ctim.tv_sec);
  s += '.';
  s += std::to_string(st.st_ctim.tv_nsec);
  s += ':';
  s += std::to_string(st.st_mode);
  s += ':';
  s += std::to_string(st.st_uid);
  return s;
}

std::string fileStamp(const std::string& path) {
  struct stat st;
  if (::lstat(path.c_str(), &st) != 0) return kNoFile;
  return stamp(st);
}

// The entitlements of the plug-in at bundlePath when Entitlements.plist can
// be trusted: a file anyone else could have written stands in for no
// signature at all. The bytes are returned with the dictionary so that the
// store keeps exactly what was trusted.
std::pair<lmo::Dictionary, std::string> readTrustedEntitlements(const std::string& bundlePath) {
  base::Result<std::optional<std::string>> bytes = platform::readTrustedFile(
      childPath(bundlePath, kEntitlementsPlistName), kMaxEntitlementsBytes);
  std::string problem;
  if (!bytes.has_value()) {
    problem = bytes.error().description();
  } else if (!bytes.value()) {
    return {};
  } else {
    base::Result<lmo::Value> value = platform::readPropertyList(*bytes.value());
    if (!value.has_value()) {
      problem = value.error().description();
    } else if (const lmo::Dictionary* dict = value->getIfDictionary()) {
      return {*dict, std::move(*bytes.value())};
    } else {
      problem = "it is not a dictionary";
    }
  }
  base::vtlog("ignoring entitlements of plug-in at %@: %@", bundlePath, problem);
  return {};
}

std::optional<lmo::Dictionary> extensionDictionary(const lmo::Dictionary& info) {
  if (const lmo::Dictionary* d = info.get(kExtensionKey).getIfDictionary()) return *d;
  if (const lmo::Dictionary* d = info.get(kOldStyleExtensionKey).getIfDictionary()) return *d;
  return std::nullopt;
}

const std::string* nonEmptyString(const lmo::Value& v) {
  const std::string* s = v.getIfString();
  return s != nullptr && !s->empty() ? s : nullptr;
}

}  // namespace

base::Result<PlugInInfo> parsePlugInInfo(const std::string& bundlePath, std::string_view bytes) {
  base::Result<lmo::Value> value = platform::readPropertyList(bytes);
  if (!value.has_value()) {
    return omnidexError(kOmnidexMalformedBundle,
                        base::format("cannot read the Info.plist of the bundle at %@: %@",
                                     bundlePath, value.error().description()));
  }
  const lmo::Dictionary* info = value->getIfDictionary();
  if (info == nullptr) {
    return omnidexError(
        kOmnidexMalformedBundle,
        base::format("the Info.plist of the bundle at %@ is not a dictionary", bundlePath));
  }
  std::optional<lmo::Dictionary> extension = extensionDictionary(*info);
  if (!extension) {
    return omnidexError(kOmnidexNotAPlugIn,
                        base::format("the bundle at %@ is not a plug-in: its Info dictionary has "
                                     "no \"QXExtension\" or \"Vantrel\" dictionary",
                                     bundlePath));
  }
  const std::string* identifier = nonEmptyString(extension->get(kExtensionIdentifierKey));
  if (identifier == nullptr) identifier = nonEmptyString(info->get(kBundleIdentifierKey));
  if (identifier == nullptr) {
    return omnidexError(kOmnidexNoIdentifier,
                        base::format("the plug-in at %@ has no identifier (no "
                                     "QXExtensionIdentifier, nor KBBundleIdentifier)",
                                     bundlePath));
  }
  return PlugInInfo{*info, std::move(*extension), *identifier};
}

base::Result<lmo::Dictionary> parseEntitlements(std::string_view bytes) {
  if (bytes.empty()) return lmo::Dictionary();
  base::Result<lmo::Value> value = platform::readPropertyList(bytes);
  if (!value.has_value()) return value.error();
  const lmo::Dictionary* dict = value->getIfDictionary();
  if (dict == nullptr) {
    return omnidexError(kOmnidexMalformedBundle, "stored entitlements are not a dictionary");
  }
  return *dict;
}

ContentDigest contentDigest(std::string_view infoBytes, std::string_view entitlementsBytes) {
  return ContentDigest{platform::sha1(infoBytes.data(), infoBytes.size()),
                       platform::sha1(entitlementsBytes.data(), entitlementsBytes.size())};
}

base::Result<PlugInBundle> readPlugInBundle(const std::string& path) {
  struct stat st;
  if (path.size() > kMaxPathLength || ::stat(path.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
    return omnidexError(kOmnidexNotABundle, base::format("no bundle directory at %@", path));
  }
  PlugInBundle bundle;
  bundle.path = path;
  // The entitlements' stamp comes first: it is taken before either file is
  // read.
  const std::string entitlementsStamp = fileStamp(childPath(path, kEntitlementsPlistName));
  platform::SmallFileRead info =
      platform::readSmallFile(childPath(path, kInfoPlistName), kMaxInfoPlistBytes);
  if (info.error == ENOENT) {
    return omnidexError(kOmnidexNotABundle,
                        base::format("no Info.plist in the bundle at %@", path));
  }
  if (std::optional<std::string> problem = platform::smallFileProblem(info, kMaxInfoPlistBytes)) {
    return omnidexError(
        kOmnidexMalformedBundle,
        base::format("cannot read the Info.plist of the bundle at %@: %@", path, *problem));
  }
  bundle.metadata = VT_TRY(parsePlugInInfo(path, info.bytes));
  std::tie(bundle.entitlements, bundle.entitlementsBytes) = readTrustedEntitlements(path);
  bundle.infoBytes = std::move(info.bytes);
  bundle.fingerprint = stamp(info.st) + "|" + entitlementsStamp;
  bundle.digest = contentDigest(bundle.infoBytes, bundle.entitlementsBytes);
  return bundle;
}

std::string plugInFingerprint(const std::string& path) {
  return fileStamp(childPath(path, kInfoPlistName)) + "|" +
         fileStamp(childPath(path, kEntitlementsPlistName));
}

ApplicationBundle readApplicationBundle(const std::string& path) {
  ApplicationBundle app;
  app.path = path;
  const std::string infoPath = childPath(path, kInfoPlistName);
  app.fingerprint = fileStamp(infoPath);
  platform::SmallFileRead r = platform::readSmallFile(infoPath, kMaxInfoPlistBytes);
  if (platform::smallFileProblem(r, kMaxInfoPlistBytes)) return app;
  app.info = parseApplicationInfo(r.bytes);
  if (app.info) {
    app.digest = platform::sha1(r.bytes.data(), r.bytes.size());
    app.infoBytes = std::move(r.bytes);
  }
  return app;
}

std::optional<lmo::Dictionary> parseApplicationInfo(std::string_view bytes) {
  base::Result<lmo::Value> value = platform::readPropertyList(bytes);
  if (!value.has_value()) return std::nullopt;
  const lmo::Dictionary* dict = value->getIfDictionary();
  if (dict == nullptr) return std::nullopt;
  return *dict;
}

std::string applicationFingerprint(const std::string& path) {
  return fileStamp(childPath(path, kInfoPlistName));
}

}  // namespace vantrel::omnidex
