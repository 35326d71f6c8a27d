#pragma once
// The daemon's plug-in record: a VTPlugInCore built from the application
// registry's record of an installed plug-in. It keeps that registry record
// for its whole life and answers every metadata lookup through it, so nothing
// of the bundle's Info dictionary is copied at construction and every reader
// sees the registry's current snapshot of the plug-in.

#include <atomic>
#include <climits>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <string_view>

#include "base/Error.h"
#include "lmo/Value.h"
#include "model/VTPlugInCore.h"
#include "omnidex/Records.h"
#include "omnidex/Workspace.h"
#include "platform/ProcessAssertions.h"
#include "registry/VTDHost.h"

namespace vantrel::registry {

// An entitlement whose string value names the plug-in this one replaces: the
// two share one annotation (and so one election).
inline constexpr std::string_view kReplacePlugInEntitlement = "com.karvo.developer.replace-plugin";
// An entitlement that has the plug-in elected automatically when its record
// is built.
inline constexpr std::string_view kAutoElectEntitlement = "com.karvo.developer.auto-elect-plugin";
// Extension dictionary key that sets the hub protocol version.
inline constexpr std::string_view kHubProtocolVersionKey = "HubProtocolVersion";

class VTDatabase;

// While one lives on a thread, "unrecognized match operator:<pattern>" is
// logged at most once there. Scopes nest; the outermost one counts.
class MatchLogOnce {
 public:
  MatchLogOnce();
  ~MatchLogOnce();
  MatchLogOnce(const MatchLogOnce&) = delete;
  MatchLogOnce& operator=(const MatchLogOnce&) = delete;

  // Whether the line may be written now (and counts it).
  static bool mayLog();

 private:
  bool outermost_;
};

class VTDPlugIn : public model::VTPlugInCore {
 public:
  // Hub protocol versions of plug-ins that do not declare one.
  static constexpr uint32_t kOldStyleHubProtocolVersion = 1;
  static constexpr uint32_t kDefaultHubProtocolVersion = 2;

  // Builds the record of one registry record. Null when the registry record
  // has no bundle path (silently), when it has no identifier (the base logs
  // "missing identifier in plug-in at %@"), or when the plug-in is
  // mis-configured: then "ignoring mis-configured plug-in at %@: %@" is logged
  // with the bundle path and the reason. Runs on the database queue; the
  // record is complete before anyone else sees it.
  static std::shared_ptr<VTDPlugIn> initWithOXData(omnidex::PlugInRecordPtr record);
  // Why initWithOXData makes no record of this registry record: the
  // validation error of a mis-configured plug-in, or code 12 "missing
  // identifier or bundle"; nullopt when it makes one. Logs nothing.
  static std::optional<base::Error> recordProblem(const omnidex::PlugInRecordPtr& record);

  // ---- Metadata, through the registry record ----
  // A record that has no registry record (one made from a form) answers from
  // its own fields, as the base does.

  // The registry record's keyed lookup: the Info dictionary (falling back to
  // the extension dictionary for a key absent there), the extension
  // dictionary, and the attributes dictionary.
  lmo::Value infoKey(std::string_view key) const override;
  lmo::Value pluginKey(std::string_view key) const override;
  lmo::Value attribute(std::string_view key) const override;
  // The registry record's Info dictionary, not the stored field (which stays
  // empty for records built from registry data).
  std::optional<lmo::Dictionary> bundleInfoDictionary() const override;

  // The base's rules, then: a plug-in that is not data-only needs a data
  // container, and a plug-in outside an application must lie on the system
  // volume (platform::isOnSystemVolume). Code 12, as the base.
  std::optional<base::Error> diagnose() const override;

  // ---- Display names ----
  // Each is fetched from the registry record on its first read and kept; a
  // value set before the first read wins, and setting null makes the next
  // read fetch again. Safe to call from any thread.

  std::optional<std::string> localizedName() const override;
  void setLocalizedName(std::optional<std::string> name) override;
  std::optional<std::string> localizedShortName() const override;
  void setLocalizedShortName(std::optional<std::string> name) override;
  // The containing application's name; null for a stand-alone plug-in.
  std::optional<std::string> localizedContainingName() const override;
  void setLocalizedContainingName(std::optional<std::string> name) override;

  // ---- Entitlements and annotations ----

  // The entitlement's value, or null.
  lmo::Value valueForEntitlement(std::string_view name) const;
  // The entitlement exists and is not false (a number 0 counts as false;
  // strings, containers and other numbers count as granted).
  bool hasEntitlement(std::string_view name) const;
  // Where the annotation store keeps this plug-in's annotation: the string
  // value of the replace-plugin entitlement, else the identifier. Null only
  // for a record that has neither.
  std::optional<std::string> annotationKey() const;

  // ---- Match rules ----
  // A rule dictionary maps keys naming a property of the plug-in to patterns
  // that property must satisfy; every key must hold. See docs/match-rules.md.
  // Nothing here fails: a value or pattern of an unexpected kind fails the
  // key. Callable from any thread; "QXUserElection" enters the database's
  // queue, so not from that queue.

  // Every key of rules holds; absent or empty rules match every plug-in.
  bool match(const std::optional<lmo::Dictionary>& rules) const;
  // One key of a rule dictionary against its pattern.
  bool matchKey(std::string_view key, const lmo::Value& pattern) const;
  // A string value against one operator pattern or an array of them (any).
  bool matchValuePatterns(std::string_view value, const lmo::Value& patterns) const;
  // A string value against one operator pattern.
  bool matchValuePattern(std::string_view value, std::string_view pattern) const;
  // The value as an activation rule, the pattern as the host's extension
  // items.
  bool matchDictionary(const lmo::Value& value, const lmo::Dictionary& pattern) const;
  // The election as "QXUserElection" tests it: the stored election (0 when
  // none) with bits 8 to 15 cleared, as signed 32-bit decimal text.
  std::string electionText() const;

  // The database whose annotations hold this record's election; set by the
  // database that builds the record, before it is shared.
  void setDatabase(std::weak_ptr<VTDatabase> database) { database_ = std::move(database); }

  // ---- Host authorisation ----
  // Called on the service queue. Nothing here fails: missing files, keys or
  // services mean no restriction.

  // Null when host may use the plug-in, else why not: the host's own
  // allowed-plug-ins restriction, the entitlement the plug-in demands of its
  // hosts, then the device's rating limit on the containing application.
  std::optional<std::string> allowForClient(const VTDHost& host) const;
  // The containing application's rating is above the device's limit (read
  // afresh on every call).
  bool ageRestricted() const;
  // The containing application's rating from its bundle container's
  // metadata file, read once per record; -1 when unknown.
  int64_t containerAgeRestriction() const;
  // The privacy-consent services granted to the containing application.
  std::set<std::string> allowedVGLServices() const;

  // ---- Access and enabling ----

  // A read token per resource path (a string or an array of strings,
  // relative to the bundle; "." is the bundle itself). Resources that get
  // no token are left out, with a log line.
  lmo::Dictionary issueResourceExtensions(const lmo::Value& resources) const;
  // Adds "extensions" to a form: tokens for the bundle of an application
  // extension, or for the resources its "Shared" key lists.
  void augmentForm(lmo::Dictionary& form) const;
  // Registers the plug-in as an external service that the host process pid
  // (named for certain by hostPidfd) may launch, with its environment and
  // sandbox profile. Null on success, else a code 4 error.
  std::optional<base::Error> enableForPid(pid_t pid, int hostPidfd) const;

  // ---- Busy check ----

  // Null when no instance of the plug-in runs; otherwise a conflict entry
  // naming the running bundle under protocol::kKeyConflictBundleIdentifier.
  // An instance of any registered bundle with this plug-in's bundle
  // identifier counts, so registry is asked for those bundles. Scans /proc:
  // call it where a request may wait for that (the service queue). A caller
  // that checks several plug-ins passes one snapshot of the processes.
  std::optional<lmo::Dictionary> checkBusy(omnidex::Workspace& registry) const;
  std::optional<lmo::Dictionary> checkBusy(omnidex::Workspace& registry,
                                           const platform::ProcessSnapshot& processes) const;

  // Every entry of info whose key does not begin with "DT" (case-sensitive);
  // empty for null.
  static lmo::Dictionary prunedInfoDictionaryFor(const std::optional<lmo::Dictionary>& info);

  // The registry record. Set once, by initWithOXData, before the record is
  // shared; setOxproxy is not safe against concurrent readers.
  const omnidex::PlugInRecordPtr& oxproxy() const { return oxproxy_; }
  void setOxproxy(omnidex::PlugInRecordPtr record) { oxproxy_ = std::move(record); }

 private:
  // The record of a registry record before validation; null without a
  // bundle path or identifier.
  static std::shared_ptr<VTDPlugIn> fromOXData(const omnidex::PlugInRecordPtr& record);

  using NameFetch = std::optional<std::string> (*)(const omnidex::PlugInRecord&);
  // The stored name in field, or (when none is stored) the registry's,
  // which is stored unless a setter got there first.
  std::optional<std::string> lazyName(std::optional<std::string>& field, NameFetch fetch) const;

  omnidex::PlugInRecordPtr oxproxy_;    // Constant once the record is shared.
  std::weak_ptr<VTDatabase> database_;  // Constant once the record is shared.

  // The containing application's rating: kRatingNotRead until first read.
  // Atomic so that a racing first read costs a second file read, no more.
  static constexpr int64_t kRatingNotRead = INT64_MIN;
  mutable std::atomic<int64_t> containerAgeRestriction_{kRatingNotRead};

  // Guards the three names below: a first read stores what it fetched while
  // other threads may read or set the same field.
  mutable std::mutex namesMutex_;
  mutable std::optional<std::string> localizedName_;
  mutable std::optional<std::string> localizedShortName_;
  mutable std::optional<std::string> localizedContainingName_;
  // The bundle's canonical path, resolved for its first token and kept (a
  // changed bundle is a new record): nullopt until then, and empty when it
  // is the bundle's path itself, as it nearly always is, so that most
  // records keep no second copy. Guarded by namesMutex_.
  mutable std::optional<std::string> canonicalBundlePath_;
};

using VTDPlugInPtr = std::shared_ptr<VTDPlugIn>;

}  // namespace vantrel::registry
