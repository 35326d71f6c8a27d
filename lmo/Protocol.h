#pragma once
// The daemon's request protocol in one place: the service name, the protocol
// version, every request type, message key, flag and error code. The daemon,
// the client library, the tools and the tests all spell the protocol with
// these names; docs/protocol.md describes the same table for other languages.
//
// Adding a request is one name here, one row in the daemon's dispatch table
// and its handler file.

#include <cstdint>
#include <string_view>
#include <type_traits>

namespace vantrel::protocol {

// ---- Service and version ----

// The service the daemon listens on unless told otherwise (-S).
inline constexpr const char* kDefaultServiceName = "com.karvo.vantrel.vantreld";
// The version every request carries, and the oldest one still served alike.
inline constexpr uint64_t kCurrentVersion = 3;
inline constexpr uint64_t kOldestVersion = 2;

// ---- Request types ("request") ----

inline constexpr const char* kRequestAdd = "add";
inline constexpr const char* kRequestRemove = "remove";
inline constexpr const char* kRequestBulk = "bulk";
inline constexpr const char* kRequestMatch = "match";
inline constexpr const char* kRequestReady = "ready";
inline constexpr const char* kRequestAccess = "access";
inline constexpr const char* kRequestAnnotate = "annotate";
inline constexpr const char* kRequestLock = "lock";
// Beyond the base requests: why a plug-in is or is not offered to a host,
// and, without a plug-in, the daemon's own state.
inline constexpr const char* kRequestExplain = "explain";

// ---- Envelope and reply keys ----

inline constexpr const char* kKeyRequest = "request";
inline constexpr const char* kKeyVersion = "version";
inline constexpr const char* kKeyErrorCode = "errorcode";
inline constexpr const char* kKeyError = "error";

// ---- Request keys ----

inline constexpr const char* kKeyPaths = "paths";
inline constexpr const char* kKeyUuids = "uuids";
inline constexpr const char* kKeyFlags = "flags";
inline constexpr const char* kKeyRules = "rules";
inline constexpr const char* kKeyAnnotations = "annotations";

// ---- Reply keys ----

// "match": the forms found.
inline constexpr const char* kKeyMatches = "matches";
// "access": one read token per plug-in; in a form: resource path -> token.
inline constexpr const char* kKeyExtensions = "extensions";
// "lock" refused as busy: one map per running plug-in.
inline constexpr const char* kKeyConflicts = "conflicts";
// In a conflict map: the running plug-in's bundle identifier.
inline constexpr const char* kKeyConflictBundleIdentifier = "ExtensionBundleIdentifier";
// Added to match forms: the replacing plug-in's "uuid" on a replaced one,
// and the replaced identifier on the replacing one.
inline constexpr const char* kKeyOverrider = "overrider";
inline constexpr const char* kKeyOverriding = "overriding";

// ---- Plug-in form keys (each element of "matches", and "form" of an
// explanation) ----

inline constexpr std::string_view kFormHubProtocolVersion = "hubProtocolVersion";
inline constexpr std::string_view kFormPath = "path";
inline constexpr std::string_view kFormSystemResident = "systemResident";
inline constexpr std::string_view kFormIdentifier = "identifier";
inline constexpr std::string_view kFormOriginalIdentifier = "original-identifier";
inline constexpr std::string_view kFormVersion = "version";
inline constexpr std::string_view kFormBundleInfo = "bundleInfo";
inline constexpr std::string_view kFormInfo = "info";
inline constexpr std::string_view kFormUuid = "uuid";
inline constexpr std::string_view kFormLastModified = "lastmodified";
inline constexpr std::string_view kFormAnnotations = "annotations";
inline constexpr std::string_view kFormEntitlements = "entitlements";
inline constexpr std::string_view kFormContainingPath = "containingPath";
inline constexpr std::string_view kFormContainingName = "localizedContainingDisplayName";
inline constexpr std::string_view kFormDisplayName = "localizedDisplayName";
inline constexpr std::string_view kFormShortName = "localizedShortName";
inline constexpr std::string_view kFormHash = "hash";
inline constexpr std::string_view kFormRequirement = "requirement";

// ---- Annotation keys (inside "annotations") ----

inline constexpr const char* kAnnotationElection = "election";
inline constexpr const char* kAnnotationExtension = "extension";

// ---- "explain" ----
// Request: at most one of uuid, path, identifier names the plug-in (none:
// the daemon's status); pid or hostpath names the host (default: the
// sender); rules and flags as "match".
inline constexpr const char* kKeyUuid = "uuid";
inline constexpr const char* kKeyPath = "path";
inline constexpr const char* kKeyIdentifier = "identifier";
inline constexpr const char* kKeyPid = "pid";
inline constexpr const char* kKeyHostPath = "hostpath";
// Reply without a plug-in: "status", a map of the keys below.
inline constexpr const char* kKeyStatus = "status";
inline constexpr const char* kKeyInstalled = "installed";
inline constexpr const char* kKeyHolds = "holds";
// Reply with one: "plugins", one explanation per registration the name
// selects (an identifier may select several; none selects an empty list
// plus "reason" at the top level).
inline constexpr const char* kKeyPlugIns = "plugins";
// An explanation, and a hold in "holds".
inline constexpr const char* kKeyOffered = "offered";
inline constexpr const char* kKeyReason = "reason";
inline constexpr const char* kKeyText = "text";
inline constexpr const char* kKeySteps = "steps";
inline constexpr const char* kKeyFilter = "filter";
inline constexpr const char* kKeyPassed = "passed";
inline constexpr const char* kKeyForm = "form";
inline constexpr const char* kKeyEntitlements = "entitlements";
inline constexpr const char* kKeyContainer = "container";
inline constexpr const char* kKeyHold = "hold";
inline constexpr const char* kKeyToken = "token";
inline constexpr const char* kKeyPlugInCount = "plugincount";
inline constexpr const char* kKeyCreated = "created";
inline constexpr const char* kKeyBeatenBy = "beatenby";
inline constexpr const char* kKeyRule = "rule";
inline constexpr const char* kKeyExclusion = "exclusion";
inline constexpr const char* kKeyElection = "election";

// Why a plug-in is not offered ("reason"), the first filter it fails in
// match's order; "offered" when it passes them all.
inline constexpr const char* kReasonOffered = "offered";
inline constexpr const char* kReasonNotInstalled = "not-installed";
inline constexpr const char* kReasonNotRegistered = "not-registered";
inline constexpr const char* kReasonMisconfigured = "misconfigured";
inline constexpr const char* kReasonElection = "election";
inline constexpr const char* kReasonLocation = "location";
inline constexpr const char* kReasonDedicated = "dedicated";
inline constexpr const char* kReasonOnHold = "on-hold";
inline constexpr const char* kReasonRules = "rules";
inline constexpr const char* kReasonExcluded = "excluded";
inline constexpr const char* kReasonHostAuthorisation = "host-authorisation";
inline constexpr const char* kReasonDuplicate = "duplicate";

// The filters of an explanation's "steps", in the order match applies them.
inline constexpr const char* kFilterElection = "election";
inline constexpr const char* kFilterLocation = "location";
inline constexpr const char* kFilterDedication = "dedication";
inline constexpr const char* kFilterHold = "hold";
inline constexpr const char* kFilterRules = "rules";
inline constexpr const char* kFilterExclusions = "exclusions";
inline constexpr const char* kFilterAuthorisation = "authorisation";
inline constexpr const char* kFilterDuplicates = "duplicates";

// How a duplicate lost ("rule" in "beatenby").
inline constexpr const char* kRuleHigherVersion = "higher-version";
inline constexpr const char* kRuleSystemVolume = "system-volume";
inline constexpr const char* kRuleMoreRecent = "more-recent";
// Equal in all of the above: the registration found first is kept.
inline constexpr const char* kRuleFoundFirst = "found-first";

// ---- Error codes ("errorcode") ----
// Never 0: a client reads 0 or a missing code as success.
enum ErrorCode : int64_t {
  kErrorRegistryRefused = 2,  // the application registry refused (un)registration
  kErrorBadRequest = 4,       // malformed or unserviceable request; transport failure
  kErrorVersionMismatch = 7,  // protocol or database version mismatch
  kErrorBadPath = 9,          // bad or unknown path
  kErrorAccessDenied = 11,    // access refused
  kErrorInvalidPlugIn = 12,   // the plug-in's own configuration is invalid
  kErrorBusy = 14,            // plug-ins are busy
};

// ---- Entitlements and notifications ----

// Grants privileged discovery (DiscoveryFlags::kAll) and explaining for
// another process.
inline constexpr std::string_view kManagerEntitlement = "com.karvo.private.vantrel.manager";
// Posted without payload after every annotation change and every hold taken
// or released.
inline constexpr std::string_view kAnnotationChangeNotification =
    "com.karvo.vantrel.annotation-change";

// ---- Flags ----

// "match" (and "explain"): bits of "flags"; other bits are ignored.
enum class DiscoveryFlags : uint64_t {
  kNone = 0,
  // Keep registrations of one identifier that differ in version.
  kVersions = 0x1,
  // With kVersions: keep registrations of one identifier and version too.
  kDuplicates = 0x4,
  // Only plug-ins on the system volume.
  kSystemOnly = 0x8,
  // Privileged: skip the location, dedication, hold and authorisation
  // filters (kManagerEntitlement, not sandboxed).
  kAll = 0x200,
};

// "lock", take form: what each path names.
enum class HoldFlags : uint64_t {
  kNone = 0,
  // An application bundle: hold every plug-in in it (refused while one runs).
  kApplication = 1,
  // A plug-in bundle: hold that plug-in.
  kPlugIn = 2,
};

template <typename Flags>
concept FlagEnum = std::is_same_v<Flags, DiscoveryFlags> || std::is_same_v<Flags, HoldFlags>;

template <FlagEnum Flags>
constexpr uint64_t bits(Flags flags) {
  return static_cast<uint64_t>(flags);
}
template <FlagEnum Flags>
constexpr Flags operator|(Flags a, Flags b) {
  return static_cast<Flags>(bits(a) | bits(b));
}
template <FlagEnum Flags>
constexpr Flags operator&(Flags a, Flags b) {
  return static_cast<Flags>(bits(a) & bits(b));
}
// Whether every bit of wanted is set in flags.
template <FlagEnum Flags>
constexpr bool has(Flags flags, Flags wanted) {
  return (bits(flags) & bits(wanted)) == bits(wanted);
}

}  // namespace vantrel::protocol
