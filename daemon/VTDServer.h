#pragma once
// The daemon's one server: the plug-in database, the listener on the named
// service, the work queues every request runs on, the list of plug-in holds
// and the user's preferences.
//
// Queues:
//   "lmo"        new connections and every client connection's events; only
//                client objects and transactions are made there.
//   "service"    every transaction, one at a time (submitRequest). A
//                request may run on the thread that delivered it (the I/O
//                thread, or the "lmo" queue's) when the queue is idle, so
//                work on it must never wait for the I/O thread or the
//                "lmo" queue.
//   "serverSync" the list of holds; entered synchronously from the service
//                queue and from connection events, never from itself.
// The database queue ("VTDatabase", inherited) is entered from the service
// queue; nothing on it calls back into the server's queues.
//
// Lifetime: the process keeps its one server for good (server()). Clients
// and transactions hold it strongly, the listener only weakly.

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/Format.h"
#include "base/SerialQueue.h"
#include "base/Uuid.h"
#include "lmo/Connection.h"
#include "lmo/Listener.h"
#include "registry/VTDUserPrefs.h"
#include "registry/VTDatabase.h"

namespace vantrel::daemon {

class VTDLmoClient;
class VTDPlugInHold;
using VTDPlugInHoldPtr = std::shared_ptr<VTDPlugInHold>;

// Whether an operation's debug lines and message dumps are written.
inline constexpr uint32_t kVerboseDebug = 1;
inline constexpr uint32_t kVerboseDumps = 2;

// A request that took at least this long has its freed memory given back to
// the system when it ends (requestFinished).
inline constexpr std::chrono::milliseconds kTrimAfterRequestTime{20};

class VTDServer : public registry::VTDatabase, public registry::VTDatabaseDelegate {
 public:
  // Made only through initForService (the database factory needs it public).
  VTDServer() = default;
  ~VTDServer() override;

  // The server on the named service (a name beginning with "/" is the socket
  // path itself) with the annotation store at database (null: the store's
  // default place), over the process's application registry. The listener
  // is bound but not accepting until run() or resume(). Null when the
  // registry cannot be opened or the service cannot be listened on (a live
  // daemon already there, say); the reason has been logged.
  static std::shared_ptr<VTDServer> initForService(const char* service, const char* database);
  // As above over the given registry (tests run servers over their own).
  static std::shared_ptr<VTDServer> initForService(const char* service, const char* database,
                                                   std::shared_ptr<omnidex::Workspace> workspace);

  // The process's server: the last one constructed, null before the first.
  static std::shared_ptr<VTDServer> server();
  // Forgets the process's server so that a test can let it go.
  static void resetForTest();

  // Resumes the listener, then blocks the calling (main) thread for good.
  [[noreturn]] void run();
  // Starts accepting connections; calling it again does nothing.
  void resume();
  // Stops accepting new connections (tests); accepted ones go on.
  void cancelListenerForTest();

  // ---- Logging ----

  // Always writes the formatted line to the system log.
  template <typename... Args>
  void log(std::string_view fmt, const Args&... args) const {
    emit(5, fmt, args...);
  }
  // Writes the line only when verbose() is at least 1; otherwise the
  // arguments are not even formatted.
  template <typename... Args>
  void debug(std::string_view fmt, const Args&... args) const {
    if (verbose() != 0) emit(6, fmt, args...);
  }
  // Formats and writes one line; the result is never used as a format
  // again. level does not filter: 6 and above are written at info level,
  // the rest at notice.
  void logFormatArguments(int level, std::string_view fmt, const base::FormatArg* args,
                          size_t count) const;

  // Called on the service queue after each request's work, with how long it
  // took: after a long one (a large reply, many bundles read) what it freed
  // is given back to the system, since requests run on several threads and
  // each thread's heap would otherwise keep its peak.
  void requestFinished(std::chrono::steady_clock::duration took);
  // Runs a request's work on the service queue, after the work submitted
  // before it; from the connection's event handler, on the calling thread
  // when the queue is idle. The caller must hold no lock the work could
  // need.
  void submitRequest(std::function<void()> work);

  // ---- Holds (each synchronous; never call them on syncQueue()) ----

  // Whether any active hold blocks the plug-in.
  bool holdOnPlugIn(const registry::VTDPlugIn& plugIn) { return holdFor(plugIn) != nullptr; }
  // The oldest active hold that blocks the plug-in, or null.
  VTDPlugInHoldPtr holdFor(const registry::VTDPlugIn& plugIn);
  // Adds a hold and announces the change.
  void addHold(VTDPlugInHoldPtr hold);
  // Releases the hold with that token, whoever asks; an unknown token
  // changes nothing and announces nothing.
  void unholdToken(const base::Uuid& token);
  // Releases every hold that client took (one announcement each).
  void unholdClient(const VTDLmoClient& client);

  // ---- The database's delegate ----

  // Withdraws the service registrations of the departing plug-ins.
  void removedPlugIns(const std::vector<omnidex::PlugInRecordPtr>& records) override;

  // ---- Accessors ----

  uint32_t verbose() const { return verbose_.load(std::memory_order_relaxed); }
  void setVerbose(uint32_t verbose) { verbose_.store(verbose, std::memory_order_relaxed); }
  const lmo::QueuePtr& lmoQueue() const { return lmoQueue_; }
  const lmo::QueuePtr& mainQueue() const { return mainQueue_; }
  const lmo::QueuePtr& syncQueue() const { return syncQueue_; }
  const std::shared_ptr<lmo::Listener>& service() const { return service_; }
  const std::shared_ptr<registry::VTDUserPrefs>& userPrefs() const { return userPrefs_; }
  // A copy of the active holds, oldest first.
  std::vector<VTDPlugInHoldPtr> holds();

 private:
  bool setUp(const char* service);
  template <typename... Args>
  void emit(int level, std::string_view fmt, const Args&... args) const {
    if constexpr (sizeof...(Args) == 0) {
      logFormatArguments(level, fmt, nullptr, 0);
    } else {
      const base::FormatArg list[] = {base::FormatArg(args)...};
      logFormatArguments(level, fmt, list, sizeof...(Args));
    }
  }

  std::atomic<uint32_t> verbose_{0};

  // Constant once initForService has returned.
  lmo::QueuePtr lmoQueue_;
  lmo::QueuePtr mainQueue_;
  lmo::QueuePtr syncQueue_;
  std::shared_ptr<lmo::Listener> service_;
  std::shared_ptr<registry::VTDUserPrefs> userPrefs_;

  // Guarded by syncQueue_.
  std::vector<VTDPlugInHoldPtr> holds_;
};

using VTDServerPtr = std::shared_ptr<VTDServer>;

}  // namespace vantrel::daemon
