#pragma once
// A hold: plug-ins kept out of discovery and use while a client replaces
// them. Identified by a random token; it also ends when the client that took
// it goes away (the server releases it then). While it exists it keeps one
// unit of outstanding work open, so the daemon is not stopped as idle.
//
// Immutable after construction: safe to read from any thread.

#include <memory>
#include <unordered_map>
#include <vector>

#include "base/Uuid.h"
#include "lmo/OutstandingWork.h"
#include "lmo/Value.h"
#include "registry/VTDPlugIn.h"

namespace vantrel::daemon {

class VTDLmoClient;

class VTDPlugInHold {
 public:
  // A hold on plugIns (duplicates by UUID collapse) for client (held
  // weakly), with a fresh token. Every record must have a UUID (checked).
  static std::shared_ptr<VTDPlugInHold> initWithPlugIns(
      const std::vector<registry::VTDPlugInPtr>& plugIns,
      const std::shared_ptr<VTDLmoClient>& client);

  const base::Uuid& uuid() const { return uuid_; }
  // The held plug-ins by UUID: a record looked up again later still matches.
  const std::unordered_map<base::Uuid, registry::VTDPlugInPtr>& blocked() const { return blocked_; }
  bool blocks(const registry::VTDPlugIn& plugIn) const;
  // The client that took the hold; null once that client object is gone.
  std::shared_ptr<VTDLmoClient> client() const { return client_.lock(); }
  const lmo::Date& created() const { return created_; }

  // Holds are the same when their tokens are.
  bool operator==(const VTDPlugInHold& other) const { return uuid_ == other.uuid_; }

 private:
  VTDPlugInHold() = default;

  base::Uuid uuid_;
  std::unordered_map<base::Uuid, registry::VTDPlugInPtr> blocked_;
  std::weak_ptr<VTDLmoClient> client_;
  lmo::Date created_;
  lmo::OutstandingWorkScope work_;
};

}  // namespace vantrel::daemon

template <>
struct std::hash<vantrel::daemon::VTDPlugInHold> {
  size_t operator()(const vantrel::daemon::VTDPlugInHold& hold) const noexcept {
    return std::hash<vantrel::base::Uuid>()(hold.uuid());
  }
};
