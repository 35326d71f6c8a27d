#include <chrono>
#include <thread>

#include "omnidex/Errors.h"
#include "omnidex/Limits.h"
#include "omnidex/Store.h"
#include "tests/omnidex/OmnidexFixtures.h"

namespace vantrel::omnidex {
namespace {

using testing::RegistryTree;

constexpr const char* kApp = "com.example.app";

std::vector<ConsentEntry> entriesOf(Omnidex& registry, const std::string& application) {
  std::optional<std::vector<ConsentEntry>> entries = registry.privacyConsentEntries(application);
  EXPECT_TRUE(entries.has_value());
  return entries.value_or(std::vector<ConsentEntry>());
}

TEST(PrivacyConsent, AnswersReplaceEachOtherWithTheirTimeAndSurviveARestart) {
  RegistryTree tree;
  auto registry = tree.open();
  ASSERT_TRUE(registry);
  EXPECT_TRUE(entriesOf(*registry, kApp).empty()) << "an application never asked about";
  ASSERT_TRUE(registry->revokeConsent(kApp, "com.example.zoo").has_value());
  ASSERT_TRUE(registry->grantConsent("com.example.other", "com.example.camera").has_value());
  lmo::Date last;
  for (bool granted : {true, false, true}) {
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
    ASSERT_TRUE((granted ? registry->grantConsent(kApp, kKeyboardNetworkService)
                         : registry->revokeConsent(kApp, kKeyboardNetworkService))
                    .has_value());
    const std::vector<ConsentEntry> entries = entriesOf(*registry, kApp);
    ASSERT_EQ(entries.size(), 2u) << "one answer per service, in service order";
    EXPECT_EQ(entries[0], (ConsentEntry{"com.example.zoo", false, entries[0].changed}));
    EXPECT_EQ(entries[1].service, kKeyboardNetworkService);
    EXPECT_EQ(entries[1].granted, granted);
    EXPECT_GT(entries[1].changed, last);
    EXPECT_NEAR(entries[1].changed.secondsSince1970, testing::secondsNow(), 5);
    last = entries[1].changed;
  }
  const std::vector<ConsentEntry> saved = entriesOf(*registry, kApp);
  registry.reset();
  registry = tree.open();
  ASSERT_TRUE(registry);
  EXPECT_EQ(entriesOf(*registry, kApp), saved);
}

TEST(PrivacyConsent, IdentifiersAndAnswerCountsAreBounded) {
  RegistryTree tree;
  auto registry = tree.open();
  ASSERT_TRUE(registry);
  const std::string longest(kMaxConsentIdentifierLength, 'a');
  for (const std::string& bad : {std::string(), longest + "a", std::string("a\0b", 3)}) {
    base::Result<void> r = registry->grantConsent(bad, "s");
    ASSERT_FALSE(r.has_value());
    EXPECT_EQ(r.error().code, kOmnidexBadIdentifier);
    EXPECT_EQ(registry->grantConsent("a", bad).error().code, kOmnidexBadIdentifier);
    EXPECT_TRUE(entriesOf(*registry, bad).empty());
  }
  EXPECT_TRUE(registry->grantConsent(longest, longest).has_value());

  for (size_t i = 0; i < kMaxConsentEntriesPerApplication; ++i) {
    ASSERT_TRUE(registry->grantConsent(kApp, "s." + std::to_string(i)).has_value()) << i;
  }
  EXPECT_EQ(registry->grantConsent(kApp, "s.more").error().code, kOmnidexFull);
  // A full application may still change an answer, and others add theirs.
  EXPECT_TRUE(registry->revokeConsent(kApp, "s.7").has_value());
  EXPECT_TRUE(registry->grantConsent("com.example.other", "s.more").has_value());
  EXPECT_EQ(entriesOf(*registry, kApp).size(), kMaxConsentEntriesPerApplication);
}

TEST(PrivacyConsent, AStoreMadeBeforeTheTableOpensAndGainsIt) {
  RegistryTree tree;
  const std::string bundle = testing::writeBundle(
      tree.file("elsewhere/Keys.plugin"), testing::plugInInfo("com.example.keys", "com.karvo.p"));
  auto runSql = [&](const char* sql) {
    testing::runSql(tree.file("state/" + std::string(kStoreFileName)), sql);
  };
  auto registry = tree.open();
  ASSERT_TRUE(registry && registry->registerPlugIn(bundle).has_value());
  const base::Uuid uuid = registry->plugInForUrl(bundle)->uuid;
  registry.reset();
  // What the build before the table left: the same version, its own tables.
  runSql("DROP TABLE privacy_consent");
  registry = tree.open();
  ASSERT_TRUE(registry);
  ASSERT_NE(registry->plugInForUrl(bundle), nullptr);
  EXPECT_EQ(registry->plugInForUrl(bundle)->uuid, uuid);
  ASSERT_TRUE(registry->grantConsent(kApp, kKeyboardNetworkService).has_value());
  EXPECT_EQ(entriesOf(*registry, kApp).size(), 1u);
  registry.reset();

  // A table of that name that is not this one is refused, not altered.
  runSql("DROP TABLE privacy_consent; CREATE TABLE privacy_consent (x TEXT)");
  base::Result<std::shared_ptr<Omnidex>> opened = Omnidex::open(tree.config());
  ASSERT_FALSE(opened.has_value());
  EXPECT_EQ(opened.error().code, kOmnidexStoreFailed);
  runSql("INSERT INTO privacy_consent (x) VALUES ('kept')");
}

}  // namespace
}  // namespace vantrel::omnidex
