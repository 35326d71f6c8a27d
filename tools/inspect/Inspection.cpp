#include "tools/inspect/Inspection.h"

#include <algorithm>
#include <filesystem>
#include <system_error>

#include "base/Log.h"
#include "model/VTBundle.h"
#include "model/VTPlugInCore.h"

namespace vantrel::tools {
namespace {

namespace fs = std::filesystem;
using lmo::Dictionary;
using lmo::Value;
using model::FileUrl;
using model::VTPlugInCore;

// An old-style plug-in read as the registry presents it: the bundle's Info
// dictionary stays the bundle info, and its "Vantrel" dictionary is the
// extension dictionary.
class OldStylePlugIn : public VTPlugInCore {
 public:
  explicit OldStylePlugIn(Dictionary info) : info_(std::move(info)) {}
  std::optional<Dictionary> bundleInfoDictionary() const override { return info_; }

 private:
  Dictionary info_;
};

std::string text(const Value& v) {
  if (const std::string* s = v.getIfString()) return *s;
  return v.isNull() ? std::string() : describe(v);
}

// The identifier the registry records: the extension's own
// "QXExtensionIdentifier" when present, else the bundle's "KBBundleIdentifier".
std::optional<std::string> plugInIdentifier(const Dictionary& info, const Value& extension) {
  if (const Dictionary* ext = extension.getIfDictionary()) {
    if (const std::string* id = ext->get("QXExtensionIdentifier").getIfString()) return *id;
  }
  if (const std::string* id = info.get("KBBundleIdentifier").getIfString()) return *id;
  return std::nullopt;
}

// A plug-in lying directly in the PlugIns directory of an *.app bundle
// belongs to that application.
std::string containingApplication(const std::string& path) {
  fs::path p(path);
  fs::path plugIns = p.parent_path();
  if (plugIns.filename() != "PlugIns") return {};
  fs::path app = plugIns.parent_path();
  return app.extension() == ".app" ? app.string() : std::string();
}

std::shared_ptr<VTPlugInCore> buildRecord(const Dictionary& info, const FileUrl& url,
                                          std::string& style, std::string& failure) {
  const Value& extension = info.get("QXExtension");
  const Value& legacy = info.get("Vantrel");
  auto identifier = plugInIdentifier(info, extension.isNull() ? legacy : extension);
  if (extension.isNull() && legacy.getIfDictionary() != nullptr) {
    style = "old-style plug-in";
    auto record = std::make_shared<OldStylePlugIn>(info);
    if (!record->setupWithName(identifier, url, Value(), Value(), std::nullopt)) return nullptr;
    record->setPlugInDictionary(*legacy.getIfDictionary());
    return record;
  }
  if (extension.isNull()) {
    failure = "not a plug-in bundle: Info.plist has neither \"QXExtension\" nor \"Vantrel\"";
    return nullptr;
  }
  auto record = VTPlugInCore::initWithName(identifier, url, Value(info), Value(), std::nullopt);
  if (record) style = record->isAppExtension() ? "application extension" : "plug-in";
  return record;
}

void mergeSdk(VTPlugInCore& record) {
  const std::string* spec = record.sdkSpec().getIfString();
  auto info = record.bundleInfoDictionary();
  if (spec == nullptr || !info) return;
  if (auto sdk = VTPlugInCore::readSDKDictionary(*spec)) {
    record.setDictionaries(Value(VTPlugInCore::mergeDictionary(*sdk, *info)));
  }
}

// The hub protocol version the registry gives a record: the extension's own
// "HubProtocolVersion", else 1 for an old-style plug-in and 2 for the rest.
uint32_t hubProtocolVersion(const VTPlugInCore& record, const std::string& style) {
  const Value& declared = record.pluginKey("HubProtocolVersion");
  if (declared.isNumeric()) return static_cast<uint32_t>(declared.unsignedValue());
  return style == "old-style plug-in" ? 1 : 2;
}

}  // namespace

Inspection inspectBundle(const std::string& path) {
  Inspection result;
  result.path = path;
  base::LogCapture capture;

  auto bundle = model::VTBundle::initWithPath(path);
  std::optional<Dictionary> info = bundle ? bundle->infoDictionary() : std::nullopt;
  if (!info) {
    result.failure = bundle ? "no readable Info.plist" : "not a bundle directory";
    result.log = capture.lines();
    return result;
  }
  result.containingApp = containingApplication(bundle->path().value_or(path));
  std::shared_ptr<VTPlugInCore> record = buildRecord(
      *info, FileUrl::fromPath(bundle->path().value_or(path)), result.style, result.failure);
  if (!record) {
    if (result.failure.empty())
      result.failure = "the plug-in model refused the bundle (see the log line)";
    result.log = capture.lines();
    return result;
  }
  // An SDK completes extension-style metadata only: an old-style record's
  // bundle info has no "QXExtension" entry to merge into.
  if (result.style != "old-style plug-in") mergeSdk(*record);
  record->setHubProtocolVersion(hubProtocolVersion(*record, result.style));
  result.verdict = record->diagnose();
  record->canonicalize();

  result.built = true;
  result.identifier = record->identifier().value_or("");
  result.version = text(record->version());
  result.protocol = text(record->protocolSpec());
  result.extensionPoint = text(record->sdkSpec());
  base::Error exportError;
  result.form = record->exportForm(&exportError);
  result.log = capture.lines();
  return result;
}

std::vector<std::string> findPlugInBundles(const std::string& root) {
  std::vector<std::string> found;
  std::error_code ec;
  auto isBundle = [&](const fs::path& p) {
    return fs::is_directory(p, ec) && fs::exists(p / "Info.plist", ec);
  };
  for (const auto& entry : fs::directory_iterator(root, ec)) {
    const fs::path& p = entry.path();
    if (!isBundle(p)) continue;
    if (p.extension() == ".app") {
      for (const auto& plugIn : fs::directory_iterator(p / "PlugIns", ec)) {
        if (isBundle(plugIn.path())) found.push_back(plugIn.path().string());
      }
    } else {
      found.push_back(p.string());
    }
  }
  std::sort(found.begin(), found.end());
  return found;
}

}  // namespace vantrel::tools
