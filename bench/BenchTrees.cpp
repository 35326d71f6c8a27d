#include "bench/BenchTrees.h"

#include <stdlib.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "platform/PropertyList.h"

namespace vantrel::bench {
namespace {

namespace fs = std::filesystem;
using lmo::Dictionary;
using lmo::Value;

void writeInfo(const std::string& dir, const Dictionary& info) {
  fs::create_directories(dir);
  std::ofstream(dir + "/Info.plist") << platform::writePropertyListXML(Value(info)).value();
}

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

}  // namespace

std::string makeTempDir() {
  std::string pattern = (fs::temp_directory_path() / "vantrel-bench-XXXXXX").string();
  if (::mkdtemp(pattern.data()) == nullptr) std::abort();
  return pattern;
}

Tree::Tree(int apps, int plugInsPerApp) : root(makeTempDir()) {
  buildTree(root, apps, plugInsPerApp);
}

Tree::~Tree() {
  std::error_code ec;
  fs::remove_all(root, ec);
}

omnidex::OmnidexConfig configFor(const Tree& tree, const std::string& stateDir) {
  return omnidex::OmnidexConfig{stateDir, {tree.root + "/apps"}, {}};
}

std::shared_ptr<omnidex::Omnidex> largeRegistry() {
  static Tree tree(100, 100);
  static std::shared_ptr<omnidex::Omnidex> registry = [] {
    auto r = omnidex::Omnidex::open(configFor(tree, tree.root + "/state")).value();
    r->reconcile();
    return r;
  }();
  return registry;
}

}  // namespace vantrel::bench
