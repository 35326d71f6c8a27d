#include "omnidex/OmnidexState.h"

#include <algorithm>
#include <functional>
#include <iterator>
#include <optional>
#include <set>
#include <thread>
#include <utility>
#include <vector>

#include "base/Log.h"
#include "omnidex/BundlePaths.h"
#include "omnidex/Errors.h"
#include "omnidex/Limits.h"
#include "omnidex/RecordFactory.h"

namespace vantrel::omnidex {
namespace {

void logUnreadableRow(const std::string& path, const std::string& reason) {
  base::vtlog("ignoring unreadable registry entry for %@: %@", path, reason);
}

// A bundle that is not there, or not a plug-in, is simply not registered; a
// broken one is worth a line, since someone meant it to be a plug-in.
void logRefusedBundle(const base::Error& error) {
  if (error.code == kOmnidexNotABundle || error.code == kOmnidexNotAPlugIn) return;
  base::vtlog("skipping bundle: %@", error.description());
}

std::optional<std::string> containerOrLog(const Containers& containers, const base::Uuid& uuid,
                                          const std::string& path) {
  base::Result<std::string> container = containers.ensure(uuid);
  if (container.has_value()) return container.value();
  base::vtlog("cannot create the data container of plug-in at %@: %@", path,
              container.error().description());
  return std::nullopt;
}

// Runs work(i) for every i below count, the upper half on a second thread
// when there is enough to share. work must only touch its own i.
void inParallel(size_t count, const std::function<void(size_t)>& work) {
  constexpr size_t kWorthASecondThread = 256;
  const size_t half = count < kWorthASecondThread ? count : count / 2;
  std::thread helper;
  if (half < count) {
    helper = std::thread([&] {
      for (size_t i = half; i < count; ++i) work(i);
    });
  }
  for (size_t i = 0; i < half; ++i) work(i);
  if (helper.joinable()) helper.join();
}

}  // namespace

Omnidex::State::State(std::vector<ScanRoot> scanRoots, std::unique_ptr<Store> openStore,
                      std::string containersRoot)
    : roots(std::move(scanRoots)),
      containers(std::move(containersRoot)),
      store(std::move(openStore)),
      announcements(std::make_unique<base::SerialQueue>(kAnnounceQueueLabel)) {}

// What a plug-in row's bytes parse to; made off the write path.
struct ParsedRow {
  base::Result<PlugInInfo> metadata;
  base::Result<lmo::Dictionary> entitlements;
  ContentDigest digest;
  // Made beside the parse when the row's application is loaded and its
  // container exists; otherwise made, with whichever of those is missing,
  // when the row is loaded.
  PlugInRecordPtr record;
};

namespace {

// Rows whose bytes are parsed together before they are loaded in order:
// enough to share between two threads, few enough that the rows held at
// once stay small.
constexpr size_t kLoadChunk = 512;

}  // namespace

base::Result<void> Omnidex::State::load() {
  std::lock_guard write(writeMutex);
  std::unique_lock index(indexMutex);
  const std::unordered_set<base::Uuid> existingContainers = containers.existing();
  // Parsing the stored bytes is most of loading a large registry, and each
  // row's is independent of the others'; loading stays in row order.
  std::vector<PlugInRow> chunk;
  std::vector<std::optional<ParsedRow>> parsed;
  const auto flush = [&] {
    parsed.assign(chunk.size(), std::nullopt);
    inParallel(chunk.size(), [&](size_t i) {
      const PlugInRow& row = chunk[i];
      ParsedRow& p = parsed[i].emplace(ParsedRow{
          parsePlugInInfo(row.path, row.infoBytes), parseEntitlements(row.entitlementsBytes),
          contentDigest(row.infoBytes, row.entitlementsBytes), nullptr});
      p.record = recordIfReady(row, p, existingContainers);
    });
    for (size_t i = 0; i < chunk.size(); ++i) {
      loadPlugIn(std::move(chunk[i]), std::move(*parsed[i]), existingContainers);
    }
    chunk.clear();
  };
  base::Result<void> loaded = store->load(
      [&](PlugInRow&& row) {
        chunk.push_back(std::move(row));
        if (chunk.size() == kLoadChunk) flush();
      },
      [this](ApplicationRow&& row) { loadApplication(std::move(row)); },
      [](const std::string& path) { logUnreadableRow(path, "its UUID is not one"); });
  flush();
  return loaded;
}

void Omnidex::State::loadApplication(ApplicationRow&& row) {
  std::optional<lmo::Dictionary> info;
  std::optional<platform::Sha1Digest> digest;
  if (row.infoBytes) {
    info = parseApplicationInfo(*row.infoBytes);
    digest = platform::sha1(row.infoBytes->data(), row.infoBytes->size());
  }
  indexes.putApplication(
      ApplicationEntry{makeApplicationRecord(row.path, info), std::move(row.fingerprint), digest});
}

PlugInRecordPtr Omnidex::State::recordIfReady(
    const PlugInRow& row, const ParsedRow& parsed,
    const std::unordered_set<base::Uuid>& existingContainers) const {
  if (!parsed.metadata.has_value() || !parsed.entitlements.has_value() ||
      !existingContainers.contains(row.uuid)) {
    return nullptr;
  }
  ApplicationRecordPtr app;
  if (std::optional<std::string> appPath = containingApplicationPath(row.path)) {
    const ApplicationEntry* entry = indexes.applicationAt(*appPath);
    if (entry == nullptr) return nullptr;
    app = entry->record;
  }
  return recordOf(row, parsed, std::move(app), containers.pathFor(row.uuid));
}

PlugInRecordPtr Omnidex::State::recordOf(const PlugInRow& row, const ParsedRow& parsed,
                                         ApplicationRecordPtr app,
                                         std::optional<std::string> container) {
  return makePlugInRecord(
      row.path, parsed.metadata.value(), parsed.entitlements.value(),
      PlugInIdentity{row.uuid, row.originalIdentifier, lmo::Date{row.registered}}, std::move(app),
      std::move(container));
}

void Omnidex::State::loadPlugIn(PlugInRow&& row, ParsedRow&& parsed,
                                const std::unordered_set<base::Uuid>& existingContainers) {
  if (indexes.size() >= kMaxRegisteredPlugIns) {
    logUnreadableRow(row.path,
                     base::format("the registry holds %u plug-ins already", kMaxRegisteredPlugIns));
    return;
  }
  if (parsed.record) {
    indexes.put(PlugInEntry{std::move(parsed.record), row.isExplicit, std::move(row.fingerprint),
                            parsed.digest});
    return;
  }
  if (!parsed.metadata.has_value()) {
    return logUnreadableRow(row.path, parsed.metadata.error().description());
  }
  if (!parsed.entitlements.has_value()) {
    return logUnreadableRow(row.path, parsed.entitlements.error().description());
  }
  ApplicationRecordPtr app;
  if (std::optional<std::string> appPath = containingApplicationPath(row.path)) {
    if (const ApplicationEntry* entry = indexes.applicationAt(*appPath)) {
      app = entry->record;
    } else {
      // Its row is missing (a database edited by hand): read the
      // application now; an empty fingerprint makes the next
      // reconciliation store it.
      ApplicationBundle bundle = readApplicationBundle(*appPath);
      app = makeApplicationRecord(*appPath, bundle.info);
      indexes.putApplication(ApplicationEntry{app, {}, bundle.digest});
    }
  }
  // Containers are made at registration; one removed since is made again.
  std::optional<std::string> container = existingContainers.contains(row.uuid)
                                             ? containers.pathFor(row.uuid)
                                             : containerOrLog(containers, row.uuid, row.path);
  indexes.put(PlugInEntry{recordOf(row, parsed, std::move(app), std::move(container)),
                          row.isExplicit, std::move(row.fingerprint), parsed.digest});
}

base::Result<std::unique_ptr<Watcher>> Omnidex::State::makeWatcher() {
  // The state outlives the watcher: ~Omnidex stops it first.
  return Watcher::create(roots, [this](const std::vector<std::string>& items, bool all) {
    reconcileScope(all ? nullptr : &items);
  });
}

const ScanRoot* Omnidex::State::rootOf(const std::string& item) const {
  const size_t slash = item.rfind('/');
  const std::string parent = slash == 0 ? "/" : item.substr(0, slash);
  for (const ScanRoot& root : roots) {
    if (root.path == parent) return &root;
  }
  return nullptr;
}

void Omnidex::State::reconcileScope(const std::vector<std::string>* items) {
  std::lock_guard write(writeMutex);
  Planner planner(indexes, containers, currentDate());
  // The plug-in bundles found in the scanned scope (sorted once all are
  // in), and the registered plug-ins in it.
  std::vector<std::string> found;
  const auto addFound = [&found](std::vector<std::string> bundles) {
    found.insert(found.end(), std::make_move_iterator(bundles.begin()),
                 std::make_move_iterator(bundles.end()));
  };
  std::vector<const PlugInEntry*> known;
  if (items == nullptr) {
    for (const ScanRoot& root : roots) {
      for (const std::string& item : itemsOf(root)) addFound(bundlesOfItem(root.kind, item));
    }
    for (const auto& [path, entry] : indexes.plugIns()) known.push_back(&entry);
  } else {
    std::set<std::string> seen;
    for (const std::string& item : *items) {
      const ScanRoot* root = rootOf(item);
      if (root == nullptr) continue;
      addFound(bundlesOfItem(root->kind, item));
      for (const PlugInEntry* entry : indexes.plugInsWithin(item)) {
        if (seen.insert(*entry->record->bundlePath).second) known.push_back(entry);
      }
    }
  }
  // Stamping every known bundle's files is most of a scan that finds little
  // new: the stamps are taken on two threads, the decisions made in order.
  std::sort(found.begin(), found.end());
  found.erase(std::unique(found.begin(), found.end()), found.end());
  std::vector<char> inScan(known.size());
  std::vector<char> isKnown(found.size());
  for (size_t i = 0; i < known.size(); ++i) {
    const std::string& path = *known[i]->record->bundlePath;
    const auto it = std::lower_bound(found.begin(), found.end(), path);
    inScan[i] = it != found.end() && *it == path;
    if (inScan[i]) isKnown[static_cast<size_t>(it - found.begin())] = 1;
  }
  std::vector<std::string> stamps(known.size());
  inParallel(known.size(), [&](size_t i) {
    if (inScan[i] || known[i]->isExplicit)
      stamps[i] = plugInFingerprint(*known[i]->record->bundlePath);
  });
  for (size_t i = 0; i < known.size(); ++i) {
    const PlugInEntry* entry = known[i];
    const std::string& path = *entry->record->bundlePath;
    // A plug-in found by a scan goes when the scan no longer finds it; one
    // registered by path stays for as long as its bundle is readable.
    if (!inScan[i] && !entry->isExplicit) {
      planner.drop(*entry);
    } else if (stamps[i] == entry->fingerprint) {
      planner.keep(*entry);
    } else if (base::Result<PlugInBundle> bundle = readPlugInBundle(path); bundle.has_value()) {
      (void)planner.read(std::move(bundle).value(), Origin::kScan);  // cannot fail: not new
    } else {
      logRefusedBundle(bundle.error());
      planner.drop(*entry);
    }
  }
  for (size_t j = 0; j < found.size(); ++j) {
    if (isKnown[j]) continue;
    base::Result<PlugInBundle> bundle = readPlugInBundle(found[j]);
    if (!bundle.has_value()) {
      logRefusedBundle(bundle.error());
      continue;
    }
    base::Result<void> accepted = planner.read(std::move(bundle).value(), Origin::kScan);
    if (!accepted.has_value()) logRefusedBundle(accepted.error());
  }
  (void)apply(planner.finish());  // a failure has been logged; the next scan tries again
}

base::Result<void> Omnidex::State::apply(ChangeSet changes) {
  if (changes.empty()) return base::Result<void>::success();
  base::Result<void> written = store->write(changes.batch);
  if (!written.has_value()) {
    for (const base::Uuid& uuid : changes.madeContainers) (void)containers.remove(uuid);
    base::vtlog("cannot update the application registry: %@", written.error().description());
    return written;
  }
  {
    std::unique_lock index(indexMutex);
    for (const std::string& path : changes.erasedPlugIns) indexes.erase(path);
    for (const std::string& path : changes.erasedApplications) indexes.eraseApplication(path);
    for (ApplicationEntry& entry : changes.putApplications)
      indexes.putApplication(std::move(entry));
    for (PlugInEntry& entry : changes.putPlugIns) indexes.put(std::move(entry));
  }
  for (const base::Uuid& uuid : changes.droppedContainers) {
    base::Result<void> removed = containers.remove(uuid);
    if (!removed.has_value()) {
      base::vtlog("cannot remove the data container at %@: %@", containers.pathFor(uuid),
                  removed.error().description());
    }
  }
  announce(std::move(changes.uninstalled), std::move(changes.installed));
  return base::Result<void>::success();
}

void Omnidex::State::announce(std::vector<PlugInRecordPtr> uninstalled,
                              std::vector<PlugInRecordPtr> installed) {
  if (uninstalled.empty() && installed.empty()) return;
  // The queue is drained before State goes (~Omnidex), so `this` outlives
  // every block.
  announcements->async([this, uninstalled = std::move(uninstalled),
                        installed = std::move(installed)] { deliver(uninstalled, installed); });
}

void Omnidex::State::deliver(const std::vector<PlugInRecordPtr>& uninstalled,
                             const std::vector<PlugInRecordPtr>& installed) {
  std::vector<std::shared_ptr<WorkspaceObserver>> live;
  {
    std::lock_guard lock(observersMutex);
    std::erase_if(observers, [](const std::weak_ptr<WorkspaceObserver>& o) { return o.expired(); });
    for (const std::weak_ptr<WorkspaceObserver>& weak : observers) {
      if (std::shared_ptr<WorkspaceObserver> observer = weak.lock()) live.push_back(observer);
    }
  }
  if (!uninstalled.empty()) {
    for (const auto& observer : live) observer->pluginsWillUninstall(uninstalled);
  }
  if (!installed.empty()) {
    for (const auto& observer : live) observer->pluginsDidInstall(installed);
  }
}

void Omnidex::State::waitForAnnouncements() {
  if (announcements->isCurrent()) return;
  announcements->sync([] {});
}

}  // namespace vantrel::omnidex
