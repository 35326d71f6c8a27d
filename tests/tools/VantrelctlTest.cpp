// vantrelctl as people and scripts run it: the built tool as a child
// process against a real vantreld on a private tree (two applications and a
// few plug-ins), checking its output, its JSON and its exit statuses.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "lmo/Protocol.h"
#include "tests/support/PeerProcess.h"
#include "tests/support/TempDir.h"
#include "tools/vantrelctl/ExitStatus.h"
#include "tools/vantrelctl/JsonReader.h"

extern char** environ;

namespace vantrel::lmo {
// Readable values in failure messages.
void PrintTo(const Value& value, std::ostream* os) {
  *os << describe(value);
}
}  // namespace vantrel::lmo

namespace vantrel::ctl {
namespace {

using namespace std::chrono_literals;
using lmo::Dictionary;
using lmo::Value;
using vantrel::testing::PeerProcess;

constexpr auto kDeadline = 15s;

bool eventually(const std::function<bool()>& condition) {
  const auto deadline = std::chrono::steady_clock::now() + kDeadline;
  for (; !condition(); std::this_thread::sleep_for(20ms)) {
    if (std::chrono::steady_clock::now() > deadline) return false;
  }
  return true;
}

std::string readFile(const std::string& path) {
  std::ostringstream text;
  text << std::ifstream(path, std::ios::binary).rdbuf();
  return text.str();
}

// An Info.plist for a plug-in of extension point, with extra XML inside its
// QXExtension dictionary (a version, a principal class, Dedicated).
std::string plugInPlist(const std::string& identifier, const std::string& point,
                        const std::string& version, const std::string& extension = "") {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
         "<key>KBBundleIdentifier</key><string>" +
         identifier +
         "</string>"
         "<key>KBBundleExecutable</key><string>main</string>"
         "<key>QXExtension</key><dict>"
         "<key>QXExtensionPointIdentifier</key><string>" +
         point +
         "</string>"
         "<key>QXExtensionAttributes</key><dict><key>QXExtensionVersion</key><string>" +
         version + "</string></dict>" + extension + "</dict></dict></plist>\n";
}

std::string appPlist(const std::string& identifier, const std::string& name) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
         "<key>KBBundleIdentifier</key><string>" +
         identifier +
         "</string>"
         "<key>KBBundleName</key><string>" +
         name +
         "</string>"
         "<key>KBBundleExecutable</key><string>" +
         name + "</string></dict></plist>\n";
}

struct Outcome {
  int status = -1;  // the exit status; -1 when killed or timed out
  std::string out, err;
};

// A parsed --json document; fails the test (and gives null) on bad JSON.
Value json(const Outcome& run) {
  base::Result<Value> value = readJson(run.out);
  if (!value.has_value()) {
    ADD_FAILURE() << value.error().description() << " in:\n" << run.out;
    return Value();
  }
  return value.value();
}

// The forms (or any array of maps) of a --json document, by "identifier".
std::multiset<std::string> identifiers(const Value& array) {
  std::multiset<std::string> out;
  if (const lmo::Array* items = array.getIfArray()) {
    for (const Value& item : *items) {
      if (const Dictionary* d = item.getIfDictionary()) {
        out.insert(lmo::describe(d->get(protocol::kFormIdentifier)));
      }
    }
  }
  return out;
}

class Vantrelctl : public ::testing::Test {
 protected:
  void SetUp() override {
    writeApp("Alpha", {{"Share", plugInPlist("com.test.share", "com.test.share-point", "1.0")},
                       {"Widget", plugInPlist("com.test.widget", "com.test.widget-point", "1.0")},
                       {"Custom", plugInPlist("com.test.custom", "com.test.share-point", "1.0",
                                              "<key>PrincipalClass</key><string>X</string>")}});
    writeApp("Beta", {{"Share", plugInPlist("com.test.share", "com.test.share-point", "2.0")},
                      {"Private", plugInPlist("com.test.private", "com.test.widget-point", "1.0",
                                              "<key>Dedicated</key><true/>")},
                      {"Hidden", plugInPlist("com.test.hidden", "com.test.widget-point", "1.0")}});
    char host[256] = "localhost";
    ::gethostname(host, sizeof host - 1);
    tmp_.write(std::string("prefs/") + host + "/com.karvo.vantrel.userprefs.plist",
               "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
               "<key>exclusions</key><array><dict><key>QXExtensionIdentifier</key>"
               "<string>com.test.hidden</string></dict></array></dict></plist>\n");
    for (const std::string entry :
         {"VANTREL_RUNTIME_DIR=run", "VANTREL_STATE_DIR=state", "VANTREL_APP_DIRS=apps",
          "VANTREL_PLUGIN_DIRS=plugins", "VANTREL_PREFERENCES_DIR=prefs", "VANTREL_SDK_DIRS=sdks",
          "VANTREL_SYSTEM_DIR=system", "XDG_STATE_HOME=xdg-state", "HOME=home"}) {
      const size_t value = entry.find('=') + 1;
      environment_.push_back(entry.substr(0, value) + tmp_.file(entry.substr(value)));
    }
    std::filesystem::create_directories(tmp_.path() / "home");
    daemon_ = startLogged(VANTRELD_PATH, {}, "vantreld.log", "VANTREL_LOG=stderr");
    ASSERT_TRUE(eventually([&] {
      return ctl({"status"}).status == kExitOk &&
             ctl({"status", "--json"}).out.find("\"installed\": 6") != std::string::npos;
    })) << readFile(tmp_.file("vantreld.log"));
  }

  void writeApp(const std::string& name,
                const std::vector<std::pair<std::string, std::string>>& plugIns) {
    tmp_.write("apps/" + name + ".app/Info.plist", appPlist("com.test." + name, name));
    for (const auto& [plugIn, plist] : plugIns) {
      tmp_.write("apps/" + name + ".app/PlugIns/" + plugIn + ".appex/Info.plist", plist);
    }
  }
  std::string plugIn(const std::string& app, const std::string& name) const {
    return tmp_.file("apps/" + app + ".app/PlugIns/" + name + ".appex");
  }

  // Runs vantrelctl to completion (killed after kDeadline) with stdin from
  // input.
  Outcome ctl(const std::vector<std::string>& args, const std::string& input = "") {
    const std::string outPath = tmp_.file("ctl.out"), errPath = tmp_.file("ctl.err");
    const std::string inPath = tmp_.write("ctl.in", input);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 0, inPath.c_str(), O_RDONLY, 0);
    posix_spawn_file_actions_addopen(&actions, 1, outPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC,
                                     0600);
    posix_spawn_file_actions_addopen(&actions, 2, errPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC,
                                     0600);
    std::vector<std::string> argStrings{VANTRELCTL_PATH};
    argStrings.insert(argStrings.end(), args.begin(), args.end());
    std::vector<char*> argv, envp;
    for (std::string& a : argStrings) argv.push_back(a.data());
    argv.push_back(nullptr);
    std::vector<std::string> env = environment_;
    env.push_back("VANTREL_LOG=");
    for (std::string& e : env) envp.push_back(e.data());
    envp.push_back(nullptr);
    pid_t pid = -1;
    Outcome run;
    if (posix_spawn(&pid, VANTRELCTL_PATH, &actions, nullptr, argv.data(), envp.data()) != 0) {
      ADD_FAILURE() << "cannot start " << VANTRELCTL_PATH;
      return run;
    }
    posix_spawn_file_actions_destroy(&actions);
    int status = 0;
    if (!eventually([&] { return ::waitpid(pid, &status, WNOHANG) == pid; })) {
      ::kill(pid, SIGKILL);
      ::waitpid(pid, &status, 0);
      ADD_FAILURE() << "vantrelctl hung";
    }
    run.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    run.out = readFile(outPath);
    run.err = readFile(errPath);
    return run;
  }

  // A long-running child (its pid is the program's own) whose standard
  // error goes to the file log in the tree.
  std::unique_ptr<PeerProcess> startLogged(const std::string& program,
                                           const std::vector<std::string>& args,
                                           const std::string& log, const char* logging) {
    std::vector<std::string> shellArgs{"-c", "exec 2>\"$1\"; shift; exec \"$0\" \"$@\"", program,
                                       tmp_.file(log)};
    shellArgs.insert(shellArgs.end(), args.begin(), args.end());
    std::vector<std::string> env = environment_;
    env.push_back(logging);
    return PeerProcess::start("/bin/bash", shellArgs, env);
  }
  std::unique_ptr<PeerProcess> startCtl(const std::vector<std::string>& args,
                                        const std::string& log) {
    return startLogged(VANTRELCTL_PATH, args, log, "VANTREL_LOG=");
  }

  // The exit status of child once it exits within kDeadline, else -1.
  static int exitStatus(PeerProcess& child) {
    pollfd p{child.pidfd(), POLLIN, 0};
    if (::poll(&p, 1, static_cast<int>(std::chrono::milliseconds(kDeadline).count())) != 1) {
      return -1;
    }
    const int status = child.wait();
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  }

  vantrel::testing::TempDir tmp_;
  std::vector<std::string> environment_;
  std::unique_ptr<PeerProcess> daemon_;
};

TEST_F(Vantrelctl, ExitStatusesAndTheirMessages) {
  const std::string nowhere = tmp_.file("run/nobody-here");
  const std::string accessDenied = "(code " + std::to_string(protocol::kErrorAccessDenied) + ")";
  struct Case {
    std::vector<std::string> args;
    int status;
    std::vector<std::string> inStderr;  // "" for stdout checks below
    std::string inStdout;
  } cases[] = {
      {{"--version"}, kExitOk, {}, "vantrelctl " VANTREL_VERSION "\n"},
      {{"help", "why"}, kExitOk, {}, "usage: vantrelctl why PLUGIN"},
      {{"list", "--help"}, kExitOk, {}, "--point ID"},
      {{"frobnicate"}, kExitUsage, {"unknown command: frobnicate", "usage: vantrelctl"}, ""},
      {{"list", "--bogus"}, kExitUsage, {"unknown option --bogus", "usage: vantrelctl list"}, ""},
      {{"show"}, kExitUsage, {"show: missing argument"}, ""},
      {{"--timeout", "soon", "status"}, kExitUsage, {"--timeout wants a number"}, ""},
      {{"match", "{\"a\": [1, }"},
       kExitUsage,
       {"malformed rules: unexpected character at byte 10"},
       ""},
      {{"match", "[]"}, kExitUsage, {"malformed rules: not a JSON object"}, ""},
      {{"match", "--rule", "novalue"}, kExitUsage, {"--rule wants KEY=PATTERN"}, ""},
      {{"release", "not-a-token"}, kExitUsage, {"not a hold token"}, ""},
      {{"-S", nowhere, "list"},
       kExitUnreachable,
       {"cannot connect to vantreld at " + nowhere + ": ",
        "Start it with 'systemctl start vantreld.socket' or run 'vantreld -S " + nowhere + "'"},
       ""},
      {{"show", "com.test.nothing"},
       kExitRefused,
       {"vantrelctl: no plug-in com.test.nothing is installed\n"},
       ""},
      {{"show", "com.test.share"},
       kExitRefused,
       {"com.test.share names 2 registrations; name one by UUID or path", plugIn("Alpha", "Share"),
        plugIn("Beta", "Share")},
       ""},
      {{"list", "--all"},
       kExitRefused,
       {accessDenied, "--all needs the entitlement \"" +
                          std::string(protocol::kManagerEntitlement) +
                          "\" and an unsandboxed process"},
       ""},
      {{"why", plugIn("Alpha", "Share"), "--host", "1"},
       kExitRefused,
       {"explaining for another host requires", accessDenied},
       ""},
  };
  for (const Case& c : cases) {
    const Outcome run = ctl(c.args);
    const std::string label = ::testing::PrintToString(c.args);
    EXPECT_EQ(run.status, c.status) << label << "\n" << run.err;
    for (const std::string& text : c.inStderr) {
      EXPECT_NE(run.err.find(text), std::string::npos) << label << " stderr:\n" << run.err;
    }
    EXPECT_NE(run.out.find(c.inStdout), std::string::npos) << label << " stdout:\n" << run.out;
  }
  // The status of an absent daemon still says what it tried.
  const Outcome status = ctl({"-S", nowhere, "status", "--json"});
  EXPECT_EQ(status.status, kExitUnreachable);
  const Value document = json(status);
  const Dictionary* d = document.getIfDictionary();
  ASSERT_NE(d, nullptr);
  EXPECT_EQ(d->get("socket"), Value(nowhere));
  EXPECT_EQ(d->get("answering"), Value::boolean(false));
}

TEST_F(Vantrelctl, StatusNamesTheDaemon) {
  const Outcome human = ctl({"status"});
  EXPECT_EQ(human.status, kExitOk);
  EXPECT_NE(human.out.find("Socket:     " +
                           tmp_.file(std::string("run/") + protocol::kDefaultServiceName)),
            std::string::npos)
      << human.out;
  EXPECT_NE(human.out.find("answering (pid " + std::to_string(daemon_->pid()) + ")"),
            std::string::npos)
      << human.out;
  const Value document = json(ctl({"status", "--json"}));
  const Dictionary* d = document.getIfDictionary();
  ASSERT_NE(d, nullptr);
  EXPECT_EQ(d->get(protocol::kKeyPid), Value::integer(daemon_->pid()));
  EXPECT_EQ(d->get(protocol::kKeyVersion), Value::integer(protocol::kCurrentVersion));
  EXPECT_EQ(d->get(protocol::kKeyInstalled), Value::integer(6));
  EXPECT_EQ(d->get(protocol::kKeyHolds), Value(lmo::Array()));
}

TEST_F(Vantrelctl, ListAndMatchPrintTheSamePlugIns) {
  // Offered to vantrelctl: the higher com.test.share, and the widget; the
  // dedicated, excluded and misconfigured ones are not.
  const Outcome table = ctl({"list"});
  EXPECT_EQ(table.status, kExitOk);
  std::istringstream lines(table.out);
  std::string header, row;
  std::getline(lines, header);
  EXPECT_TRUE(header.starts_with("IDENTIFIER")) << table.out;
  for (const char* column : {"VERSION", "POINT", "ELECTION", "WHERE", "PATH"}) {
    EXPECT_NE(header.find(column), std::string::npos) << header;
  }
  std::getline(lines, row);
  EXPECT_EQ(header.find("PATH"), row.find(plugIn("Beta", "Share"))) << "columns align:\n"
                                                                    << table.out;
  EXPECT_NE(row.find("com.test.share   2.0      com.test.share-point   0         Beta"),
            std::string::npos)
      << row;
  EXPECT_NE(table.out.find("2 plug-ins listed."), std::string::npos);
  const Outcome bare = ctl({"list", "--no-legend"});
  EXPECT_TRUE(bare.out.starts_with("com.test.share ")) << bare.out;
  EXPECT_EQ(bare.out.find("listed"), std::string::npos);

  using Ids = std::multiset<std::string>;
  const std::string shareRule = "{\"QXExtensionPointIdentifier\": \"com.test.share-point\"}";
  struct Case {
    std::vector<std::string> args;
    std::string input;
    Ids found;
  } cases[] = {
      {{"list"}, "", Ids{"com.test.share", "com.test.widget"}},
      {{"list", "--versions"}, "", Ids{"com.test.share", "com.test.share", "com.test.widget"}},
      {{"list", "--point", "com.test.widget-point"}, "", Ids{"com.test.widget"}},
      {{"list", "--system"}, "", Ids{}},
      {{"match", shareRule}, "", Ids{"com.test.share"}},
      {{"match", "-", "--versions"}, shareRule, Ids{"com.test.share", "com.test.share"}},
      {{"match", "--rule", "QXExtensionIdentifier=com.test.widget"}, "", Ids{"com.test.widget"}},
      // A --rule wins over the same key in RULES.
      {{"match", shareRule, "--rule", "QXExtensionPointIdentifier=com.test.widget-point"},
       "",
       Ids{"com.test.widget"}},
  };
  for (const Case& c : cases) {
    std::vector<std::string> args = c.args;
    args.push_back("--json");
    const Outcome run = ctl(args, c.input);
    EXPECT_EQ(run.status, kExitOk) << run.err;
    EXPECT_EQ(identifiers(json(run)), c.found) << ::testing::PrintToString(c.args);
  }
}

TEST_F(Vantrelctl, ShowPrintsOnePlugInInFull) {
  const Outcome human = ctl({"show", plugIn("Alpha", "Widget")});
  EXPECT_EQ(human.status, kExitOk) << human.err;
  for (const std::string& line : std::vector<std::string>{
           "Identifier:    com.test.widget\n", "Version:       1.0\n",
           "Path:          " + plugIn("Alpha", "Widget") + "\n",
           "Point:         com.test.widget-point\n", "Where:         Alpha\n", "Election:      0\n",
           "On hold:       no\n", "Offered:       yes (offered to the host)\n",
           "Container:     " + tmp_.file("state/containers/")}) {
    EXPECT_NE(human.out.find(line), std::string::npos) << line << " in:\n" << human.out;
  }
  // Relative paths ("./..." or "../...") are made absolute; the JSON is the
  // daemon's explanation.
  const std::string relative =
      "./" + std::filesystem::relative(plugIn("Alpha", "Widget"), std::filesystem::current_path())
                 .string();
  const Value document = json(ctl({"show", relative, "--json"}));
  const Dictionary* d = document.getIfDictionary();
  ASSERT_NE(d, nullptr);
  for (const char* key : {protocol::kKeyForm, protocol::kKeyAnnotations, protocol::kKeyEntitlements,
                          protocol::kKeyContainer}) {
    EXPECT_TRUE(d->contains(key)) << key;
  }
  EXPECT_EQ(d->get(protocol::kKeyIdentifier), Value("com.test.widget"));
}

TEST_F(Vantrelctl, ElectionsAreSetAndReset) {
  const auto election = [&] {
    const Value document = json(ctl({"show", "com.test.widget", "--json"}));
    const Dictionary* d = document.getIfDictionary();
    return d ? d->get(protocol::kKeyElection).integerValue() : -1;
  };
  const Outcome elected = ctl({"elect", "com.test.widget"});
  EXPECT_EQ(elected.status, kExitOk) << elected.err;
  EXPECT_NE(elected.out.find("com.test.widget "), std::string::npos);
  EXPECT_NE(elected.out.find(": election 0 -> 1"), std::string::npos) << elected.out;
  EXPECT_EQ(election(), 1);
  EXPECT_EQ(identifiers(json(ctl({"match", "--rule", "QXUserElection=1", "--json"}))),
            std::multiset<std::string>{"com.test.widget"});
  EXPECT_EQ(ctl({"reset", "com.test.widget"}).status, kExitOk);
  EXPECT_EQ(election(), 0);
  EXPECT_EQ(ctl({"elect", "com.test.widget"}).status, kExitOk);
  const Value unelected = json(ctl({"unelect", "com.test.widget", "--json"}));
  const Dictionary* first =
      unelected.getIfArray() ? unelected.getIfArray()->at(0).getIfDictionary() : nullptr;
  ASSERT_NE(first, nullptr);
  EXPECT_EQ(first->get("old"), Value::integer(1));
  EXPECT_EQ(first->get(protocol::kKeyElection), Value::integer(0));
  EXPECT_EQ(election(), 0);
  // Nothing is changed when one of the plug-ins does not resolve.
  EXPECT_EQ(ctl({"elect", "com.test.widget", "com.test.nothing"}).status, kExitRefused);
  EXPECT_EQ(election(), 0);
}

TEST_F(Vantrelctl, WhyRendersEachReason) {
  struct Case {
    std::vector<std::string> args;
    const char* reason;
    std::vector<std::string> inOutput;
  } cases[] = {
      {{plugIn("Alpha", "Widget")},
       protocol::kReasonOffered,
       {": offered: offered to the host", "authorisation  passed"}},
      {{plugIn("Alpha", "Widget"), "--rule", "QXUserElection=1"},
       protocol::kReasonElection,
       {"not offered (election)", "election       failed"}},
      {{plugIn("Alpha", "Widget"), "--system"},
       protocol::kReasonLocation,
       {"not offered (location)", "location       failed"}},
      {{plugIn("Beta", "Private")},
       protocol::kReasonDedicated,
       {"not offered (dedicated)", "dedication     failed"}},
      {{plugIn("Alpha", "Widget"), "--point", "com.test.share-point"},
       protocol::kReasonRules,
       {"not offered (rules)", "rules          failed"}},
      {{plugIn("Beta", "Hidden")},
       protocol::kReasonExcluded,
       {"not offered (excluded)", "Exclusion:  {\"QXExtensionIdentifier\":\"com.test.hidden\"}"}},
      {{plugIn("Alpha", "Share")},
       protocol::kReasonDuplicate,
       {"not offered (duplicate)", "Beaten by:  ", "version 2.0 at " + plugIn("Beta", "Share"),
        "(rule higher-version)"}},
      {{plugIn("Alpha", "Custom")},
       protocol::kReasonMisconfigured,
       {"not offered (misconfigured): mis-configured: "}},
  };
  for (const Case& c : cases) {
    std::vector<std::string> args{"why"};
    args.insert(args.end(), c.args.begin(), c.args.end());
    const Outcome human = ctl(args);
    EXPECT_EQ(human.status, kExitOk) << human.err;
    for (const std::string& text : c.inOutput) {
      EXPECT_NE(human.out.find(text), std::string::npos) << c.reason << ": " << text << " in:\n"
                                                         << human.out;
    }
    args.push_back("--json");
    const Value document = json(ctl(args));
    const Dictionary* d = document.getIfDictionary();
    ASSERT_NE(d, nullptr) << c.reason;
    EXPECT_EQ(d->get(protocol::kKeyReason), Value(c.reason));
  }
  // Names nothing registered: a reason, not an explanation.
  const std::string loose = tmp_.write("loose/Loose.appex/Info.plist",
                                       plugInPlist("com.test.loose", "com.test.widget-point", "1"));
  const Outcome unregistered = ctl({"why", std::filesystem::path(loose).parent_path().string()});
  EXPECT_EQ(unregistered.status, kExitRefused);
  EXPECT_NE(unregistered.err.find("is not registered"), std::string::npos) << unregistered.err;
}

TEST_F(Vantrelctl, AddAndRemoveReportEachPath) {
  const std::string extra = tmp_.file("apps/Alpha.app/PlugIns/Extra.appex");
  tmp_.write("apps/Alpha.app/PlugIns/Extra.appex/Info.plist",
             plugInPlist("com.test.extra", "com.test.widget-point", "1.0"));
  const std::string missing = tmp_.file("nowhere/Missing.appex");
  const Outcome add = ctl({"add", extra, missing});
  EXPECT_EQ(add.status, kExitRefused);
  EXPECT_NE(add.out.find("added " + extra + "\n"), std::string::npos) << add.out;
  EXPECT_NE(add.err.find("invalid plugin path: " + missing + " (code " +
                         std::to_string(protocol::kErrorBadPath) + ")"),
            std::string::npos)
      << add.err;
  const Value removed = json(ctl({"remove", extra, missing, "--json"}));
  const lmo::Array* outcomes = removed.getIfArray();
  ASSERT_TRUE(outcomes != nullptr && outcomes->size() == 2) << lmo::describe(removed);
  const Dictionary& ok = *outcomes->at(0).getIfDictionary();
  const Dictionary& failed = *outcomes->at(1).getIfDictionary();
  EXPECT_EQ(ok.get("ok"), Value::boolean(true));
  EXPECT_EQ(failed.get("ok"), Value::boolean(false));
  EXPECT_EQ(failed.get(protocol::kKeyErrorCode), Value::integer(protocol::kErrorBadPath));
}

TEST_F(Vantrelctl, MonitorSeesInstallsElectionsAndHoldsUntilInterrupted) {
  auto monitor = startCtl({"monitor", "--json"}, "monitor.log");
  ASSERT_TRUE(monitor);
  // The monitor's first look is its baseline; give it time to take it.
  std::this_thread::sleep_for(1500ms);
  const auto nextEvent = [&](const char* event) -> Dictionary {
    while (std::optional<std::string> line = monitor->readLine(kDeadline)) {
      base::Result<Value> v = readJson(*line);
      const Dictionary* d = v.has_value() ? v->getIfDictionary() : nullptr;
      if (d == nullptr) ADD_FAILURE() << "not a JSON object: " << *line;
      if (d != nullptr && d->get("event") == Value(event)) return *d;
    }
    ADD_FAILURE() << "no " << event << " event; " << readFile(tmp_.file("monitor.log"));
    return {};
  };

  tmp_.write("apps/Beta.app/PlugIns/Extra.appex/Info.plist",
             plugInPlist("com.test.extra", "com.test.widget-point", "3.0"));
  ASSERT_EQ(ctl({"add", tmp_.file("apps/Beta.app/PlugIns/Extra.appex")}).status, kExitOk);
  EXPECT_EQ(nextEvent("installed").get(protocol::kKeyVersion), Value("3.0"));

  ASSERT_EQ(ctl({"elect", "com.test.extra"}).status, kExitOk);
  const Dictionary elected = nextEvent("elected");
  EXPECT_EQ(elected.get(protocol::kKeyIdentifier), Value("com.test.extra"));
  EXPECT_EQ(elected.get(protocol::kKeyElection), Value::integer(1));

  // hold keeps its hold until SIGINT, then releases it and exits 0.
  auto hold = startCtl({"hold", plugIn("Alpha", "Widget")}, "hold.log");
  ASSERT_TRUE(hold);
  const std::optional<std::string> token = hold->readLine(kDeadline);
  ASSERT_TRUE(token && base::Uuid::parse(*token)) << readFile(tmp_.file("hold.log"));
  const Dictionary taken = nextEvent("hold-taken");
  EXPECT_EQ(taken.get(protocol::kKeyToken), Value(*token));
  EXPECT_EQ(taken.get(protocol::kKeyPid), Value::integer(hold->pid()));
  const Outcome onHold = ctl({"why", plugIn("Alpha", "Widget")});
  EXPECT_NE(onHold.out.find("not offered (on-hold)"), std::string::npos) << onHold.out;
  EXPECT_NE(onHold.out.find("Hold:       token " + *token + ", holder pid " +
                            std::to_string(hold->pid())),
            std::string::npos)
      << onHold.out;

  ::kill(hold->pid(), SIGINT);
  EXPECT_EQ(exitStatus(*hold), kExitOk) << readFile(tmp_.file("hold.log"));
  EXPECT_EQ(nextEvent("hold-released").get(protocol::kKeyToken), Value(*token));
  EXPECT_NE(ctl({"status"}).out.find("Holds:      0"), std::string::npos);

  ::kill(monitor->pid(), SIGINT);
  EXPECT_EQ(exitStatus(*monitor), kExitOk);
}

TEST_F(Vantrelctl, AHoldWhoseDaemonGoesAwayExits3) {
  auto hold = startCtl({"hold", plugIn("Alpha", "Widget")}, "hold.log");
  ASSERT_TRUE(hold && hold->readLine(kDeadline));
  daemon_->kill();
  EXPECT_EQ(exitStatus(*hold), kExitUnreachable) << readFile(tmp_.file("hold.log"));
  EXPECT_NE(readFile(tmp_.file("hold.log")).find("the hold ended with the connection"),
            std::string::npos);
}

}  // namespace
}  // namespace vantrel::ctl
