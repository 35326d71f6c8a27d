// Costs of the plug-in database over 10,000 registered plug-ins: a discovery
// query for one extension point (100 matches), with and without an election
// filter, and a lookup by UUID whose record is not cached yet.

#include <benchmark/benchmark.h>

#include <chrono>
#include <memory>
#include <string>
#include <vector>

#include "bench/BenchTrees.h"
#include "registry/VTDatabase.h"

namespace {

using vantrel::bench::kExtensionPoints;
using vantrel::bench::largeRegistry;
using vantrel::lmo::Dictionary;
using vantrel::lmo::Value;
using vantrel::registry::VTDatabase;

// One database over the large registry, caching every record it builds.
std::shared_ptr<VTDatabase> largeDatabase() {
  static std::shared_ptr<VTDatabase> database = [] {
    static const std::string annotations = vantrel::bench::makeTempDir() + "/Annotations";
    auto db = VTDatabase::initWithDatabase(annotations, largeRegistry());
    db->setCacheLimit(1u << 20);
    return db;
  }();
  return database;
}

void findPlugIns(benchmark::State& state, const Dictionary& query) {
  std::shared_ptr<VTDatabase> db = largeDatabase();
  size_t matched = 0;
  for (auto _ : state) {
    auto found = db->findPlugIns(query);
    matched = found ? found->size() : 0;
    benchmark::DoNotOptimize(found);
  }
  if (matched != 10000 / kExtensionPoints) state.SkipWithError("unexpected match count");
  state.counters["matches"] = static_cast<double>(matched);
}

void BM_DatabaseFindPlugInsOver10000(benchmark::State& state) {
  findPlugIns(state, Dictionary{{"QXExtensionPointIdentifier", Value("com.bench.point42")}});
}
BENCHMARK(BM_DatabaseFindPlugInsOver10000)->Unit(benchmark::kMicrosecond);

// Every plug-in is unannotated, so election "0" keeps all 100 but reads the
// annotation store once per candidate.
void BM_DatabaseFindPlugInsElectionFilter(benchmark::State& state) {
  findPlugIns(state, Dictionary{{"QXExtensionPointIdentifier", Value("com.bench.point42")},
                                {"QXUserElection", Value("0")}});
}
BENCHMARK(BM_DatabaseFindPlugInsElectionFilter)->Unit(benchmark::kMicrosecond);

// Each iteration looks up a plug-in whose record has not been built: the
// registry lookup, the record's construction and validation, and the cache
// insertion. The cache is emptied outside the timed region when every
// plug-in has been built once.
void BM_DatabaseFindPlugInCold(benchmark::State& state) {
  std::shared_ptr<VTDatabase> db = largeDatabase();
  std::vector<vantrel::base::Uuid> uuids;
  const auto installed = largeRegistry()->installedPlugIns().value();
  for (const auto& record : installed) uuids.push_back(record->uuid);
  db->queue().sync([&] { db->purgeCachesToLimit(0); });
  size_t next = 0;
  for (auto _ : state) {
    if (next == uuids.size()) {
      db->queue().sync([&] { db->purgeCachesToLimit(0); });
      next = 0;
    }
    const auto start = std::chrono::steady_clock::now();
    auto plugIn = db->findPlugIn(uuids[next++]);
    const auto stop = std::chrono::steady_clock::now();
    if (!plugIn) state.SkipWithError("record not built");
    state.SetIterationTime(std::chrono::duration<double>(stop - start).count());
  }
}
BENCHMARK(BM_DatabaseFindPlugInCold)->UseManualTime()->Unit(benchmark::kMicrosecond);

}  // namespace
