#pragma once
// Working out what one change does to the registry: which rows to write,
// which index entries to put and erase, which data containers to make and
// remove, and what to announce. The planner reads the indexes and the file
// system but changes neither (beyond making the data containers of new
// plug-ins); Omnidex applies the finished ChangeSet.
//
// A plug-in keeps its UUID, original identifier and data container while its
// path stays registered with the same identifier. A changed Info.plist or
// entitlements announce the old record as uninstalling and the new one as
// installed; so does a change of the containing application's record (its
// name, or the end of its placeholder state), since the plug-in's record
// carries it.

#include <map>
#include <optional>
#include <string>
#include <vector>

#include "base/Result.h"
#include "omnidex/BundleReader.h"
#include "omnidex/Containers.h"
#include "omnidex/Indexes.h"
#include "omnidex/Store.h"

namespace vantrel::omnidex {

enum class Origin {
  kScan,          // found in a watched directory
  kRegistration,  // registered by path: kept while the bundle exists, announced even unchanged
};

struct ChangeSet {
  StoreBatch batch;
  std::vector<PlugInEntry> putPlugIns;
  std::vector<std::string> erasedPlugIns;
  std::vector<ApplicationEntry> putApplications;
  std::vector<std::string> erasedApplications;
  std::vector<base::Uuid> madeContainers;     // removed again when the batch cannot be written
  std::vector<base::Uuid> droppedContainers;  // removed once the batch is written
  std::vector<PlugInRecordPtr> uninstalled;   // old records, announced first
  std::vector<PlugInRecordPtr> installed;

  bool empty() const {
    return batch.empty() && putPlugIns.empty() && erasedPlugIns.empty() &&
           putApplications.empty() && erasedApplications.empty() && uninstalled.empty() &&
           installed.empty();
  }
};

class Planner {
 public:
  // indexes and containers must outlive the planner; now is the
  // registration date of what this change registers.
  Planner(const Indexes& indexes, const Containers& containers, lmo::Date now)
      : indexes_(indexes), containers_(containers), now_(now) {}

  // The bundle at bundle.path has been read. Errors: kOmnidexFull when it is
  // new and the registry holds kMaxRegisteredPlugIns plug-ins.
  base::Result<void> read(PlugInBundle bundle, Origin origin);
  // The plug-in of entry is gone (or no longer a plug-in).
  void drop(const PlugInEntry& entry);
  // The plug-in of entry is unchanged; its application is still looked at.
  void keep(const PlugInEntry& entry);

  ChangeSet finish();

 private:
  enum class Kind { kNew, kReplace, kRefresh, kKeep, kDrop };
  struct Decision {
    Kind kind;
    const PlugInEntry* existing = nullptr;
    std::optional<PlugInBundle> bundle;
    bool isExplicit = false;
    bool announce = false;  // a registration of an unchanged bundle
  };

  // Settles the application's record for this change; keptByThisChange: a
  // plug-in of this change stays in it.
  void resolveApplication(const std::string& appPath, bool keptByThisChange, ChangeSet& changes);
  bool applicationStillNeeded(const std::string& appPath, bool keptByThisChange) const;
  std::optional<std::string> makeContainer(const base::Uuid& uuid, const std::string& path,
                                           ChangeSet& changes);
  ApplicationRecordPtr applicationFor(const std::string& path) const;
  void plan(const std::string& path, Decision& decision, ChangeSet& changes);
  void putNew(const std::string& path, const Decision& decision, ChangeSet& changes);
  void putReplacement(const std::string& path, const Decision& decision, ChangeSet& changes);
  void putRefresh(const Decision& decision, ChangeSet& changes);
  void rehome(const PlugInEntry& entry, ChangeSet& changes);

  const Indexes& indexes_;
  const Containers& containers_;
  const lmo::Date now_;
  size_t newCount_ = 0;
  std::map<std::string, Decision> decisions_;  // by bundle path
  // The application records this change settles on, by application path;
  // null for an application that is dropped.
  std::map<std::string, ApplicationRecordPtr, std::less<>> applications_;
};

}  // namespace vantrel::omnidex
