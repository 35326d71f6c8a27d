// vantrel-test-peer: a stand-in client process for tests. Copied into a
// temporary bundle (next to an Info.plist naming it as KBBundleExecutable and
// an Entitlements.plist), it gives tests a real peer with real entitlements.
//
// Modes (the first argument):
//   sleep      writes "ready\n" to standard output once running, then blocks
//              until it is killed or its standard input is closed; exit 0.
//   print-pid  writes its pid and "\n" to standard output; exit 0.
// Anything else: a usage line on standard error, exit 2.
//
// It links nothing of the project, so that copying the one file is enough.

#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

namespace {

constexpr int kUsageExit = 2;

int sleepUntilStdinCloses() {
  std::fputs("ready\n", stdout);
  std::fflush(stdout);
  char buffer[256];
  for (;;) {
    const ssize_t n = ::read(STDIN_FILENO, buffer, sizeof buffer);
    if (n == 0) return 0;
    if (n < 0 && errno != EINTR) return 0;
  }
}

int printPid() {
  std::printf("%d\n", static_cast<int>(::getpid()));
  return std::fflush(stdout) == 0 ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc == 2 && std::strcmp(argv[1], "sleep") == 0) return sleepUntilStdinCloses();
  if (argc == 2 && std::strcmp(argv[1], "print-pid") == 0) return printPid();
  std::fprintf(stderr, "usage: %s sleep|print-pid\n", argc > 0 ? argv[0] : "vantrel-test-peer");
  return kUsageExit;
}
