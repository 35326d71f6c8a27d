// The two files the system reads back after writing them: the annotation
// store (the input's first part, FuzzSupport.h) and a launch description
// (the second part). Either may have been edited or damaged by anyone who
// can write it, so each is loaded as the system loads it:
//  - the annotation store as the daemon opens it at start. Whatever loads
//    must save and load again as the same table, and a change to one
//    plug-in's annotation must survive the next load without touching the
//    others;
//  - the launch description as the launcher reads it (a trusted file, a
//    property list, a description). Whatever it accepts must publish again,
//    as the service manager writes it, and read back as the same
//    description.

#include <optional>
#include <string>

#include "fuzz/FuzzSupport.h"
#include "lmo/Protocol.h"
#include "model/VTPlugInCore.h"
#include "platform/LaunchDescription.h"
#include "platform/PropertyList.h"
#include "platform/TrustedFile.h"
#include "registry/VTDAnnotationStore.h"
#include "registry/VTDPlugIn.h"

namespace {

using namespace vantrel;
using lmo::Dictionary;
using lmo::Value;
using registry::VTDAnnotationStore;

// Whether the table holds a value that the XML property list written for it
// cannot carry as it is (an unsigned integer above INT64_MAX, a real -0, a
// date with a fraction): a reload gives it back changed, as documented.
bool changesWhenWritten(const Value& v) {
  switch (v.type()) {
    case Value::Type::kInteger:
      return v.isUnsignedInteger() && !v.getIfInt64();
    case Value::Type::kReal:
      return *v.getIfReal() == 0;
    case Value::Type::kDate:
      return v.getIfDate()->secondsSince1970 != static_cast<int64_t>(v.getIfDate()->secondsSince1970);
    case Value::Type::kArray:
      for (const Value& item : *v.getIfArray()) {
        if (changesWhenWritten(item)) return true;
      }
      return false;
    case Value::Type::kDictionary:
      for (const auto& [key, item] : *v.getIfDictionary()) {
        if (changesWhenWritten(item)) return true;
      }
      return false;
    default:
      return false;
  }
}

// A plug-in whose annotation key is key: what the store needs of a record.
std::shared_ptr<registry::VTDPlugIn> plugInKeyed(const std::string& key) {
  const Dictionary form{
      {std::string(protocol::kFormPath), fuzz::scratchDirectory() + "/P.appex"},
      {std::string(protocol::kFormIdentifier), key},
      {std::string(protocol::kFormBundleInfo), Dictionary{{"QXExtension", Dictionary()}}},
  };
  return model::VTPlugInCore::initWithForm<registry::VTDPlugIn>(form);
}

void checkAnnotationStore(std::string_view bytes) {
  const std::string path = fuzz::scratchDirectory() + "/Annotations";
  fuzz::writeFile(path, bytes);
  auto store = VTDAnnotationStore::initWithDatabase(path);
  const Dictionary table = store->annotations();
  base::Error error;
  if (!store->saveDb(&error)) {
    // Only what no property list can hold is refused (documented).
    FUZZ_REQUIRE(error.code == platform::kPropertyListUnrepresentable,
                 "a loaded table can be saved", error.description());
    return;
  }
  if (changesWhenWritten(Value(table))) return;
  FUZZ_REQUIRE(VTDAnnotationStore::initWithDatabase(path)->annotations() == table,
               "a saved table loads as itself", describe(table));

  // One plug-in's election changes; every other annotation stays.
  const std::string key = table.empty() ? std::string("com.example.fuzzed") : table.begin()->first;
  auto plugIn = plugInKeyed(key);
  FUZZ_REQUIRE(plugIn != nullptr, "a plug-in record can be made for any key", key);
  store->setAnnotation(Dictionary{{protocol::kAnnotationElection, Value::integer(1)}}, *plugIn);
  const Dictionary reloaded = VTDAnnotationStore::initWithDatabase(path)->annotations();
  auto annotation = reloaded.get(key).getIfDictionary();
  FUZZ_REQUIRE(annotation != nullptr &&
                   annotation->get(protocol::kAnnotationElection) == Value::integer(1),
               "a changed annotation survives a reload", key);
  FUZZ_REQUIRE(reloaded.removing(key) == table.removing(key),
               "a change to one annotation leaves the others", key);
}

void checkLaunchDescription(std::string_view bytes) {
  constexpr pid_t kHost = 4242;
  const std::string directory = fuzz::scratchDirectory() + "/run";
  const std::string path = platform::launchDescriptionPath(directory, kHost, "com.example.fuzzed");
  fuzz::writeFile(path, bytes);
  auto read = platform::readTrustedFile(path, platform::kMaxLaunchDescriptionBytes);
  if (!read.has_value() || !read.value()) return;
  auto file = platform::readPropertyList(*read.value());
  if (!file.has_value()) return;
  auto description = platform::decodeLaunchDescription(file.value());
  if (!description.has_value()) return;

  // Published again from what was read: the service dictionary as the file
  // has it, the working directory as the data container.
  const Dictionary& top = *file->getIfDictionary();
  platform::ExternalServiceRegistration registration;
  registration.bundleIdentifier = description->bundleIdentifier;
  registration.version = description->version;
  registration.hostPid = description->hostPid;
  registration.executablePath = description->executablePath;
  registration.description =
      Dictionary{{platform::kLaunchServiceKey, top.get(platform::kLaunchServiceKey)}};
  registration.dataContainer = description->workingDirectory;
  auto encoded = platform::encodeLaunchDescription(registration);
  FUZZ_REQUIRE(encoded.has_value(), "an accepted description publishes again",
               encoded.error().description());
  auto written = platform::writePropertyListFile(path, encoded.value());
  if (!written.has_value()) {
    FUZZ_REQUIRE(written.error().code == platform::kPropertyListUnrepresentable,
                 "an accepted description can be written", written.error().description());
    return;
  }
  auto again = platform::readTrustedFile(path, platform::kMaxLaunchDescriptionBytes);
  FUZZ_REQUIRE(again.has_value() && again.value(), "a published description is trusted", path);
  auto value = platform::readPropertyList(*again.value());
  FUZZ_REQUIRE(value.has_value(), "a published description reads", value.error().description());
  auto decoded = platform::decodeLaunchDescription(value.value());
  FUZZ_REQUIRE(decoded.has_value(), "a published description decodes",
               decoded.error().description());
  const platform::LaunchDescription& a = description.value();
  const platform::LaunchDescription& b = decoded.value();
  FUZZ_REQUIRE(a.bundleIdentifier == b.bundleIdentifier && a.version == b.version &&
                   a.hostPid == b.hostPid && a.executablePath == b.executablePath &&
                   a.environment == b.environment && a.sandboxProfile == b.sandboxProfile &&
                   a.workingDirectory == b.workingDirectory,
               "a published description reads back as itself", describe(top));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  fuzz::setUpProcess();
  const auto parts = fuzz::splitParts(data, size, 2);
  checkAnnotationStore(parts[0]);
  checkLaunchDescription(parts[1]);
  return 0;
}
