#include "platform/LaunchDescription.h"

#include <sys/stat.h>

#include <cerrno>
#include <climits>

#include "base/Format.h"
#include "platform/AtomicFile.h"
#include "platform/PropertyList.h"

namespace vantrel::platform {
namespace {

constexpr const char* kServicesDirectoryName = "services";
constexpr const char* kLaunchFileSuffix = ".plist";

base::Error malformed(const char* what) {
  return base::Error{kPropertyListErrorDomain, kPropertyListMalformed, what};
}

// What is wrong with an "LMOService" dictionary; nullptr when nothing.
const char* serviceProblem(const lmo::Dictionary& service) {
  const lmo::Value& environment = service.get(kLaunchEnvironmentKey);
  if (!environment.isNull()) {
    const lmo::Dictionary* variables = environment.getIfDictionary();
    if (variables == nullptr) return "the environment is not a dictionary";
    if (variables->size() > kMaxLaunchEnvironmentVariables) return "too many environment variables";
  }
  const lmo::Value& profile = service.get(kLaunchSandboxProfileKey);
  if (!profile.isNull() && profile.getIfString() == nullptr) {
    return "the sandbox profile is not a string";
  }
  return nullptr;
}

const lmo::Dictionary& environmentOf(const lmo::Dictionary& service) {
  static const lmo::Dictionary kNone;
  const lmo::Dictionary* variables = service.get(kLaunchEnvironmentKey).getIfDictionary();
  return variables != nullptr ? *variables : kNone;
}

bool isAbsolutePath(const std::string* path) {
  return path != nullptr && !path->empty() && path->front() == '/';
}

bool isEnvironmentName(std::string_view name) {
  return !name.empty() && name.find('=') == std::string_view::npos;
}

}  // namespace

std::optional<base::Error> executableProblem(const std::string& path) {
  struct stat st;
  if (::stat(path.c_str(), &st) != 0) return posixError(errno, "no executable at", path);
  if (!S_ISREG(st.st_mode) || (st.st_mode & (S_IXUSR | S_IXGRP | S_IXOTH)) == 0) {
    return posixError(EACCES, "cannot execute", path);
  }
  return std::nullopt;
}

std::string servicesDirectoryPath(const std::string& directory) {
  return directory + "/" + kServicesDirectoryName;
}

std::string launchDirectoryPath(const std::string& directory, pid_t pid) {
  return base::format("%@/%d", servicesDirectoryPath(directory), static_cast<int>(pid));
}

std::string launchDescriptionPath(const std::string& directory, pid_t pid,
                                  std::string_view bundleIdentifier) {
  return base::format("%@/%@%s", launchDirectoryPath(directory, pid), bundleIdentifier,
                      kLaunchFileSuffix);
}

base::Result<lmo::Value> encodeLaunchDescription(const ExternalServiceRegistration& registration) {
  const auto invalid = [&](int code, const char* what) {
    return base::Error{kPosixErrorDomain, code,
                       base::format("malformed launch description for %@: %s",
                                    registration.bundleIdentifier, what)};
  };
  lmo::Dictionary service;
  if (const lmo::Value& value = registration.description.get(kLaunchServiceKey); !value.isNull()) {
    const lmo::Dictionary* dictionary = value.getIfDictionary();
    if (dictionary == nullptr) return invalid(EINVAL, "the service is not a dictionary");
    service = *dictionary;
  }
  if (const char* problem = serviceProblem(service)) {
    return invalid(environmentOf(service).size() > kMaxLaunchEnvironmentVariables ? E2BIG : EINVAL,
                   problem);
  }
  lmo::Dictionary file{
      {kLaunchFormatVersionKey, lmo::Value::integer(kLaunchDescriptionFormatVersion)},
      {kLaunchBundleIdentifierKey, registration.bundleIdentifier},
      {kLaunchVersionKey, registration.version},
      {kLaunchExecutableKey, registration.executablePath},
      {kLaunchHostPidKey, lmo::Value::integer(registration.hostPid)},
      {kLaunchServiceKey, service},
  };
  const std::string* container =
      registration.dataContainer ? &*registration.dataContainer : nullptr;
  if (isAbsolutePath(container)) file = file.setting(kLaunchWorkingDirectoryKey, *container);
  return lmo::Value(file);
}

base::Result<LaunchDescription> decodeLaunchDescription(const lmo::Value& file) {
  const lmo::Dictionary* top = file.getIfDictionary();
  if (top == nullptr) return malformed("not a dictionary");
  if (top->get(kLaunchFormatVersionKey).getIfInt64() != kLaunchDescriptionFormatVersion) {
    return malformed("unknown format version");
  }
  const std::string* bundleIdentifier = top->get(kLaunchBundleIdentifierKey).getIfString();
  const std::string* version = top->get(kLaunchVersionKey).getIfString();
  const std::string* executable = top->get(kLaunchExecutableKey).getIfString();
  const std::optional<int64_t> pid = top->get(kLaunchHostPidKey).getIfInt64();
  const lmo::Dictionary* service = top->get(kLaunchServiceKey).getIfDictionary();
  if (!bundleIdentifier || !version || !pid || !service) return malformed("a key is missing");
  if (!isAbsolutePath(executable)) return malformed("the executable is not an absolute path");
  if (*pid <= 0 || *pid > INT_MAX) return malformed("the host pid is out of range");
  if (const char* problem = serviceProblem(*service)) return malformed(problem);
  LaunchDescription d;
  d.bundleIdentifier = *bundleIdentifier;
  d.version = *version;
  d.hostPid = static_cast<pid_t>(*pid);
  d.executablePath = *executable;
  for (const auto& [name, value] : environmentOf(*service)) {
    const std::string* text = value.getIfString();
    if (text != nullptr && isEnvironmentName(name)) d.environment.push_back(name + "=" + *text);
  }
  const std::string* profile = service->get(kLaunchSandboxProfileKey).getIfString();
  d.sandboxProfile = profile != nullptr ? *profile : kDefaultSandboxProfile;
  if (const lmo::Value& cwd = top->get(kLaunchWorkingDirectoryKey); !cwd.isNull()) {
    if (!isAbsolutePath(cwd.getIfString())) {
      return malformed("the working directory is not an absolute path");
    }
    d.workingDirectory = *cwd.getIfString();
  }
  return d;
}

}  // namespace vantrel::platform
