#pragma once
// The application registry as its users see it: which plug-ins and
// applications are installed, lookups, registration, and announcements of
// installs and uninstalls. Omnidex (Omnidex.h) is the implementation the
// daemon runs on; the interface keeps its users independent of how the
// registry stores and discovers bundles.
//
// Every operation may be called from any thread. Lookups answer from the
// registry's current state.

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/Result.h"
#include "omnidex/PrivacyConsent.h"
#include "omnidex/Records.h"

namespace vantrel::omnidex {

// Told about plug-ins arriving and leaving. Called on a thread of the
// registry's own, one announcement at a time, in the order the changes
// happened, and never while a registry lock is held: an observer may call
// back into the registry's lookups.
class WorkspaceObserver {
 public:
  virtual ~WorkspaceObserver() = default;
  // The plug-ins have been registered and can be looked up.
  virtual void pluginsDidInstall(const std::vector<PlugInRecordPtr>& records) = 0;
  // The plug-ins are going. The registry forgets them before it announces
  // them, so an observer that drops what it built from them cannot have it
  // rebuilt from a lookup racing the announcement.
  virtual void pluginsWillUninstall(const std::vector<PlugInRecordPtr>& records) = 0;
};

// Keeps or drops one candidate of a query, given its identifier (empty when
// it has none) and its entitlements. Applied before the caller builds
// anything from the candidate.
using PlugInFilter =
    std::function<bool(const std::string& identifier, const lmo::Dictionary& entitlements)>;

class Workspace {
 public:
  virtual ~Workspace() = default;

  // Adds an observer, held weakly: a destroyed observer is skipped.
  virtual void addObserver(std::weak_ptr<WorkspaceObserver> observer) = 0;
  // Brings the registry up to date with the file system, announcing what
  // changed to the observers added so far, then keeps following the file
  // system. Idempotent: later calls do nothing.
  virtual void startMonitoring() = 0;

  // Every registered plug-in; nullopt only when the registry cannot answer.
  virtual std::optional<std::vector<PlugInRecordPtr>> installedPlugIns() = 0;
  // The plug-ins that may match query, each passed through filter first. The
  // registry narrows the candidates by "QXExtensionPointIdentifier" and
  // "QXExtensionIdentifier" when their patterns are plain strings (or arrays
  // of them) without an operator prefix; every other key is the caller's to
  // match. The result is a superset of the plug-ins the query selects.
  // filter runs on the calling thread with no registry lock held, so it may
  // call back into the registry; an empty filter keeps every candidate.
  virtual std::optional<std::vector<PlugInRecordPtr>> plugInsMatchingQuery(
      const lmo::Dictionary& query, const PlugInFilter& filter) = 0;
  virtual PlugInRecordPtr plugInForUuid(const base::Uuid& uuid) = 0;
  // path: a plug-in bundle's path; it is made absolute and lexically normal
  // before the lookup.
  virtual PlugInRecordPtr plugInForUrl(const std::string& path) = 0;

  struct ApplicationLookup {
    ApplicationRecordPtr application;      // null when the path is not known
    std::vector<PlugInRecordPtr> plugIns;  // the application's plug-ins, by path
  };
  virtual ApplicationLookup applicationForUrl(const std::string& path) = 0;

  // Registers the plug-in bundle at path (or re-reads it when it is
  // registered already) and announces it as installed; the announcement is
  // posted, not waited for. Errors say why the bundle was refused; a refused
  // bundle leaves the registry as it was.
  virtual base::Result<void> registerPlugIn(const std::string& path) = 0;
  // Forgets the plug-in at path, removes its data container and announces it
  // as uninstalling. An error when the path is not registered.
  virtual base::Result<void> unregisterPlugIn(const std::string& path) = 0;
  // Drops whatever the registry caches beyond its indexes.
  virtual void clearCaches() = 0;

  // The user's privacy-consent answers for the application with that bundle
  // identifier, in service identifier order; empty when there are none.
  // nullopt when the registry cannot answer (its store cannot be read).
  virtual std::optional<std::vector<ConsentEntry>> privacyConsentEntries(
      const std::string& appBundleIdentifier) = 0;
};

}  // namespace vantrel::omnidex
