#include "model/VTSandboxExtension.h"

#include "platform/SandboxExtensionService.h"

namespace vantrel::model {

std::shared_ptr<VTSandboxExtension> VTSandboxExtension::initWithExtension(std::string token) {
  return std::make_shared<VTSandboxExtension>(std::move(token));
}

VTSandboxExtension::VTSandboxExtension(std::string token) : token_(std::move(token)) {}

VTSandboxExtension::~VTSandboxExtension() {
  expel();
}

void VTSandboxExtension::consume() {
  if (handle_.load() != 0) return;
  int64_t consumed = platform::sandbox_extension_consume(token_);
  int64_t expected = 0;
  // Another thread consumed first: keep its handle and give ours back.
  if (!handle_.compare_exchange_strong(expected, consumed) && consumed > 0) {
    platform::sandbox_extension_release(consumed);
  }
}

void VTSandboxExtension::expel() {
  int64_t handle = handle_.exchange(0);
  if (handle > 0) platform::sandbox_extension_release(handle);
}

}  // namespace vantrel::model
