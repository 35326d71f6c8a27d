// Costs of the platform services the match rules lean on: type conformance
// and activation-rule evaluation, both on every candidate plug-in of a match.

#include <benchmark/benchmark.h>

#include <string>
#include <utility>
#include <vector>

#include "lmo/Value.h"
#include "platform/ActivationRules.h"
#include "platform/TypeIdentifiers.h"

namespace {

using vantrel::lmo::Array;
using vantrel::lmo::Dictionary;
using vantrel::lmo::Value;
using vantrel::platform::TypeRegistry;

// Pairs that conform and pairs that do not, known and unknown types.
const std::pair<const char*, const char*> kQueries[] = {
    {"public.jpeg", "public.item"},
    {"public.svg-image", "public.xml"},
    {"public.folder", "public.data"},
    {"com.example.unknown", "public.data"},
};

void BM_TypeConformsToWarmRegistry(benchmark::State& state) {
  const TypeRegistry types = TypeRegistry::load({});
  for (auto _ : state) {
    for (const auto& [type, parent] : kQueries) {
      benchmark::DoNotOptimize(types.conformsTo(type, parent));
    }
  }
  state.SetItemsProcessed(state.iterations() * std::size(kQueries));
}
BENCHMARK(BM_TypeConformsToWarmRegistry);

// Through the shared registry: adds the check of the SDK directories' files.
void BM_TypeConformsToShared(benchmark::State& state) {
  for (auto _ : state) {
    benchmark::DoNotOptimize(vantrel::platform::typeConformsTo("public.jpeg", "public.item"));
  }
}
BENCHMARK(BM_TypeConformsToShared);

// Ten items of one or two attachments against a rule of three types.
void BM_ActivationRuleTenItems(benchmark::State& state) {
  const TypeRegistry types = TypeRegistry::load({});
  const Value rule(Dictionary{{"maxItems", Value::integer(10)},
                              {"public.image", Value::integer(10)},
                              {"public.text", Value::integer(10)},
                              {"public.url", Value::integer(5)}});
  const char* kinds[] = {"public.jpeg", "public.png", "public.html", "public.file-url"};
  std::vector<Value> items;
  for (int i = 0; i < 10; ++i) {
    Array attachments{Value(kinds[i % 4])};
    if (i % 3 == 0) attachments = attachments.appending(Value("public.utf8-plain-text"));
    items.push_back(Value(Dictionary{{"attachments", Value(attachments)}}));
  }
  const Value extensionItems(Dictionary{{"items", Value(Array(items))}});
  if (!vantrel::platform::activationRuleAdmits(rule, extensionItems, types)) {
    state.SkipWithError("the rule does not admit the benchmark's items");
  }
  for (auto _ : state) {
    benchmark::DoNotOptimize(vantrel::platform::activationRuleAdmits(rule, extensionItems, types));
  }
}
BENCHMARK(BM_ActivationRuleTenItems);

}  // namespace
