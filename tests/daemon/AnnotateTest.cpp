// The annotate request: the shape of the change, what is stored, and the
// file it leaves.

#include <gtest/gtest.h>

#include "base/Log.h"
#include "platform/NotificationCenter.h"
#include "platform/PropertyList.h"
#include "registry/VTDatabase.h"
#include "tests/daemon/DaemonFixture.h"

namespace vantrel::daemon::testing {
namespace {

using lmo::Array;
using lmo::Dictionary;
using lmo::Value;

using Annotate = DaemonTest;

TEST_F(Annotate, MalformedChangesTouchNothing) {
  const Value uuids = Array{uuidOf("widget")};
  const std::pair<Value, Expected> cases[] = {
      {Value(),
       {protocol::kErrorBadRequest, "invalid request format (bad annotations dictionary)"}},
      {Array{},
       {protocol::kErrorBadRequest, "invalid request format (bad annotations dictionary)"}},
      {Dictionary{{protocol::kAnnotationElection, "1"}},
       {protocol::kErrorBadRequest, "invalid request format (annotation election)"}},
      {Dictionary{{protocol::kAnnotationExtension, Array{}}},
       {protocol::kErrorBadRequest, "invalid request format (annotation extension)"}},
      {Dictionary{{protocol::kAnnotationElection, "1"}, {protocol::kAnnotationExtension, Array{}}},
       {protocol::kErrorBadRequest, "invalid request format (annotation election)"}},
  };
  for (const auto& [annotations, expected] : cases) {
    const Dictionary extras =
        Dictionary{{protocol::kKeyUuids, uuids}}.setting(protocol::kKeyAnnotations, annotations);
    EXPECT_EQ(errorOf(request(protocol::kRequestAnnotate, extras)), expected)
        << lmo::describe(annotations);
  }
  // A change without a known key succeeds without looking at "uuids".
  EXPECT_EQ(errorOf(request(protocol::kRequestAnnotate,
                            {{protocol::kKeyAnnotations, Dictionary{{"colour", "red"}}},
                             {protocol::kKeyUuids, "garbage"}})),
            Expected(0, ""));
  EXPECT_EQ(server_->annotationForPlugIn(*plugIn("widget")), std::nullopt);
  EXPECT_EQ(platform::notificationCount(protocol::kAnnotationChangeNotification), 0u);
}

TEST_F(Annotate, StoresTheKnownKeysAndAnnounces) {
  base::LogCapture log;
  const Dictionary settings{{"size", Value::integer(2)}};
  const Dictionary reply = request(
      protocol::kRequestAnnotate,
      {{protocol::kKeyUuids, Array{uuidOf("widget"), uuidOf("share")}},
       {protocol::kKeyAnnotations, Dictionary{{protocol::kAnnotationElection, Value::integer(0)},
                                              {protocol::kAnnotationExtension, settings},
                                              {"colour", "red"}}}});
  EXPECT_TRUE(reply.empty()) << lmo::describe(reply);
  const Dictionary stored{{protocol::kAnnotationElection, Value::integer(0)},
                          {protocol::kAnnotationExtension, settings}};
  EXPECT_EQ(server_->annotationForPlugIn(*plugIn("widget")), stored);
  EXPECT_EQ(server_->annotationForPlugIn(*plugIn("share")), stored);
  EXPECT_EQ(platform::notificationCount(protocol::kAnnotationChangeNotification), 2u);
  EXPECT_TRUE(log.contains(" plug-in com.x.widget election := 0"));

  // Only the extension: the election stays, and the log shows none given.
  request(
      protocol::kRequestAnnotate,
      {{protocol::kKeyUuids, Array{uuidOf("widget")}},
       {protocol::kKeyAnnotations, Dictionary{{protocol::kAnnotationExtension, Dictionary{}}}}});
  EXPECT_TRUE(log.contains(" plug-in com.x.widget election := (null)"));

  // The store's file on disk is what a restarted daemon reads.
  auto file = platform::readPropertyListFile(annotations_);
  ASSERT_TRUE(file.has_value()) << file.error().description();
  const std::string text = lmo::describe(file.value());
  EXPECT_NE(text.find("com.x.widget"), std::string::npos) << text;
  EXPECT_EQ(text.find("colour"), std::string::npos) << text;
}

}  // namespace
}  // namespace vantrel::daemon::testing
