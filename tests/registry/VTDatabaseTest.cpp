#include "registry/VTDatabase.h"

#include <gtest/gtest.h>

#include <thread>

#include "base/Log.h"
#include "lmo/Protocol.h"
#include "platform/NotificationCenter.h"
#include "tests/registry/RegistryFixtures.h"

namespace vantrel::registry {
namespace {

using lmo::Array;
using lmo::Dictionary;
using lmo::Value;
using model::FileUrl;
using omnidex::PlugInRecordPtr;
using testing::election;
using testing::identifiers;
using testing::Names;
using testing::record;
using Lines = std::vector<std::string>;

constexpr const char* kAutoElect = "com.karvo.developer.auto-elect-plugin";

class Database : public testing::RegistryTest {
 protected:
  // n valid records, installed in the fake.
  std::vector<PlugInRecordPtr>& install(int n) {
    workspace_->records.clear();
    for (int i = 0; i < n; ++i)
      workspace_->records.push_back(record("com.x.p" + std::to_string(i)));
    return workspace_->records;
  }
};

TEST_F(Database, CacheServesOneObjectUntilAPurge) {
  auto r = install(1).at(0);
  auto db = database();
  auto first = db->findPlugIn(r->uuid);
  ASSERT_NE(first, nullptr);
  EXPECT_EQ(db->plugInForProxy(r), first);
  EXPECT_EQ(db->findPlugInAtPath(FileUrl::fromPath(*r->bundlePath)), first);

  base::LogCapture log;
  db->queue().sync([&] {
    db->purgeCachesToLimit(1);  // equal to the limit: nothing
    db->purgeCachesToLimit(0);
  });
  EXPECT_EQ(log.lines(), Lines{"purging cache for 1 > 0"});
  EXPECT_EQ(workspace_->cacheClears, 1);
  EXPECT_NE(db->findPlugIn(r->uuid), first);

  // {limit, records looked up, records cached afterwards}; the purge comes
  // before the insert, so limit + 1 records fit.
  const std::tuple<uint32_t, int, size_t> limits[] = {
      {0, 3, 1}, {2, 3, 3}, {2, 4, 1}, {static_cast<uint32_t>(-1), 6, 6}};
  for (const auto& [limit, created, cachedAfter] : limits) {
    db = database();
    db->setCacheLimit(limit);
    for (const PlugInRecordPtr& p : install(created)) db->findPlugIn(p->uuid);
    EXPECT_EQ(db->cacheCountForTest(), cachedAfter) << limit << " " << created;
  }
}

TEST_F(Database, FailedLookupsAreLoggedAndNotCached) {
  auto bad = record("com.x.bad");
  bad->dataContainerPath.reset();
  workspace_->records = {bad};
  auto db = database();
  base::LogCapture log;
  const base::Uuid unknown = base::Uuid::random();
  EXPECT_EQ(db->findPlugIn(unknown), nullptr);
  EXPECT_EQ(db->findPlugInAtPath(FileUrl::fromPath("/nowhere.plugin")), nullptr);
  EXPECT_EQ(db->findPlugInAtPath(FileUrl::fromPath(*bad->bundlePath)), nullptr);
  EXPECT_EQ(db->findPlugIn(bad->uuid), nullptr);
  const std::string refused = "ignoring mis-configured plug-in at " + *bad->bundlePath +
                              ": this plug-in has no sandbox data container";
  EXPECT_EQ(log.lines(),
            (Lines{"Omnidex cannot find plug-in with UUID:" + unknown.string(),
                   "Omnidex cannot find plug-in at path:/nowhere.plugin", refused, refused}));
  EXPECT_EQ(db->cacheCountForTest(), 0u);
}

// Records what it is told, and whether on the database queue.
struct Delegate : VTDatabaseDelegate {
  void removedPlugIns(const std::vector<PlugInRecordPtr>& records) override {
    calls.push_back(records);
    onQueue = onQueue || db->queue().isCurrent();
  }
  VTDatabase* db = nullptr;
  std::vector<std::vector<PlugInRecordPtr>> calls;
  bool onQueue = false;
};

TEST_F(Database, InstallAndUninstallAnnouncements) {
  const auto records = install(3);
  auto db = database();
  auto delegate = std::make_shared<Delegate>();
  delegate->db = db.get();
  db->setDelegate(delegate);
  auto kept = db->findPlugIn(records[2]->uuid);
  auto gone = db->findPlugIn(records[0]->uuid);

  base::LogCapture log;
  db->pluginsDidInstall({records[2]});
  EXPECT_EQ(db->findPlugIn(records[2]->uuid), kept);
  db->pluginsWillUninstall({records[0], records[1]});
  db->pluginsWillUninstall({});
  auto line = [&](const char* what, int i) {
    const std::string id = "com.x.p" + std::to_string(i);
    return what + id + " " + id + "(3) " + records[i]->uuid.string() + " " +
           *records[i]->bundlePath;
  };
  EXPECT_EQ(log.lines(),
            (Lines{line("INSTALLED:", 2), line("UNINSTALLED:", 0), line("UNINSTALLED:", 1)}));
  EXPECT_EQ(delegate->calls,
            (std::vector<std::vector<PlugInRecordPtr>>{{records[0], records[1]}, {}}));
  EXPECT_FALSE(delegate->onQueue);
  EXPECT_NE(db->findPlugIn(records[0]->uuid), gone);  // dropped from the cache

  delegate.reset();  // a departed delegate is simply not told
  db->pluginsWillUninstall({records[2]});
  EXPECT_NE(db->findPlugIn(records[2]->uuid), kept);
}

// ---- Discovery: findPlugIns and its election filter ----

class Discovery : public testing::RegistryTest {
 protected:
  std::optional<Names> find(Value selector) {
    return identifiers(db_->findPlugIns(Dictionary{{"QXUserElection", selector}}));
  }
  VTDatabasePtr db_ = database();
};

TEST_F(Discovery, ElectionFilter) {
  for (const char* id : {"one", "zero", "unset", "e257", "minus"})
    workspace_->records.push_back(record(id));
  workspace_->records.push_back(record("auto", {{kAutoElect, Value::integer(1)}}));
  workspace_->records.push_back(record("autoText", {{kAutoElect, "yes"}}));
  workspace_->records.push_back(
      record("replacer", {{"com.karvo.developer.replace-plugin", "one"}}));
  db_->annotations()->setAnnotations(Dictionary{{"one", election(1)},
                                                {"zero", election(0)},
                                                {"e257", election(257)},
                                                {"minus", election(-1)}});
  const Names all{"one", "zero", "unset", "e257", "minus", "auto", "autoText", "replacer"};

  EXPECT_EQ(find("1"), (Names{"one", "e257", "auto", "replacer"}));
  EXPECT_EQ(find("255"), (Names{"minus"}));
  // A selector is "=" and any text, or text starting with a letter (é), a
  // combining mark (U+0301) or a digit; one that matches no election selects
  // nothing.
  for (const Value& none : {Value("="), Value(Array{}), Value("abc"), Value("\xC3\xA9t"),
                            Value("\xCC\x81x"), Value("=-1")}) {
    EXPECT_EQ(find(none), Names{}) << describe(none);
  }
  EXPECT_EQ(find(Array{"0", "=1"}),
            (Names{"one", "zero", "unset", "e257", "auto", "autoText", "replacer"}));
  // Only a numeric auto-elect entitlement counts before the record is built;
  // building "autoText" above elected it, so the filter now sees election 1.
  EXPECT_EQ(find("1"), (Names{"one", "e257", "auto", "autoText", "replacer"}));
  // A bad selector anywhere (a symbol; a letter beyond the Basic Multilingual
  // Plane, which starts with a surrogate; bad UTF-8), or one that is no
  // string: no filtering at all.
  for (const Value& bad : {Value(Array{"1", "-x"}), Value("-1"), Value(""), Value(" 1"),
                           Value("\xE2\x82\xAC"), Value("\xF0\x9D\x90\x80"), Value("\xFF"),
                           Value::integer(1), Value(Array{"1", Value::integer(1)})}) {
    EXPECT_EQ(find(bad), all) << describe(bad);
  }
  EXPECT_EQ(identifiers(db_->findPlugIns(std::nullopt)), all);
}

TEST_F(Discovery, RecordsThatAreNotOffered) {
  auto inPlaceholder = record("inPlaceholder");
  inPlaceholder->containingApplication =
      std::make_shared<omnidex::ApplicationRecord>(omnidex::ApplicationRecord{.placeholder = true});
  auto inApp = record("inApp");
  inApp->containingApplication = std::make_shared<omnidex::ApplicationRecord>();
  auto noBundle = record("noBundle");
  noBundle->bundlePath.reset();
  auto duplicate = record("dup");
  auto sameUuid = std::make_shared<omnidex::PlugInRecord>(*duplicate);
  workspace_->records = {inPlaceholder, inApp, noBundle, duplicate, sameUuid};

  EXPECT_EQ(identifiers(db_->findPlugIns(std::nullopt)), (Names{"inApp", "dup"}));
  EXPECT_EQ(find("0"), (Names{"inApp", "dup"}));
  workspace_->failing = true;
  EXPECT_EQ(db_->findPlugIns(std::nullopt), std::nullopt);
  EXPECT_EQ(find("1"), std::nullopt);
}

// ---- Elections: annotation changes through the database ----

using Elections = testing::RegistryTest;

TEST_F(Elections, EverySetPostsOneNotification) {
  auto p = VTDPlugIn::initWithOXData(record("com.x.p"));
  auto db = database();
  // The second database cannot save; the change is broadcast all the same.
  auto unsaved = VTDatabase::initWithDatabase(tmp_.file("missing/Annotations"), workspace_);
  base::LogCapture quiet;
  uint64_t expected = 0;
  for (auto& [target, annotation] :
       {std::pair{db, std::optional(election(1))}, {db, std::nullopt}, {unsaved, election(1)}}) {
    EXPECT_EQ(target->setAnnotation(annotation, *p), std::nullopt);
    EXPECT_EQ(platform::notificationCount(protocol::kAnnotationChangeNotification), ++expected);
    EXPECT_EQ(target->annotationForPlugIn(*p), annotation);
  }
}

TEST_F(Elections, AutoElectionWhenTheRecordIsBuilt) {
  const Dictionary extension{{protocol::kAnnotationExtension, Dictionary{{"x", "y"}}}};
  const Value yes = Value::boolean(true), no = Value::integer(0);
  const std::tuple<Value, std::optional<Dictionary>, std::optional<Dictionary>> cases[] = {
      {yes, std::nullopt, election(1)},
      {yes, election(0), election(1)},
      {yes, election(2), election(2)},
      {yes, extension, extension.setting(protocol::kAnnotationElection, Value::integer(1))},
      {no, std::nullopt, std::nullopt}};
  for (const auto& [entitlement, before, after] : cases) {
    auto r = record("com.x.auto", {{kAutoElect, entitlement}});
    workspace_->records = {r};
    auto db = database();
    auto stored = [&](const std::optional<Dictionary>& a) {
      db->annotations()->setAnnotations(a ? Dictionary{{"com.x.auto", *a}} : Dictionary{});
    };
    stored(before);
    const uint64_t posted = platform::notificationCount(protocol::kAnnotationChangeNotification);
    auto p = db->findPlugIn(r->uuid);
    EXPECT_EQ(db->annotationForPlugIn(*p), after);
    EXPECT_EQ(platform::notificationCount(protocol::kAnnotationChangeNotification),
              posted);  // auto-election posts nothing
    if (!after) continue;

    // Set back to 0, it is elected again when the record is rebuilt.
    stored(election(0));
    db->queue().sync([&] { db->purgeCachesToLimit(0); });
    db->findPlugIn(r->uuid);
    EXPECT_EQ(db->annotationForPlugIn(*p), election(1));
  }
}

// ---- Lookups, discovery, annotation writes and announcements from several
// threads at once; meant for ThreadSanitizer as much as for the assertions ----

using Concurrency = testing::RegistryTest;

TEST_F(Concurrency, QueriesWritesAndAnnouncementsInterleave) {
  constexpr int kPlugIns = 12, kRounds = 150;
  base::LogCapture quiet;  // purge and announcement lines are not the point here
  std::vector<PlugInRecordPtr>& records = workspace_->records;
  for (int i = 0; i < kPlugIns; ++i)
    records.push_back(record(std::to_string(i), {{kAutoElect, Value::integer(i % 2)}}));
  auto db = database();
  db->setCacheLimit(4);  // purges interleave with everything else
  auto delegate = std::make_shared<testing::CountingDelegate>();
  db->setDelegate(delegate);

  // Uninstalls only drop cached records: every lookup still finds its plug-in.
  std::vector<std::thread> threads;
  auto loop = [&](auto body) {
    threads.emplace_back([body] {
      for (int i = 0; i < kRounds; ++i) body(i);
    });
  };
  loop([&](int i) {  // the registry's announcement thread
    db->pluginsDidInstall({records[i % kPlugIns]});
    db->pluginsWillUninstall({records[i % kPlugIns]});
  });
  loop([&](int i) {
    EXPECT_NE(db->findPlugInAtPath(FileUrl::fromPath(*records[i % kPlugIns]->bundlePath)), nullptr);
    auto found = db->findPlugIns(Dictionary{{"QXUserElection", "1"}});
    ASSERT_TRUE(found);
    for (const VTDPlugInPtr& p : *found) p->localizedName();
  });
  loop([&](int i) {
    VTDPlugInPtr p = db->findPlugIn(records[i * 7 % kPlugIns]->uuid);
    ASSERT_NE(p, nullptr);
    db->setAnnotation(election(i % 3), *p);
    db->annotationForPlugIn(*p);
    p->setLocalizedName(std::to_string(i));
  });
  for (std::thread& t : threads) t.join();

  EXPECT_EQ(delegate->removed.load(), kRounds);
  EXPECT_LE(db->cacheCountForTest(), 5u);
  // Every annotation written is in the file, whole.
  auto reloaded = VTDAnnotationStore::initWithDatabase(tmp_.file("Annotations"));
  EXPECT_EQ(reloaded->annotations(), db->annotations()->annotations());
}

}  // namespace
}  // namespace vantrel::registry
