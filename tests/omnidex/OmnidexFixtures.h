#pragma once
// Bundle trees on disk and a recording observer for the registry's tests.

#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "lmo/Value.h"
#include "omnidex/Omnidex.h"
#include "tests/support/TempDir.h"

namespace vantrel::omnidex::testing {

// An Info dictionary of a plug-in: "KBBundleIdentifier" identifier and a
// "QXExtension" declaring extensionPoint, plus extras at the top level.
lmo::Dictionary plugInInfo(const std::string& identifier, const std::string& extensionPoint,
                           lmo::Dictionary extras = {});

// Seconds since 1970, now.
double secondsNow();

// Makes dir (and its parents) and writes info as dir/Info.plist; returns dir.
std::string writeBundle(const std::string& dir, const lmo::Dictionary& info);

// A state directory, an application directory and a plug-in directory in
// one temporary tree.
class RegistryTree {
 public:
  std::string state() const { return temp_.file("state"); }
  std::string apps() const { return temp_.file("apps"); }
  std::string plugIns() const { return temp_.file("plugins"); }
  std::string file(const std::string& relative) const { return temp_.file(relative); }
  // Writes text to file(relative), making its directories; returns the path.
  std::string write(const std::string& relative, const std::string& text) const {
    return temp_.write(relative, text);
  }
  OmnidexConfig config() const;
  // Opens the registry on config(); fails the test when it cannot.
  std::shared_ptr<Omnidex> open() const;
  // The data container directory of uuid.
  std::string container(const base::Uuid& uuid) const;

 private:
  vantrel::testing::TempDir temp_;
};

class RecordingObserver : public WorkspaceObserver {
 public:
  struct Event {
    bool installed;  // else will-uninstall
    std::vector<PlugInRecordPtr> records;
  };

  void pluginsDidInstall(const std::vector<PlugInRecordPtr>& records) override;
  void pluginsWillUninstall(const std::vector<PlugInRecordPtr>& records) override;

  std::vector<Event> events() const;
  void clear();
  // Waits (on the recorded events, never only sleeping) until a record with
  // that bundle path has been announced installed / uninstalling, or the
  // timeout passes. The record announced, or null.
  PlugInRecordPtr waitForInstalled(const std::string& path,
                                   std::chrono::milliseconds timeout = std::chrono::seconds(5)) {
    return waitFor(true, path, timeout);
  }
  PlugInRecordPtr waitForUninstalled(const std::string& path,
                                     std::chrono::milliseconds timeout = std::chrono::seconds(5)) {
    return waitFor(false, path, timeout);
  }
  // Bundle paths announced so far, in order, as "+path" / "-path".
  std::vector<std::string> log() const;

 private:
  PlugInRecordPtr waitFor(bool installed, const std::string& path,
                          std::chrono::milliseconds timeout);
  mutable std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<Event> events_;  // Guarded by mutex_.
};

// A recording observer, added to registry.
std::shared_ptr<RecordingObserver> observe(Omnidex& registry);

// Runs sql on the SQLite database at path; a failure fails the test.
void runSql(const std::string& path, const std::string& sql);

}  // namespace vantrel::omnidex::testing
