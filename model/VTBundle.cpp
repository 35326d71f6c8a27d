#include "model/VTBundle.h"

#include "base/Check.h"
#include "base/Log.h"
#include "lmo/Message.h"
#include "model/MetadataKeys.h"

namespace vantrel::model {

using platform::BundleObject;

namespace {

constexpr std::string_view kPlugInsDirectory = "PlugIns";

std::string appendPathComponent(std::string base, std::string_view name) {
  while (base.size() > 1 && base.back() == '/') base.pop_back();
  while (!name.empty() && name.front() == '/') name.remove_prefix(1);
  if (name.empty()) return base;
  if (base.empty() || base.back() != '/') base += '/';
  base += name;
  return base;
}

}  // namespace

std::shared_ptr<VTBundle> VTBundle::initForMainBundle() {
  return initWithLMOBundle(BundleObject::mainBundle());
}

std::shared_ptr<VTBundle> VTBundle::initWithURL(const FileUrl& url) {
  return initWithPath(url.path());
}

std::shared_ptr<VTBundle> VTBundle::initWithPath(const std::string& path) {
  return initWithLMOBundle(BundleObject::create(path, BundleObject::Kind::kBundleDirectory));
}

std::shared_ptr<VTBundle> VTBundle::initWithExecutableURL(const FileUrl& url) {
  return initWithExecutablePath(url.path());
}

std::shared_ptr<VTBundle> VTBundle::initWithExecutablePath(const std::string& path) {
  std::shared_ptr<BundleObject> bundle =
      BundleObject::create(path, BundleObject::Kind::kExecutable);
  if (!bundle || !bundle->stringProperty(platform::kBundlePathProperty)) {
    bundle = BundleObject::create(path, BundleObject::Kind::kBundleDirectory);
  }
  return initWithLMOBundle(std::move(bundle));
}

std::shared_ptr<VTBundle> VTBundle::initWithLMOBundle(std::shared_ptr<const BundleObject> bundle) {
  if (!bundle) return nullptr;
  return std::make_shared<VTBundle>(std::move(bundle));
}

VTBundle::VTBundle(std::shared_ptr<const BundleObject> bundle) : bundle_(std::move(bundle)) {
  VT_CHECK(bundle_ != nullptr, "VTBundle needs a bundle object");
}

std::optional<std::string> VTBundle::stringProperty(int number) const {
  return bundle_->stringProperty(number);
}

std::optional<std::string> VTBundle::path() const {
  return stringProperty(platform::kBundlePathProperty);
}

std::optional<FileUrl> VTBundle::url() const {
  std::optional<std::string> p = path();
  return p ? std::optional<FileUrl>(FileUrl::fromPath(*p)) : std::nullopt;
}

std::optional<std::string> VTBundle::executablePath() const {
  std::optional<std::string> executable = stringProperty(platform::kBundleExecutableProperty);
  return executable ? executable : path();
}

std::optional<std::string> VTBundle::supportPath() const {
  {
    std::lock_guard lock(mutex_);
    if (supportPath_) return supportPath_;
  }
  // Concurrent first uses compute the same value; the first to store wins.
  std::optional<std::string> support = bundle_->copySupportDirectory();
  if (!support) return std::nullopt;
  std::lock_guard lock(mutex_);
  if (!supportPath_) supportPath_ = std::move(support);
  return supportPath_;
}

std::optional<std::string> VTBundle::bundleDirectory(const std::string& name) const {
  std::optional<std::string> support = supportPath();
  if (!support) return std::nullopt;
  return appendPathComponent(std::move(*support), name);
}

std::optional<std::string> VTBundle::plugInsPath() const {
  return bundleDirectory(std::string(kPlugInsDirectory));
}

std::optional<lmo::Dictionary> VTBundle::infoDictionary() const {
  std::optional<lmo::Dictionary> source = bundle_->infoDictionary();
  if (!source) {
    base::vtlog("failed to retrieve Info.plist for %@ through %@", path(), *bundle_);
  }
  std::optional<lmo::Dictionary> result;
  if (source) result = lmo::propertyListFromMessage(*source);
  if (!result) {
    base::vtlog("failed to convert Info.plist to dictionary: %@ source=%@", path(), source);
  }
  return result;
}

std::optional<std::string> VTBundle::bundleIdentifier() const {
  return bundle_->infoString(kBundleIdentifierKey);
}

}  // namespace vantrel::model
