// The database over a real registry: bundles in a temporary application
// directory, the registry's SQLite store in a temporary state directory.

#include <gtest/gtest.h>

#include <chrono>
#include <thread>

#include "base/Format.h"
#include "base/Log.h"
#include "omnidex/Omnidex.h"
#include "registry/VTDatabase.h"
#include "tests/registry/RegistryFixtures.h"

namespace vantrel::registry {
namespace {

using lmo::Dictionary;
using lmo::Value;
using testing::identifiers;
using testing::Names;

using RegistryIntegration = testing::RegistryTest;

TEST_F(RegistryIntegration, DiscoverElectAndUnregister) {
  const std::string app = tmp_.file("apps/Host.app");
  tmp_.write("apps/Host.app/Info.plist",
             "<plist><dict><key>KBBundleDisplayName</key><string>Host</string>"
             "<key>KBBundleIdentifier</key><string>com.x.host</string></dict></plist>");
  for (const char* name : {"widget", "share"}) {
    tmp_.write(std::string("apps/Host.app/PlugIns/") + name + ".appex/Info.plist",
               base::format("<plist><dict><key>KBBundleIdentifier</key><string>com.x.%s</string>"
                            "<key>KBBundleVersion</key><string>4</string><key>QXExtension</key>"
                            "<dict><key>QXExtensionPointIdentifier</key><string>com.karvo.%s"
                            "</string><key>QXExtensionProtocol</key><string>P</string><key>"
                            "QXExtensionAttributes</key><dict/></dict></dict></plist>",
                            name, name));
  }

  auto registry = omnidex::Omnidex::open({tmp_.file("state"), {tmp_.file("apps")}, {}});
  ASSERT_TRUE(registry.has_value()) << registry.error().description();
  base::LogCapture log;
  auto db = VTDatabase::initWithDatabase(tmp_.file("Annotations"), registry.value());
  ASSERT_NE(db, nullptr);
  auto delegate = std::make_shared<testing::CountingDelegate>();
  db->setDelegate(delegate);

  const Dictionary widgets{{"QXExtensionPointIdentifier", "com.karvo.widget"}};
  const Dictionary elected = widgets.setting("QXUserElection", "1");
  auto found = db->findPlugIns(widgets);
  ASSERT_EQ(identifiers(found), (Names{"com.x.widget"}));
  const VTDPlugInPtr widget = found->front();
  EXPECT_EQ(widget->containingPath(), app);
  EXPECT_EQ(widget->localizedContainingName(), "Host");
  EXPECT_EQ(widget->sdkSpec(), Value("com.karvo.widget"));
  EXPECT_EQ(identifiers(db->findPlugIns(std::nullopt)), (Names{"com.x.widget", "com.x.share"}));
  EXPECT_EQ(identifiers(db->plugInsWithinApplication(model::FileUrl::fromPath(app))),
            (Names{"com.x.widget", "com.x.share"}));

  EXPECT_EQ(identifiers(db->findPlugIns(elected)), Names{});
  db->setAnnotation(testing::election(1), *widget);
  found = db->findPlugIns(elected);
  ASSERT_EQ(identifiers(found), (Names{"com.x.widget"}));
  EXPECT_EQ(found->front(), widget);  // the cached object

  const auto widgetUrl = model::FileUrl::fromPath(app + "/PlugIns/widget.appex");
  EXPECT_EQ(db->removePlugIn(widgetUrl), std::nullopt);
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
  while (delegate->removed == 0 && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  ASSERT_EQ(delegate->removed, 1);
  const base::Uuid uuid = *widget->uuid();
  EXPECT_TRUE(log.contains("UNINSTALLED:com.x.widget com.x.widget(4) " + uuid.string()));
  EXPECT_EQ(db->findPlugIn(uuid), nullptr);
  EXPECT_EQ(db->removePlugIn(widgetUrl),
            (base::Error{"Vantrel", 2, "Omnidex failed to deregister the plug-in"}));
  // The election outlives the plug-in.
  EXPECT_EQ(db->annotations()->annotationForIdentifier("com.x.widget"), testing::election(1));
}

}  // namespace
}  // namespace vantrel::registry
