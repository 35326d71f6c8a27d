#include "platform/TypeIdentifiers.h"

#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <limits>
#include <mutex>
#include <utility>

#include "base/Check.h"
#include "base/Log.h"
#include "base/Result.h"
#include "lmo/Value.h"
#include "platform/AtomicFile.h"
#include "platform/FileStamp.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"

namespace vantrel::platform {
namespace {

constexpr const char* kTypeDeclarationErrorDomain = "TypeDeclaration";
constexpr const char* kIdentifierKey = "identifier";
constexpr const char* kConformsToKey = "conformsTo";
constexpr const char* kMimeTypesKey = "mimeTypes";
constexpr const char* kExtensionsKey = "extensions";
// Values quoted in log lines are cut to this many bytes, so that a hostile
// file cannot flood the log with one entry.
constexpr size_t kMaxLoggedValueLength = 80;

// One built-in type: lists are separated by single spaces.
struct BuiltInType {
  const char* identifier;
  const char* parents;
  const char* mimeTypes;
  const char* extensions;
};

// The table docs/type-identifiers.md shows; keep the two in step. Where two
// types could claim a tag, the first in this table holds it.
constexpr BuiltInType kBuiltInTypes[] = {
    {"public.item", "", "", ""},
    {"public.content", "", "", ""},
    {"public.data", "public.item", "application/octet-stream", ""},
    {"public.directory", "public.item", "inode/directory", ""},
    {"public.folder", "public.directory", "", ""},
    {"public.text", "public.data public.content", "", ""},
    {"public.plain-text", "public.text", "text/plain", "txt text"},
    {"public.utf8-plain-text", "public.plain-text", "", ""},
    {"public.html", "public.text", "text/html", "html htm"},
    {"public.json", "public.text", "application/json", "json"},
    {"public.xml", "public.text", "application/xml text/xml", "xml"},
    {"public.comma-separated-values-text", "public.text", "text/csv", "csv"},
    {"public.url", "public.data", "text/uri-list", ""},
    {"public.file-url", "public.url", "", ""},
    {"public.archive", "public.data", "", ""},
    {"public.zip-archive", "public.archive", "application/zip", "zip"},
    {"public.tar-archive", "public.archive", "application/x-tar", "tar"},
    {"public.image", "public.data public.content", "", ""},
    {"public.jpeg", "public.image", "image/jpeg", "jpeg jpg"},
    {"public.png", "public.image", "image/png", "png"},
    {"public.gif", "public.image", "image/gif", "gif"},
    {"public.svg-image", "public.image public.xml", "image/svg+xml", "svg"},
    {"public.audiovisual-content", "public.data public.content", "", ""},
    {"public.audio", "public.audiovisual-content", "", ""},
    {"public.mp3", "public.audio", "audio/mpeg", "mp3"},
    {"public.movie", "public.audiovisual-content", "", ""},
    {"public.mpeg-4", "public.movie", "video/mp4", "mp4"},
    {"public.pdf", "public.data public.content", "application/pdf", "pdf"},
};

std::vector<std::string> splitSpaces(std::string_view list) {
  std::vector<std::string> parts;
  size_t start = 0;
  while (start < list.size()) {
    size_t end = list.find(' ', start);
    if (end == std::string_view::npos) end = list.size();
    if (end > start) parts.emplace_back(list.substr(start, end - start));
    start = end + 1;
  }
  return parts;
}

bool isAsciiAlnum(char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9');
}

std::string asciiLower(std::string_view s) {
  std::string out(s);
  for (char& c : out) {
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  }
  return out;
}

// Dot-separated components of letters, digits, '-' and '_', none empty.
bool isValidTypeIdentifier(std::string_view s) {
  if (s.empty() || s.size() > kMaxTypeIdentifierLength) return false;
  if (s.front() == '.' || s.back() == '.') return false;
  char previous = 0;
  for (char c : s) {
    const bool ok = isAsciiAlnum(c) || c == '-' || c == '_' || (c == '.' && previous != '.');
    if (!ok) return false;
    previous = c;
  }
  return true;
}

// The characters of a MIME type or subtype name (RFC 6838).
bool isMimeNameCharacter(char c) {
  return isAsciiAlnum(c) || std::strchr("!#$&^_.+-", c) != nullptr;
}

// "type/subtype", parameters and blanks around it dropped, in lower case;
// nullopt when what remains is not of that form.
std::optional<std::string> normalizeMimeType(std::string_view s) {
  s = s.substr(0, s.find(';'));
  while (!s.empty() && (s.front() == ' ' || s.front() == '\t')) s.remove_prefix(1);
  while (!s.empty() && (s.back() == ' ' || s.back() == '\t')) s.remove_suffix(1);
  if (s.empty() || s.size() > kMaxTypeTagLength) return std::nullopt;
  const size_t slash = s.find('/');
  if (slash == 0 || slash == std::string_view::npos || slash + 1 == s.size()) return std::nullopt;
  for (size_t i = 0; i < s.size(); ++i) {
    if (i != slash && !isMimeNameCharacter(s[i])) return std::nullopt;
  }
  return asciiLower(s);
}

// The extension without one leading dot, in lower case; nullopt when empty
// or holding anything but letters, digits and "._+-" (so never a path).
std::optional<std::string> normalizeExtension(std::string_view s) {
  if (!s.empty() && s.front() == '.') s.remove_prefix(1);
  if (s.empty() || s.size() > kMaxTypeTagLength || s.front() == '.') return std::nullopt;
  for (char c : s) {
    if (!isAsciiAlnum(c) && std::strchr("._+-", c) == nullptr) return std::nullopt;
  }
  return asciiLower(s);
}

std::string brief(const lmo::Value& v) {
  std::string text = lmo::describe(v);
  if (text.size() > kMaxLoggedValueLength) {
    text.resize(kMaxLoggedValueLength);
    text += "...";
  }
  return text;
}

base::Error declarationError(std::string description) {
  return base::Error{kTypeDeclarationErrorDomain, 1, std::move(description)};
}

// The strings of an array under key, each passed through normalize. A missing
// key is an empty list unless required. Duplicates are dropped.
template <typename Normalize>
base::Result<std::vector<std::string>> readList(const lmo::Dictionary& declaration, const char* key,
                                                bool required, const char* what,
                                                Normalize normalize) {
  const lmo::Value* value = declaration.find(key);
  if (value == nullptr) {
    if (required) return declarationError(base::format("%s is missing", key));
    return std::vector<std::string>();
  }
  const lmo::Array* array = value->getIfArray();
  if (array == nullptr) return declarationError(base::format("%s is not an array", key));
  if (array->size() > kMaxTypeDeclarationListLength) {
    return declarationError(
        base::format("%s has more than %u entries", key, kMaxTypeDeclarationListLength));
  }
  std::vector<std::string> items;
  for (const lmo::Value& element : *array) {
    const std::string* text = element.getIfString();
    std::optional<std::string> normal = text ? normalize(*text) : std::nullopt;
    if (!normal) {
      return declarationError(
          base::format("%s holds %@, which is not a %s", key, brief(element), what));
    }
    if (std::find(items.begin(), items.end(), *normal) == items.end()) {
      items.push_back(std::move(*normal));
    }
  }
  return items;
}

std::optional<std::string> asIdentifier(std::string_view s) {
  if (!isValidTypeIdentifier(s)) return std::nullopt;
  return std::string(s);
}

std::string declarationsPath(const std::string& directory) {
  return directory + "/" + kTypeDeclarationsFileName;
}

FileStamp stampOf(const std::string& path) {
  struct stat st = {};
  return ::stat(path.c_str(), &st) != 0 ? FileStamp::failed(errno) : FileStamp::of(st);
}

// What TypeRegistry::shared() last loaded.
struct SharedState {
  std::mutex mutex;
  // Guarded by mutex: the directories and file stamps the registry was
  // loaded from, and the registry.
  std::vector<std::string> directories;
  std::vector<FileStamp> stamps;
  TypeRegistry::SharedPtr registry;
};

SharedState& sharedState() {
  // Never destroyed, so a thread still querying at exit finds it alive.
  static SharedState& state = *new SharedState;
  return state;
}

}  // namespace

// Reads declaration files into a registry under construction.
struct TypeRegistry::Loader {
  TypeRegistry& registry;
  size_t declared = 0;  // over all files

  static base::Result<TypeRecord> parse(const lmo::Value& entry) {
    const lmo::Dictionary* declaration = entry.getIfDictionary();
    if (declaration == nullptr) return declarationError("it is not a dictionary");
    const std::string* identifier = declaration->get(kIdentifierKey).getIfString();
    if (identifier == nullptr) return declarationError("identifier is missing or not a string");
    if (!isValidTypeIdentifier(*identifier)) {
      return declarationError(
          base::format("%@ is not a valid type identifier", brief(lmo::Value(*identifier))));
    }
    TypeRecord record{*identifier, {}, {}, {}, {}};
    record.parents = VT_TRY(
        readList(*declaration, kConformsToKey, /*required=*/true, "type identifier", asIdentifier));
    record.mimeTypes = VT_TRY(
        readList(*declaration, kMimeTypesKey, /*required=*/false, "MIME type", normalizeMimeType));
    record.extensions = VT_TRY(readList(*declaration, kExtensionsKey, /*required=*/false,
                                        "filename extension", normalizeExtension));
    return record;
  }

  void readFile(const std::string& path) {
    const FileStamp stamp = stampOf(path);
    // No file is the common case: most SDK directories declare no types.
    if (stamp.error == ENOENT || stamp.error == ENOTDIR) return;
    base::Result<lmo::Value> contents = readPropertyListFile(path);
    if (!contents.has_value()) return ignoreFile(path, contents.error().description());
    const lmo::Array* entries = contents->getIfArray();
    if (entries == nullptr) return ignoreFile(path, "it does not hold an array");
    for (size_t i = 0; i < entries->size(); ++i) {
      if (i >= kMaxDeclaredTypesPerFile || declared >= kMaxDeclaredTypes) {
        base::vtlog("ignoring type declarations from entry %u of %@: more than %u in %s", i, path,
                    i >= kMaxDeclaredTypesPerFile ? kMaxDeclaredTypesPerFile : kMaxDeclaredTypes,
                    i >= kMaxDeclaredTypesPerFile ? "one file" : "all files");
        return;
      }
      readEntry(path, i, entries->at(i));
    }
  }

  void readEntry(const std::string& path, size_t index, const lmo::Value& entry) {
    base::Result<TypeRecord> record = parse(entry);
    if (record.has_value() && registry.contains(record->identifier)) {
      record = declarationError(
          base::format("%@ is already %s", record->identifier,
                       registry.isBuiltIn(record->identifier) ? "a built-in type" : "declared"));
    }
    if (!record.has_value()) {
      base::vtlog("ignoring type declaration %u of %@: %@", index, path,
                  record.error().description());
      return;
    }
    record->source = path;
    registry.add(std::move(record).value());
    ++declared;
  }

  static void ignoreFile(const std::string& path, const std::string& reason) {
    base::vtlog("ignoring type declarations in %@: %@", path, reason);
  }
};

TypeRegistry TypeRegistry::builtIn() {
  TypeRegistry registry;
  for (const BuiltInType& type : kBuiltInTypes) {
    TypeRecord record{type.identifier,
                      splitSpaces(type.parents),
                      splitSpaces(type.mimeTypes),
                      splitSpaces(type.extensions),
                      {}};
    VT_CHECK(isValidTypeIdentifier(record.identifier), "built-in type identifier is invalid");
    VT_CHECK(!registry.contains(record.identifier), "built-in type listed twice");
    registry.add(std::move(record));
  }
  registry.builtInCount_ = registry.types_.size();
  return registry;
}

TypeRegistry TypeRegistry::load(const std::vector<std::string>& directories) {
  TypeRegistry registry = builtIn();
  Loader loader{registry};
  for (const std::string& directory : directories) loader.readFile(declarationsPath(directory));
  for (const auto& [index, unknown] : registry.resolve()) {
    const TypeRecord& type = registry.types_[index];
    std::string names;
    for (const std::string& name : unknown) names += (names.empty() ? "" : ", ") + name;
    base::vtlog("ignoring unknown parent types of %@ declared in %@: %@", type.identifier,
                type.source, names);
  }
  return registry;
}

TypeRegistry::SharedPtr TypeRegistry::shared() {
  std::vector<std::string> directories = sdkDirectories();
  std::vector<FileStamp> stamps;
  stamps.reserve(directories.size());
  for (const std::string& directory : directories) {
    stamps.push_back(stampOf(declarationsPath(directory)));
  }
  SharedState& state = sharedState();
  std::lock_guard lock(state.mutex);
  if (state.registry && state.directories == directories && state.stamps == stamps) {
    return state.registry;
  }
  // Stamped before reading: a file that changes during the load is seen as
  // changed again at the next call.
  state.registry = std::make_shared<const TypeRegistry>(load(directories));
  state.directories = std::move(directories);
  state.stamps = std::move(stamps);
  return state.registry;
}

void TypeRegistry::add(TypeRecord record) {
  VT_CHECK(types_.size() < std::numeric_limits<uint32_t>::max(), "too many types");
  const auto index = static_cast<uint32_t>(types_.size());
  byIdentifier_.emplace(record.identifier, index);
  // emplace keeps an earlier claim: the first type to claim a tag holds it.
  for (const std::string& mimeType : record.mimeTypes) byMimeType_.emplace(mimeType, index);
  for (const std::string& extension : record.extensions) byExtension_.emplace(extension, index);
  types_.push_back(std::move(record));
}

std::vector<std::pair<uint32_t, std::vector<std::string>>> TypeRegistry::resolve() {
  std::vector<std::pair<uint32_t, std::vector<std::string>>> dropped;
  std::vector<std::vector<uint32_t>> edges(types_.size());
  for (uint32_t t = 0; t < types_.size(); ++t) {
    std::vector<std::string> unknown;
    for (const std::string& parent : types_[t].parents) {
      if (std::optional<uint32_t> p = indexOf(parent)) {
        edges[t].push_back(*p);
      } else {
        unknown.push_back(parent);
      }
    }
    VT_CHECK(t >= builtInCount_ || unknown.empty(), "built-in type has an unknown parent");
    if (!unknown.empty()) {
      std::erase_if(types_[t].parents, [&](const std::string& parent) {
        return std::find(unknown.begin(), unknown.end(), parent) != unknown.end();
      });
      dropped.emplace_back(t, std::move(unknown));
    }
  }
  computeConformance(edges);
  return dropped;
}

// Tarjan's strongly-connected components, iteratively (a long chain of
// declarations must not exhaust the stack). A component is finished only
// after every component its members reach through parents, so the rows of
// all outside parents are complete when a component's row is built; rows of
// members of the component itself are still zero and add nothing.
void TypeRegistry::computeConformance(const std::vector<std::vector<uint32_t>>& edges) {
  constexpr uint32_t kUnvisited = std::numeric_limits<uint32_t>::max();
  const size_t n = types_.size();
  rowWords_ = (n + 63) / 64;
  conformance_.assign(n * rowWords_, 0);

  std::vector<uint32_t> order(n, kUnvisited), low(n, 0);
  std::vector<bool> onStack(n, false);
  std::vector<uint32_t> stack;
  struct Frame {
    uint32_t node;
    size_t nextEdge;
  };
  std::vector<Frame> frames;
  uint32_t counter = 0;
  auto visit = [&](uint32_t v) {
    order[v] = low[v] = counter++;
    stack.push_back(v);
    onStack[v] = true;
    frames.push_back({v, 0});
  };

  for (uint32_t root = 0; root < n; ++root) {
    if (order[root] != kUnvisited) continue;
    visit(root);
    while (!frames.empty()) {
      const uint32_t v = frames.back().node;
      if (frames.back().nextEdge < edges[v].size()) {
        const uint32_t w = edges[v][frames.back().nextEdge++];
        if (order[w] == kUnvisited) {
          visit(w);
        } else if (onStack[w]) {
          low[v] = std::min(low[v], order[w]);
        }
        continue;
      }
      frames.pop_back();
      if (!frames.empty()) {
        const uint32_t caller = frames.back().node;
        low[caller] = std::min(low[caller], low[v]);
      }
      if (low[v] != order[v]) continue;
      std::vector<uint32_t> component;
      uint32_t member;
      do {
        member = stack.back();
        stack.pop_back();
        onStack[member] = false;
        component.push_back(member);
      } while (member != v);
      finishComponent(component, edges);
    }
  }
}

void TypeRegistry::finishComponent(const std::vector<uint32_t>& component,
                                   const std::vector<std::vector<uint32_t>>& edges) {
  std::vector<uint64_t> row(rowWords_, 0);
  for (uint32_t member : component) {
    row[member / 64] |= uint64_t{1} << (member % 64);
    for (uint32_t parent : edges[member]) {
      const uint64_t* parentRow = &conformance_[parent * rowWords_];
      for (size_t w = 0; w < rowWords_; ++w) row[w] |= parentRow[w];
    }
  }
  for (uint32_t member : component) {
    std::copy(row.begin(), row.end(), conformance_.begin() + member * rowWords_);
  }
}

std::optional<uint32_t> TypeRegistry::indexOf(std::string_view type) const {
  auto it = byIdentifier_.find(type);
  if (it == byIdentifier_.end()) return std::nullopt;
  return it->second;
}

bool TypeRegistry::isBuiltIn(std::string_view type) const {
  std::optional<uint32_t> index = indexOf(type);
  return index && *index < builtInCount_;
}

bool TypeRegistry::ancestor(uint32_t type, uint32_t parent) const {
  return (conformance_[type * rowWords_ + parent / 64] >> (parent % 64)) & 1;
}

bool TypeRegistry::conformsTo(std::string_view type, std::string_view parent) const {
  if (type == parent) return true;
  std::optional<uint32_t> t = indexOf(type);
  if (!t) return false;
  std::optional<uint32_t> p = indexOf(parent);
  return p && ancestor(*t, *p);
}

bool TypeRegistry::contains(std::string_view type) const {
  return indexOf(type).has_value();
}

std::vector<std::string> TypeRegistry::supertypes(std::string_view type) const {
  std::vector<std::string> out;
  std::optional<uint32_t> t = indexOf(type);
  if (!t) return out;
  for (uint32_t p = 0; p < types_.size(); ++p) {
    if (ancestor(*t, p)) out.push_back(types_[p].identifier);
  }
  std::sort(out.begin(), out.end());
  return out;
}

std::optional<std::string> TypeRegistry::typeForMimeType(std::string_view mimeType) const {
  std::optional<std::string> key = normalizeMimeType(mimeType);
  if (!key) return std::nullopt;
  auto it = byMimeType_.find(*key);
  if (it == byMimeType_.end()) return std::nullopt;
  return types_[it->second].identifier;
}

std::optional<std::string> TypeRegistry::typeForFilenameExtension(
    std::string_view extension) const {
  std::optional<std::string> key = normalizeExtension(extension);
  if (!key) return std::nullopt;
  auto it = byExtension_.find(*key);
  if (it == byExtension_.end()) return std::nullopt;
  return types_[it->second].identifier;
}

bool typeConformsTo(std::string_view type, std::string_view parent) {
  return TypeRegistry::shared()->conformsTo(type, parent);
}

std::optional<std::string> typeForMimeType(std::string_view mimeType) {
  return TypeRegistry::shared()->typeForMimeType(mimeType);
}

std::optional<std::string> typeForFilenameExtension(std::string_view extension) {
  return TypeRegistry::shared()->typeForFilenameExtension(extension);
}

}  // namespace vantrel::platform
