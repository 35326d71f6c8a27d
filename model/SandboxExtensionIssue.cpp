#include "model/SandboxExtensionIssue.h"

#include "platform/SandboxExtensionService.h"

namespace vantrel::model {

std::optional<std::string> issue_read_extension(const FileUrl& url) {
  return platform::sandbox_extension_issue_file(url.path());
}

}  // namespace vantrel::model
