#pragma once
// The annotation store: the user's choices about plug-ins (chiefly the
// election) that must survive restarts. An in-memory table from annotation
// key (VTDPlugIn::annotationKey) to annotation dictionary, loaded once from an
// XML property list when the store is made and written back whole, atomically,
// after every change:
//   { "version": 16, "data": { <annotation key>: <annotation>, ... } }
// After the load the table is the truth; the file is never read again.

#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/Error.h"
#include "lmo/Value.h"
#include "model/FileUrl.h"

namespace vantrel::registry {

class VTDPlugIn;

// The one file format version this store reads and writes.
inline constexpr int64_t kAnnotationDatabaseVersion = 16;
// The code a failed load reports for a missing file. The table's loader
// tells "no file yet" (first start: nothing to log) from a broken file by
// this code alone, whatever the domain, so a missing file is reported with it
// rather than with ENOENT.
inline constexpr int64_t kFileNotFoundErrorCode = 260;
// The domain of that error.
inline constexpr const char* kAnnotationStoreErrorDomain = "AnnotationStore";

class VTDAnnotationStore {
 public:
  VTDAnnotationStore() = default;
  VTDAnnotationStore(const VTDAnnotationStore&) = delete;
  VTDAnnotationStore& operator=(const VTDAnnotationStore&) = delete;

  // ${XDG_STATE_HOME:-$HOME/.local/state}/com.karvo.vantrel/Annotations, with
  // the directory made (mode 0700) when missing. The daemon cannot run
  // without it: when neither variable gives an absolute directory, or the
  // directory's path is 1023 bytes or more, the process stops with "unable
  // to locate user directory: errno %d"; when the directory cannot be made,
  // with "unable to create plugin annotations directory:%@ error:%@".
  static model::FileUrl defaultDatabaseURL();

  // A store over the file at path (used as the file itself; its directory is
  // neither made nor required), or over defaultDatabaseURL() for nullopt,
  // loaded now, after removing the temporary files that saves interrupted by
  // a crash or a kill left beside it. A file that cannot be loaded leaves the
  // table empty; unless it is simply missing, "unable to load annotation
  // database:%@ error:%@ (resetting)" is logged, and the next save replaces
  // it. Never null.
  static std::shared_ptr<VTDAnnotationStore> initWithDatabase(std::optional<std::string> path);

  // The annotation stored under key; null when there is none or it is not a
  // dictionary.
  std::optional<lmo::Dictionary> annotationForIdentifier(std::string_view key) const;
  // The annotation stored under the plug-in's annotationKey().
  std::optional<lmo::Dictionary> annotationForPlugIn(const VTDPlugIn& plugIn) const;

  // Merges annotation into the plug-in's stored one key by key (its values
  // win; keys it lacks stay), or removes the stored one for nullopt, then
  // saves. A failed save is logged ("unable to save annotations:%@
  // error:%@") and the change kept in memory for the next save. Saves even
  // when nothing changed.
  void setAnnotation(const std::optional<lmo::Dictionary>& annotation, const VTDPlugIn& plugIn);
  // As setAnnotation for each of plugIns, with one save for them all.
  void setAnnotation(const std::optional<lmo::Dictionary>& annotation,
                     const std::vector<std::shared_ptr<VTDPlugIn>>& plugIns);

  // Replaces the table with the file's "data". False on failure, with the
  // reason in *error when error is not null (a missing file: code
  // kFileNotFoundErrorCode; another version: code 7), and the probe "db-load"
  // fired. The table is left alone on failure.
  bool loadDb(base::Error* error);
  // Writes the table to the file atomically. False on failure, with the
  // reason in *error when error is not null; the old file is then untouched.
  bool saveDb(base::Error* error);

  const model::FileUrl& annotationsURL() const { return annotationsURL_; }
  void setAnnotationsURL(model::FileUrl url) { annotationsURL_ = std::move(url); }
  // A snapshot of the whole table.
  lmo::Dictionary annotations() const;
  void setAnnotations(lmo::Dictionary table);

 private:
  // Merges annotation into the entry of each of plugIns (or removes them
  // for null), then saves once.
  void setAnnotation(const std::optional<lmo::Dictionary>& annotation,
                     const std::vector<const VTDPlugIn*>& plugIns);
  // Writes the table, logging a failure.
  void save();
  // Removes the atomic writer's stale temporaries of the annotation file.
  void removeInterruptedSaves() const;

  // Constant once the store is shared.
  model::FileUrl annotationsURL_ = model::FileUrl::fromPath("");

  // Guards table_. Writers (setAnnotation) are serialised by the database
  // queue; the lock is what lets the discovery filter read the table from the
  // registry's match call, off that queue, while a write replaces it. The
  // table is an immutable value, so a reader holds the lock only to copy it.
  mutable std::mutex mutex_;
  lmo::Dictionary table_;
};

using VTDAnnotationStorePtr = std::shared_ptr<VTDAnnotationStore>;

}  // namespace vantrel::registry
