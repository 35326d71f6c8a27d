// What one request or one client may make the daemon do: each bound is
// served at its limit and refused one past it, and a refusal loses nothing.

#include <gtest/gtest.h>

#include <chrono>
#include <regex>
#include <string>
#include <vector>

#include "base/Format.h"
#include "base/Log.h"
#include "daemon/Limits.h"
#include "lmo/Protocol.h"
#include "registry/VTDAnnotationStore.h"
#include "tests/daemon/DaemonFixture.h"

namespace vantrel::daemon::testing {
namespace {

using lmo::Array;
using lmo::Dictionary;
using lmo::Value;

Array repeated(const Value& value, size_t count) {
  return Array(std::vector<Value>(count, value));
}

Expected tooMany(const char* what, size_t given, size_t limit) {
  return {protocol::kErrorBadRequest, base::format(kTooManyFormat, what, given, limit)};
}

Dictionary annotation(const char* key, Value value) {
  return Dictionary{{protocol::kKeyAnnotations, Value(Dictionary{{key, std::move(value)}})}};
}

using Limits = DaemonTest;

TEST_F(Limits, RequestsAreServedAtTheLimitAndRefusedPastIt) {
  const Value widgetPath(plugInPath("widget"));
  const Value widget(uuidOf("widget"));
  const Value pluginHold = u64(protocol::HoldFlags::kPlugIn);
  const Value anyOf = repeated(Value(std::string(kWidget)), kMaxPatternElements + 1);
  Dictionary ruleKeys;
  for (size_t i = 0; i <= kMaxRuleKeys; ++i) {
    ruleKeys = ruleKeys.setting("key" + std::to_string(i), Value::boolean(false));
  }
  struct Case {
    const char* type;
    Dictionary extras;
    Expected expected;
  };
  const Case cases[] = {
      {protocol::kRequestAdd,
       {{protocol::kKeyPaths, repeated(widgetPath, kMaxPathsPerRequest + 1)}},
       tooMany(protocol::kKeyPaths, kMaxPathsPerRequest + 1, kMaxPathsPerRequest)},
      {protocol::kRequestRemove,
       {{protocol::kKeyPaths, repeated(widgetPath, kMaxPathsPerRequest + 1)}},
       tooMany(protocol::kKeyPaths, kMaxPathsPerRequest + 1, kMaxPathsPerRequest)},
      {protocol::kRequestLock,
       {{protocol::kKeyPaths, repeated(widgetPath, kMaxPathsPerRequest + 1)},
        {protocol::kKeyFlags, pluginHold}},
       tooMany(protocol::kKeyPaths, kMaxPathsPerRequest + 1, kMaxPathsPerRequest)},
      {protocol::kRequestLock,
       {{protocol::kKeyUuids, repeated(widget, kMaxUuidsPerRequest + 1)}},
       tooMany(protocol::kKeyUuids, kMaxUuidsPerRequest + 1, kMaxUuidsPerRequest)},
      {protocol::kRequestAccess,
       {{protocol::kKeyUuids, repeated(widget, kMaxUuidsPerRequest + 1)}},
       tooMany(protocol::kKeyUuids, kMaxUuidsPerRequest + 1, kMaxUuidsPerRequest)},
      {protocol::kRequestReady,
       {{protocol::kKeyUuids, repeated(widget, kMaxUuidsPerRequest + 1)}},
       tooMany(protocol::kKeyUuids, kMaxUuidsPerRequest + 1, kMaxUuidsPerRequest)},
      {protocol::kRequestAnnotate,
       annotation(protocol::kAnnotationElection, Value::integer(1))
           .setting(protocol::kKeyUuids, repeated(widget, kMaxUuidsPerRequest + 1)),
       tooMany(protocol::kKeyUuids, kMaxUuidsPerRequest + 1, kMaxUuidsPerRequest)},
      {protocol::kRequestMatch,
       {{protocol::kKeyRules, Value(ruleKeys)}},
       tooMany(kRuleKeysName, kMaxRuleKeys + 1, kMaxRuleKeys)},
      {protocol::kRequestMatch,
       {{protocol::kKeyRules, Value(Dictionary{{"QXExtensionIdentifier", anyOf}})}},
       tooMany(kPatternElementsName, kMaxPatternElements + 1, kMaxPatternElements)},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(errorOf(request(c.type, c.extras)), c.expected) << c.type;
  }
  // Nothing was lost on the way: the plug-in is registered, unheld,
  // unannotated.
  EXPECT_NE(plugIn("widget"), nullptr);
  EXPECT_TRUE(server_->holds().empty());
  EXPECT_TRUE(server_->annotations()->annotations().empty());

  // At the limits, served: the largest access reply fits in a frame, and
  // an annotate of the most plug-ins is stored before it is answered.
  const Dictionary access = request(protocol::kRequestAccess,
                                    {{protocol::kKeyUuids, repeated(widget, kMaxUuidsPerRequest)}});
  ASSERT_EQ(errorOf(access), Expected(0, ""));
  const Array* tokens = access.get(protocol::kKeyExtensions).getIfArray();
  ASSERT_NE(tokens, nullptr);
  EXPECT_EQ(tokens->size(), kMaxUuidsPerRequest);
  base::LogCapture log;
  EXPECT_EQ(
      errorOf(request(protocol::kRequestAnnotate,
                      annotation(protocol::kAnnotationElection, Value::integer(1))
                          .setting(protocol::kKeyUuids, repeated(widget, kMaxUuidsPerRequest)))),
      Expected(0, ""));
  EXPECT_EQ(registry::VTDAnnotationStore::initWithDatabase(annotations_)
                ->annotationForIdentifier(kWidget)
                .value_or(Dictionary())
                .get(protocol::kAnnotationElection),
            Value::integer(1));
  // Per-plug-in lines up to a bound, then one line for the rest.
  EXPECT_EQ(log.count(base::format("client %d plug-in %@ election := %@", ::getpid(),
                                   std::string(kWidget), Value::integer(1))),
            kMaxItemLogLinesPerRequest);
  EXPECT_EQ(errorOf(request(
                protocol::kRequestMatch,
                {{protocol::kKeyRules,
                  Value(Dictionary{{"QXExtensionIdentifier", repeated(Value(std::string(kWidget)),
                                                                      kMaxPatternElements)}})}})),
            Expected(0, ""));
}

TEST_F(Limits, HoldsPerClientAreBoundedAndAnEmptyLockCounts) {
  const auto own = connect();
  const Dictionary emptyHold{{protocol::kKeyPaths, Array{}},
                             {protocol::kKeyFlags, u64(protocol::HoldFlags::kPlugIn)}};
  for (size_t i = 0; i < kMaxHoldsPerClient; ++i) {
    ASSERT_EQ(errorOf(request(protocol::kRequestLock, emptyHold, own)), Expected(0, "")) << i;
  }
  EXPECT_EQ(errorOf(request(protocol::kRequestLock, emptyHold, own)),
            Expected(protocol::kErrorAccessDenied,
                     base::format(kHoldsPerClientFormat, kMaxHoldsPerClient, kMaxHoldsPerClient)));
  EXPECT_EQ(server_->holds().size(), kMaxHoldsPerClient);
  // Another client is not held back by this one.
  EXPECT_EQ(errorOf(request(protocol::kRequestLock, emptyHold)), Expected(0, ""));
}

TEST_F(Limits, AnnotationsAreBoundedInSizeAndNumberAndARefusalStoresNothing) {
  const Value widget(uuidOf("widget"));
  const auto extensionOf = [](size_t bytes) {
    return Value(Dictionary{{"blob", Value::data(lmo::Value::Bytes(bytes, 0x5a))}});
  };
  // A map of one entry, the key "blob" with its header, and the header of
  // a byte string with a 16-bit length: the encoding beside the bytes.
  constexpr size_t kFraming = 1 + 5 + 3;
  const Dictionary tooLarge = annotation(protocol::kAnnotationExtension,
                                         extensionOf(kMaxExtensionAnnotationBytes - kFraming + 1))
                                  .setting(protocol::kKeyUuids, Array{widget});
  EXPECT_EQ(errorOf(request(protocol::kRequestAnnotate, tooLarge)),
            Expected(protocol::kErrorBadRequest,
                     base::format(kExtensionTooLargeFormat, kMaxExtensionAnnotationBytes + 1,
                                  kMaxExtensionAnnotationBytes)));
  EXPECT_TRUE(server_->annotations()->annotations().empty());
  const Dictionary largest = annotation(protocol::kAnnotationExtension,
                                        extensionOf(kMaxExtensionAnnotationBytes - kFraming))
                                 .setting(protocol::kKeyUuids, Array{widget});
  EXPECT_EQ(errorOf(request(protocol::kRequestAnnotate, largest)), Expected(0, ""));

  // A full store takes changes to the plug-ins it keeps, and no new one.
  const Dictionary stored = server_->annotations()->annotations();
  std::vector<Dictionary::Entry> full(stored.begin(), stored.end());
  for (size_t i = full.size(); i < kMaxAnnotations; ++i) {
    full.emplace_back("com.filler." + std::to_string(i), Value(Dictionary{}));
  }
  server_->annotations()->setAnnotations(Dictionary::fromEntries(std::move(full)));
  const auto elect = [&](const char* name) {
    return errorOf(request(protocol::kRequestAnnotate,
                           annotation(protocol::kAnnotationElection, Value::integer(1))
                               .setting(protocol::kKeyUuids, Array{Value(uuidOf(name))})));
  };
  EXPECT_EQ(elect("widget"), Expected(0, ""));
  EXPECT_EQ(elect("share"),
            Expected(protocol::kErrorBadRequest,
                     base::format(kTooManyAnnotationsFormat, kMaxAnnotations, kMaxAnnotations)));
  EXPECT_EQ(server_->annotations()->annotationForIdentifier(kShare), std::nullopt);
}

TEST_F(Limits, APeerLogsOneLinePerRequestAndNoMoreThanItsBudget) {
  base::LogCapture log;
  const std::string line = "unrecognized match operator:?XYZ";
  // Two candidates, three elements each: one line.
  const Dictionary rules{
      {protocol::kKeyRules,
       Value(Dictionary{{"QXExtensionIdentifier", repeated(Value(std::string("?XYZ")), 3)}})}};
  ASSERT_EQ(errorOf(request(protocol::kRequestMatch, rules)), Expected(0, ""));
  EXPECT_EQ(log.count(line), 1u);

  // One connection asking for a line again and again gets its burst and
  // what its rate refills meanwhile; the rest is dropped and counted.
  const auto flooder = connect();
  const size_t requests = kPeerLogLinesBurst * 2;
  const auto start = std::chrono::steady_clock::now();
  for (size_t i = 0; i < requests; ++i) {
    ASSERT_EQ(errorOf(request(protocol::kRequestMatch, rules, flooder)), Expected(0, "")) << i;
  }
  const double seconds =
      std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  const size_t logged = log.count(line) - 1;
  EXPECT_GE(logged, kPeerLogLinesBurst);
  EXPECT_LE(logged, kPeerLogLinesBurst + 1 + static_cast<size_t>(seconds * kPeerLogLinesPerSecond));

  // Other connections keep their own budget.
  ASSERT_EQ(errorOf(request(protocol::kRequestMatch, rules)), Expected(0, ""));
  EXPECT_EQ(log.count(line), logged + 2);

  // Every dropped line is accounted for, at the latest when the flooder
  // goes away.
  flooder->cancel();
  const std::regex suppressed(
      base::format("(\\d+) log lines of client %d suppressed \\(more "
                   "than %u a second\\)",
                   ::getpid(), kPeerLogLinesPerSecond));
  const auto droppedLines = [&] {
    size_t total = 0;
    for (const std::string& l : log.lines()) {
      std::smatch m;
      if (std::regex_match(l, m, suppressed)) total += std::stoul(m[1]);
    }
    return total;
  };
  EXPECT_TRUE(eventually([&] { return droppedLines() == requests - logged; }))
      << droppedLines() << " of " << requests - logged;
}

TEST(LogBudget, AdmitsABurstThenARateAndCountsWhatItDrops) {
  using Clock = base::LogBudget::Clock;
  base::LogCapture log;
  const Clock::time_point t0 = Clock::now() + std::chrono::seconds(1);
  {
    base::LogBudget budget("peer", 3, 2);
    size_t dropped = 99;
    struct Step {
      double at;  // seconds after t0
      bool admitted;
      size_t droppedBefore;  // when admitted
    };
    const Step steps[] = {
        {0, true, 0},   {0, true, 0},    {0, true, 0},  {0, false, 0}, {0.1, false, 0},
        {0.5, true, 2}, {0.5, false, 0}, {10, true, 1}, {10, true, 0}, {10, true, 0},
        {10, false, 0}, {9, false, 0},  // a clock going back refills nothing
    };
    for (const Step& step : steps) {
      const auto at =
          t0 + std::chrono::duration_cast<Clock::duration>(std::chrono::duration<double>(step.at));
      EXPECT_EQ(budget.admit(at, &dropped), step.admitted) << step.at;
      if (step.admitted) {
        EXPECT_EQ(dropped, step.droppedBefore) << step.at;
      }
    }
  }
  // The two lines still dropped when the budget ended are reported then.
  EXPECT_EQ(log.lines(), std::vector<std::string>{"2 log lines of peer suppressed (more than 2 a "
                                                  "second)"});
}

}  // namespace
}  // namespace vantrel::daemon::testing
