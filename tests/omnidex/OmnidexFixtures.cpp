#include "tests/omnidex/OmnidexFixtures.h"

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

PlugInRecordPtr RecordingObserver::waitForInstalled(const std::string& path,
                                                    std::chrono::milliseconds timeout) {
  return waitFor(true, path, timeout);
}

PlugInRecordPtr RecordingObserver::waitForUninstalled(const std::string& path,
                                                      std::chrono::milliseconds timeout) {
  return waitFor(false, path, timeout);
}

}  // namespace vantrel::omnidex::testing
