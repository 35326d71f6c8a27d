#include <gtest/gtest.h>

#include "model/VTPlugInCore.h"
#include "tests/model/PlugInFixtures.h"

namespace vantrel::model {
namespace {

using lmo::Dictionary;
using lmo::Value;
using testing::bundleInfo;
using testing::recordAt;

TEST(Diagnose, RulesInOrderFirstFailureDecides) {
  const Value attrs(Dictionary{});
  const std::string protocol = "missing \"QXExtensionProtocol\" key in Info.plist or SDK";
  const std::string attributes = "missing \"QXExtensionAttributes\" key in Info.plist or SDK";
  const std::string principal = "Application Extensions may not use the \"PrincipalClass\" key";
  const std::string passProxy = "the \"PassProxy\" key is not supported on this platform";
  const std::string hybrid = "hybrid plug-ins are not supported on this platform";
  struct Case {
    std::string path;
    Dictionary extension;
    std::string message;  // empty: valid
  };
  const Case cases[] = {
      {"/a/X.plugin", {{"QXExtensionProtocol", "P"}, {"QXExtensionAttributes", attrs}}, ""},
      {"/a/X.plugin", {{"QXExtensionAttributes", attrs}}, protocol},
      {"/a/X.APPEX", {{"QXExtensionAttributes", attrs}}, protocol},
      {"/a/X.appex", {{"QXExtensionAttributes", attrs}}, ""},
      {"/a/X.appex", {{"QXExtensionAttributes", "junk"}}, attributes},
      {"/a/X.appex", {{"EmbeddedCode", "e"}}, attributes},  // first failure only
      {"/a/X.appex", {{"QXExtensionAttributes", attrs}, {"PrincipalClass", "QXObject"}}, ""},
      {"/a/X.appex", {{"QXExtensionAttributes", attrs}, {"PrincipalClass", "Mine"}}, principal},
      {"/a/X.plugin",
       {{"QXExtensionProtocol", "P"}, {"QXExtensionAttributes", attrs}, {"PrincipalClass", "M"}},
       ""},
      {"/a/X.appex",
       {{"QXExtensionAttributes", attrs}, {"PassProxy", Value::boolean(false)}},
       passProxy},
      {"/a/X.appex",
       {{"QXExtensionAttributes", attrs}, {"PassProxy", "x"}, {"EmbeddedCode", "e"}},
       passProxy},
      {"/a/X.appex",
       {{"QXExtensionAttributes", attrs}, {"EmbeddedCode", Value::boolean(false)}},
       hybrid},
  };
  for (const Case& c : cases) {
    auto r = recordAt(c.path, bundleInfo(c.extension));
    std::optional<base::Error> error = r->diagnose();
    SCOPED_TRACE(c.path + " " + describe(c.extension));
    if (c.message.empty()) {
      EXPECT_FALSE(error) << error->description();
      continue;
    }
    ASSERT_TRUE(error);
    EXPECT_EQ(*error, (base::Error{"Vantrel", 12, c.message}));
  }

  VTPlugInCore unnamed;  // never set up: no identifier
  unnamed.setPlugInDictionary(Dictionary{{"EmbeddedCode", "e"}});
  EXPECT_EQ(unnamed.diagnose()->localizedDescription,
            "missing identifier (no QXExtensionIdentifier, nor even KBBundleIdentifier)");
}

}  // namespace
}  // namespace vantrel::model
