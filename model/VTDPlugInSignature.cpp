#include "model/VTDPlugInSignature.h"

#include "base/Uuid.h"
#include "platform/Digest.h"

namespace vantrel::model {
namespace {

constexpr const char* kPlaceholderRequirement = "dummy requirement";

lmo::Value randomHash() {
  std::string text = base::Uuid::random().string();
  platform::Sha1Digest digest = platform::sha1(text.data(), text.size());
  return lmo::Value::data(digest.data(), digest.size());
}

}  // namespace

std::shared_ptr<VTDPlugInSignature> VTDPlugInSignature::initWithURL(const FileUrl& /*url*/,
                                                                    base::Error* /*error*/) {
  return std::make_shared<VTDPlugInSignature>();
}

VTDPlugInSignature::VTDPlugInSignature()
    : cdhash_(randomHash()), requirement_(kPlaceholderRequirement) {}

}  // namespace vantrel::model
