#include "registry/VTDPlugIn.h"

#include <gtest/gtest.h>

#include <limits>

#include "base/Log.h"
#include "tests/registry/RegistryFixtures.h"

namespace vantrel::registry {
namespace {

using lmo::Dictionary;
using lmo::Value;
using testing::record;

TEST(VTDPlugIn, LastModifiedAndHubProtocolVersion) {
  const std::pair<std::optional<double>, int32_t> dates[] = {
      {std::nullopt, 0}, {-1.5, -1}, {1.9, 1}, {1e12, std::numeric_limits<int32_t>::max()}};
  for (const auto& [seconds, expected] : dates) {
    auto r = record("p");
    if (seconds) r->registrationDate = lmo::Date{*seconds};
    EXPECT_EQ(VTDPlugIn::initWithOXData(r)->lastModified(), expected) << seconds.value_or(0);
  }
  // {declared version (null: none), old-style Info key, expected}
  const std::tuple<Value, bool, uint32_t> hubs[] = {{Value(), false, 2},
                                                    {Value(), true, 1},
                                                    {Value::integer(0), true, 0},
                                                    {Value::integer(7), false, 7}};
  for (const auto& [declared, oldStyle, expected] : hubs) {
    auto r = record("p");
    r->extensionDictionary = r->extensionDictionary.setting("HubProtocolVersion", declared);
    r->infoDictionary = Dictionary{{oldStyle ? "Vantrel" : "QXExtension", r->extensionDictionary}};
    EXPECT_EQ(VTDPlugIn::initWithOXData(r)->hubProtocolVersion(), expected) << oldStyle;
  }
}

TEST(VTDPlugIn, MisconfiguredRecordsAreRefused) {
  const std::string system = "/System/Library/PlugIns/p.plugin";
  struct Case {
    std::string path;
    Value protocol;  // null: none
    bool container, inApp;
    std::string logged;  // empty: accepted
  } cases[] = {
      {system, "P", false, false,
       "mis-configured plug-in at " + system + ": this plug-in has no sandbox data container"},
      {system, "#Data", false, false, ""},  // data-only: no container needed
      {"/Systemic/p.plugin", "P", true, false, "outside containing apps must be in /System"},
      {"/opt/A.app/PlugIns/p.plugin", "P", true, true, ""},
      {system, Value(), false, false,
       "missing \"QXExtensionProtocol\" key"},  // the base's rules come first
  };
  for (const Case& c : cases) {
    auto r = record("p");
    r->bundlePath = c.path;
    r->extensionDictionary =
        c.protocol.isNull() ? r->extensionDictionary.removing("QXExtensionProtocol")
                            : r->extensionDictionary.setting("QXExtensionProtocol", c.protocol);
    if (!c.container) r->dataContainerPath.reset();
    if (c.inApp) r->containingApplication = std::make_shared<omnidex::ApplicationRecord>();
    base::LogCapture log;
    EXPECT_EQ(VTDPlugIn::initWithOXData(r) == nullptr, !c.logged.empty()) << c.path;
    EXPECT_EQ(log.lines().size(), c.logged.empty() ? 0u : 1u);
    EXPECT_TRUE(c.logged.empty() || log.contains(c.logged)) << c.logged;
  }
}

TEST(VTDPlugIn, NamesEntitlementsAndAnnotationKey) {
  auto r = record("own", {{"com.karvo.developer.replace-plugin", Value::boolean(true)}});
  r->localizedName = "Name";
  r->localizedShortName = "N";
  EXPECT_EQ(VTDPlugIn::initWithOXData(r)->localizedContainingName(), std::nullopt);
  r->containingApplication = std::make_shared<omnidex::ApplicationRecord>(
      omnidex::ApplicationRecord{.localizedName = "App"});
  auto p = VTDPlugIn::initWithOXData(r);
  p->setLocalizedShortName("Mine");  // set before the first read: wins
  EXPECT_EQ(p->localizedName(), "Name");
  EXPECT_EQ(p->localizedShortName(), "Mine");
  EXPECT_EQ(p->localizedContainingName(), "App");
  p->setLocalizedName("Other");
  EXPECT_EQ(p->localizedName(), "Other");
  p->setLocalizedName(std::nullopt);  // fetched again
  EXPECT_EQ(p->localizedName(), "Name");
  EXPECT_EQ(p->annotationKey(), "own");  // a replace-plugin value counts only as a string

  // Any number 0 (or false) withholds an entitlement; everything else grants it.
  EXPECT_FALSE(p->hasEntitlement("absent"));
  for (const auto& [value, granted] : {std::pair{Value::integer(0), false},
                                       {Value::real(0.0), false},
                                       {Value::boolean(false), false},
                                       {Value("false"), true},
                                       {Value::integer(2), true}}) {
    EXPECT_EQ(VTDPlugIn::initWithOXData(record("p", {{"e", value}}))->hasEntitlement("e"), granted)
        << describe(value);
  }
}

}  // namespace
}  // namespace vantrel::registry
