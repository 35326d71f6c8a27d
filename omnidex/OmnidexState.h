#pragma once
// Omnidex's insides, shared by Omnidex.cpp (the operations) and
// OmnidexState.cpp (loading, reconciling, applying changes, announcing).
//
// Locks, always taken in this order and never while an observer runs:
//   writeMutex   serialises every change, from the first file read to the
//                posting of its announcements, so changes are applied and
//                announced in one order;
//   indexMutex   guards indexes: shared for lookups, exclusive while a change
//                is applied (with writeMutex held, so a holder of writeMutex
//                may read indexes without it);
//   observersMutex, monitorMutex: leaves, held only for a copy or a swap.

#include <memory>
#include <mutex>
#include <optional>
#include <shared_mutex>
#include <string>
#include <unordered_set>
#include <vector>

#include "base/SerialQueue.h"
#include "omnidex/ConsentStore.h"
#include "omnidex/Containers.h"
#include "omnidex/Indexes.h"
#include "omnidex/Omnidex.h"
#include "omnidex/Planner.h"
#include "omnidex/Scanner.h"
#include "omnidex/Store.h"
#include "omnidex/Watcher.h"
#include "platform/ScopedFd.h"

namespace vantrel::omnidex {

struct ParsedRow;

inline constexpr const char* kAnnounceQueueLabel = "omnidex.announce";

struct Omnidex::State {
  State(std::vector<ScanRoot> scanRoots, std::unique_ptr<Store> openStore,
        std::string containersRoot);

  // Reads the store into the indexes (open only, before anyone else can
  // see the registry).
  base::Result<void> load();
  // Rescans items (each one top-level item below a root), or every root and
  // every registered plug-in when items is null, and applies what changed.
  void reconcileScope(const std::vector<std::string>* items);
  // Writes the change, then updates the indexes and posts its
  // announcements. writeMutex must be held. On a store failure nothing
  // changes (containers made for it are removed again) and the error is
  // returned after a log line.
  base::Result<void> apply(ChangeSet changes);
  // Waits until the announcements posted so far have been delivered; does
  // not wait when called from an observer (it would wait for itself).
  void waitForAnnouncements();

  // Constant after construction.
  const std::vector<ScanRoot> roots;
  const Containers containers;

  std::mutex writeMutex;
  std::unique_ptr<Store> store;  // Guarded by writeMutex.

  // Set at open, then constant; thread-safe itself (it has its own
  // connection and lock), so consent never waits for writeMutex.
  std::unique_ptr<ConsentStore> consent;

  // The state directory's lock, held for the registry's life; set at open.
  platform::ScopedFd stateLock;

  mutable std::shared_mutex indexMutex;
  Indexes indexes;  // Guarded by indexMutex; written only with writeMutex held too.

  std::mutex observersMutex;
  std::vector<std::weak_ptr<WorkspaceObserver>> observers;  // Guarded by observersMutex.

  std::mutex monitorMutex;
  bool monitoring = false;           // Guarded by monitorMutex.
  std::unique_ptr<Watcher> watcher;  // Guarded by monitorMutex.
  // Watches put in at open, for startMonitoring() to take.
  std::optional<base::Result<std::unique_ptr<Watcher>>> openedWatcher;  // Guarded by monitorMutex.

  // A watcher of the roots whose changes are reconciled here; not started.
  base::Result<std::unique_ptr<Watcher>> makeWatcher();

  // Delivers announcements one at a time, in the order they were posted.
  // ~Omnidex destroys it (so drains it) before anything else goes.
  std::unique_ptr<base::SerialQueue> announcements;

 private:
  void announce(std::vector<PlugInRecordPtr> uninstalled, std::vector<PlugInRecordPtr> installed);
  void deliver(const std::vector<PlugInRecordPtr>& uninstalled,
               const std::vector<PlugInRecordPtr>& installed);
  const ScanRoot* rootOf(const std::string& item) const;
  // row's record when it can be made without changing anything (its
  // application loaded, its container there); reads indexes, so it runs
  // while nothing writes them.
  PlugInRecordPtr recordIfReady(const PlugInRow& row, const ParsedRow& parsed,
                                const std::unordered_set<base::Uuid>& existingContainers) const;
  // row's record, its bytes parsed successfully, in app and container.
  static PlugInRecordPtr recordOf(const PlugInRow& row, const ParsedRow& parsed,
                                  ApplicationRecordPtr app, std::optional<std::string> container);
  // row, its bytes parsed already (off the write path, in parallel).
  void loadPlugIn(PlugInRow&& row, ParsedRow&& parsed,
                  const std::unordered_set<base::Uuid>& existingContainers);
  void loadApplication(ApplicationRow&& row);
};

}  // namespace vantrel::omnidex
