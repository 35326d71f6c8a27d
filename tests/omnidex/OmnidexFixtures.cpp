#include "tests/omnidex/OmnidexFixtures.h"

#include <sqlite3.h>

#include <filesystem>

#include "platform/PropertyList.h"

namespace vantrel::omnidex::testing {

lmo::Dictionary plugInInfo(const std::string& identifier, const std::string& extensionPoint,
                           lmo::Dictionary extras) {
  lmo::Dictionary extension{{"QXExtensionPointIdentifier", lmo::Value(extensionPoint)},
                            {"QXExtensionAttributes", lmo::Value(lmo::Dictionary{})}};
  return extras.setting("KBBundleIdentifier", lmo::Value(identifier))
      .setting("QXExtension", lmo::Value(extension));
}

double secondsNow() {
  return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
}

std::string writeBundle(const std::string& dir, const lmo::Dictionary& info) {
  std::filesystem::create_directories(dir);
  EXPECT_TRUE(platform::writePropertyListFile(dir + "/Info.plist", lmo::Value(info)).has_value());
  return dir;
}

OmnidexConfig RegistryTree::config() const {
  std::filesystem::create_directories(apps());
  std::filesystem::create_directories(plugIns());
  return OmnidexConfig{state(), {apps()}, {plugIns()}};
}

std::shared_ptr<Omnidex> RegistryTree::open() const {
  base::Result<std::shared_ptr<Omnidex>> opened = Omnidex::open(config());
  if (!opened.has_value()) {
    ADD_FAILURE() << "cannot open the registry: " << opened.error().description();
    return nullptr;
  }
  return opened.value();
}

std::string RegistryTree::container(const base::Uuid& uuid) const {
  return state() + "/containers/" + uuid.string();
}

void RecordingObserver::pluginsDidInstall(const std::vector<PlugInRecordPtr>& records) {
  std::lock_guard lock(mutex_);
  events_.push_back(Event{true, records});
  changed_.notify_all();
}

void RecordingObserver::pluginsWillUninstall(const std::vector<PlugInRecordPtr>& records) {
  std::lock_guard lock(mutex_);
  events_.push_back(Event{false, records});
  changed_.notify_all();
}

std::vector<RecordingObserver::Event> RecordingObserver::events() const {
  std::lock_guard lock(mutex_);
  return events_;
}

void RecordingObserver::clear() {
  std::lock_guard lock(mutex_);
  events_.clear();
}

std::vector<std::string> RecordingObserver::log() const {
  std::vector<std::string> lines;
  for (const Event& event : events()) {
    for (const PlugInRecordPtr& r : event.records) {
      lines.push_back((event.installed ? "+" : "-") + r->bundlePath.value_or("?"));
    }
  }
  return lines;
}

PlugInRecordPtr RecordingObserver::waitFor(bool installed, const std::string& path,
                                           std::chrono::milliseconds timeout) {
  std::unique_lock lock(mutex_);
  PlugInRecordPtr found;
  changed_.wait_for(lock, timeout, [&] {
    for (const Event& event : events_) {
      if (event.installed != installed) continue;
      for (const PlugInRecordPtr& r : event.records) {
        if (r->bundlePath == path) found = r;
      }
    }
    return found != nullptr;
  });
  return found;
}

std::shared_ptr<RecordingObserver> observe(Omnidex& registry) {
  auto observer = std::make_shared<RecordingObserver>();
  registry.addObserver(observer);
  return observer;
}

void runSql(const std::string& path, const std::string& sql) {
  sqlite3* db = nullptr;
  ASSERT_EQ(sqlite3_open(path.c_str(), &db), SQLITE_OK);
  EXPECT_EQ(sqlite3_exec(db, sql.c_str(), nullptr, nullptr, nullptr), SQLITE_OK)
      << sqlite3_errmsg(db);
  sqlite3_close(db);
}

}  // namespace vantrel::omnidex::testing
