#include "platform/ServiceTable.h"

#include <climits>

#include "platform/Paths.h"
#include "platform/PropertyList.h"

namespace vantrel::platform {
namespace {

constexpr const char* kFormatVersionKey = "formatVersion";
constexpr const char* kServicesKey = "services";
constexpr const char* kBundleIdentifierKey = "bundleIdentifier";
constexpr const char* kVersionKey = "version";
constexpr const char* kPidKey = "pid";
constexpr const char* kExecutableKey = "executable";
constexpr const char* kDescriptionKey = "description";

base::Error malformed(const char* what) {
  return base::Error{kPropertyListErrorDomain, kPropertyListMalformed, what};
}

std::optional<ExternalServiceRegistration> decodeEntry(const lmo::Value& entry) {
  const lmo::Dictionary* d = entry.getIfDictionary();
  if (d == nullptr) return std::nullopt;
  const std::string* bundleIdentifier = d->get(kBundleIdentifierKey).getIfString();
  const std::string* version = d->get(kVersionKey).getIfString();
  const std::optional<int64_t> pid = d->get(kPidKey).getIfInt64();
  const std::string* executable = d->get(kExecutableKey).getIfString();
  const lmo::Dictionary* description = d->get(kDescriptionKey).getIfDictionary();
  if (!bundleIdentifier || !version || !pid || !executable || !description) return std::nullopt;
  if (*pid <= 0 || *pid > INT_MAX) return std::nullopt;
  ExternalServiceRegistration r{*bundleIdentifier, *version, static_cast<pid_t>(*pid), *executable,
                                *description};
  if (!isValidRegistration(r)) return std::nullopt;
  return r;
}

}  // namespace

bool isSameService(const ExternalServiceRegistration& a, const ExternalServiceRegistration& b) {
  return a.bundleIdentifier == b.bundleIdentifier && a.version == b.version &&
         a.hostPid == b.hostPid;
}

bool isValidRegistration(const ExternalServiceRegistration& r) {
  return isSinglePathComponent(r.bundleIdentifier, kMaxPublishedBundleIdentifierLength) &&
         r.hostPid > 0 && !r.executablePath.empty() && r.executablePath.front() == '/';
}

lmo::Value encodeServiceTable(const std::vector<ExternalServiceRegistration>& table) {
  std::vector<lmo::Value> services;
  services.reserve(table.size());
  for (const ExternalServiceRegistration& r : table) {
    services.emplace_back(lmo::Dictionary{
        {kBundleIdentifierKey, r.bundleIdentifier},
        {kVersionKey, r.version},
        {kPidKey, lmo::Value::integer(r.hostPid)},
        {kExecutableKey, r.executablePath},
        {kDescriptionKey, r.description},
    });
  }
  return lmo::Dictionary{
      {kFormatVersionKey, lmo::Value::integer(kServicesFileFormatVersion)},
      {kServicesKey, lmo::Array(std::move(services))},
  };
}

base::Result<std::vector<ExternalServiceRegistration>> decodeServiceTable(const lmo::Value& file) {
  const lmo::Dictionary* top = file.getIfDictionary();
  if (top == nullptr) return malformed("not a dictionary");
  if (top->get(kFormatVersionKey).getIfInt64() != kServicesFileFormatVersion) {
    return malformed("unknown format version");
  }
  const lmo::Array* services = top->get(kServicesKey).getIfArray();
  if (services == nullptr) return malformed("no services array");
  if (services->size() > kMaxExternalServiceRegistrations) return malformed("too many services");
  std::vector<ExternalServiceRegistration> table;
  table.reserve(services->size());
  for (const lmo::Value& entry : *services) {
    std::optional<ExternalServiceRegistration> r = decodeEntry(entry);
    if (!r) return malformed("malformed service entry");
    table.push_back(std::move(*r));
  }
  return table;
}

}  // namespace vantrel::platform
