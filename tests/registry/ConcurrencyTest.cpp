// Lookups, discovery, annotation writes and announcements from several
// threads at once; meant for ThreadSanitizer as much as for the assertions.

#include <gtest/gtest.h>

#include <thread>

#include "base/Log.h"
#include "registry/VTDatabase.h"
#include "tests/registry/RegistryFixtures.h"

namespace vantrel::registry {
namespace {

using omnidex::PlugInRecordPtr;

using Concurrency = testing::RegistryTest;

TEST_F(Concurrency, QueriesWritesAndAnnouncementsInterleave) {
  constexpr int kPlugIns = 12, kRounds = 150;
  base::LogCapture quiet;  // purge and announcement lines are not the point here
  std::vector<PlugInRecordPtr>& records = workspace_->records;
  for (int i = 0; i < kPlugIns; ++i) {
    records.push_back(testing::record(std::to_string(i), {{"com.karvo.developer.auto-elect-plugin",
                                                           lmo::Value::integer(i % 2)}}));
  }
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
    EXPECT_NE(db->findPlugInAtPath(model::FileUrl::fromPath(*records[i % kPlugIns]->bundlePath)),
              nullptr);
    auto found = db->findPlugIns(lmo::Dictionary{{"QXUserElection", "1"}});
    ASSERT_TRUE(found);
    for (const VTDPlugInPtr& p : *found) p->localizedName();
  });
  loop([&](int i) {
    VTDPlugInPtr p = db->findPlugIn(records[i * 7 % kPlugIns]->uuid);
    ASSERT_NE(p, nullptr);
    db->setAnnotation(testing::election(i % 3), *p);
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
