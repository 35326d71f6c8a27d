#pragma once
// A scripted application registry, and an environment that keeps each
// registry test's notifications, state and annotations in a fresh directory.

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cstdlib>
#include <set>

#include "lmo/Protocol.h"
#include "omnidex/Workspace.h"
#include "registry/VTDatabase.h"
#include "tests/support/ScopedEnvironment.h"
#include "tests/support/TempDir.h"

namespace vantrel::registry::testing {

using omnidex::PlugInRecordPtr;
using Names = std::multiset<std::string>;

// A valid stand-alone plug-in under /System/ with a data container.
inline std::shared_ptr<omnidex::PlugInRecord> record(const std::string& identifier,
                                                     lmo::Dictionary entitlements = {}) {
  auto r = std::make_shared<omnidex::PlugInRecord>();
  r->uuid = base::Uuid::random();
  r->bundlePath = "/System/Library/PlugIns/" + identifier + ".plugin";
  r->identifier = r->originalIdentifier = r->bundleIdentifier = identifier;
  r->bundleVersion = "3";
  r->extensionDictionary = {{"QXExtensionProtocol", "P"},
                            {"QXExtensionPointIdentifier", "com.karvo.point"},
                            {"QXExtensionAttributes", lmo::Dictionary{}}};
  r->infoDictionary = {{"QXExtension", r->extensionDictionary}, {"KBBundleIdentifier", identifier}};
  r->entitlements = std::move(entitlements);
  r->dataContainerPath = "/var/lib/vantrel/containers/x";
  return r;
}

inline lmo::Dictionary election(int64_t e) {
  return {{protocol::kAnnotationElection, lmo::Value::integer(e)}};
}

// The identifiers of a lookup's records, duplicates kept.
inline std::optional<Names> identifiers(const std::optional<VTDatabase::PlugInList>& found) {
  if (!found) return std::nullopt;
  Names names;
  for (const VTDPlugInPtr& p : *found) names.insert(*p->identifier());
  return names;
}

// Counts the records it is told were removed.
struct CountingDelegate : VTDatabaseDelegate {
  void removedPlugIns(const std::vector<PlugInRecordPtr>& records) override {
    removed += static_cast<int>(records.size());
  }
  std::atomic<int> removed{0};
};

// Serves the records it is given. Its fields are set before the database
// uses it, then only read. Tests announce by calling the database.
class FakeWorkspace : public omnidex::Workspace {
 public:
  std::vector<PlugInRecordPtr> records;
  bool failing = false;  // every listing answers nullopt
  int cacheClears = 0;   // changed on the database queue only

  void addObserver(std::weak_ptr<omnidex::WorkspaceObserver>) override {}
  void startMonitoring() override {}
  std::optional<std::vector<PlugInRecordPtr>> installedPlugIns() override {
    return failing ? std::nullopt : std::optional(records);
  }
  std::optional<std::vector<PlugInRecordPtr>> plugInsMatchingQuery(
      const lmo::Dictionary&, const omnidex::PlugInFilter& filter) override {
    auto all = installedPlugIns();
    if (all) std::erase_if(*all, [&](auto& r) { return !filter(*r->identifier, r->entitlements); });
    return all;
  }
  PlugInRecordPtr plugInForUuid(const base::Uuid& uuid) override {
    return first([&](const PlugInRecordPtr& r) { return r->uuid == uuid; });
  }
  PlugInRecordPtr plugInForUrl(const std::string& path) override {
    return first([&](const PlugInRecordPtr& r) { return r->bundlePath == path; });
  }
  ApplicationLookup applicationForUrl(const std::string&) override { return {}; }
  base::Result<void> registerPlugIn(const std::string&) override { return ok(); }
  base::Result<void> unregisterPlugIn(const std::string&) override { return ok(); }
  void clearCaches() override { ++cacheClears; }
  std::optional<std::vector<omnidex::ConsentEntry>> privacyConsentEntries(
      const std::string&) override {
    return failing ? std::nullopt : std::optional(std::vector<omnidex::ConsentEntry>());
  }

 private:
  static base::Result<void> ok() { return base::Result<void>::success(); }
  template <typename Predicate>
  PlugInRecordPtr first(Predicate matches) const {
    auto found = std::find_if(records.begin(), records.end(), matches);
    return found == records.end() ? nullptr : *found;
  }
};

// Points the runtime, state and annotation directories into a temporary
// directory, and restores the environment (HOME included) afterwards.
class RegistryTest : public ::testing::Test {
 protected:
  VTDatabasePtr database() {
    return VTDatabase::initWithDatabase(tmp_.file("Annotations"), workspace_);
  }

  vantrel::testing::TempDir tmp_;
  std::shared_ptr<FakeWorkspace> workspace_ = std::make_shared<FakeWorkspace>();

 private:
  using Env = vantrel::testing::ScopedEnvironment;
  Env runtime_{"VANTREL_RUNTIME_DIR", tmp_.file("run")};
  Env state_{"VANTREL_STATE_DIR", tmp_.file("state")};
  Env xdg_{"XDG_STATE_HOME", tmp_.file("xdg")};
  Env home_{"HOME", std::getenv("HOME")};
};

}  // namespace vantrel::registry::testing
