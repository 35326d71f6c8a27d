#pragma once
// Read access to a bundle on disk: its path, Info dictionary, identifier,
// executable, support directory and the directory holding its plug-ins.
//
// A thin layer over the platform's bundle objects, which are immutable and
// safe to read from any thread; the only state added here is the cached
// support directory. A VTBundle may be read from several queues at once.

#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "lmo/Value.h"
#include "model/FileUrl.h"
#include "platform/BundleService.h"

namespace vantrel::model {

class VTBundle {
 public:
  // Each factory returns null when the bundle service cannot make a bundle
  // object for the location (no such directory, no bundle around the
  // executable, an unusable path).

  // The running program's own bundle.
  static std::shared_ptr<VTBundle> initForMainBundle();
  // The bundle directory at url's path (initWithPath).
  static std::shared_ptr<VTBundle> initWithURL(const FileUrl& url);
  // The bundle directory at path.
  static std::shared_ptr<VTBundle> initWithPath(const std::string& path);
  // The bundle around the executable at url's path (initWithExecutablePath).
  static std::shared_ptr<VTBundle> initWithExecutableURL(const FileUrl& url);
  // The bundle whose executable is at path; when the service cannot place
  // that executable in a bundle, path itself taken as a bundle directory.
  static std::shared_ptr<VTBundle> initWithExecutablePath(const std::string& path);
  // Wraps an existing bundle object; null for a null object.
  static std::shared_ptr<VTBundle> initWithLMOBundle(
      std::shared_ptr<const platform::BundleObject> bundle);

  explicit VTBundle(std::shared_ptr<const platform::BundleObject> bundle);

  // A string property of the bundle object by number (2 path, 3 executable),
  // or nullopt.
  std::optional<std::string> stringProperty(int number) const;
  std::optional<std::string> path() const;
  std::optional<FileUrl> url() const;
  // The executable's path; the bundle's own path when it has no executable.
  std::optional<std::string> executablePath() const;
  // The bundle's support directory, read once and kept. A missing one is not
  // cached, so a later call asks again.
  std::optional<std::string> supportPath() const;
  // supportPath() with name appended as one more path component; nullopt
  // without a support directory.
  std::optional<std::string> bundleDirectory(const std::string& name) const;
  // bundleDirectory("PlugIns").
  std::optional<std::string> plugInsPath() const;
  // The Info dictionary; nullopt (after two log lines) when the bundle has
  // none.
  std::optional<lmo::Dictionary> infoDictionary() const;
  // The Info dictionary's "KBBundleIdentifier" string; nullopt when there is
  // no Info dictionary or no such string. Does not log.
  std::optional<std::string> bundleIdentifier() const;

  const platform::BundleObject& bundleObject() const { return *bundle_; }

 private:
  // Constant after construction, never null.
  const std::shared_ptr<const platform::BundleObject> bundle_;

  mutable std::mutex mutex_;
  mutable std::optional<std::string> supportPath_;  // Guarded by mutex_.
};

using VTBundlePtr = std::shared_ptr<VTBundle>;

}  // namespace vantrel::model
