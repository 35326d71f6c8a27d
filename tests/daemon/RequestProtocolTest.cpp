// The envelope, the dispatch table, the path and UUID decoders, and the
// registration requests, through a real socket.

#include <gtest/gtest.h>

#include <filesystem>

#include "base/Log.h"
#include "tests/daemon/DaemonFixture.h"
#include "tests/omnidex/OmnidexFixtures.h"

namespace vantrel::daemon::testing {
namespace {

using lmo::Array;
using lmo::Dictionary;
using lmo::Value;

using RequestProtocol = DaemonTest;

TEST_F(RequestProtocol, EnvelopeIsCheckedBeforeDispatch) {
  const std::pair<Dictionary, Expected> cases[] = {
      {{{"request", "bulk"}, {"version", u64(1)}},
       {7, "unsupported protocol version 1 (current 3)"}},
      {{{"request", "bulk"}, {"version", u64(4)}},
       {7, "unsupported protocol version 4 (current 3)"}},
      {{{"request", "bulk"}}, {7, "unsupported protocol version 0 (current 3)"}},
      {{{"request", "bulk"}, {"version", "3"}}, {7, "unsupported protocol version 0 (current 3)"}},
      {{{"request", "bulk"}, {"version", u64((1ull << 32) + 2)}},
       {7, "unsupported protocol version 2 (current 3)"}},
      {{{"version", u64(9)}}, {7, "unsupported protocol version 9 (current 3)"}},
      {{{"version", u64(3)}}, {4, "invalid request format (missing type)"}},
      {{{"request", u64(1)}, {"version", u64(3)}}, {4, "invalid request format (missing type)"}},
      {{{"request", "frobnicate"}, {"version", u64(2)}}, {4, "unrecognized request"}},
      {{{"request", "Match"}, {"version", u64(3)}}, {4, "unrecognized request"}},
      {{{"request", "bulk"}, {"version", u64(2)}}, {0, ""}},
      {{{"request", "bulk"}, {"version", u64(3)}, {"flags", u64(0x1F)}}, {0, ""}},
  };
  auto connection = connect();
  for (const auto& [message, expected] : cases) {
    const auto reply = send(message, connection);
    ASSERT_TRUE(reply) << lmo::describe(message);
    EXPECT_EQ(errorOf(*reply), expected) << lmo::describe(message);
    if (expected.first == 0) {
      EXPECT_TRUE(reply->empty()) << lmo::describe(*reply);
    }
  }
}

TEST_F(RequestProtocol, PathsAreDecodedAndCanonicalised) {
  const std::string loose = writePlugIn("loose/Tool.plugin", "com.x.tool");
  std::filesystem::create_directory_symlink(tmp_.file("loose"), tmp_.file("link"));
  const std::string viaLink = tmp_.file("link/Tool.plugin");
  const std::string notABundle = tmp_.file("loose");
  struct Case {
    const char* type;
    Value paths;
    Expected expected;
  };
  const Case cases[] = {
      {"add", Value(), {4, "invalid request format"}},
      {"add", Value("/tmp"), {4, "invalid request format"}},
      {"add", Array{u64(1)}, {4, "invalid request format"}},
      {"add", Array{"tmp/x"}, {9, "absolute path required: tmp/x"}},
      {"remove", Array{""}, {9, "absolute path required: "}},
      {"add", Array{}, {0, ""}},
      {"add", Array{"/nonexistent/x.plugin"}, {9, "invalid plugin path: /nonexistent/x.plugin"}},
      // Registered under its canonical path; the next path fails and the
      // first stays registered.
      {"add", Array{viaLink, notABundle}, {2, "unable to register plug-in at " + notABundle}},
      {"remove", Array{"/nonexistent/x.plugin"}, {9, "no plugin at /nonexistent/x.plugin"}},
  };
  base::LogCapture log;
  for (const Case& c : cases) {
    EXPECT_EQ(errorOf(request(c.type, Dictionary().setting("paths", c.paths))), c.expected)
        << c.type << " " << lmo::describe(c.paths);
  }
  EXPECT_EQ(log.count("failed to register plug-in at " + notABundle), 1u);
  ASSERT_NE(registry_->plugInForUrl(loose), nullptr);

  EXPECT_EQ(errorOf(request("remove", {{"paths", Array{viaLink}}})), Expected(0, ""));
  EXPECT_EQ(registry_->plugInForUrl(loose), nullptr);
  EXPECT_EQ(errorOf(request("remove", {{"paths", Array{loose}}})),
            Expected(9, "no plugin at " + loose));
  EXPECT_EQ(log.count("bulk options 0x1f not supported"), 0u);
  request("bulk", {{"flags", u64(0x1F)}});
  EXPECT_EQ(log.count("bulk options 0x1f not supported"), 1u);
}

TEST_F(RequestProtocol, UninstallWithdrawsServiceRegistrations) {
  base::LogCapture log;
  EXPECT_EQ(errorOf(request("remove", {{"paths", Array{plugInPath("widget")}}})), Expected(0, ""));
  EXPECT_TRUE(eventually([&] { return log.contains("PLUGIN REMOVAL:com.x.widget RESULT:"); }));
  EXPECT_EQ(server_->findPlugIn(uuidOf("share"))->identifier(), kShare);
}

TEST_F(RequestProtocol, UuidListsAreDecodedInOrder) {
  const Dictionary change{{"election", Value::integer(1)}};
  const base::Uuid widget = uuidOf("widget");
  const base::Uuid unknown = base::Uuid::random();
  const auto annotate = [&](const Value& uuids) {
    return errorOf(
        request("annotate", Dictionary{{"annotations", change}}.setting("uuids", uuids)));
  };
  const std::pair<Value, Expected> cases[] = {
      {Value(), {4, "invalid request format (uuid)"}},
      {Value(widget), {4, "invalid request format (uuid)"}},
      {Array{"not a uuid"}, {4, "invalid request (bad uuid array)"}},
      {Array{Value::data(widget.bytes().data(), 16)}, {4, "invalid request (bad uuid array)"}},
      {Array{unknown}, {4, "no such plugin (uuid not found)"}},
      {Array{}, {0, ""}},
  };
  for (const auto& [uuids, expected] : cases) {
    EXPECT_EQ(annotate(uuids), expected) << lmo::describe(uuids);
  }
  EXPECT_EQ(server_->annotationForPlugIn(*plugIn("widget")), std::nullopt);
  // Elements before the bad one keep their effect.
  EXPECT_EQ(annotate(Array{widget, unknown}), Expected(4, "no such plugin (uuid not found)"));
  EXPECT_EQ(server_->annotationForPlugIn(*plugIn("widget")), change);
}

}  // namespace
}  // namespace vantrel::daemon::testing
