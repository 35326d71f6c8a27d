#pragma once
// Omnidex: the application registry the daemon runs on.
//
// Its durable truth is one SQLite database, "registry.sqlite3" in the state
// directory; lookups are answered from in-memory indexes (by UUID, bundle
// path, extension point and plug-in identifier) loaded at open. The file
// system feeds it: at startMonitoring() it reconciles the application and
// plug-in directories with the store, then follows them with inotify so that
// an application copied in or deleted is announced within a second.
// Plug-ins registered explicitly by path may live anywhere and survive
// restarts. The same database keeps the user's privacy-consent answers per
// application (omnidex/ConsentStore.h).

#include <memory>
#include <string>
#include <vector>

#include "base/Result.h"
#include "omnidex/Workspace.h"

namespace vantrel::omnidex {

struct OmnidexConfig {
  std::string stateDirectory;                       // holds registry.sqlite3 and containers/
  std::vector<std::string> applicationDirectories;  // hold *.app bundles
  std::vector<std::string> plugInDirectories;       // hold stand-alone plug-in bundles
  // Set when startMonitoring() will follow: the watches then go in on a
  // second thread while the stored registry loads, rather than after it.
  bool followChanges = false;

  // VANTREL_STATE_DIR (platform::stateDirectory()), VANTREL_APP_DIRS
  // (default "/Applications:<system>/Applications") and VANTREL_PLUGIN_DIRS
  // (default "<system>/Library/PlugIns"), colon-separated, where <system> is
  // platform::systemVolumeDirectory() ("/System").
  static OmnidexConfig fromEnvironment();
};

class Omnidex final : public Workspace {
 public:
  // Opens (creating when needed) the store and loads its indexes; nothing is
  // scanned or watched until startMonitoring(). Errors: the state directory
  // cannot be made, the database cannot be opened, or its schema version is
  // not the one this build reads.
  static base::Result<std::shared_ptr<Omnidex>> open(const OmnidexConfig& config);

  // The process's registry, opened from the environment on first use and
  // kept for the life of the process; null (after a log line saying why)
  // when it cannot be opened.
  static std::shared_ptr<Workspace> defaultWorkspace();

  // Stops watching (waiting for a rescan in progress) and delivers the
  // announcements still queued. Must not run inside an observer callback:
  // the announcement thread cannot wait for itself.
  ~Omnidex() override;

  // Workspace.
  void addObserver(std::weak_ptr<WorkspaceObserver> observer) override;
  void startMonitoring() override;
  std::optional<std::vector<PlugInRecordPtr>> installedPlugIns() override;
  std::optional<std::vector<PlugInRecordPtr>> plugInsMatchingQuery(
      const lmo::Dictionary& query, const PlugInFilter& filter) override;
  PlugInRecordPtr plugInForUuid(const base::Uuid& uuid) override;
  PlugInRecordPtr plugInForUrl(const std::string& path) override;
  ApplicationLookup applicationForUrl(const std::string& path) override;
  base::Result<void> registerPlugIn(const std::string& path) override;
  base::Result<void> unregisterPlugIn(const std::string& path) override;
  void clearCaches() override;
  std::optional<std::vector<ConsentEntry>> privacyConsentEntries(
      const std::string& appBundleIdentifier) override;

  // Records that the user granted (revoked) the service to the application
  // with that bundle identifier, now, replacing an earlier answer. The
  // application need not be installed: consent belongs to its identifier.
  // Errors (domain "Omnidex"), with the store left as it was:
  // kOmnidexBadIdentifier for an empty identifier, one longer than
  // kMaxConsentIdentifierLength or holding a NUL character; kOmnidexFull
  // for a new answer beyond the limits of omnidex/Limits.h;
  // kOmnidexStoreFailed.
  base::Result<void> grantConsent(const std::string& appBundleIdentifier,
                                  const std::string& serviceIdentifier);
  base::Result<void> revokeConsent(const std::string& appBundleIdentifier,
                                   const std::string& serviceIdentifier);

  // Brings the store up to date with the watched directories (and checks
  // every plug-in registered by path) now, announcing what changed, and
  // returns when the announcements have been delivered (called from an
  // observer, it returns without waiting). startMonitoring() runs it once;
  // tests and tools call it directly.
  void reconcile();

 private:
  Omnidex() = default;
  struct State;
  std::unique_ptr<State> state_;
};

}  // namespace vantrel::omnidex
