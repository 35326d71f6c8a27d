#pragma once
// The process's one I/O thread: an epoll loop that watches every listener and
// connection socket and runs their I/O callbacks. Callbacks move bytes and
// hand events to serial queues; handler code runs here only by borrowing an
// idle queue (SerialQueue::tryRunHere), so nothing that can run on such a
// queue may wait for this thread (runAndWait is for set-up and tear-down).

#include <sys/epoll.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <thread>
#include <unordered_map>
#include <vector>

namespace vantrel::lmo {

// Something with a socket the loop watches. Its callbacks run on the I/O
// thread only.
class IoSource {
 public:
  virtual ~IoSource() = default;
  // The epoll events that became ready for the source's descriptor.
  virtual void handleIo(uint32_t events) = 0;
  // The process is about to stop (announceTerminationImminent).
  virtual void terminationImminent() {}
};

class IoLoop {
 public:
  // The process-wide loop; its thread starts on first use and runs for the
  // life of the process.
  static IoLoop& shared();

  // Watches fd for events and keeps source alive until remove(). Returns the
  // registration's token (never 0). A failure of epoll itself stops the
  // process: it means a descriptor bug of ours.
  uint64_t add(int fd, uint32_t events, std::shared_ptr<IoSource> source);
  // Changes the events watched for a registration.
  void modify(int fd, uint64_t token, uint32_t events);
  // Stops watching fd and releases the source. Must run on the I/O thread,
  // so no callback of the registration can be running elsewhere.
  void remove(int fd, uint64_t token);

  // Runs task on the I/O thread, after the I/O callbacks in progress.
  void post(std::function<void()> task);
  // Runs task on the I/O thread and waits for it (at once when called
  // there), so that the caller sees registrations as the task left them.
  void runAndWait(const std::function<void()>& task);
  bool isCurrent() const;

  // Gives every registered source its terminationImminent() callback
  // (connections deliver the termination-imminent event to their handlers).
  void announceTerminationImminent();

 private:
  IoLoop();
  void run();
  void runPostedTasks();

  const int epollFd_;
  const int wakeFd_;  // eventfd that post() signals
  std::thread thread_;

  mutable std::mutex mutex_;
  uint64_t nextToken_ = 1;                                           // Guarded by mutex_.
  std::unordered_map<uint64_t, std::shared_ptr<IoSource>> sources_;  // Guarded by mutex_.
  std::vector<std::function<void()>> tasks_;                         // Guarded by mutex_.
};

}  // namespace vantrel::lmo
