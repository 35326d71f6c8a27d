// vantrel-loadbench: the figures users meet. vantreld runs as its own
// process on a generated tree of applications of 100 plug-ins each; client
// processes of this program send it frames over its socket. A raw AF_UNIX
// ping-pong and a one-thread epoll server answering the very frames the
// daemon answers are measured in the same run, in rounds that alternate
// with the daemon's, so that the ratios hold on a noisy machine.
//
//   vantrel-loadbench [--vantreld PATH] [--apps N] [--requests N]
//                     [--match-requests N] [--seconds S] [--rounds N]
//                     [--starts N] [--cache N] [--json]
//
// Prints a Markdown table (figure, measured, baseline, ratio, goal, met?)
// and the command lines that made it; --json prints the same as JSON.
// Exit status 1 when a figure could not be measured, 2 for a bad command
// line; goals that are missed are reported, not failed.

#include <signal.h>
#include <sys/socket.h>
#include <sys/utsname.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <functional>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "bench/BenchTrees.h"
#include "bench/load/Arguments.h"
#include "bench/load/DaemonProcess.h"
#include "bench/load/Wire.h"
#include "bench/load/Workers.h"
#include "lmo/Json.h"
#include "lmo/Protocol.h"
#include "omnidex/QueryKeys.h"

namespace vantrel::bench::load {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using lmo::Dictionary;
using lmo::Value;

// The shape of the tree: every application carries one plug-in of each
// extension point, so a rule naming one point selects one plug-in per
// application. Points are named as bench/BenchTrees.cpp names them.
constexpr int kPlugInsPerApp = kExtensionPoints;
constexpr int kMatchedPoint = 42;
constexpr const char* kPointPrefix = "com.bench.point";
// The small tree of the start-up figures has a tenth of the applications.
constexpr int kSmallTreeDivisor = 10;

constexpr int kRateClients = 16;
constexpr int kMatchClients = 4;
// How long a start may take to its first complete answer before the run
// gives up on it.
constexpr auto kStartTimeout = 60s;
// How long after a start the daemon is left to settle before it is stopped
// (its registry committed, its watches in place), so that a warm start
// finds the state a user's previous run leaves.
constexpr auto kSettle = 500ms;

// The goals.
constexpr double kRoundTripRatioGoal = 1.3;
constexpr double kRateRatioGoal = 0.8;
constexpr double kMatchP50GoalMs = 1;
constexpr double kMatchP99GoalMs = 2;
constexpr double kMatchRateGoal = 1000;
constexpr double kColdStartGoalMs = 1000;
constexpr double kWarmStartGoalMs = 200;
constexpr double kSmallColdStartGoalMs = 150;
constexpr double kSmallWarmStartGoalMs = 50;
constexpr double kMemoryGoalMiB = 64;

struct Options {
  std::string vantreld = VANTRELD_PATH;
  int apps = 100;
  uint64_t requests = 20000;
  uint64_t matchRequests = 2000;
  double seconds = 6;
  int rounds = 3;
  int starts = 3;
  uint32_t cacheLimit = 10000;
  bool json = false;
};

[[noreturn]] void usage() {
  std::fputs(
      "Usage: vantrel-loadbench [--vantreld PATH] [--apps N] [--requests N]\n"
      "                         [--match-requests N] [--seconds S] [--rounds N]\n"
      "                         [--starts N] [--cache N] [--json]\n"
      "  --apps N            applications of 100 plug-ins in the large tree (100);\n"
      "                      the small tree has a tenth of them\n"
      "  --requests N        timed empty round trips, daemon and ping-pong each (20000)\n"
      "  --match-requests N  timed \"match\" round trips of one client (2000)\n"
      "  --seconds S         length of each request-rate figure (6)\n"
      "  --rounds N          rounds alternating the daemon and its baseline (3)\n"
      "  --starts N          starts per start-up figure; the median is shown (3)\n"
      "  --cache N           the daemon's -c (10000: every record cached)\n"
      "Example, small enough for CI:\n"
      "  vantrel-loadbench --apps 10 --requests 1000 --match-requests 100 --seconds 1 --starts 1\n",
      stderr);
  std::exit(2);
}

Options parseOptions(int argc, char** argv) {
  Options options;
  const std::optional<std::string> problem =
      walkArguments(argc, argv, &options.json, &options.vantreld,
                    [&](std::string_view name, double number) -> std::optional<std::string> {
                      if (name == "--apps") {
                        options.apps = static_cast<int>(number);
                      } else if (name == "--requests") {
                        options.requests = static_cast<uint64_t>(number);
                      } else if (name == "--match-requests") {
                        options.matchRequests = static_cast<uint64_t>(number);
                      } else if (name == "--seconds") {
                        options.seconds = number;
                      } else if (name == "--rounds") {
                        options.rounds = static_cast<int>(number);
                      } else if (name == "--starts") {
                        options.starts = static_cast<int>(number);
                      } else if (name == "--cache") {
                        options.cacheLimit = static_cast<uint32_t>(number);  // 0: nothing cached
                      } else {
                        return "unknown option";
                      }
                      return std::nullopt;
                    });
  if (problem || options.apps < 1 || options.requests < 1 || options.matchRequests < 1 ||
      options.seconds <= 0 || options.rounds < 1 || options.starts < 1) {
    usage();
  }
  return options;
}

// A line on standard error, with the seconds since the program started.
void progress(const std::string& text) {
  static const auto start = std::chrono::steady_clock::now();
  const double seconds =
      std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  std::fprintf(stderr, "loadbench [%5.1f s]: %s\n", seconds, text.c_str());
}

// ---- Figures and their text ----

std::string fixed(double value, int decimals) {
  char text[64];
  std::snprintf(text, sizeof text, "%.*f", decimals, value);
  return text;
}

// 12345 as "12,345".
std::string grouped(double value) {
  const std::string digits = std::to_string(static_cast<uint64_t>(value + 0.5));
  std::string text;
  for (size_t i = 0; i < digits.size(); ++i) {
    if (i > 0 && (digits.size() - i) % 3 == 0) text += ',';
    text += digits[i];
  }
  return text;
}

// Seconds as a number of milliseconds, to about three digits.
std::string millisecondNumber(double seconds) {
  const double ms = seconds * 1000;
  return ms < 10 ? fixed(ms, 2) : ms < 100 ? fixed(ms, 1) : grouped(ms);
}

std::string milliseconds(double seconds) {
  return millisecondNumber(seconds) + " ms";
}

// A goal in milliseconds as the table states it: "1 s", "200 ms".
std::string goalTime(double ms) {
  return ms >= 1000 ? fixed(ms / 1000, 0) + " s" : fixed(ms, 0) + " ms";
}

std::string applications(int count) {
  return grouped(count) + (count == 1 ? " application" : " applications");
}

struct Latencies {
  explicit Latencies(std::vector<double> micros) : sorted(std::move(micros)) {
    std::sort(sorted.begin(), sorted.end());
  }
  double p50() const { return percentile(sorted, 0.5); }
  double p99() const { return percentile(sorted, 0.99); }
  std::vector<double> sorted;
};

// Requests per second of clients that ran side by side: all they did over
// how long they ran together (the mean of their own times).
struct Rate {
  void add(const std::vector<ClientReport>& reports) {
    double seconds = 0;
    for (const ClientReport& report : reports) {
      requests += report.requests;
      seconds += report.seconds;
    }
    if (!reports.empty()) elapsed += seconds / static_cast<double>(reports.size());
  }
  double perSecond() const { return elapsed > 0 ? static_cast<double>(requests) / elapsed : 0; }
  uint64_t requests = 0;
  double elapsed = 0;
};

struct Row {
  std::string figure;
  std::string goal;
  std::string measured = "not measured";
  std::string baseline = "—";
  std::optional<double> ratio;
  std::optional<bool> met;  // nullopt: not measured
  Dictionary values;        // the numbers behind the text, for --json

  void fail(const base::Error& error) {
    const std::string text = error.description();
    progress("failed: " + figure + ": " + text);
    measured = "failed: " + text.substr(0, text.find('\n'));
  }
  void set(std::string key, double value) { values = values.setting(key, Value::real(value)); }
};

// ---- The requests ----

Bytes annotateRequest() {
  return requestFrame(
      Dictionary{{protocol::kKeyRequest, Value(protocol::kRequestAnnotate)},
                 {protocol::kKeyVersion, Value::unsignedInteger(protocol::kCurrentVersion)},
                 {protocol::kKeyAnnotations, Value(Dictionary{})}});
}

Bytes matchRequest() {
  const std::string point = kPointPrefix + std::to_string(kMatchedPoint);
  return requestFrame(Dictionary{
      {protocol::kKeyRequest, Value(protocol::kRequestMatch)},
      {protocol::kKeyVersion, Value::unsignedInteger(protocol::kCurrentVersion)},
      {protocol::kKeyRules, Value(Dictionary{{omnidex::kExtensionPointIdentifierKey, point}})}});
}

// The daemon's reply to request, as it travels: what the baselines send.
base::Result<Bytes> replyOf(const std::string& socket, Bytes request) {
  const int fd = connectTo(socket);
  if (fd < 0) return base::Error{"LoadBench", 1, "cannot connect to " + socket};
  FrameSocket connection(fd);
  setFrameId(request, 1);
  std::span<uint8_t> reply;
  if (connection.send(request)) reply = connection.receive();
  if (reply.empty()) return base::Error{"LoadBench", 1, "no reply from the daemon"};
  if (auto wrong = checkReply(reply, 1, {})) return base::Error{"LoadBench", 1, "got " + *wrong};
  return Bytes(reply.begin(), reply.end());
}

// ---- The run ----

// The rows of the table, in its order.
enum RowNumber : size_t {
  kRoundTripRow,
  kRateRow,
  kMatchRow,
  kMatchRateRow,
  kColdStartRow,
  kWarmStartRow,
  kSmallStartRow,
  kMemoryRow,
  kRowCount
};

class LoadBench {
 public:
  explicit LoadBench(Options options);
  // Removes the trees and every daemon's state, after the table is out:
  // tens of thousands of files, which some file systems take a while over.
  ~LoadBench();
  LoadBench(const LoadBench&) = delete;
  LoadBench& operator=(const LoadBench&) = delete;

  void run();
  void print(int argc, char** argv) const;
  bool measuredAll() const {
    return std::all_of(rows_.begin(), rows_.end(), [](const Row& row) { return row.met; });
  }

 private:
  struct Starts {
    std::vector<double> cold;
    std::vector<double> warm;
  };
  // options_.starts cold starts on tree, each on an empty state directory,
  // then as many warm ones, each on the state the run before it left. serve
  // runs on the daemon of the last cold start before it is stopped.
  base::Result<Starts> measureStarts(const Tree& tree, int apps, const std::string& name,
                                     const std::function<void(DaemonProcess&)>& serve);
  void measureRequests(DaemonProcess& daemon);
  void measureRoundTrip(Row& row, const std::string& socket, const Bytes& request,
                        const Bytes& reply);
  void measureRate(Row& row, const std::string& socket, const Bytes& request, const Bytes& reply);
  void measureMatches(const std::string& socket);
  void measureMemory(const DaemonProcess& daemon);

  DaemonConfig configFor(const Tree& tree, const std::string& stateDir) const {
    return DaemonConfig{options_.vantreld, tree.root + "/apps", stateDir, work_,
                        options_.cacheLimit};
  }
  int smallApps() const { return std::max(1, options_.apps / kSmallTreeDivisor); }

  // Constant after construction.
  const Options options_;
  const std::string work_;

  std::vector<Row> rows_;
  std::vector<std::string> daemonCommand_;
  std::unique_ptr<Tree> large_;
  std::unique_ptr<Tree> small_;
};

LoadBench::LoadBench(Options options)
    : options_(std::move(options)), work_(makeTempDir()), rows_(kRowCount) {
  const std::string plugIns = grouped(options_.apps * kPlugInsPerApp);
  rows_[kRoundTripRow] = {"empty request round trip, one client (\"annotate\", empty change)",
                          "≤ " + fixed(kRoundTripRatioGoal, 1) + "× the ping-pong"};
  rows_[kRateRow] = {"requests per second, " + std::to_string(kRateClients) +
                         " client processes, one request in flight each",
                     "≥ " + fixed(kRateRatioGoal, 1) + "× the epoll server"};
  rows_[kMatchRow] = {
      "\"match\" over " + plugIns + " installed plug-ins, rule selecting " +
          grouped(options_.apps) + " (one per application), one client: p50, p99, reply size",
      "p50 ≤ " + fixed(kMatchP50GoalMs, 0) + " ms, p99 ≤ " + fixed(kMatchP99GoalMs, 0) + " ms"};
  rows_[kMatchRateRow] = {
      "\"match\" throughput, " + std::to_string(kMatchClients) + " client processes",
      "≥ " + grouped(kMatchRateGoal) + "/s"};
  rows_[kColdStartRow] = {"start until the first complete answer, " + plugIns + " plug-ins in " +
                              applications(options_.apps) + ", empty state (cold)",
                          "≤ " + goalTime(kColdStartGoalMs)};
  rows_[kWarmStartRow] = {"the same with the state of a previous run (warm)",
                          "≤ " + goalTime(kWarmStartGoalMs)};
  rows_[kSmallStartRow] = {
      "start, " + grouped(smallApps() * kPlugInsPerApp) + " plug-ins in " +
          applications(smallApps()) + ", cold / warm",
      "≤ " + goalTime(kSmallColdStartGoalMs) + " / ≤ " + goalTime(kSmallWarmStartGoalMs)};
  rows_[kMemoryRow] = {"daemon memory after those matches, " + plugIns + " installed, -c " +
                           std::to_string(options_.cacheLimit) + ": VmRSS / VmHWM",
                       "≤ " + fixed(kMemoryGoalMiB, 0) + " MiB"};
}

LoadBench::~LoadBench() {
  progress("removing the trees and the daemons' state");
  large_.reset();
  small_.reset();
  std::error_code ec;
  fs::remove_all(work_, ec);
  progress("done");
}

// The median of samples, and their range when there are several.
std::string startText(std::vector<double> samples) {
  std::sort(samples.begin(), samples.end());
  std::string text = milliseconds(percentile(samples, 0.5));
  if (samples.size() > 1) {
    text += " (median of " + std::to_string(samples.size()) + "; " +
            millisecondNumber(samples.front()) + "–" + milliseconds(samples.back()) + ")";
  }
  return text;
}

double median(std::vector<double> samples) {
  std::sort(samples.begin(), samples.end());
  return percentile(samples, 0.5);
}

void LoadBench::run() {
  progress("generating " + grouped(options_.apps) + " applications x " +
           std::to_string(kPlugInsPerApp) + " plug-ins, and " + grouped(smallApps()) + " x " +
           std::to_string(kPlugInsPerApp));
  const auto start = std::chrono::steady_clock::now();
  large_ = std::make_unique<Tree>(options_.apps, kPlugInsPerApp);
  small_ = std::make_unique<Tree>(smallApps(), kPlugInsPerApp);
  progress("generated in " +
           milliseconds(
               std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count()));

  bool served = false;
  const base::Result<Starts> largeStarts =
      measureStarts(*large_, options_.apps, "large", [&](DaemonProcess& daemon) {
        served = true;
        measureRequests(daemon);
      });
  if (!largeStarts.has_value()) {
    rows_[kColdStartRow].fail(largeStarts.error());
    rows_[kWarmStartRow].fail(largeStarts.error());
    if (!served) {
      for (size_t row : {kRoundTripRow, kRateRow, kMatchRow, kMatchRateRow, kMemoryRow}) {
        rows_[row].fail(largeStarts.error());
      }
    }
  } else {
    const double cold = median(largeStarts->cold);
    const double warm = median(largeStarts->warm);
    Row& coldRow = rows_[kColdStartRow];
    coldRow.measured = startText(largeStarts->cold);
    coldRow.met = cold * 1000 <= kColdStartGoalMs;
    coldRow.set("median_ms", cold * 1000);
    Row& warmRow = rows_[kWarmStartRow];
    warmRow.measured = startText(largeStarts->warm);
    warmRow.met = warm * 1000 <= kWarmStartGoalMs;
    warmRow.set("median_ms", warm * 1000);
  }

  Row& smallRow = rows_[kSmallStartRow];
  const base::Result<Starts> smallStarts = measureStarts(*small_, smallApps(), "small", nullptr);
  if (!smallStarts.has_value()) {
    smallRow.fail(smallStarts.error());
  } else {
    const double cold = median(smallStarts->cold);
    const double warm = median(smallStarts->warm);
    smallRow.measured = startText(smallStarts->cold) + " / " + startText(smallStarts->warm);
    smallRow.met = cold * 1000 <= kSmallColdStartGoalMs && warm * 1000 <= kSmallWarmStartGoalMs;
    smallRow.set("cold_median_ms", cold * 1000);
    smallRow.set("warm_median_ms", warm * 1000);
  }
}

base::Result<LoadBench::Starts> LoadBench::measureStarts(
    const Tree& tree, int apps, const std::string& name,
    const std::function<void(DaemonProcess&)>& serve) {
  // One plug-in of the point per application: the answer is complete when
  // every application has been found.
  const Bytes request = matchRequest();
  const uint64_t expected = static_cast<uint64_t>(apps);
  Starts starts;
  std::string state;
  for (int i = 0; i < 2 * options_.starts; ++i) {
    const bool cold = i < options_.starts;
    if (cold) state = work_ + "/" + name + "-state-" + std::to_string(i);
    std::unique_ptr<DaemonProcess> daemon = VT_TRY(DaemonProcess::start(configFor(tree, state)));
    daemonCommand_ = daemon->arguments();
    const double seconds = VT_TRY(daemon->firstCompleteAnswer(request, expected, kStartTimeout));
    (cold ? starts.cold : starts.warm).push_back(seconds);
    progress(name + " tree, " + (cold ? "cold" : "warm") + " start: " + milliseconds(seconds));
    if (i + 1 == options_.starts && serve) serve(*daemon);
    std::this_thread::sleep_for(kSettle);
    daemon->stop();
  }
  return starts;
}

void LoadBench::measureRequests(DaemonProcess& daemon) {
  const Bytes request = annotateRequest();
  const base::Result<Bytes> reply = replyOf(daemon.socket(), request);
  if (!reply.has_value()) {
    rows_[kRoundTripRow].fail(reply.error());
    rows_[kRateRow].fail(reply.error());
  } else {
    measureRoundTrip(rows_[kRoundTripRow], daemon.socket(), request, reply.value());
    measureRate(rows_[kRateRow], daemon.socket(), request, reply.value());
  }
  measureMatches(daemon.socket());
  measureMemory(daemon);
}

void LoadBench::measureRoundTrip(Row& row, const std::string& socket, const Bytes& request,
                                 const Bytes& reply) {
  progress("empty round trips: the daemon and the ping-pong, " + std::to_string(options_.rounds) +
           " rounds");
  const Load load{request, {}, std::max<uint64_t>(1, options_.requests / options_.rounds)};
  std::vector<double> daemonMicros;
  std::vector<double> rawMicros;
  for (int round = 0; round < options_.rounds; ++round) {
    base::Result<std::vector<ClientReport>> measured = runClients(
        1, [&socket] { return connectTo(socket); }, load);
    if (!measured.has_value()) return row.fail(measured.error());
    daemonMicros.insert(daemonMicros.end(), measured->front().micros.begin(),
                        measured->front().micros.end());

    int pair[2];
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) {
      return row.fail(base::Error{"LoadBench", 1, "cannot make a socket pair"});
    }
    const pid_t answerer = startAnswerer(pair[1], reply);
    ::close(pair[1]);
    measured = runClients(
        1, [&pair] { return pair[0]; }, load);
    ::close(pair[0]);
    stopChild(answerer);
    if (!measured.has_value()) return row.fail(measured.error());
    rawMicros.insert(rawMicros.end(), measured->front().micros.begin(),
                     measured->front().micros.end());
  }
  const Latencies daemon(std::move(daemonMicros));
  const Latencies raw(std::move(rawMicros));
  const auto text = [](const Latencies& l) {
    return fixed(l.p50(), 1) + " µs p50 (p99 " + fixed(l.p99(), 1) + " µs)";
  };
  row.measured = text(daemon);
  row.baseline = text(raw) + ", raw AF_UNIX ping-pong, " + std::to_string(request.size()) +
                 " B request / " + std::to_string(reply.size()) + " B reply";
  row.ratio = daemon.p50() / raw.p50();
  row.met = *row.ratio <= kRoundTripRatioGoal;
  row.set("p50_us", daemon.p50());
  row.set("p99_us", daemon.p99());
  row.set("baseline_p50_us", raw.p50());
  row.set("baseline_p99_us", raw.p99());
  row.set("request_bytes", static_cast<double>(request.size()));
  row.set("reply_bytes", static_cast<double>(reply.size()));
}

void LoadBench::measureRate(Row& row, const std::string& socket, const Bytes& request,
                            const Bytes& reply) {
  progress("request rate, " + std::to_string(kRateClients) +
           " clients: the daemon and the epoll server, " + std::to_string(options_.rounds) +
           " rounds");
  const std::string serverSocket = work_ + "/epoll.socket";
  const int listener = listenOn(serverSocket);
  if (listener < 0)
    return row.fail(base::Error{"LoadBench", 1, "cannot listen on " + serverSocket});
  const pid_t server = startEpollServer(listener, reply);
  ::close(listener);
  const Load load{request, {}, 0, options_.seconds / options_.rounds};
  Rate daemon;
  Rate epoll;
  std::optional<base::Error> error;
  const auto measure = [&](const std::string& path, Rate& rate) {
    base::Result<std::vector<ClientReport>> measured = runClients(
        kRateClients, [&path] { return connectTo(path); }, load);
    if (measured.has_value()) {
      rate.add(measured.value());
    } else {
      error = measured.error();
    }
  };
  for (int round = 0; round < options_.rounds && !error; ++round) {
    measure(socket, daemon);
    if (!error) measure(serverSocket, epoll);
  }
  stopChild(server);
  if (error) return row.fail(*error);
  row.measured = grouped(daemon.perSecond()) + "/s";
  row.baseline = grouped(epoll.perSecond()) + "/s, one-thread epoll server, same frames";
  row.ratio = daemon.perSecond() / epoll.perSecond();
  row.met = *row.ratio >= kRateRatioGoal;
  row.set("per_second", daemon.perSecond());
  row.set("baseline_per_second", epoll.perSecond());
}

void LoadBench::measureMatches(const std::string& socket) {
  const ReplyCheck check{static_cast<uint64_t>(options_.apps)};
  const Bytes request = matchRequest();
  const auto connect = [&socket] { return connectTo(socket); };

  progress("\"match\" latency, one client");
  Row& row = rows_[kMatchRow];
  const base::Result<std::vector<ClientReport>> one =
      runClients(1, connect, Load{request, check, options_.matchRequests});
  if (!one.has_value()) {
    row.fail(one.error());
  } else {
    const Latencies latencies(one->front().micros);
    const double p50 = latencies.p50() / 1000;
    const double p99 = latencies.p99() / 1000;
    row.measured = "p50 " + fixed(p50, 2) + " ms, p99 " + fixed(p99, 2) + " ms, reply " +
                   grouped(static_cast<double>(one->front().replyBytes)) + " B";
    row.met = p50 <= kMatchP50GoalMs && p99 <= kMatchP99GoalMs;
    row.set("p50_ms", p50);
    row.set("p99_ms", p99);
    row.set("reply_bytes", static_cast<double>(one->front().replyBytes));
  }

  progress("\"match\" rate, " + std::to_string(kMatchClients) + " clients");
  Row& rateRow = rows_[kMatchRateRow];
  const base::Result<std::vector<ClientReport>> many =
      runClients(kMatchClients, connect, Load{request, check, 0, options_.seconds});
  if (!many.has_value()) return rateRow.fail(many.error());
  Rate rate;
  rate.add(many.value());
  rateRow.measured = grouped(rate.perSecond()) + "/s";
  rateRow.met = rate.perSecond() >= kMatchRateGoal;
  rateRow.set("per_second", rate.perSecond());
}

void LoadBench::measureMemory(const DaemonProcess& daemon) {
  Row& row = rows_[kMemoryRow];
  const std::optional<DaemonProcess::Memory> memory = daemon.memory();
  if (!memory) return row.fail(base::Error{"LoadBench", 1, "no /proc status for the daemon"});
  const double resident = static_cast<double>(memory->residentKiB) / 1024;
  const double peak = static_cast<double>(memory->peakKiB) / 1024;
  row.measured = fixed(resident, 1) + " MiB / " + fixed(peak, 1) + " MiB";
  // The goal is what the daemon keeps once it serves; the peak (start-up
  // reading every bundle) is shown beside it.
  row.met = resident <= kMemoryGoalMiB;
  row.set("vmrss_mib", resident);
  row.set("vmhwm_mib", peak);
}

// ---- Output ----

std::string commandLine(const std::vector<std::string>& words) {
  std::string line;
  for (const std::string& word : words) line += (line.empty() ? "" : " ") + word;
  return line;
}

std::string machine() {
  std::string model = "unknown CPU";
  std::ifstream cpuinfo("/proc/cpuinfo");
  for (std::string line; std::getline(cpuinfo, line);) {
    if (line.starts_with("model name")) {
      model = line.substr(line.find(':') + 2);
      break;
    }
  }
  utsname system{};
  ::uname(&system);
  return std::to_string(std::thread::hardware_concurrency()) + " CPUs (" + model + "), " +
         system.sysname + " " + system.release;
}

std::string today() {
  const std::time_t now = std::time(nullptr);
  char text[32];
  std::strftime(text, sizeof text, "%Y-%m-%d %H:%M UTC", std::gmtime(&now));
  return text;
}

void LoadBench::print(int argc, char** argv) const {
  const std::string command = commandLine(std::vector<std::string>(argv, argv + argc));
  const std::string daemon = commandLine(daemonCommand_);
  if (options_.json) {
    std::vector<Value> rows;
    for (const Row& row : rows_) {
      rows.push_back(Value(Dictionary{
          {"figure", Value(row.figure)},
          {"measured", Value(row.measured)},
          {"baseline", Value(row.baseline)},
          {"ratio", row.ratio ? Value::real(*row.ratio) : Value()},
          {"goal", Value(row.goal)},
          {"met", row.met ? Value::boolean(*row.met) : Value()},
          {"values", Value(row.values)},
      }));
    }
    const Dictionary report{{"rows", Value(lmo::Array(std::move(rows)))},
                            {"command", Value(command)},
                            {"daemon", Value(daemon)},
                            {"machine", Value(machine())},
                            {"date", Value(today())}};
    std::printf("%s\n", lmo::toJson(Value(report), lmo::JsonStyle::kPretty).c_str());
    return;
  }
  std::printf("| figure | measured | baseline (same run) | ratio | goal | met? |\n");
  std::printf("| --- | --- | --- | --- | --- | --- |\n");
  for (const Row& row : rows_) {
    const std::string ratio = row.ratio ? fixed(*row.ratio, 2) + "×" : "—";
    const char* met = !row.met ? "—" : *row.met ? "yes" : "no";
    std::printf("| %s | %s | %s | %s | %s | %s |\n", row.figure.c_str(), row.measured.c_str(),
                row.baseline.c_str(), ratio.c_str(), row.goal.c_str(), met);
  }
  std::printf("\nCommand: `%s`\n", command.c_str());
  std::printf(
      "Daemon (the last one started): `%s`, its environment pointing every directory it reads "
      "or writes into the run's own temporary directory\n",
      daemon.c_str());
  std::printf("Machine: %s; %s\n", machine().c_str(), today().c_str());
}

}  // namespace
}  // namespace vantrel::bench::load

int main(int argc, char** argv) {
  using namespace vantrel::bench::load;
  const Options options = parseOptions(argc, argv);
  if (::access(options.vantreld.c_str(), X_OK) != 0) {
    std::fprintf(stderr, "vantrel-loadbench: cannot run %s (--vantreld names the daemon)\n",
                 options.vantreld.c_str());
    return 2;
  }
  // A peer gone is a failed write, reported as such, not the end of the run.
  ::signal(SIGPIPE, SIG_IGN);
  LoadBench bench(options);
  bench.run();
  std::fflush(stderr);
  bench.print(argc, argv);
  std::fflush(stdout);
  return bench.measuredAll() ? 0 : 1;
}
