// Costs of the foundation that every request path leans on: value lookups
// and copies, descriptions, and the serial-queue hand-offs.

#include <benchmark/benchmark.h>

#include <atomic>
#include <latch>
#include <string>
#include <vector>

#include "base/SerialQueue.h"
#include "lmo/Json.h"
#include "lmo/Value.h"

namespace {

using vantrel::base::SerialQueue;
using vantrel::lmo::Array;
using vantrel::lmo::Dictionary;
using vantrel::lmo::Value;

// An Info dictionary of a typical size: a few dozen keys, one nested level.
Dictionary infoLike(int keys) {
  std::vector<Dictionary::Entry> entries;
  for (int i = 0; i < keys; ++i) {
    entries.emplace_back("KBKey" + std::to_string(i), Value("value " + std::to_string(i)));
  }
  entries.emplace_back("QXExtension",
                       Value(Dictionary{{"QXExtensionPointIdentifier", Value("com.karvo.share")},
                                        {"QXExtensionAttributes", Value(Dictionary{})}}));
  return Dictionary::fromEntries(std::move(entries));
}

void BM_DictionaryLookup(benchmark::State& state) {
  Dictionary d = infoLike(static_cast<int>(state.range(0)));
  for (auto _ : state) {
    benchmark::DoNotOptimize(d.find("QXExtension"));
    benchmark::DoNotOptimize(d.find("KBKey7"));
    benchmark::DoNotOptimize(d.find("absent"));
  }
  state.SetItemsProcessed(state.iterations() * 3);
}
BENCHMARK(BM_DictionaryLookup)->Arg(8)->Arg(64);

void BM_ValueCopy(benchmark::State& state) {
  Value v(infoLike(64));
  for (auto _ : state) {
    Value copy = v;
    benchmark::DoNotOptimize(copy);
  }
}
BENCHMARK(BM_ValueCopy);

void BM_DictionarySetting(benchmark::State& state) {
  Dictionary d = infoLike(static_cast<int>(state.range(0)));
  for (auto _ : state) benchmark::DoNotOptimize(d.setting("election", Value::integer(1)));
}
BENCHMARK(BM_DictionarySetting)->Arg(8)->Arg(64);

void BM_DescribeAndJson(benchmark::State& state) {
  Value v(infoLike(32));
  for (auto _ : state) {
    benchmark::DoNotOptimize(describe(v));
    benchmark::DoNotOptimize(vantrel::lmo::toJson(v));
  }
}
BENCHMARK(BM_DescribeAndJson);

// sync onto an idle queue runs on the caller's thread: no thread switch.
void BM_QueueSyncIdle(benchmark::State& state) {
  SerialQueue q("bench.idle");
  int n = 0;
  for (auto _ : state) q.sync([&] { ++n; });
  benchmark::DoNotOptimize(n);
}
BENCHMARK(BM_QueueSyncIdle);

// async submissions drained by the worker: per-block hand-off cost.
void BM_QueueAsyncThroughput(benchmark::State& state) {
  SerialQueue q("bench.async");
  std::atomic<int64_t> done{0};
  int64_t submitted = 0;
  for (auto _ : state) {
    q.async([&] { done.fetch_add(1, std::memory_order_relaxed); });
    ++submitted;
  }
  q.sync([] {});
  state.SetItemsProcessed(submitted);
}
BENCHMARK(BM_QueueAsyncThroughput);

}  // namespace
