#pragma once
// Type identifiers: reverse-DNS names for kinds of data ("public.jpeg"), and
// conformance between them. A type conforms to itself, to the parents it is
// declared with, and to everything they conform to. A small table of common
// types is built in; more are declared in the file "types.plist" of any SDK
// directory (platform::sdkDirectories()). docs/type-identifiers.md has the
// built-in table and the file format.
//
// Identifiers compare exactly (case-sensitively). MIME types and filename
// extensions compare without regard to ASCII case.

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <vector>

namespace vantrel::platform {

inline constexpr const char* kTypeDeclarationsFileName = "types.plist";
// Longest identifier a declaration may name (as itself or as a parent).
inline constexpr size_t kMaxTypeIdentifierLength = 255;
// Longest MIME type or filename extension a declaration may claim.
inline constexpr size_t kMaxTypeTagLength = 127;
// Parents, MIME types and extensions that one declaration may list (each).
inline constexpr size_t kMaxTypeDeclarationListLength = 32;
// Declarations read from one file; entries past this are ignored.
inline constexpr size_t kMaxDeclaredTypesPerFile = 1024;
// Declarations read over all files; the conformance table is a bit matrix
// over all types, so this bounds its size (about 560 KB at the limit).
inline constexpr size_t kMaxDeclaredTypes = 2048;

class TypeRegistry {
 public:
  using SharedPtr = std::shared_ptr<const TypeRegistry>;

  // The built-in types plus those declared in <dir>/types.plist for each
  // directory, read in order. Never fails: a directory without the file adds
  // nothing, silently; a file that cannot be read or is not an array adds
  // nothing and writes one log line; each malformed declaration in it is
  // skipped with one log line naming the file, the entry and why. A
  // declaration of an identifier that is built in or was declared before (in
  // this file, an earlier file or an earlier directory) is skipped the same
  // way. A parent that no type declares is dropped from the declaration, with
  // one log line per declaration; the rest of it stands.
  static TypeRegistry load(const std::vector<std::string>& directories);

  // The process-wide registry over platform::sdkDirectories(). Each call
  // checks the directory list and every types.plist in it (one stat(2) per
  // directory) and loads the registry afresh when any changed (path, or its
  // FileStamp). The returned registry never changes; hold it
  // across many queries to pay for the check once. Thread-safe.
  static SharedPtr shared();

  // Whether type conforms to parent: true when they are equal, or when type is
  // known and parent is among its declared ancestors. A type that is not known
  // conforms only to itself. Cycles among declarations are allowed: every type
  // of a cycle conforms to every other.
  bool conformsTo(std::string_view type, std::string_view parent) const;

  // Whether the type is built in or declared.
  bool contains(std::string_view type) const;

  // Every known type that type conforms to, itself included, sorted. Empty for
  // a type that is not known.
  std::vector<std::string> supertypes(std::string_view type) const;

  // The type that claims a MIME type. Parameters (from ';') and surrounding
  // blanks are ignored, so "text/plain; charset=utf-8" finds the type of
  // "text/plain". nullopt when no type claims it.
  std::optional<std::string> typeForMimeType(std::string_view mimeType) const;

  // The type that claims a filename extension, given with or without its
  // leading dot ("jpg" or ".jpg"). nullopt when no type claims it.
  std::optional<std::string> typeForFilenameExtension(std::string_view extension) const;

  // Number of known types, built-ins included.
  size_t size() const { return types_.size(); }

 private:
  struct StringHash {
    using is_transparent = void;
    size_t operator()(std::string_view s) const { return std::hash<std::string_view>{}(s); }
  };
  using Index = std::unordered_map<std::string, uint32_t, StringHash, std::equal_to<>>;

  struct TypeRecord {
    std::string identifier;
    std::vector<std::string> parents;
    std::vector<std::string> mimeTypes;   // lower case
    std::vector<std::string> extensions;  // lower case, without the dot
    std::string source;                   // the file that declared it; empty when built in
  };
  struct Loader;

  TypeRegistry() = default;
  static TypeRegistry builtIn();

  // Adds a type whose identifier is not yet known; tags another type already
  // claims stay with that type.
  void add(TypeRecord record);
  // Drops parents that are not known and computes the conformance matrix.
  // Returns, for each type that lost parents, its index and those parents.
  std::vector<std::pair<uint32_t, std::vector<std::string>>> resolve();
  void computeConformance(const std::vector<std::vector<uint32_t>>& edges);
  void finishComponent(const std::vector<uint32_t>& component,
                       const std::vector<std::vector<uint32_t>>& edges);
  std::optional<uint32_t> indexOf(std::string_view type) const;
  bool isBuiltIn(std::string_view type) const;
  bool ancestor(uint32_t type, uint32_t parent) const;

  // Constant once load() returns; the built-ins come first.
  size_t builtInCount_ = 0;
  std::vector<TypeRecord> types_;
  Index byIdentifier_;
  Index byMimeType_;   // lower-case keys
  Index byExtension_;  // lower-case keys, without the dot
  size_t rowWords_ = 0;
  // Row t, words [t * rowWords_, (t + 1) * rowWords_): bit p is set when type
  // t conforms to type p.
  std::vector<uint64_t> conformance_;
};

// The same queries against TypeRegistry::shared().
bool typeConformsTo(std::string_view type, std::string_view parent);
std::optional<std::string> typeForMimeType(std::string_view mimeType);
std::optional<std::string> typeForFilenameExtension(std::string_view extension);

}  // namespace vantrel::platform
