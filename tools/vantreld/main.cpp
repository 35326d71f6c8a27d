// vantreld: the plug-in registry daemon.
//
//   vantreld [-c cachelimit] [-d annotationdb] [-S servicename] [-v]...
//
// Exit status 2 for a bad command line, 1 when the server cannot be made
// (another daemon already serves the name, the registry cannot be opened).
// Otherwise it serves until it is stopped.

#include <malloc.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>
#include <cstdlib>

#include "base/Log.h"
#include "daemon/VTDServer.h"
#include "lmo/Protocol.h"

namespace {

constexpr int kExitUsage = 2;
constexpr int kExitNoServer = 1;

struct Options {
  const char* service = vantrel::protocol::kDefaultServiceName;
  const char* database = nullptr;
  uint32_t cacheLimit = vantrel::registry::kDefaultCacheLimit;
  uint32_t verbose = 0;
};

[[noreturn]] void usage() {
  std::fputs("Usage: vantreld [-S servicename] [-v]\n", stderr);
  std::exit(kExitUsage);
}

Options parseOptions(int argc, char** argv) {
  Options options;
  int option;
  opterr = 0;  // the usage line is the only complaint
  while ((option = ::getopt(argc, argv, "c:d:S:v")) != -1) {
    switch (option) {
      case 'c':
        // No validation on purpose: "abc" is 0 and "20x" is 20.
        options.cacheLimit = static_cast<uint32_t>(std::atoi(optarg));
        break;
      case 'd':
        options.database = optarg;
        break;
      case 'S':
        options.service = optarg;
        break;
      case 'v':
        ++options.verbose;
        break;
      default:
        usage();
    }
  }
  if (optind != argc) usage();
  return options;
}

}  // namespace

int main(int argc, char** argv) {
  const Options options = parseOptions(argc, argv);
  // A peer that goes away mid-reply must cost a write error, not the daemon.
  std::signal(SIGPIPE, SIG_IGN);
  auto server = vantrel::daemon::VTDServer::initForService(options.service, options.database);
  if (!server) {
    vantrel::base::vtlog("unable to construct server");
    return kExitNoServer;
  }
  server->setVerbose(options.verbose);
  server->setCacheLimit(options.cacheLimit);
  // Start-up has read every bundle and built the registry; what it freed
  // goes back to the system before the daemon settles down to serve.
  ::malloc_trim(0);
  server->run();
}
