#pragma once
// The processes of a load run besides the daemon: client processes that send
// one request at a time and report to the parent through a pipe, and the two
// servers the daemon is compared with, a blocking ping-pong answerer and a
// one-thread epoll server. Each is a fork()ed child of the benchmark, so
// every figure is taken across process boundaries, as users meet it.

#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "base/Result.h"
#include "bench/load/Wire.h"

namespace vantrel::bench::load {

// What each client process sends and for how long. A client first makes
// warmup untimed round trips (connection set up on both sides), then waits
// until every client is ready, then runs: requests timed round trips with
// each latency recorded, or, with requests 0, as many as fit in seconds.
struct Load {
  Bytes request;  // a request frame; each send sets its id
  ReplyCheck reply;
  uint64_t requests = 0;
  double seconds = 0;
  int warmup = 10;
};

// What one client process did.
struct ClientReport {
  uint64_t requests = 0;       // round trips timed
  double seconds = 0;          // from the common start to its last reply
  std::vector<double> micros;  // each round trip, when a count was asked for
  size_t replyBytes = 0;       // the last reply frame, length prefix included
};

// Runs clients client processes, each on the socket connect() returns in
// the child, all starting together. Errors: a child that cannot be made,
// cannot connect, or gets a wrong reply or none (the first such, as the
// child words it).
base::Result<std::vector<ClientReport>> runClients(int clients, const std::function<int()>& connect,
                                                   const Load& load);

// A child that answers every frame read from fd with reply (its in-reply-to
// set to the request's id) by blocking read and write, until the stream ends.
pid_t startAnswerer(int fd, const Bytes& reply);

// A child with one thread and one epoll set over listener and the
// connections it accepts, answering every frame as startAnswerer does.
pid_t startEpollServer(int listener, const Bytes& reply);

// Ends a child of ours: SIGTERM, then SIGKILL if it has not exited within a
// few seconds; reaps it either way.
// In a child just forked from parent: dies with it (SIGKILL), so a
// benchmark that is killed or aborts leaves no process behind.
void dieWithParent(pid_t parent);
void stopChild(pid_t pid);

// The p-th percentile (0..1) of sorted samples; 0 for none.
double percentile(const std::vector<double>& sorted, double p);

}  // namespace vantrel::bench::load
