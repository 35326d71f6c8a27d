// Runs LLVMFuzzerTestOneInput over files and directories named on the command
// line, in the builds without libFuzzer (GCC): replays a corpus or a crash.
// A failed property or a fault stops it, so CTest fails on that input; the
// input being replayed is printed first, so the failure names it.

#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <system_error>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

namespace {

// Inputs larger than this are skipped: every parser fuzzed refuses them.
constexpr std::uintmax_t kMaxInputSize = 32 * 1024 * 1024;

int runFile(const std::filesystem::path& path) {
  std::error_code ec;
  if (std::filesystem::file_size(path, ec) > kMaxInputSize || ec) {
    std::fprintf(stderr, "skipping %s\n", path.c_str());
    return 0;
  }
  std::fprintf(stderr, "replaying %s\n", path.c_str());
  std::ifstream in(path, std::ios::binary);
  std::vector<uint8_t> bytes((std::istreambuf_iterator<char>(in)),
                             std::istreambuf_iterator<char>());
  LLVMFuzzerTestOneInput(bytes.data(), bytes.size());
  return 1;
}

}  // namespace

int main(int argc, char** argv) {
  int runs = 0;
  for (int i = 1; i < argc; ++i) {
    std::error_code ec;
    std::filesystem::path arg(argv[i]);
    if (std::filesystem::is_directory(arg, ec)) {
      for (const auto& entry : std::filesystem::recursive_directory_iterator(arg, ec)) {
        if (entry.is_regular_file(ec)) runs += runFile(entry.path());
      }
    } else if (std::filesystem::is_regular_file(arg, ec)) {
      runs += runFile(arg);
    } else {
      std::fprintf(stderr, "no such input: %s\n", argv[i]);
      return 2;
    }
  }
  std::printf("ran %d inputs\n", runs);
  return 0;
}
