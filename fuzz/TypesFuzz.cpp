// Type declarations: the types.plist files of two SDK directories (the
// input's two parts, FuzzSupport.h; an empty part is no file), loaded as the
// daemon loads them. Declarations may name unknown parents, repeat or
// redeclare types and form cycles. Properties:
//  - the built-in types keep their conformance and their tags whatever the
//    files say;
//  - conformance is reflexive and transitive, and supertypes() agrees with
//    conformsTo();
//  - a type declared once conforms to each of its known parents, and when
//    no identifier is declared twice, every declared type's supertypes are
//    exactly what its declared parents reach (cycles included).

#include <algorithm>
#include <filesystem>
#include <map>
#include <set>
#include <string>
#include <system_error>
#include <vector>

#include "fuzz/FuzzSupport.h"
#include "platform/PropertyList.h"
#include "platform/TypeIdentifiers.h"

namespace {

using namespace vantrel;
using platform::TypeRegistry;

// Declared types checked one by one per input, so that a large file costs
// one load and a bounded amount of checking.
constexpr size_t kMaxCheckedTypes = 64;

const TypeRegistry& builtIn() {
  static const TypeRegistry registry = TypeRegistry::load({});
  return registry;
}

// What a file declares, read without the loader's validation: identifiers
// (in order, repeats kept) and each one's "conformsTo" strings.
struct Declared {
  std::vector<std::string> identifiers;
  std::map<std::string, std::vector<std::string>> parents;
};

void readDeclarations(std::string_view bytes, Declared& declared) {
  auto file = platform::readPropertyList(bytes);
  const lmo::Array* entries = file.has_value() ? file->getIfArray() : nullptr;
  if (entries == nullptr) return;
  for (size_t i = 0; i < entries->size() && i < platform::kMaxDeclaredTypesPerFile; ++i) {
    const lmo::Dictionary* entry = entries->at(i).getIfDictionary();
    const std::string* id = entry ? entry->get("identifier").getIfString() : nullptr;
    if (id == nullptr) continue;
    declared.identifiers.push_back(*id);
    std::vector<std::string>& parents = declared.parents[*id];
    if (const lmo::Array* list = entry->get("conformsTo").getIfArray()) {
      for (const lmo::Value& parent : *list) {
        if (const std::string* p = parent.getIfString()) parents.push_back(*p);
      }
    }
  }
}

void checkBuiltIns(const TypeRegistry& registry) {
  for (const char* type : {"public.jpeg", "public.svg-image", "public.folder", "public.data"}) {
    FUZZ_REQUIRE(registry.supertypes(type) == builtIn().supertypes(type),
                 "a built-in type keeps its conformance", type);
  }
  FUZZ_REQUIRE(registry.typeForMimeType("image/jpeg") == "public.jpeg" &&
                   registry.typeForFilenameExtension("txt") == "public.plain-text",
               "a built-in type keeps its tags", "");
}

void checkClosure(const TypeRegistry& registry, const std::string& type) {
  const std::vector<std::string> supertypes = registry.supertypes(type);
  FUZZ_REQUIRE(std::binary_search(supertypes.begin(), supertypes.end(), type),
               "a known type conforms to itself", type);
  for (const std::string& parent : supertypes) {
    FUZZ_REQUIRE(registry.conformsTo(type, parent), "supertypes() agrees with conformsTo()",
                 type + " " + parent);
    for (const std::string& grandparent : registry.supertypes(parent)) {
      FUZZ_REQUIRE(std::binary_search(supertypes.begin(), supertypes.end(), grandparent),
                   "conformance is transitive", type + " " + parent + " " + grandparent);
    }
  }
}

// The types type reaches through declared parents and the built-in table.
std::vector<std::string> reach(const TypeRegistry& registry, const Declared& declared,
                               const std::string& type) {
  std::set<std::string> seen{type};
  std::vector<std::string> work{type};
  while (!work.empty()) {
    const std::string t = work.back();
    work.pop_back();
    std::vector<std::string> next;
    if (builtIn().contains(t)) {
      next = builtIn().supertypes(t);
    } else if (auto it = declared.parents.find(t); it != declared.parents.end()) {
      next = it->second;
    }
    for (const std::string& parent : next) {
      if (registry.contains(parent) && seen.insert(parent).second) work.push_back(parent);
    }
  }
  return {seen.begin(), seen.end()};
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  fuzz::setUpProcess();
  const auto parts = fuzz::splitParts(data, size, 2);
  std::vector<std::string> directories;
  Declared declared;
  for (size_t i = 0; i < parts.size(); ++i) {
    const std::string directory = fuzz::scratchDirectory() + "/types" + std::to_string(i);
    const std::string file = directory + "/" + platform::kTypeDeclarationsFileName;
    std::error_code ec;
    if (parts[i].empty()) {
      std::filesystem::remove(file, ec);
    } else {
      fuzz::writeFile(file, parts[i]);
    }
    directories.push_back(directory);
    readDeclarations(parts[i], declared);
  }
  const TypeRegistry registry = TypeRegistry::load(directories);
  checkBuiltIns(registry);

  std::map<std::string, int> times;
  for (const std::string& id : declared.identifiers) ++times[id];
  const bool repeats =
      std::any_of(times.begin(), times.end(), [](const auto& entry) { return entry.second > 1; });
  size_t checked = 0;
  for (const auto& [id, count] : times) {
    if (!registry.contains(id) || builtIn().contains(id)) continue;
    if (++checked > kMaxCheckedTypes) break;
    checkClosure(registry, id);
    if (count > 1) continue;
    for (const std::string& parent : declared.parents[id]) {
      if (registry.contains(parent)) {
        FUZZ_REQUIRE(registry.conformsTo(id, parent), "a type conforms to its known parents",
                     id + " " + parent);
      }
    }
    if (!repeats) {
      FUZZ_REQUIRE(registry.supertypes(id) == reach(registry, declared, id),
                   "a type's supertypes are what its parents reach", id);
    }
  }
  return 0;
}
