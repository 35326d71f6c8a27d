// vantrel-env-reporter: a stand-in plug-in executable for the launcher's
// tests. It writes what it was started with to standard output, one fact a
// line, and exits 0:
//   env <NAME=value>     each entry of its environment, in order
//   cwd <path>           its working directory
//   nnp <value>          the NoNewPrivs field of /proc/self/status
//   write <path> ok      for each argument pair "write <path>": creating
//   write <path> <errno> (or truncating) the file worked, or its errno
//   end
// Anything else on the command line: a usage line on standard error, exit 2.
// It uses nothing of the project, so it runs with an empty environment.

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <string>

extern char** environ;

namespace {

constexpr int kUsageExit = 2;
constexpr const char* kNoNewPrivsField = "NoNewPrivs:";

std::string noNewPrivs() {
  std::ifstream status("/proc/self/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.rfind(kNoNewPrivsField, 0) != 0) continue;
    const size_t value = line.find_first_not_of(" \t", std::strlen(kNoNewPrivsField));
    return value == std::string::npos ? "" : line.substr(value);
  }
  return "unknown";
}

void reportWrite(const char* path) {
  const int fd = ::open(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
  if (fd < 0) {
    std::printf("write %s %d\n", path, errno);
    return;
  }
  ::close(fd);
  std::printf("write %s ok\n", path);
}

}  // namespace

int main(int argc, char** argv) {
  for (int i = 1; i < argc; i += 2) {
    if (std::strcmp(argv[i], "write") != 0 || i + 1 >= argc) {
      std::fprintf(stderr, "usage: %s [write <path>]...\n", argv[0]);
      return kUsageExit;
    }
  }
  for (char** entry = environ; *entry != nullptr; ++entry) std::printf("env %s\n", *entry);
  char cwd[PATH_MAX];
  std::printf("cwd %s\n", ::getcwd(cwd, sizeof cwd) != nullptr ? cwd : "(unknown)");
  std::printf("nnp %s\n", noNewPrivs().c_str());
  for (int i = 1; i + 1 < argc; i += 2) reportWrite(argv[i + 1]);
  std::printf("end\n");
  return 0;
}
