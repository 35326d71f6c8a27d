#include <gtest/gtest.h>

#include "base/Log.h"
#include "lmo/Protocol.h"
#include "model/VTPlugInCore.h"
#include "tests/model/PlugInFixtures.h"

namespace vantrel::model {
namespace {

using lmo::Dictionary;
using lmo::Value;
using testing::bundleInfo;
using testing::I;
using testing::recordAt;

TEST(PlugInForm, ExportAndRebuildRoundTrip) {
  Dictionary info = bundleInfo({}, {{"KBBundleInfoPlistURL", "file:///x/Info.plist"}});
  auto r = recordAt("/apps/A.app/PlugIns/X.appex", info);
  r->canonicalize();
  r->setOriginalIdentifier("orig");
  r->setHubProtocolVersion(3);
  r->setLastModified(-5);
  r->setOnSystemVolume(true);
  r->setEntitlements(Dictionary{{"e", Value::boolean(true)}});
  r->setAnnotations(Dictionary{{protocol::kAnnotationElection, Value::integer(1)}});
  r->setContainingUrl(FileUrl::fromPath("/apps/A.app"));
  r->setLocalizedName("Name");
  r->setLocalizedShortName("Short");
  r->setLocalizedContainingName("App");
  r->setCdhash(Value::data("abc", 3));
  r->setRequirement("req");

  base::Error untouched{"sentinel", 99, std::nullopt};
  Dictionary form = r->exportForm(&untouched);
  EXPECT_EQ(untouched.domain, "sentinel");
  EXPECT_EQ(form.keys(),
            (std::vector<std::string>{"annotations", "bundleInfo", "containingPath", "entitlements",
                                      "hubProtocolVersion", "identifier", "info", "lastmodified",
                                      "localizedContainingDisplayName", "localizedDisplayName",
                                      "localizedShortName", "original-identifier", "path",
                                      "systemResident", "uuid", "version"}));
  EXPECT_EQ(form.get("bundleInfo"), Value(info.removing("KBBundleInfoPlistURL")));
  EXPECT_EQ(r->bundleInfoDictionary(), info);  // the record keeps it
  EXPECT_EQ(form.get("uuid"), Value(r->uuid()->string()));
  EXPECT_EQ(form.get("version"), Value("1"));

  auto back = VTPlugInCore::initWithForm(form);
  ASSERT_NE(back, nullptr);
  EXPECT_EQ(back->exportForm(nullptr).removing("version").removing("info"),
            form.removing("version").removing("info"));
  EXPECT_TRUE(back->cdhash().isNull());
  EXPECT_FALSE(back->requirement());
  // The canonical version lived only in the exporter's extension dictionary.
  EXPECT_TRUE(back->version().isNull());
}

TEST(PlugInForm, RecordWithoutOptionalValues) {
  Dictionary form = recordAt("/System/X.plugin", bundleInfo({}))->exportForm(nullptr);
  EXPECT_EQ(form.get("annotations"), Value(Dictionary{}));
  for (const char* key :
       {"version", "original-identifier", "entitlements", "containingPath", "localizedDisplayName",
        "localizedShortName", "localizedContainingDisplayName"}) {
    EXPECT_FALSE(form.contains(key)) << key;
  }
  EXPECT_FALSE(VTPlugInCore::initWithForm(form)->containingUrl());
}

TEST(PlugInForm, FormValuesAreReadTypeSafely) {
  const Dictionary base{{"path", "/a/X"}, {"identifier", "x"}, {"bundleInfo", bundleInfo({})}};
  const base::Uuid id = base::Uuid::random();
  const char* lower = "0a1b2c3d-4e5f-6071-8293-a4b5c6d7e8f9";
  struct Case {
    Dictionary extra;
    uint32_t hub;
    int32_t lastModified;
    bool system;
    std::optional<base::Uuid> uuid;  // nullopt: a fresh random one
  } cases[] = {
      // clang-format off
      {{}, 1, 0, false, std::nullopt},
      {{{"hubProtocolVersion", I(0)}, {"uuid", id}}, 0, 0, false, id},
      {{{"hubProtocolVersion", "3"}, {"lastmodified", "5"}, {"systemResident", "YES"}},
       1, 0, false, std::nullopt},
      {{{"hubProtocolVersion", I(-1)}, {"lastmodified", I(1LL << 40)}, {"uuid", "bad"}},
       1, 0, false, std::nullopt},
      {{{"lastmodified", I(-7)}, {"systemResident", Value::boolean(true)}, {"uuid", lower}},
       1, -7, true, base::Uuid::parse(lower)},
      // clang-format on
  };
  for (const Case& c : cases) {
    Dictionary form = base;
    for (const auto& [k, v] : c.extra) form = form.setting(k, v);
    auto r = VTPlugInCore::initWithForm(form);
    ASSERT_NE(r, nullptr);
    SCOPED_TRACE(describe(form));
    EXPECT_EQ(r->hubProtocolVersion(), c.hub);
    EXPECT_EQ(r->lastModified(), c.lastModified);
    EXPECT_EQ(r->onSystemVolume(), c.system);
    ASSERT_TRUE(r->uuid());
    if (c.uuid) {
      EXPECT_EQ(r->uuid(), c.uuid);
    }
  }
  auto hashed = VTPlugInCore::initWithForm(base.setting("hash", Value::data("h", 1)));
  EXPECT_EQ(hashed->cdhash(), Value::data("h", 1));
}

TEST(PlugInForm, RebuildFailuresLog) {
  const Value info(bundleInfo({}));
  struct Case {
    Dictionary form;
    std::vector<std::string> log;
  } cases[] = {
      {{{"identifier", "x"}, {"bundleInfo", info}}, {}},
      {{{"path", Value::integer(3)}, {"identifier", "x"}}, {}},
      {{{"path", "/p"}, {"bundleInfo", info}}, {"missing identifier in plug-in at /p"}},
      {{{"path", "/p"}, {"identifier", "x"}, {"bundleInfo", Value::integer(4)}},
       {"malformed plug-in dictionary in plug-in x at file:///p: 4"}},
  };
  for (const Case& c : cases) {
    base::LogCapture capture;
    EXPECT_EQ(VTPlugInCore::initWithForm(c.form), nullptr) << describe(c.form);
    EXPECT_EQ(capture.lines(), c.log);
  }
}

TEST(PlugInForm, AnnotationChanges) {
  auto r = recordAt("/a/X.plugin", bundleInfo({}));
  r->setAnnotation(protocol::kAnnotationElection,
                   Value::integer(1));  // starting from no annotations
  r->setAnnotation(protocol::kAnnotationExtension, Value(Dictionary{{"k", "v"}}));
  r->setAnnotation(protocol::kAnnotationElection, Value());
  EXPECT_EQ(r->annotations(),
            (Dictionary{{protocol::kAnnotationExtension, Dictionary{{"k", "v"}}}}));
  r->updateFromForm(Dictionary{{"annotations", Dictionary{{"a", "b"}}}, {"identifier", "new"}});
  EXPECT_EQ(r->annotations(), (Dictionary{{"a", "b"}}));
  EXPECT_EQ(r->identifier(), "p");
  r->updateFromForm(Dictionary{{"annotations", "not a dictionary"}});
  EXPECT_FALSE(r->annotations());
}

}  // namespace
}  // namespace vantrel::model
