// Costs of the application registry: bringing a fresh store up to date with
// 1,000 plug-in bundles, a discovery query over 10,000 registered plug-ins,
// and a lookup by UUID.

#include <benchmark/benchmark.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "omnidex/Omnidex.h"
#include "platform/PropertyList.h"

namespace {

namespace fs = std::filesystem;
using vantrel::lmo::Dictionary;
using vantrel::lmo::Value;
using vantrel::omnidex::Omnidex;
using vantrel::omnidex::OmnidexConfig;
using vantrel::omnidex::PlugInRecordPtr;

// Extension points in the trees: a query for one of them matches
// plug-ins / kExtensionPoints plug-ins.
constexpr int kExtensionPoints = 100;

std::string makeTempDir() {
  std::string pattern = (fs::temp_directory_path() / "vantrel-bench-XXXXXX").string();
  if (::mkdtemp(pattern.data()) == nullptr) std::abort();
  return pattern;
}

void writeInfo(const std::string& dir, const Dictionary& info) {
  fs::create_directories(dir);
  std::ofstream(dir + "/Info.plist")
      << vantrel::platform::writePropertyListXML(Value(info)).value();
}

// apps applications of plugInsPerApp plug-ins each, below root/apps.
void buildTree(const std::string& root, int apps, int plugInsPerApp) {
  int n = 0;
  for (int a = 0; a < apps; ++a) {
    const std::string app = root + "/apps/App" + std::to_string(a) + ".app";
    writeInfo(app, Dictionary{{"KBBundleName", Value("App " + std::to_string(a))},
                              {"KBBundleIdentifier", Value("com.bench.app" + std::to_string(a))}});
    for (int p = 0; p < plugInsPerApp; ++p, ++n) {
      const Dictionary extension{
          {"QXExtensionPointIdentifier",
           Value("com.bench.point" + std::to_string(n % kExtensionPoints))},
          {"QXExtensionAttributes", Value(Dictionary{{"Kind", Value("k")}})}};
      writeInfo(app + "/PlugIns/P" + std::to_string(p) + ".appex",
                Dictionary{{"KBBundleIdentifier", Value("com.bench.plugin" + std::to_string(n))},
                           {"KBBundleName", Value("Plug-in " + std::to_string(n))},
                           {"KBBundleVersion", Value("1")},
                           {"QXExtension", Value(extension)}});
    }
  }
}

OmnidexConfig configFor(const std::string& root, const std::string& state) {
  return OmnidexConfig{state, {root + "/apps"}, {}};
}

// A tree built once per process, removed at exit.
struct Tree {
  Tree(int apps, int plugInsPerApp) : root(makeTempDir()) { buildTree(root, apps, plugInsPerApp); }
  ~Tree() {
    std::error_code ec;
    fs::remove_all(root, ec);
  }
  std::string root;
};

void BM_OmnidexReconcile1000AtOpen(benchmark::State& state) {
  static Tree tree(100, 10);
  int run = 0;
  for (auto _ : state) {
    state.PauseTiming();
    const std::string dir = tree.root + "/state" + std::to_string(run++);
    state.ResumeTiming();
    {
      std::shared_ptr<Omnidex> registry = Omnidex::open(configFor(tree.root, dir)).value();
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

// 10,000 plug-ins, registered once per process.
std::shared_ptr<Omnidex> largeRegistry() {
  static Tree tree(100, 100);
  static std::shared_ptr<Omnidex> registry = [] {
    std::shared_ptr<Omnidex> r = Omnidex::open(configFor(tree.root, tree.root + "/state")).value();
    r->reconcile();
    return r;
  }();
  return registry;
}

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
