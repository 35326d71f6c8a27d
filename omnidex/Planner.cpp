#include "omnidex/Planner.h"

#include <utility>

#include "base/Log.h"
#include "omnidex/BundlePaths.h"
#include "omnidex/Errors.h"
#include "omnidex/Limits.h"
#include "omnidex/RecordFactory.h"

namespace vantrel::omnidex {
namespace {

PlugInRow rowFor(const PlugInBundle& bundle, const PlugInIdentity& identity, bool isExplicit) {
  return PlugInRow{bundle.path,
                   identity.uuid,
                   bundle.metadata.identifier,
                   identity.originalIdentifier,
                   bundle.infoBytes,
                   bundle.entitlementsBytes,
                   identity.registrationDate.secondsSince1970,
                   isExplicit,
                   bundle.fingerprint};
}

}  // namespace

base::Result<void> Planner::read(PlugInBundle bundle, Origin origin) {
  const PlugInEntry* existing = indexes_.plugInAt(bundle.path);
  Decision decision;
  decision.existing = existing;
  decision.isExplicit = origin == Origin::kRegistration || (existing && existing->isExplicit);
  if (existing == nullptr) {
    if (indexes_.size() + newCount_ >= kMaxRegisteredPlugIns) {
      return omnidexError(kOmnidexFull,
                          base::format("the registry holds %u plug-ins already; not registering "
                                       "the plug-in at %@",
                                       kMaxRegisteredPlugIns, bundle.path));
    }
    ++newCount_;
    decision.kind = Kind::kNew;
  } else if (existing->digest != bundle.digest) {
    decision.kind = Kind::kReplace;
  } else {
    decision.kind = Kind::kRefresh;
    decision.announce = origin == Origin::kRegistration;
  }
  std::string path = bundle.path;
  decision.bundle = std::move(bundle);
  decisions_.insert_or_assign(std::move(path), std::move(decision));
  return base::Result<void>::success();
}

void Planner::drop(const PlugInEntry& entry) {
  decisions_.insert_or_assign(*entry.record->bundlePath, Decision{Kind::kDrop, &entry});
}

void Planner::keep(const PlugInEntry& entry) {
  // A scan keeps bundles in path order: the end is the hint.
  decisions_.insert_or_assign(decisions_.end(), *entry.record->bundlePath,
                              Decision{Kind::kKeep, &entry, std::nullopt, entry.isExplicit});
}

bool Planner::applicationStillNeeded(const std::string& appPath, bool keptByThisChange) const {
  if (keptByThisChange) return true;
  for (const PlugInRecordPtr& record : indexes_.plugInsOfApplication(appPath)) {
    if (!decisions_.contains(*record->bundlePath)) return true;
  }
  return false;
}

void Planner::resolveApplication(const std::string& appPath, bool keptByThisChange,
                                 ChangeSet& changes) {
  const ApplicationEntry* existing = indexes_.applicationAt(appPath);
  if (!applicationStillNeeded(appPath, keptByThisChange)) {
    applications_[appPath] = nullptr;
    if (existing != nullptr) {
      changes.batch.removedApplications.push_back(appPath);
      changes.erasedApplications.push_back(appPath);
    }
    return;
  }
  if (existing != nullptr && existing->fingerprint == applicationFingerprint(appPath)) {
    applications_[appPath] = existing->record;
    return;
  }
  ApplicationBundle bundle = readApplicationBundle(appPath);
  ApplicationEntry entry;
  // The same content under a new fingerprint (touched, copied over with the
  // same bytes) keeps the record, so nothing is announced for it.
  entry.record = existing != nullptr && existing->digest == bundle.digest
                     ? existing->record
                     : makeApplicationRecord(appPath, bundle.info);
  entry.fingerprint = bundle.fingerprint;
  entry.digest = bundle.digest;
  applications_[appPath] = entry.record;
  changes.batch.applications.push_back(
      ApplicationRow{appPath, std::move(bundle.infoBytes), entry.fingerprint});
  changes.putApplications.push_back(std::move(entry));
}

ApplicationRecordPtr Planner::applicationFor(const std::string& path) const {
  std::optional<std::string_view> appPath = containingApplicationPathView(path);
  if (!appPath) return nullptr;
  auto it = applications_.find(*appPath);
  return it == applications_.end() ? nullptr : it->second;
}

std::optional<std::string> Planner::makeContainer(const base::Uuid& uuid, const std::string& path,
                                                  ChangeSet& changes) {
  base::Result<std::string> container = containers_.ensure(uuid);
  if (!container.has_value()) {
    base::vtlog("cannot create the data container of plug-in at %@: %@", path,
                container.error().description());
    return std::nullopt;
  }
  changes.madeContainers.push_back(uuid);
  return container.value();
}

void Planner::putNew(const std::string& path, const Decision& decision, ChangeSet& changes) {
  const PlugInBundle& bundle = *decision.bundle;
  const PlugInIdentity identity{base::Uuid::random(), bundle.metadata.identifier, now_};
  std::optional<std::string> container = makeContainer(identity.uuid, path, changes);
  PlugInRecordPtr record = makePlugInRecord(path, bundle.metadata, bundle.entitlements, identity,
                                            applicationFor(path), std::move(container));
  changes.batch.plugIns.push_back(rowFor(bundle, identity, decision.isExplicit));
  changes.putPlugIns.push_back(
      PlugInEntry{record, decision.isExplicit, bundle.fingerprint, bundle.digest});
  changes.installed.push_back(std::move(record));
}

void Planner::putReplacement(const std::string& path, const Decision& decision,
                             ChangeSet& changes) {
  const PlugInBundle& bundle = *decision.bundle;
  const PlugInRecord& old = *decision.existing->record;
  const bool sameIdentifier = old.identifier == bundle.metadata.identifier;
  PlugInIdentity identity{base::Uuid::random(), bundle.metadata.identifier, now_};
  std::optional<std::string> container;
  if (sameIdentifier) {
    identity.uuid = old.uuid;
    identity.originalIdentifier = old.originalIdentifier.value_or(bundle.metadata.identifier);
    container = old.dataContainerPath;
  } else {
    // Another plug-in now lives at this path: it gets its own identity and
    // a fresh container, and the old one's container goes with it.
    changes.droppedContainers.push_back(old.uuid);
  }
  if (!container) container = makeContainer(identity.uuid, path, changes);
  PlugInRecordPtr record = makePlugInRecord(path, bundle.metadata, bundle.entitlements, identity,
                                            applicationFor(path), std::move(container));
  changes.batch.plugIns.push_back(rowFor(bundle, identity, decision.isExplicit));
  changes.putPlugIns.push_back(
      PlugInEntry{record, decision.isExplicit, bundle.fingerprint, bundle.digest});
  changes.uninstalled.push_back(decision.existing->record);
  changes.installed.push_back(std::move(record));
}

void Planner::putRefresh(const Decision& decision, ChangeSet& changes) {
  const PlugInEntry& existing = *decision.existing;
  const PlugInBundle& bundle = *decision.bundle;
  ApplicationRecordPtr app = applicationFor(*existing.record->bundlePath);
  const bool moved = existing.record->containingApplication != app;
  PlugInRecordPtr record = existing.record;
  if (decision.announce || moved) {
    record = rebuildPlugInRecord(*existing.record, app,
                                 decision.announce ? std::optional(now_) : std::nullopt);
  }
  const bool rowChanged = decision.announce || existing.fingerprint != bundle.fingerprint ||
                          existing.isExplicit != decision.isExplicit;
  if (rowChanged) {
    changes.batch.plugInUpdates.push_back(PlugInRowUpdate{
        bundle.path, record->registrationDate.value_or(lmo::Date{}).secondsSince1970,
        decision.isExplicit, bundle.fingerprint});
  }
  if (rowChanged || moved) {
    changes.putPlugIns.push_back(
        PlugInEntry{record, decision.isExplicit, bundle.fingerprint, bundle.digest});
  }
  if (moved) changes.uninstalled.push_back(existing.record);
  if (moved || decision.announce) changes.installed.push_back(std::move(record));
}

void Planner::rehome(const PlugInEntry& entry, ChangeSet& changes) {
  ApplicationRecordPtr app = applicationFor(*entry.record->bundlePath);
  if (entry.record->containingApplication == app) return;
  PlugInRecordPtr record = rebuildPlugInRecord(*entry.record, app);
  changes.putPlugIns.push_back(
      PlugInEntry{record, entry.isExplicit, entry.fingerprint, entry.digest});
  changes.uninstalled.push_back(entry.record);
  changes.installed.push_back(std::move(record));
}

void Planner::plan(const std::string& path, Decision& decision, ChangeSet& changes) {
  switch (decision.kind) {
    case Kind::kNew:
      putNew(path, decision, changes);
      return;
    case Kind::kReplace:
      putReplacement(path, decision, changes);
      return;
    case Kind::kRefresh:
      putRefresh(decision, changes);
      return;
    case Kind::kKeep:
      rehome(*decision.existing, changes);
      return;
    case Kind::kDrop:
      changes.batch.removedPlugIns.push_back(path);
      changes.erasedPlugIns.push_back(path);
      changes.droppedContainers.push_back(decision.existing->record->uuid);
      changes.uninstalled.push_back(decision.existing->record);
      return;
  }
}

ChangeSet Planner::finish() {
  ChangeSet changes;
  // Application path -> whether a plug-in of this change stays in it.
  std::map<std::string, bool, std::less<>> appPaths;
  for (const auto& [path, decision] : decisions_) {
    if (std::optional<std::string_view> app = containingApplicationPathView(path)) {
      auto it = appPaths.lower_bound(*app);
      if (it == appPaths.end() || it->first != *app) it = appPaths.emplace_hint(it, *app, false);
      it->second |= decision.kind != Kind::kDrop;
    }
  }
  for (const auto& [appPath, kept] : appPaths) resolveApplication(appPath, kept, changes);
  for (auto& [path, decision] : decisions_) plan(path, decision, changes);
  // The application's other plug-ins carry its record too.
  for (const auto& app : appPaths) {
    const std::string& appPath = app.first;
    for (const PlugInEntry* entry : indexes_.plugInsWithin(appPath)) {
      const std::string& path = *entry->record->bundlePath;
      if (!decisions_.contains(path) && containingApplicationPathView(path) == appPath) {
        rehome(*entry, changes);
      }
    }
  }
  return changes;
}

}  // namespace vantrel::omnidex
