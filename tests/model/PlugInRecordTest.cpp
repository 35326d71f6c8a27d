#include <gtest/gtest.h>

#include <thread>

#include "base/Log.h"
#include "model/VTPlugInCore.h"
#include "tests/model/PlugInFixtures.h"

namespace vantrel::model {
namespace {

using lmo::Dictionary;
using lmo::Value;
using testing::bundleInfo;
using testing::recordAt;
using Lines = std::vector<std::string>;

const FileUrl kUrl = FileUrl::fromPath("/apps/N.app/PlugIns/S.appex");

TEST(PlugInRecord, ConstructionFailuresAndLogLines) {
  const Value good(bundleInfo({})), noExtension(Dictionary{{"K", "x"}}),
      extensionText(Dictionary{{"QXExtension", "text"}});
  const std::string malformed =
      "malformed plug-in dictionary in plug-in p at file://" + kUrl.path() + ": ";
  struct Case {
    std::optional<std::string> name;
    std::optional<FileUrl> url;
    Value info;
    Lines log;
  } cases[] = {
      {"p", std::nullopt, good, {}},
      {std::nullopt, kUrl, good, {"missing identifier in plug-in at " + kUrl.path()}},
      {"p", kUrl, Value("text"), {malformed + "text"}},
      {"p", kUrl, noExtension, {malformed + describe(noExtension)}},
      {"p", kUrl, extensionText, {malformed + describe(extensionText)}},
  };
  for (const Case& c : cases) {
    base::LogCapture capture;
    EXPECT_EQ(VTPlugInCore::initWithName(c.name, c.url, c.info, Value(), std::nullopt), nullptr);
    EXPECT_EQ(capture.lines(), c.log);
  }
}

TEST(PlugInRecord, ConstructionStoresDictionariesAndUuid) {
  base::LogCapture capture;
  Dictionary extension{{"Multiple", Value::boolean(true)}};
  Dictionary info = bundleInfo(extension, {{"KBBundleIdentifier", "b"}});
  base::Uuid id = base::Uuid::random();
  auto r = VTPlugInCore::initWithName("p", kUrl, Value(info), Value(Dictionary{{"x", "y"}}), id);
  ASSERT_NE(r, nullptr);
  EXPECT_EQ(capture.lines(), Lines{"multiplexed plug-ins (Multiple key) obsolete and ignored"});
  EXPECT_EQ(r->bundleInfoDictionary(), info);
  EXPECT_EQ(r->plugInDictionary(), extension);  // not the info argument
  EXPECT_EQ(r->uuid(), id);

  // Registry style: no bundle info; the info argument is the extension.
  auto registry = VTPlugInCore::initWithName("p", kUrl, Value(), Value(extension), std::nullopt);
  EXPECT_FALSE(registry->bundleInfoDictionary());
  EXPECT_EQ(registry->plugInDictionary(), extension);

  auto a = recordAt(kUrl.path(), info), b = recordAt(kUrl.path(), info);
  ASSERT_TRUE(a->uuid() && b->uuid());
  EXPECT_FALSE(a->isEqual(b.get()));  // each got a fresh uuid
}

TEST(PlugInRecord, DerivedProperties) {
  const Value object("QXObject"), none;
  const Value yes = Value::boolean(true), no = Value::boolean(false);
  const Value one = Value::integer(1), zero = Value::integer(0);
  struct Case {
    std::string path;
    Dictionary extension;
    Value protocol, principal;
    bool appex, dedicated, data, hybrid;
  } cases[] = {
      // clang-format off
      {"/a/X.appex",  {}, object, object, true, false, false, false},
      {"/a/X.APPEX",  {}, none, none, false, false, false, false},
      {"/a/X.appex/", {}, none, none, false, false, false, false},
      {"/a/X.plugin", {{"QXExtensionProtocol", "#Data"}, {"Dedicated", yes}},
       Value("#Data"), none, false, true, true, false},
      {"/a/X.appex",  {{"Dedicated", one}, {"PrincipalClass", "M"}, {"EmbeddedCode", no}},
       object, Value("M"), true, true, false, true},
      {"/a/X.plugin", {{"Dedicated", zero}}, none, none, false, false, false, false},
      {"/a/X.plugin", {{"Dedicated", no}}, none, none, false, false, false, false},
      // clang-format on
  };
  for (const Case& c : cases) {
    auto r = recordAt(c.path, bundleInfo(c.extension));
    SCOPED_TRACE(c.path + " " + describe(c.extension));
    EXPECT_EQ(r->protocolSpec(), c.protocol);
    EXPECT_EQ(r->embeddedProtocolSpec(), c.protocol);
    EXPECT_EQ(r->principalSpec(), c.principal);
    EXPECT_EQ(r->isAppExtension(), c.appex);
    EXPECT_EQ(r->isDedicated(), c.dedicated);
    EXPECT_EQ(r->isData(), c.data);
    EXPECT_EQ(r->isHybrid(), c.hybrid);
    EXPECT_FALSE(r->oldStyle());
  }
  auto r = recordAt("/a/X.plugin", bundleInfo({{"EmbeddedProtocol", "E"}}));
  EXPECT_EQ(r->embeddedProtocolSpec(), Value("E"));
  EXPECT_EQ(r->timestamp(), lmo::Date{0});
  r->setLastModified(-86400);
  EXPECT_EQ(r->timestamp(), lmo::Date{-86400});
  VTPlugInCore old;
  old.setBundleInfoDictionary(Dictionary{{"Vantrel", Dictionary{}}});
  EXPECT_TRUE(old.oldStyle());
}

TEST(PlugInRecordDeathTest, IdentityIsTheUuidAndNeedsOne) {
  base::Uuid id = base::Uuid::random();
  auto a = recordAt("/a/A.appex", bundleInfo({}), id);
  auto b = VTPlugInCore::initWithName("other", FileUrl::fromPath("/b"), Value(bundleInfo({})),
                                      Value(), id);
  VTPlugInCore noUuid;
  EXPECT_TRUE(*a == *b);
  EXPECT_EQ(a->hash(), b->hash());
  EXPECT_FALSE(a->isEqual(recordAt("/a/A.appex", bundleInfo({})).get()));
  EXPECT_FALSE(a->isEqual(nullptr));
  EXPECT_FALSE(a->isEqual(&noUuid));
  EXPECT_DEATH(noUuid.isEqual(a.get()), "internal inconsistency: self.uuid");
  EXPECT_DEATH(noUuid.hash(), "internal inconsistency: self.uuid");
  noUuid.setBundleInfoDictionary(Dictionary{{"KBBundleIdentifier", "x"}});
  EXPECT_DEATH(noUuid.oldStyle(), "unknown plug-in configuration style");
}

TEST(PlugInRecord, CanonicalizeSuppliesAttributesAndVersion) {
  const Dictionary short31{{"KBBundleShortVersionString", "3.1"}};
  const Dictionary own{{"QXExtensionVersion", "9"}, {"k", "v"}};
  struct Case {
    Dictionary extension, extras, attributes;
  } cases[] = {
      {{}, {}, {{"QXExtensionVersion", "1"}}},
      {{}, short31, {{"QXExtensionVersion", "3.1"}}},
      {{{"QXExtensionAttributes", "junk"}}, {}, {{"QXExtensionVersion", "1"}}},
      {{{"QXExtensionAttributes", own}}, short31, own},
  };
  for (const Case& c : cases) {
    auto r = recordAt("/a/X.appex", bundleInfo(c.extension, c.extras));
    r->canonicalize();
    EXPECT_EQ(r->attributes(), c.attributes);
    EXPECT_EQ(r->version(), c.attributes.get("QXExtensionVersion"));
    EXPECT_EQ(r->bundleInfoDictionary(), bundleInfo(c.extension, c.extras));
  }
}

TEST(PlugInRecord, ConcurrentAnnotationChangesAreNotLost) {
  auto r = recordAt("/a/X.appex", bundleInfo({}));
  auto writer = [&](std::string prefix) {
    for (int i = 0; i < 200; ++i) r->setAnnotation(prefix + std::to_string(i), Value::integer(i));
  };
  std::thread t1(writer, "a"), t2(writer, "b");
  for (int i = 0; i < 200; ++i) (void)r->annotations();
  t1.join();
  t2.join();
  EXPECT_EQ(r->annotations()->size(), 400u);
}

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
