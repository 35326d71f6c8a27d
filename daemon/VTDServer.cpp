#include "daemon/VTDServer.h"

#include <malloc.h>
#include <unistd.h>

#include "base/Log.h"
#include "daemon/VTDLmoClient.h"
#include "omnidex/Omnidex.h"
#include "platform/ServiceManager.h"

namespace vantrel::daemon {

namespace {

std::mutex singletonMutex;
VTDServerPtr singleton;  // Guarded by singletonMutex.

}  // namespace

VTDServer::~VTDServer() {
  if (service_) service_->cancel();
}

VTDServerPtr VTDServer::initForService(const char* service, const char* database) {
  return initForService(service, database, omnidex::Omnidex::defaultWorkspace());
}

VTDServerPtr VTDServer::initForService(const char* service, const char* database,
                                       std::shared_ptr<omnidex::Workspace> workspace) {
  std::optional<std::string> path;
  if (database != nullptr) path = database;
  auto server = initWithDatabase<VTDServer>(std::move(path), std::move(workspace));
  if (!server || !server->setUp(service)) return nullptr;
  return server;
}

bool VTDServer::setUp(const char* service) {
  lmoQueue_ = std::make_shared<base::SerialQueue>("lmo");
  mainQueue_ = std::make_shared<base::SerialQueue>("service", base::QueuePriority::kUserInitiated);
  syncQueue_ = std::make_shared<base::SerialQueue>("serverSync");
  auto listener = lmo::Listener::create(service, lmoQueue_);
  if (!listener.has_value()) {
    base::vtlog("unable to listen on service %s: %@", service, listener.error());
    return false;
  }
  service_ = std::move(listener).value();
  auto self = std::static_pointer_cast<VTDServer>(shared_from_this());
  {
    std::lock_guard lock(singletonMutex);
    singleton = self;
  }
  setDelegate(std::static_pointer_cast<registry::VTDatabaseDelegate>(self));
  // The listener must not keep the server alive: the server owns it.
  std::weak_ptr<VTDServer> weakSelf = self;
  service_->setConnectionHandler([weakSelf](std::shared_ptr<lmo::Connection> connection) {
    if (auto server = weakSelf.lock()) VTDLmoClient::initWithConnection(connection, server);
  });
  userPrefs_ = std::make_shared<registry::VTDUserPrefs>();
  return true;
}

VTDServerPtr VTDServer::server() {
  std::lock_guard lock(singletonMutex);
  return singleton;
}

void VTDServer::resetForTest() {
  VTDServerPtr last;
  std::lock_guard lock(singletonMutex);
  last.swap(singleton);
}

void VTDServer::run() {
  resume();
  // Everything happens on the queues and the I/O thread; the main thread
  // only has to stay.
  for (;;) ::pause();
}

void VTDServer::resume() {
  service_->resume();
}

void VTDServer::cancelListenerForTest() {
  service_->cancel();
}

void VTDServer::logFormatArguments(int level, std::string_view fmt, const base::FormatArg* args,
                                   size_t count) const {
  // Debug lines (what -v adds) go out at info level, so a peer's log budget
  // never hides what the operator asked to see.
  const base::LogLevel priority = level >= static_cast<int>(base::LogLevel::kInfo)
                                      ? base::LogLevel::kInfo
                                      : base::LogLevel::kNotice;
  base::writeLog(priority, base::formatArgs(fmt, args, count));
}

void VTDServer::requestFinished(std::chrono::steady_clock::duration took) {
  mainQueue_->assertCurrent();
  // A trim takes a few milliseconds on a large heap: small next to the
  // requests that leave much behind, too much for every request.
  if (took >= kTrimAfterRequestTime) ::malloc_trim(0);
}

void VTDServer::submitRequest(std::function<void()> work) {
  // Handing a request to the queue's worker costs a wake-up and a context
  // switch, about as much as the whole round trip of a raw socket: when
  // nothing is queued, the delivering thread runs it instead, holding the
  // queue as the worker would. Queued work keeps its turn.
  if (mainQueue_->tryRunHere(work)) return;
  mainQueue_->async(std::move(work));
}

void VTDServer::removedPlugIns(const std::vector<omnidex::PlugInRecordPtr>& records) {
  for (const omnidex::PlugInRecordPtr& record : records) {
    const std::optional<std::string> bundleIdentifier = record->bundleIdentifier;
    // The reply holds the service queue; letting it go on the I/O thread
    // keeps the last reference from ever dropping on the queue itself.
    platform::ServiceManager::shared().removeExternalService(
        bundleIdentifier.value_or(""), record->bundleVersion.value_or(""), *mainQueue_,
        [bundleIdentifier, queue = mainQueue_](int result) mutable {
          base::vtlog("PLUGIN REMOVAL:%@ RESULT:%d", bundleIdentifier, result);
          lmo::releaseQueue(std::move(queue));
        });
  }
}

}  // namespace vantrel::daemon
