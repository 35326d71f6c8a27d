// Using a discovered plug-in end to end: "ready", the launch descriptions it
// leaves for the host and the launcher that starts from them, and the read
// tokens of "access" as another process consumes them.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <optional>

#include "base/Log.h"
#include "client/VTPlugInLauncher.h"
#include "omnidex/PrivacyConsent.h"
#include "tests/daemon/DiscoveryFixture.h"
#include "tests/support/ScopedEnvironment.h"

namespace vantrel::daemon::testing {
namespace {

namespace fs = std::filesystem;
using lmo::Array;
using lmo::Dictionary;
using lmo::Value;

using Enabling = Discovery;

using vantrel::testing::ScopedEnvironment;

// Starts the plug-in as its host would and returns the lines it wrote
// before it exited, or the launcher's error.
base::Result<std::vector<std::string>> launchAndRead(const std::string& identifier) {
  int out[2];
  if (::pipe2(out, O_CLOEXEC) != 0) return base::Error{"test", errno, "no pipe"};
  base::Result<pid_t> pid =
      client::VTPlugInLauncher::launch(identifier, {.standardOutput = out[1]});
  ::close(out[1]);
  std::string text;
  char buffer[4096];
  for (ssize_t n; pid.has_value() && (n = ::read(out[0], buffer, sizeof buffer)) > 0;) {
    text.append(buffer, static_cast<size_t>(n));
  }
  ::close(out[0]);
  if (!pid.has_value()) return pid.error();
  ::waitpid(pid.value(), nullptr, 0);
  std::vector<std::string> lines;
  for (size_t start = 0, end; (end = text.find('\n', start)) != std::string::npos;
       start = end + 1) {
    lines.push_back(text.substr(start, end - start));
  }
  return lines;
}

// What a separate process reads through a bundle token: the identifier in
// the bundle's Info.plist, or the process's output as it is
// ("error <errno>").
std::string identifierReadThrough(const std::string& token) {
  auto peer = vantrel::testing::PeerProcess::start(vantrel::testing::testPeerPath(),
                                                   {"read-token", token, "Info.plist"});
  if (!peer) return "(not started)";
  std::string text;
  while (std::optional<std::string> line = peer->readLine()) {
    text += (text.empty() ? "" : "\n") + *line;
  }
  peer->wait();
  const base::Result<Value> info = platform::readPropertyList(text);
  const Dictionary* fields = info.has_value() ? info.value().getIfDictionary() : nullptr;
  const std::string* identifier =
      fields ? fields->get("KBBundleIdentifier").getIfString() : nullptr;
  return identifier ? *identifier : text;
}

TEST_F(Enabling, ReadyEnablesOnlyWhenEveryPlugInPasses) {
  base::LogCapture log;
  const pid_t self = ::getpid();
  const std::string share = launchFile(self, kShare);
  std::error_code ignored;
  std::filesystem::remove(share, ignored);  // left by an earlier test of this process
  request(protocol::kRequestLock, {{protocol::kKeyFlags, u64(protocol::HoldFlags::kPlugIn)},
                                   {protocol::kKeyPaths, Array{plugInPath("widget")}}});
  EXPECT_EQ(errorOf(request(protocol::kRequestReady,
                            {{protocol::kKeyUuids, Array{uuidOf("share"), uuidOf("widget")}}})),
            Expected(protocol::kErrorAccessDenied,
                     "access to plugin com.x.widget denied: the plug-in is on hold"));
  EXPECT_FALSE(std::filesystem::exists(share));

  // The same plug-in twice is checked twice and enabled once.
  EXPECT_EQ(errorOf(request(protocol::kRequestReady,
                            {{protocol::kKeyUuids, Array{uuidOf("share"), uuidOf("share")}}})),
            Expected(0, ""));
  const std::string enabling = base::format("enabling pid=%d for plug-in com.x.share(", self);
  const std::vector<std::string> lines = log.lines();
  EXPECT_EQ(
      std::count_if(lines.begin(), lines.end(),
                    [&](const std::string& line) {
                      return line.starts_with(enabling) &&
                             line.ends_with(uuidOf("share").string() + " " + plugInPath("share"));
                    }),
      1);
  EXPECT_TRUE(std::filesystem::exists(share));

  // The bundle's own environment wins over the data container.
  const Dictionary service{{"EnvironmentVariables", Dictionary{{"HOME", "/own"}}}};
  const std::string own = addPlugIn("Own", "com.o.own", {}, {}, {}, {{"LMOService", service}});
  EXPECT_EQ(errorOf(request(protocol::kRequestReady, {{protocol::kKeyUuids, Array{uuidAt(own)}}})),
            Expected(0, ""));
  auto file = platform::readPropertyListFile(launchFile(self, "com.o.own"));
  ASSERT_TRUE(file.has_value()) << file.error().description();
  auto description = platform::decodeLaunchDescription(file.value());
  ASSERT_TRUE(description.has_value()) << description.error().description();
  const std::vector<std::string>& environment = description.value().environment;
  EXPECT_NE(std::find(environment.begin(), environment.end(), "HOME=/own"), environment.end());

  const std::string bare = addPlugIn("Bare", "com.n.bare", {}, {}, {}, {}, false);
  EXPECT_EQ(
      errorOf(request(protocol::kRequestReady, {{protocol::kKeyUuids, Array{uuidAt(bare)}}})),
      Expected(protocol::kErrorBadRequest, "cannot obtain executable path for plug-in com.n.bare(" +
                                               uuidAt(bare).string() + ")"));
}

TEST_F(Enabling, LaunchDescriptionLastsAsLongAsTheHost) {
  std::string answer;
  auto host = ask(peerWith("Host", {}), protocol::kRequestReady, 0, {uuidOf("widget")}, &answer);
  ASSERT_EQ(answer, "ok");
  const std::string file = launchFile(host->pid(), kWidget);
  auto value = platform::readPropertyListFile(file);
  ASSERT_TRUE(value.has_value()) << value.error().description();
  auto description = platform::decodeLaunchDescription(value.value());
  ASSERT_TRUE(description.has_value()) << description.error().description();
  const std::string home = container(uuidOf("widget"));
  const std::vector<std::string>& environment = description.value().environment;
  for (const std::string& entry : {"HOME=" + home, "TMPDIR=" + home + "/tmp"}) {
    EXPECT_NE(std::find(environment.begin(), environment.end(), entry), environment.end()) << entry;
  }
  EXPECT_EQ(description.value().sandboxProfile, "plugin");

  host->closeStdin();
  host->wait();
  EXPECT_TRUE(eventually([&] { return !std::filesystem::exists(file); }));
}

TEST_F(Enabling, AccessGivesATokenPerPlugIn) {
  const Dictionary empty = request(protocol::kRequestAccess, {{protocol::kKeyUuids, Array{}}});
  EXPECT_EQ(empty.get(protocol::kKeyExtensions), Value(Array{})) << lmo::describe(empty);

  const Value widget = uuidOf("widget"), share = uuidOf("share");
  const Dictionary reply =
      request(protocol::kRequestAccess, {{protocol::kKeyUuids, Array{share, widget}}});
  const Array* tokens = reply.get(protocol::kKeyExtensions).getIfArray();
  ASSERT_TRUE(tokens != nullptr && tokens->size() == 2) << lmo::describe(reply);
  const std::string shareToken = *(*tokens)[0].getIfString();
  // "1;<nonce>;<mac>;<path>": the path pointed at another bundle, and one
  // digit of the MAC changed.
  std::string moved = shareToken;
  moved.replace(moved.rfind("share.appex"), 5, "widget");
  std::string altered = shareToken;
  const size_t mac = shareToken.find(';', 2) + 1;
  altered[mac] = altered[mac] == '0' ? '1' : '0';
  const std::pair<std::string, std::string> cases[] = {
      {shareToken, kShare},  // in request order
      {*(*tokens)[1].getIfString(), kWidget},
      {moved, "error 22"},
      {altered, "error 22"},
  };
  for (const auto& [token, expected] : cases) {
    EXPECT_EQ(identifierReadThrough(token), expected) << token;
  }

  std::filesystem::remove_all(plugInPath("share"));
  const Dictionary failed =
      request(protocol::kRequestAccess, {{protocol::kKeyUuids, Array{widget, share}}});
  EXPECT_EQ(errorOf(failed), Expected(protocol::kErrorBadRequest,
                                      "cannot create extension to " + plugInPath("share") + ": 2"));
  EXPECT_FALSE(failed.contains(protocol::kKeyExtensions));
}

TEST_F(Enabling, ReadyLetsTheHostLaunchThePlugInAsDescribed) {
  constexpr const char* kReporter = "com.e.reporter";
  constexpr const char* kIdle = "com.e.idle";
  // The executables are in place before the registry first sees the bundles.
  for (const char* identifier : {kReporter, kIdle}) {
    const std::string bundle = tmp_.file("apps/Env.app/PlugIns/") + identifier + ".appex";
    fs::create_directories(bundle);
    fs::copy_file(VANTREL_ENV_REPORTER_PATH, bundle + "/reporter");
  }
  const Dictionary executable{{"KBBundleExecutable", "reporter"}};
  const std::string reporter = addPlugIn("Env", kReporter, {}, {}, {}, executable, false);
  addPlugIn("Env", kIdle, {}, {}, {}, executable, false);
  {
    const ScopedEnvironment sdk("VTTEST_SDK", "sdk-under-test");
    ASSERT_EQ(
        errorOf(request(protocol::kRequestReady, {{protocol::kKeyUuids, Array{uuidAt(reporter)}}})),
        Expected(0, ""));
  }

  // This process is the host: its launcher looks where the daemon's service
  // manager publishes.
  const ScopedEnvironment runtime("VANTREL_RUNTIME_DIR", serviceManagerDirectory());
  const base::Result<std::vector<std::string>> lines = launchAndRead(kReporter);
  ASSERT_TRUE(lines.has_value()) << lines.error().description();
  std::vector<std::string> environment;
  std::string directory;
  for (const std::string& line : lines.value()) {
    if (line.starts_with("env ")) environment.push_back(line.substr(4));
    if (line.starts_with("cwd ")) directory = line.substr(4);
  }
  std::sort(environment.begin(), environment.end());
  const std::string home = container(uuidAt(reporter));
  EXPECT_EQ(environment,
            (std::vector<std::string>{"HOME=" + home, "KBFIXED_USER_HOME=" + home,
                                      "TMPDIR=" + home + "/tmp", "VTTEST_SDK=sdk-under-test"}));
  std::error_code ec;
  EXPECT_TRUE(fs::equivalent(directory, home, ec)) << directory << " " << home;

  const base::Result<pid_t> idle = client::VTPlugInLauncher::launch(kIdle);
  ASSERT_FALSE(idle.has_value());
  EXPECT_EQ(idle.error(),
            (base::Error{client::kPlugInLauncherErrorDomain, client::kLaunchNotEnabled,
                         "no launch description for com.e.idle (not enabled for "
                         "this process)"}));
}

TEST_F(Enabling, ReadyChoosesTheSandboxProfileByExtensionPoint) {
  const auto profileAfterReady = [&](const std::string& path, const std::string& identifier) {
    const Expected readied =
        errorOf(request(protocol::kRequestReady, {{protocol::kKeyUuids, Array{uuidAt(path)}}}));
    if (readied != Expected(0, "")) return readied.second;
    auto file = platform::readPropertyListFile(launchFile(::getpid(), identifier));
    if (!file.has_value()) return file.error().description();
    auto description = platform::decodeLaunchDescription(file.value());
    return description.has_value() ? description.value().sandboxProfile
                                   : description.error().description();
  };
  enum class Consent { kNone, kGranted, kOtherService };
  struct Case {
    const char* point;
    Value openAccess;  // null: no "RequestsOpenAccess"
    Consent consent;
    const char* profile;
  };
  const char* keyboard = "com.karvo.keyboard-service";
  const Case cases[] = {
      {keyboard, Value::boolean(true), Consent::kGranted, "plugin"},
      {keyboard, Value::boolean(true), Consent::kNone, "keyboard"},
      {keyboard, Value::boolean(true), Consent::kOtherService, "keyboard"},
      {keyboard, Value("YES"), Consent::kGranted, "keyboard"},
      {keyboard, Value(), Consent::kGranted, "keyboard"},
      {"com.karvo.netguard.filter-data", Value(), Consent::kNone, "network-filter"},
      {"com.karvo.peekview.extension.preview", Value(), Consent::kNone, "peekviewd"},
      {"com.karvo.widget", Value(), Consent::kNone, "plugin"},
  };
  std::string openKeyboard;
  int n = 0;
  for (const Case& c : cases) {
    // Consent belongs to the containing application: one each.
    const std::string app = "Profile" + std::to_string(n), id = "com.p.profile" + std::to_string(n);
    ++n;
    if (c.consent != Consent::kNone) {
      const char* service = c.consent == Consent::kGranted ? omnidex::kKeyboardNetworkService
                                                           : "com.karvo.privacy.camera";
      ASSERT_TRUE(registry_->grantConsent("com.app." + app, service).has_value());
    }
    const Dictionary attributes =
        c.openAccess.isNull() ? Dictionary{} : Dictionary{{"RequestsOpenAccess", c.openAccess}};
    const std::string path =
        addPlugIn(app, id, attributes, {{"QXExtensionPointIdentifier", c.point}});
    EXPECT_EQ(profileAfterReady(path, id), c.profile) << id << " " << c.point;
    if (openKeyboard.empty()) openKeyboard = path;  // the first case
  }

  // A revoked grant counts from the next "ready" on.
  ASSERT_TRUE(
      registry_->revokeConsent("com.app.Profile0", omnidex::kKeyboardNetworkService).has_value());
  EXPECT_EQ(profileAfterReady(openKeyboard, "com.p.profile0"), "keyboard");
}

}  // namespace
}  // namespace vantrel::daemon::testing
