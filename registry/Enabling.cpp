// What a host needs to use a plug-in: read tokens for its files, and the
// plug-in registered as a service the host's process may launch, with its
// environment and sandbox profile.

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "base/Log.h"
#include "lmo/Protocol.h"
#include "model/SandboxExtensionIssue.h"
#include "model/VTBundle.h"
#include "omnidex/PrivacyConsent.h"
#include "platform/SandboxExtensionService.h"
#include "platform/ServiceManager.h"
#include "registry/VTDPlugIn.h"

namespace vantrel::registry {

namespace {

constexpr std::string_view kExtensionPointKey = "QXExtensionPointIdentifier";
constexpr std::string_view kServiceKey = "LMOService";
constexpr std::string_view kEnvironmentKey = "EnvironmentVariables";
constexpr const char* kTestSdkVariable = "VTTEST_SDK";

// The sandbox profile of a plug-in, by its extension point.
const char* sandboxProfileFor(const VTDPlugIn& plugIn) {
  const lmo::Value point = plugIn.pluginKey(kExtensionPointKey);
  if (point == lmo::Value("com.karvo.keyboard-service")) {
    const bool openAccess = plugIn.attribute("RequestsOpenAccess") == lmo::Value::boolean(true);
    if (openAccess && plugIn.allowedVGLServices().contains(omnidex::kKeyboardNetworkService)) {
      return "plugin";
    }
    return "keyboard";
  }
  if (point == lmo::Value("com.karvo.netguard.filter-data")) return "network-filter";
  const std::optional<lmo::Dictionary> stored = plugIn.plugInDictionary();
  if (stored &&
      stored->get(kExtensionPointKey) == lmo::Value("com.karvo.peekview.extension.preview")) {
    return "peekviewd";
  }
  return "plugin";
}

}  // namespace

lmo::Dictionary VTDPlugIn::issueResourceExtensions(const lmo::Value& resources) const {
  lmo::Dictionary tokens;
  const std::optional<model::FileUrl> bundle = url();
  if (!bundle) return tokens;
  const lmo::Array list = resources.getIfString()  ? lmo::Array{resources}
                          : resources.getIfArray() ? *resources.getIfArray()
                                                   : lmo::Array{};
  for (const lmo::Value& element : list) {
    const std::string* name = element.getIfString();
    if (name == nullptr) continue;
    const model::FileUrl target =
        *name == "." ? *bundle : model::FileUrl::fromPath(bundle->path() + "/" + *name);
    errno = 0;
    std::optional<std::string> token;
    if (*name == ".") {
      // Every form of an application extension carries a token for its
      // bundle: its path is resolved once per record, not once per form.
      std::optional<std::string> canonical;
      {
        std::lock_guard lock(namesMutex_);
        canonical = canonicalBundlePath_;
      }
      if (canonical && canonical->empty()) canonical = target.path();
      if (!canonical && (canonical = platform::canonicalPath(target.path()))) {
        std::lock_guard lock(namesMutex_);
        canonicalBundlePath_ = *canonical == target.path() ? std::string() : *canonical;
      }
      if (canonical) token = platform::sandbox_extension_issue_canonical_file(*canonical);
    } else {
      token = model::issue_read_extension(target);
    }
    if (token) {
      tokens = tokens.setting(*name, lmo::Value(*token));
    } else {
      base::vtlog("failed to make extension for %@ in plug-in at %@: %s", target.path(),
                  bundle->path(), std::strerror(errno));
    }
  }
  return tokens;
}

void VTDPlugIn::augmentForm(lmo::Dictionary& form) const {
  lmo::Value shared = pluginKey("Shared");
  if (isAppExtension()) shared = lmo::Array{"."};
  if (shared.isNull()) return;
  form = form.setting(protocol::kKeyExtensions, issueResourceExtensions(shared));
}

std::optional<base::Error> VTDPlugIn::enableForPid(pid_t pid, int hostPidfd) const {
  const std::string uuidText = uuid() ? uuid()->string() : std::string();
  lmo::Dictionary environment;
  const std::optional<std::string> container =
      oxproxy_ ? oxproxy_->dataContainerPath : std::nullopt;
  if (container) {
    environment = environment.setting("HOME", *container)
                      .setting("KBFIXED_USER_HOME", *container)
                      .setting("TMPDIR", *container + "/tmp");
  } else {
    base::vtlog("no data container for plug-in %@(%@) %@ at %@", identifier(), version(), uuidText,
                path());
  }
  const char* profile = sandboxProfileFor(*this);
  if (const char* sdk = std::getenv(kTestSdkVariable)) {
    environment = environment.setting(kTestSdkVariable, sdk);
  }
  lmo::Dictionary service;
  const lmo::Value declared = infoKey(kServiceKey);
  if (const lmo::Dictionary* entries = declared.getIfDictionary()) service = *entries;
  // Entries that are not a dictionary cannot be merged and are left out.
  if (const lmo::Dictionary* own = service.get(kEnvironmentKey).getIfDictionary()) {
    for (const auto& [name, value] : *own) environment = environment.setting(name, value);
  }
  service = service.setting(kEnvironmentKey, environment)
                .setting("_SandboxProfile", profile)
                .setting("_OmitSandboxParameters", lmo::Value::boolean(true));
  base::vtlog("assigning plug-in %@(%@) to %s sandbox", identifier(), version(), profile);
  const lmo::Dictionary description{{std::string(kServiceKey), service},
                                    {"KBBundlePackageType", "LMO!"}};
  base::vtlog("enabling pid=%d for plug-in %@(%@) %@ %@", pid, identifier(), version(), uuidText,
              path());

  auto bundle = url() ? model::VTBundle::initWithURL(*url()) : nullptr;
  // The bundle service answers the bundle's own path when it names no
  // executable: only a regular, executable file will do.
  const std::optional<std::string> executable = bundle ? bundle->executablePath() : std::nullopt;
  if (!executable || platform::executableProblem(*executable)) {
    return base::error_with_code_and_format(protocol::kErrorBadRequest,
                                            "cannot obtain executable path for plug-in %@(%@)",
                                            identifier(), uuidText);
  }
  // Named as an uninstall names it, so that the registration goes with the
  // plug-in.
  const bool registered = oxproxy_ != nullptr;
  platform::ExternalServiceRegistration registration{
      (registered ? oxproxy_->bundleIdentifier : std::nullopt).value_or(identifier().value_or("")),
      (registered ? oxproxy_->bundleVersion : std::nullopt).value_or(""), pid, *executable,
      description};
  registration.dataContainer = container;
  base::Result<void> result = platform::ServiceManager::shared().registerExternalService(
      std::move(registration), hostPidfd);
  if (!result.has_value()) {
    base::vtlog("lmo error %d allowing pid %d to use plug-in %@(%@) %@ at %@", result.error().code,
                pid, identifier(), version(), uuidText, path());
    return base::error_with_code_and_format(protocol::kErrorBadRequest,
                                            "unable to enable plug-in %@(%@) for pid %d",
                                            identifier(), uuidText, pid);
  }
  return std::nullopt;
}

}  // namespace vantrel::registry
