// A whole plug-in bundle, from the bytes its author controls to the form the
// daemon hands hosts. The input is three parts (FuzzSupport.h): Info.plist,
// Entitlements.plist (an empty part: no such file) and the SDK dictionary of
// the plug-in's extension point (an empty part: none registered).
//
// The registry's road: the two files are written into a plug-in bundle
// inside an application, read as the registry reads a bundle, made into the
// registry's record and then the daemon's. Properties: the record is built
// exactly when the daemon's explanation finds no problem with it; its form
// crosses the wire unchanged and a client rebuilds from it a record of the
// same identity, whose own form rebuilds to itself.
//
// The model's road (vantrel-inspect's): the Info dictionary becomes a record,
// the SDK registered under its extension point is merged in, the record is
// validated and canonicalised and its form exported. Properties: the merge
// keeps every plug-in key, adds every SDK-only key, lets the SDK decide
// "CleanTimeout", and merging the SDK again changes nothing but the order
// and repeats of "Shared" arrays (a union "in no particular order", while an
// SDK-only array is copied as it is).

#include <cstdint>
#include <filesystem>
#include <map>
#include <optional>
#include <string>
#include <system_error>
#include <vector>

#include "fuzz/FuzzSupport.h"
#include "lmo/Cbor.h"
#include "lmo/Protocol.h"
#include "model/MetadataKeys.h"
#include "model/VTPlugInCore.h"
#include "omnidex/BundleReader.h"
#include "omnidex/RecordFactory.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"
#include "platform/SdkRegistry.h"
#include "registry/VTDPlugIn.h"

namespace {

using namespace vantrel;
using lmo::Dictionary;
using lmo::Value;
using model::VTPlugInCore;

const base::Uuid& fixedUuid() {
  static const base::Uuid uuid = *base::Uuid::parse("0CA664DE-7981-4045-BA20-ACCC77F99412");
  return uuid;
}

struct Paths {
  std::string applicationPath;
  std::string bundle;
  std::string container;
  std::string sdks;
  omnidex::ApplicationRecordPtr application;
};

const Paths& paths() {
  static const Paths p = [] {
    fuzz::setUpProcess();
    const std::string& scratch = fuzz::scratchDirectory();
    const Dictionary hostInfo{{"KBBundleIdentifier", "com.example.host"}, {"KBBundleName", "Host"}};
    Paths made{scratch + "/Applications/Host.app",
               scratch + "/Applications/Host.app/PlugIns/P.appex", scratch + "/containers/P",
               platform::sdkDirectories().front(), nullptr};
    made.application = omnidex::makeApplicationRecord(made.applicationPath, hostInfo);
    std::error_code ec;
    std::filesystem::create_directories(made.container, ec);
    return made;
  }();
  return p;
}

const Value& formValue(const Dictionary& form, std::string_view key) {
  return form.get(key);
}

// A form crosses the wire unchanged, and a client rebuilds a record of the
// same identity from it, whose form rebuilds to itself.
void checkForm(const Dictionary& form) {
  auto bytes = lmo::encodeCbor(Value(form));
  FUZZ_REQUIRE(bytes.has_value(), "a form encodes", bytes.error().description());
  auto decoded = lmo::decodeCbor(bytes.value().data(), bytes.value().size());
  FUZZ_REQUIRE(decoded.has_value() && fuzz::sameValue(decoded.value(), Value(form)),
               "a form crosses the wire unchanged",
               decoded.has_value() ? describe(form) : decoded.error().description());

  auto rebuilt = VTPlugInCore::initWithForm(form);
  if (!rebuilt) return;
  const Dictionary again = rebuilt->exportForm(nullptr);
  for (std::string_view key : {protocol::kFormUuid, protocol::kFormIdentifier, protocol::kFormPath,
                               protocol::kFormOriginalIdentifier, protocol::kFormEntitlements}) {
    FUZZ_REQUIRE(fuzz::sameValue(formValue(again, key), formValue(form, key)),
                 "a rebuilt record keeps its identity", std::string(key));
  }
  auto twice = VTPlugInCore::initWithForm(again);
  FUZZ_REQUIRE(twice && fuzz::sameValue(Value(twice->exportForm(nullptr)), Value(again)),
               "a rebuilt record's form rebuilds to itself", describe(again));
}

void registryRoad(std::string_view info, std::string_view entitlements) {
  const Paths& p = paths();
  fuzz::writeFile(p.bundle + "/" + omnidex::kInfoPlistName, info);
  const std::string entitlementsPath = p.bundle + "/" + omnidex::kEntitlementsPlistName;
  std::error_code ec;
  if (entitlements.empty()) {
    std::filesystem::remove(entitlementsPath, ec);
  } else {
    fuzz::writeFile(entitlementsPath, entitlements);
  }
  auto bundle = omnidex::readPlugInBundle(p.bundle);
  if (!bundle.has_value()) return;

  const omnidex::PlugInIdentity identity{fixedUuid(), bundle->metadata.identifier,
                                         lmo::Date{1.7e9}};
  auto record = omnidex::makePlugInRecord(p.bundle, bundle->metadata, bundle->entitlements,
                                          identity, p.application, p.container);
  const std::optional<base::Error> problem = registry::VTDPlugIn::recordProblem(record);
  auto plugIn = registry::VTDPlugIn::initWithOXData(record);
  FUZZ_REQUIRE(!problem == (plugIn != nullptr),
               "a record is built exactly when its explanation finds no problem",
               problem ? problem->description() : std::string("no problem, no record"));
  if (!plugIn) return;
  (void)plugIn->annotationKey();
  checkForm(plugIn->exportForm(nullptr));
}

// value with every "Shared" array, at any depth, as the set it stands for.
Value sharedAsSets(const Value& value) {
  const Dictionary* dictionary = value.getIfDictionary();
  if (dictionary == nullptr) return value;
  std::vector<Dictionary::Entry> entries;
  for (const auto& [key, inner] : *dictionary) {
    const lmo::Array* array = inner.getIfArray();
    if (key == model::kSharedKey && array != nullptr) {
      std::map<std::string, Value> distinct;
      for (const Value& element : *array) {
        distinct.emplace(std::string(lmo::typeName(element.type())) + ":" + describe(element),
                         element);
      }
      std::vector<Value> elements;
      for (auto& [description, element] : distinct) elements.push_back(std::move(element));
      entries.emplace_back(key, Value(lmo::Array(std::move(elements))));
    } else {
      entries.emplace_back(key, sharedAsSets(inner));
    }
  }
  return Value(Dictionary::fromEntries(std::move(entries)));
}

// The rules of an SDK merge, for the top level of the two dictionaries.
void checkMerge(const Dictionary& sdk, const Dictionary& info) {
  const Dictionary merged = VTPlugInCore::mergeDictionary(sdk, info);
  for (const auto& [key, value] : info) {
    const Value* out = merged.find(key);
    FUZZ_REQUIRE(out != nullptr, "a merge keeps every plug-in key", key);
    if (!sdk.contains(key)) {
      FUZZ_REQUIRE(fuzz::sameValue(*out, value), "a key the SDK lacks keeps its value", key);
    }
  }
  for (const auto& [key, value] : sdk) {
    const Value* out = merged.find(key);
    FUZZ_REQUIRE(out != nullptr, "a merge adds every SDK key", key);
    if (!info.contains(key) || VTPlugInCore::sdkOverridesKey(key)) {
      FUZZ_REQUIRE(fuzz::sameValue(*out, value), "the SDK's value stands", key);
    }
  }
  FUZZ_REQUIRE(sharedAsSets(Value(VTPlugInCore::mergeDictionary(sdk, merged))) ==
                   sharedAsSets(Value(merged)),
               "merging an SDK twice changes nothing", describe(merged));
}

// The extension point's SDK file, written where the lookup finds it; the
// previous input's is removed first so that no input sees another's SDK.
void registerSdk(const std::string& name, std::string_view bytes) {
  static std::string previous;
  std::error_code ec;
  if (!previous.empty()) std::filesystem::remove(previous, ec);
  previous.clear();
  if (bytes.empty() || !platform::isSinglePathComponent(name, platform::kMaxSdkNameLength)) return;
  previous = paths().sdks + "/" + name + ".plist";
  fuzz::writeFile(previous, bytes);
}

void modelRoad(std::string_view infoBytes, std::string_view sdkBytes, const std::string& location) {
  auto info = platform::readPropertyList(infoBytes);
  const Dictionary* infoDictionary = info.has_value() ? info->getIfDictionary() : nullptr;
  if (infoDictionary == nullptr) return;
  auto sdk = platform::readPropertyList(sdkBytes);
  if (sdk.has_value() && sdk->getIfDictionary() != nullptr) {
    checkMerge(*sdk->getIfDictionary(), *infoDictionary);
  }

  const std::string* identifier = infoDictionary->get(model::kBundleIdentifierKey).getIfString();
  auto record = VTPlugInCore::initWithName(
      identifier ? std::optional<std::string>(*identifier) : std::nullopt,
      model::FileUrl::fromPath(location), info.value(), Value(), fixedUuid());
  if (!record) return;
  const std::string* point = record->sdkSpec().getIfString();
  registerSdk(point ? *point : std::string(), sdkBytes);
  record->resolveSDK();
  (void)record->diagnose();
  record->canonicalize();
  checkForm(record->exportForm(nullptr));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const auto parts = fuzz::splitParts(data, size, 3);
  registryRoad(parts[0], parts[1]);
  // An application extension (".appex") answers to more rules than another
  // plug-in: both kinds are built.
  modelRoad(parts[0], parts[2], paths().bundle);
  modelRoad(parts[0], parts[2], fuzz::scratchDirectory() + "/Library/P.bundle");
  return 0;
}
