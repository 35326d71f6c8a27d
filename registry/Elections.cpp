// The database's annotation operations: every annotation read and write of
// the request operations runs on the database queue, and every change made
// through setAnnotation is broadcast.

#include "base/Log.h"
#include "lmo/Protocol.h"
#include "model/Collections.h"
#include "platform/NotificationCenter.h"
#include "registry/VTDatabase.h"

namespace vantrel::registry {

std::optional<lmo::Dictionary> VTDatabase::annotationForPlugIn(const VTDPlugIn& plugIn) {
  std::optional<lmo::Dictionary> annotation;
  sync_.sync([&] { annotation = annotations_->annotationForPlugIn(plugIn); });
  return annotation;
}

void postAnnotationChange(size_t changes) {
  // The notification carries nothing, so a post that fails costs watchers
  // one refresh; it is logged and not reported.
  base::Result<uint64_t> posted =
      platform::postNotification(protocol::kAnnotationChangeNotification, changes);
  if (!posted.has_value()) {
    base::vtlog("unable to post notification %@: %@", protocol::kAnnotationChangeNotification,
                posted.error());
  }
}

std::optional<base::Error> VTDatabase::setAnnotation(
    const std::optional<lmo::Dictionary>& annotation, const VTDPlugIn& plugIn) {
  sync_.sync([&] { annotations_->setAnnotation(annotation, plugIn); });
  // Posted off the queue: watchers that react by asking the daemon must not
  // find the queue still held.
  postAnnotationChange();
  return std::nullopt;
}

std::optional<base::Error> VTDatabase::setAnnotation(
    const std::optional<lmo::Dictionary>& annotation, const std::vector<VTDPlugInPtr>& plugIns) {
  sync_.sync([&] { annotations_->setAnnotation(annotation, plugIns); });
  postAnnotationChange(plugIns.size());
  return std::nullopt;
}

void VTDatabase::autoElect(const VTDPlugIn& plugIn) {
  sync_.assertCurrent();
  const lmo::Dictionary annotation =
      annotations_->annotationForPlugIn(plugIn).value_or(lmo::Dictionary());
  const lmo::Value& election = annotation.get(protocol::kAnnotationElection);
  if (!election.isNull() && election.integerValue() != 0) return;
  annotations_->setAnnotation(
      model::dictionaryChanging(annotation, protocol::kAnnotationElection, lmo::Value::integer(1)),
      plugIn);
}

}  // namespace vantrel::registry
