// The envelope, the dispatch table, the path and UUID decoders, and the
// registration requests, through a real socket.

#include <gtest/gtest.h>

#include <algorithm>
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
      {{{protocol::kKeyRequest, protocol::kRequestBulk}, {protocol::kKeyVersion, u64(1)}},
       {protocol::kErrorVersionMismatch, "unsupported protocol version 1 (current 3)"}},
      {{{protocol::kKeyRequest, protocol::kRequestBulk}, {protocol::kKeyVersion, u64(4)}},
       {protocol::kErrorVersionMismatch, "unsupported protocol version 4 (current 3)"}},
      {{{protocol::kKeyRequest, protocol::kRequestBulk}},
       {protocol::kErrorVersionMismatch, "unsupported protocol version 0 (current 3)"}},
      {{{protocol::kKeyRequest, protocol::kRequestBulk}, {protocol::kKeyVersion, "3"}},
       {protocol::kErrorVersionMismatch, "unsupported protocol version 0 (current 3)"}},
      {{{protocol::kKeyRequest, protocol::kRequestBulk},
        {protocol::kKeyVersion, u64((1ull << 32) + 2)}},
       {protocol::kErrorVersionMismatch, "unsupported protocol version 2 (current 3)"}},
      {{{protocol::kKeyVersion, u64(9)}},
       {protocol::kErrorVersionMismatch, "unsupported protocol version 9 (current 3)"}},
      {{{protocol::kKeyVersion, u64(protocol::kCurrentVersion)}},
       {protocol::kErrorBadRequest, "invalid request format (missing type)"}},
      {{{protocol::kKeyRequest, u64(1)}, {protocol::kKeyVersion, u64(protocol::kCurrentVersion)}},
       {protocol::kErrorBadRequest, "invalid request format (missing type)"}},
      {{{protocol::kKeyRequest, "frobnicate"},
        {protocol::kKeyVersion, u64(protocol::kOldestVersion)}},
       {protocol::kErrorBadRequest, "unrecognized request"}},
      {{{protocol::kKeyRequest, "Match"}, {protocol::kKeyVersion, u64(protocol::kCurrentVersion)}},
       {protocol::kErrorBadRequest, "unrecognized request"}},
      {{{protocol::kKeyRequest, protocol::kRequestBulk},
        {protocol::kKeyVersion, u64(protocol::kOldestVersion)}},
       {0, ""}},
      {{{protocol::kKeyRequest, protocol::kRequestBulk},
        {protocol::kKeyVersion, u64(protocol::kCurrentVersion)},
        {protocol::kKeyFlags, u64(0x1F)}},
       {0, ""}},
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
      {protocol::kRequestAdd, Value(), {protocol::kErrorBadRequest, "invalid request format"}},
      {protocol::kRequestAdd,
       Value("/tmp"),
       {protocol::kErrorBadRequest, "invalid request format"}},
      {protocol::kRequestAdd,
       Array{u64(1)},
       {protocol::kErrorBadRequest, "invalid request format"}},
      {protocol::kRequestAdd,
       Array{"tmp/x"},
       {protocol::kErrorBadPath, "absolute path required: tmp/x"}},
      {protocol::kRequestRemove, Array{""}, {protocol::kErrorBadPath, "absolute path required: "}},
      {protocol::kRequestAdd, Array{}, {0, ""}},
      {protocol::kRequestAdd,
       Array{"/nonexistent/x.plugin"},
       {protocol::kErrorBadPath, "invalid plugin path: /nonexistent/x.plugin"}},
      // Registered under its canonical path; the next path fails and the
      // first stays registered.
      {protocol::kRequestAdd,
       Array{viaLink, notABundle},
       {protocol::kErrorRegistryRefused, "unable to register plug-in at " + notABundle}},
      {protocol::kRequestRemove,
       Array{"/nonexistent/x.plugin"},
       {protocol::kErrorBadPath, "no plugin at /nonexistent/x.plugin"}},
  };
  base::LogCapture log;
  for (const Case& c : cases) {
    EXPECT_EQ(errorOf(request(c.type, Dictionary().setting(protocol::kKeyPaths, c.paths))),
              c.expected)
        << c.type << " " << lmo::describe(c.paths);
  }
  EXPECT_EQ(log.count("failed to register plug-in at " + notABundle), 1u);
  ASSERT_NE(registry_->plugInForUrl(loose), nullptr);

  EXPECT_EQ(errorOf(request(protocol::kRequestRemove, {{protocol::kKeyPaths, Array{viaLink}}})),
            Expected(0, ""));
  EXPECT_EQ(registry_->plugInForUrl(loose), nullptr);
  EXPECT_EQ(errorOf(request(protocol::kRequestRemove, {{protocol::kKeyPaths, Array{loose}}})),
            Expected(protocol::kErrorBadPath, "no plugin at " + loose));
  EXPECT_EQ(log.count("bulk options 0x1f not supported"), 0u);
  request(protocol::kRequestBulk, {{protocol::kKeyFlags, u64(0x1F)}});
  EXPECT_EQ(log.count("bulk options 0x1f not supported"), 1u);
}

TEST_F(RequestProtocol, CanonicalPathsOfUpTo1023BytesAreAccepted) {
  const std::string top = std::filesystem::canonical(tmp_.path()).string();
  // A plug-in bundle whose canonical path is exactly length bytes long.
  const auto bundleOfLength = [&](size_t length) {
    const std::string head = "/edge" + std::to_string(length), tail = "/P.plugin";
    std::string path = top + head;
    for (size_t left = length - path.size() - tail.size(); left > 0;) {
      size_t part = std::min<size_t>(left, 200);
      if (left - part == 1) --part;  // a component takes at least two bytes
      path += "/" + std::string(part - 1, 'x');
      left -= part;
    }
    path += tail;
    EXPECT_EQ(path.size(), length);
    writePlugIn(path.substr(top.size() + 1), "com.x.edge" + std::to_string(length));
    return path;
  };
  const std::string fits = bundleOfLength(1023), tooLong = bundleOfLength(1024);
  const std::pair<std::string, Expected> cases[] = {
      {fits, {0, ""}},
      {tooLong, {protocol::kErrorBadPath, "invalid plugin path: " + tooLong}},
  };
  for (const auto& [path, expected] : cases) {
    EXPECT_EQ(errorOf(request(protocol::kRequestAdd, {{protocol::kKeyPaths, Array{path}}})),
              expected)
        << path.size();
  }
  EXPECT_NE(registry_->plugInForUrl(fits), nullptr);
}

TEST_F(RequestProtocol, UninstallWithdrawsServiceRegistrations) {
  base::LogCapture log;
  EXPECT_EQ(errorOf(request(protocol::kRequestRemove,
                            {{protocol::kKeyPaths, Array{plugInPath("widget")}}})),
            Expected(0, ""));
  EXPECT_TRUE(eventually([&] { return log.contains("PLUGIN REMOVAL:com.x.widget RESULT:"); }));
  EXPECT_EQ(server_->findPlugIn(uuidOf("share"))->identifier(), kShare);
}

TEST_F(RequestProtocol, UuidListsAreDecodedInOrder) {
  const Dictionary change{{protocol::kAnnotationElection, Value::integer(1)}};
  const base::Uuid widget = uuidOf("widget");
  const base::Uuid unknown = base::Uuid::random();
  const auto annotate = [&](const Value& uuids) {
    return errorOf(request(
        protocol::kRequestAnnotate,
        Dictionary{{protocol::kKeyAnnotations, change}}.setting(protocol::kKeyUuids, uuids)));
  };
  const std::pair<Value, Expected> cases[] = {
      {Value(), {protocol::kErrorBadRequest, "invalid request format (uuid)"}},
      {Value(widget), {protocol::kErrorBadRequest, "invalid request format (uuid)"}},
      {Array{"not a uuid"}, {protocol::kErrorBadRequest, "invalid request (bad uuid array)"}},
      {Array{Value::data(widget.bytes().data(), 16)},
       {protocol::kErrorBadRequest, "invalid request (bad uuid array)"}},
      {Array{unknown}, {protocol::kErrorBadRequest, "no such plugin (uuid not found)"}},
      {Array{}, {0, ""}},
  };
  for (const auto& [uuids, expected] : cases) {
    EXPECT_EQ(annotate(uuids), expected) << lmo::describe(uuids);
  }
  EXPECT_EQ(server_->annotationForPlugIn(*plugIn("widget")), std::nullopt);
  // Elements before the bad one keep their effect.
  EXPECT_EQ(annotate(Array{widget, unknown}),
            Expected(protocol::kErrorBadRequest, "no such plugin (uuid not found)"));
  EXPECT_EQ(server_->annotationForPlugIn(*plugIn("widget")), change);
}

}  // namespace
}  // namespace vantrel::daemon::testing
