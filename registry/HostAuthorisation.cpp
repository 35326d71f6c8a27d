// Whether a host process may use a plug-in: the host's own restriction, the
// entitlement the plug-in demands of its hosts, and the device's age-rating
// limit on the containing application.

#include "base/Log.h"
#include "model/VTBundle.h"
#include "platform/DeviceRestrictions.h"
#include "platform/PropertyList.h"
#include "registry/VTDPlugIn.h"
#include "registry/VTDatabase.h"

namespace vantrel::registry {

namespace {

constexpr std::string_view kAllowedPlugInsEntitlement =
    "com.karvo.developer.vantrel.allowedplugins";
constexpr std::string_view kHostEntitlementKey = "QXExtensionHostEntitlement";
constexpr const char* kMetadataFileName = "SonaroMetadata.plist";
constexpr int64_t kUnknownRating = -1;

}  // namespace

std::optional<std::string> VTDPlugIn::allowForClient(const VTDHost& host) const {
  const lmo::Value restriction = host.entitlementValueForKey(kAllowedPlugInsEntitlement);
  if (!restriction.isNull()) {
    const lmo::Dictionary* rules = restriction.getIfDictionary();
    if (rules == nullptr) return "invalid host restriction entitlement";
    if (!match(*rules)) return "the host's plug-in entitlement does not allow this plug-in";
  }
  const lmo::Value demanded = pluginKey(kHostEntitlementKey);
  if (!demanded.isNull()) {
    // A name that is not a string is looked up by its description, which no
    // real entitlement carries: the host is refused.
    const std::string* name = demanded.getIfString();
    const std::string key = name ? *name : lmo::describe(demanded);
    if (!host.hasEntitlement(key)) {
      return base::format("the host does not have the \"%@\" entitlement", demanded);
    }
  }
  if (ageRestricted()) return "the containing Application is age restricted";
  return std::nullopt;
}

bool VTDPlugIn::ageRestricted() const {
  const std::optional<int64_t> maximum = platform::maximumApplicationRating();
  if (!maximum) return false;
  return containerAgeRestriction() > *maximum;
}

int64_t VTDPlugIn::containerAgeRestriction() const {
  int64_t cached = containerAgeRestriction_.load();
  if (cached != kRatingNotRead) return cached;
  // A failed lookup leaves "unknown" for the life of the record.
  containerAgeRestriction_.store(kUnknownRating);
  if (!oxproxy_ || !oxproxy_->containingApplication) return kUnknownRating;
  const std::string file =
      oxproxy_->containingApplication->bundleContainerPath + "/" + kMetadataFileName;
  base::Result<lmo::Value> metadata = platform::readPropertyListFile(file);
  if (!metadata.has_value()) return kUnknownRating;
  const lmo::Dictionary* top = metadata.value().getIfDictionary();
  const lmo::Dictionary* rating = top ? top->get("rating").getIfDictionary() : nullptr;
  const lmo::Value rank = rating ? rating->get("rank") : lmo::Value();
  if (rank.isNumeric()) containerAgeRestriction_.store(rank.integerValue());
  return containerAgeRestriction_.load();
}

std::set<std::string> VTDPlugIn::allowedVGLServices() const {
  std::set<std::string> granted;
  const std::optional<model::FileUrl> container = containingUrl();
  if (!container) return granted;
  auto bundle = model::VTBundle::initWithURL(*container);
  const std::optional<std::string> bundleIdentifier =
      bundle ? bundle->bundleIdentifier() : std::nullopt;
  if (!bundle || !bundleIdentifier) {
    base::vtlog("failed to create bundle for %@", path());
    return granted;
  }
  std::shared_ptr<VTDatabase> database = database_.lock();
  auto entries =
      database ? database->workspace()->privacyConsentEntries(*bundleIdentifier) : std::nullopt;
  if (!entries) {
    base::vtlog("VGLAccessCopyInformationForBundle failed for %@", container->path());
    return granted;
  }
  for (const auto& entry : *entries) {
    if (entry.granted) granted.insert(entry.service);
  }
  return granted;
}

}  // namespace vantrel::registry
