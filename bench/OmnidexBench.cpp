// Costs of the application registry: bringing a fresh store up to date with
// 1,000 plug-in bundles, a discovery query over 10,000 registered plug-ins,
// and a lookup by UUID.

#include <benchmark/benchmark.h>

#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "bench/BenchTrees.h"
#include "omnidex/Omnidex.h"

namespace {

namespace fs = std::filesystem;
using vantrel::bench::configFor;
using vantrel::bench::kExtensionPoints;
using vantrel::bench::largeRegistry;
using vantrel::bench::Tree;
using vantrel::lmo::Dictionary;
using vantrel::lmo::Value;
using vantrel::omnidex::Omnidex;
using vantrel::omnidex::PlugInRecordPtr;

void BM_OmnidexReconcile1000AtOpen(benchmark::State& state) {
  static Tree tree(100, 10);
  int run = 0;
  for (auto _ : state) {
    state.PauseTiming();
    const std::string dir = tree.root + "/state" + std::to_string(run++);
    state.ResumeTiming();
    {
      std::shared_ptr<Omnidex> registry = Omnidex::open(configFor(tree, dir)).value();
      registry->reconcile();
      if (registry->installedPlugIns()->size() != 1000) state.SkipWithError("not 1,000 plug-ins");
    }
    state.PauseTiming();
    std::error_code ec;
    fs::remove_all(dir, ec);
    state.ResumeTiming();
  }
  state.SetItemsProcessed(state.iterations() * 1000);
}
BENCHMARK(BM_OmnidexReconcile1000AtOpen)->Unit(benchmark::kMillisecond);

void BM_OmnidexQueryOver10000(benchmark::State& state) {
  std::shared_ptr<Omnidex> registry = largeRegistry();
  const Dictionary query{{"QXExtensionPointIdentifier", Value("com.bench.point42")}};
  size_t matched = 0;
  for (auto _ : state) {
    auto found = registry->plugInsMatchingQuery(
        query, [](const std::string& identifier, const Dictionary& entitlements) {
          return !identifier.empty() && entitlements.empty();
        });
    matched = found->size();
    benchmark::DoNotOptimize(found);
  }
  if (matched != 10000 / kExtensionPoints) state.SkipWithError("unexpected match count");
  state.counters["matches"] = static_cast<double>(matched);
}
BENCHMARK(BM_OmnidexQueryOver10000)->Unit(benchmark::kMicrosecond);

void BM_OmnidexPlugInForUuid(benchmark::State& state) {
  std::shared_ptr<Omnidex> registry = largeRegistry();
  std::vector<vantrel::base::Uuid> uuids;
  const std::vector<PlugInRecordPtr> installed = registry->installedPlugIns().value();
  for (const PlugInRecordPtr& r : installed) uuids.push_back(r->uuid);
  size_t i = 0;
  for (auto _ : state) {
    benchmark::DoNotOptimize(registry->plugInForUuid(uuids[i]));
    i = (i + 7919) % uuids.size();
  }
}
BENCHMARK(BM_OmnidexPlugInForUuid);

}  // namespace
