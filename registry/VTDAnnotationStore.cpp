#include "registry/VTDAnnotationStore.h"

#include <cerrno>
#include <cstdlib>
#include <set>
#include <vector>

#include "base/Check.h"
#include "base/Log.h"
#include "lmo/Protocol.h"
#include "platform/AtomicFile.h"
#include "platform/Paths.h"
#include "platform/Probes.h"
#include "platform/PropertyList.h"
#include "registry/VTDPlugIn.h"

namespace vantrel::registry {

using lmo::Dictionary;
using lmo::Value;

namespace {

constexpr const char* kDirectoryName = "com.karvo.vantrel/";
constexpr const char* kFileName = "Annotations";
constexpr const char* kVersionKey = "version";
constexpr const char* kDataKey = "data";
// The longest user directory path accepted, in bytes: with its terminating
// zero it must fit a 1024-byte buffer with one byte to spare.
constexpr size_t kMaxUserDirectoryLength = 1022;
constexpr mode_t kDirectoryMode = 0700;
// Annotations are the user's own: nobody else reads them.
constexpr mode_t kFileMode = 0600;

// An absolute directory from the environment, or nullptr.
const char* absoluteFromEnvironment(const char* name) {
  const char* value = std::getenv(name);
  return value != nullptr && value[0] == '/' ? value : nullptr;
}

// The user's private state directory: ${XDG_STATE_HOME:-$HOME/.local/state}.
// Sets errno and returns nullopt when neither variable gives one.
std::optional<std::string> userDirectory() {
  if (const char* state = absoluteFromEnvironment("XDG_STATE_HOME")) return state;
  if (const char* home = absoluteFromEnvironment("HOME"))
    return std::string(home) + "/.local/state";
  errno = ENOENT;
  return std::nullopt;
}

[[noreturn]] void stop(const std::string& message) {
  base::internalInconsistency(message.c_str(), __FILE__, __LINE__);
}

void fireLoadProbe(const base::Error& error) {
  probes::dbLoad(error.domain.c_str(), static_cast<uint64_t>(error.code));
}

}  // namespace

model::FileUrl VTDAnnotationStore::defaultDatabaseURL() {
  std::optional<std::string> user = userDirectory();
  if (user && user->size() > kMaxUserDirectoryLength) errno = ENAMETOOLONG;
  if (!user || user->size() > kMaxUserDirectoryLength) {
    stop(base::format("unable to locate user directory: errno %d", errno));
  }
  const std::string directory = *user + "/" + kDirectoryName;
  if (base::Result<void> made = platform::ensureDirectory(directory, kDirectoryMode);
      !made.has_value()) {
    stop(base::format("unable to create plugin annotations directory:%@ error:%@",
                      model::FileUrl::fromPath(directory), made.error()));
  }
  return model::FileUrl::fromPath(directory + kFileName);
}

std::shared_ptr<VTDAnnotationStore> VTDAnnotationStore::initWithDatabase(
    std::optional<std::string> path) {
  auto store = std::make_shared<VTDAnnotationStore>();
  store->annotationsURL_ = path ? model::FileUrl::fromPath(*path) : defaultDatabaseURL();
  store->removeInterruptedSaves();
  base::Error error;
  if (!store->loadDb(&error)) {
    if (error.code != kFileNotFoundErrorCode) {
      base::vtlog("unable to load annotation database:%@ error:%@ (resetting)",
                  store->annotationsURL_, error);
    }
    store->setAnnotations(Dictionary());
  }
  return store;
}

void VTDAnnotationStore::removeInterruptedSaves() const {
  const std::string& file = annotationsURL_.path();
  const size_t slash = file.rfind('/');
  const std::string directory = slash == std::string::npos ? "."
                                : slash == 0               ? "/"
                                                           : file.substr(0, slash);
  const std::string name = slash == std::string::npos ? file : file.substr(slash + 1);
  if (name.empty()) return;
  // Best effort, and silent: a directory that cannot be read (with -d, it
  // may not exist yet) holds nothing to remove, and whatever is left is
  // tried again at the next start.
  (void)platform::removeStaleTemporaryFiles(directory, name);
}

bool VTDAnnotationStore::loadDb(base::Error* error) {
  base::Result<Value> read = platform::readPropertyListFile(annotationsURL_.path());
  if (!read.has_value()) {
    base::Error failure = read.error();
    if (failure.domain == platform::kPosixErrorDomain && failure.code == ENOENT) {
      failure = base::Error{kAnnotationStoreErrorDomain, kFileNotFoundErrorCode,
                            read.error().localizedDescription};
    }
    fireLoadProbe(failure);
    if (error != nullptr) *error = std::move(failure);
    return false;
  }
  const Dictionary* document = read.value().getIfDictionary();
  const int64_t version = document ? document->get(kVersionKey).integerValue() : 0;
  if (version != kAnnotationDatabaseVersion) {
    if (error != nullptr) {
      *error = base::error_with_code_and_format(protocol::kErrorVersionMismatch,
                                                "found database version %d needed version %d",
                                                version, kAnnotationDatabaseVersion);
      fireLoadProbe(*error);
    }
    return false;
  }
  const Dictionary* data = document->get(kDataKey).getIfDictionary();
  setAnnotations(data ? *data : Dictionary());
  return true;
}

bool VTDAnnotationStore::saveDb(base::Error* error) {
  const Dictionary document{{kVersionKey, Value::integer(kAnnotationDatabaseVersion)},
                            {kDataKey, Value(annotations())}};
  base::Result<void> written =
      platform::writePropertyListFile(annotationsURL_.path(), Value(document), kFileMode);
  if (written.has_value()) return true;
  if (error != nullptr) *error = written.error();
  return false;
}

std::optional<Dictionary> VTDAnnotationStore::annotationForIdentifier(std::string_view key) const {
  const Dictionary table = annotations();
  const Value* annotation = table.find(key);
  const Dictionary* dictionary = annotation ? annotation->getIfDictionary() : nullptr;
  return dictionary ? std::optional<Dictionary>(*dictionary) : std::nullopt;
}

std::optional<Dictionary> VTDAnnotationStore::annotationForPlugIn(const VTDPlugIn& plugIn) const {
  std::optional<std::string> key = plugIn.annotationKey();
  return key ? annotationForIdentifier(*key) : std::nullopt;
}

void VTDAnnotationStore::setAnnotation(const std::optional<Dictionary>& annotation,
                                       const VTDPlugIn& plugIn) {
  setAnnotation(annotation, std::vector<const VTDPlugIn*>{&plugIn});
}

void VTDAnnotationStore::setAnnotation(const std::optional<Dictionary>& annotation,
                                       const std::vector<std::shared_ptr<VTDPlugIn>>& plugIns) {
  std::vector<const VTDPlugIn*> records;
  records.reserve(plugIns.size());
  for (const std::shared_ptr<VTDPlugIn>& plugIn : plugIns) records.push_back(plugIn.get());
  setAnnotation(annotation, records);
}

void VTDAnnotationStore::setAnnotation(const std::optional<Dictionary>& annotation,
                                       const std::vector<const VTDPlugIn*>& plugIns) {
  {
    // A record without identifier has nowhere to keep an annotation; the
    // construction paths never make one, so only the save happens. The
    // table is rebuilt once, however many plug-ins change.
    std::set<std::string> keys;
    for (const VTDPlugIn* plugIn : plugIns) {
      if (std::optional<std::string> key = plugIn->annotationKey()) keys.insert(std::move(*key));
    }
    std::lock_guard lock(mutex_);
    std::vector<Dictionary::Entry> entries;
    entries.reserve(table_.size() + keys.size());
    for (const Dictionary::Entry& entry : table_) {
      if (!keys.contains(entry.first)) entries.push_back(entry);
    }
    if (annotation) {
      for (const std::string& key : keys) {
        const Dictionary* stored = table_.get(key).getIfDictionary();
        Dictionary merged = stored ? *stored : Dictionary();
        for (const Dictionary::Entry& entry : *annotation) {
          merged = merged.setting(entry.first, entry.second);
        }
        entries.emplace_back(key, Value(std::move(merged)));
      }
    }
    table_ = Dictionary::fromEntries(std::move(entries));
  }
  save();
}

void VTDAnnotationStore::save() {
  base::Error error;
  if (!saveDb(&error)) {
    base::vtlog("unable to save annotations:%@ error:%@", annotationsURL_, error);
  }
}

Dictionary VTDAnnotationStore::annotations() const {
  std::lock_guard lock(mutex_);
  return table_;
}

void VTDAnnotationStore::setAnnotations(Dictionary table) {
  std::lock_guard lock(mutex_);
  table_ = std::move(table);
}

}  // namespace vantrel::registry
