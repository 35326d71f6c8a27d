#pragma once
// Bundle trees and registries the benchmarks share: applications full of
// plug-ins in a temporary directory, built once per process.

#include <memory>
#include <string>

#include "omnidex/Omnidex.h"

namespace vantrel::bench {

// Extension points in the trees: a query for one of them matches
// plug-ins / kExtensionPoints plug-ins ("com.bench.point<N>").
inline constexpr int kExtensionPoints = 100;

// A fresh directory under the temporary directory; stops the process when
// none can be made (a benchmark cannot run without it).
std::string makeTempDir();

// apps applications of plugInsPerApp plug-ins each, below <root>/apps, in a
// temporary root removed when the tree goes away.
struct Tree {
  Tree(int apps, int plugInsPerApp);
  ~Tree();
  Tree(const Tree&) = delete;
  Tree& operator=(const Tree&) = delete;
  std::string root;
};

// A registry over tree's applications with its state in stateDir.
omnidex::OmnidexConfig configFor(const Tree& tree, const std::string& stateDir);

// 10,000 plug-ins (100 applications of 100), registered once per process.
std::shared_ptr<omnidex::Omnidex> largeRegistry();

}  // namespace vantrel::bench
