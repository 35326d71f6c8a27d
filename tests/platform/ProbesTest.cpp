#include "platform/Probes.h"

#include <gtest/gtest.h>
#include <stdio.h>
#include <unistd.h>

#include <climits>
#include <cstdint>
#include <cstring>
#include <map>
#include <sstream>
#include <string>

#include "platform/vantreld_probes.h"

namespace vantrel::probes {
namespace {

// The probes of provider "vantreld" in this test binary's SDT notes: probe
// name (as stored, with "__" for "-") -> semaphore address, 0 for none.
std::map<std::string, uint64_t> probesInThisBinary() {
  char self[PATH_MAX] = {};
  if (::readlink("/proc/self/exe", self, sizeof self - 1) <= 0) return {};
  // readelf must be given our own path: its /proc/self would be readelf.
  FILE* pipe = ::popen((std::string("readelf -n '") + self + "'").c_str(), "r");
  if (pipe == nullptr) return {};
  std::map<std::string, uint64_t> probes;
  std::string provider, name, key;
  char line[4096];
  while (std::fgets(line, sizeof line, pipe) != nullptr) {
    std::istringstream words(line);
    words >> key;
    if (key == "Provider:") words >> provider;
    if (key == "Name:") words >> name;
    if (key == "Location:" && provider == "vantreld") {
      const char* semaphore = std::strstr(line, "Semaphore: ");
      probes[name] = semaphore ? std::strtoull(semaphore + 11, nullptr, 16) : 0;
    }
  }
  ::pclose(pipe);
  return probes;
}

// Which probes there are is check_probes.sh's to say (platform.check_probes
// runs it on this binary); here: no more than those, and the guarded two can
// be enabled by a tracer.
TEST(Probes, TenProbesAndTheGuardedOnesHaveSemaphores) {
  std::map<std::string, uint64_t> probes = probesInThisBinary();
  EXPECT_EQ(probes.size(), 10u);
  EXPECT_NE(probes["request__input"], 0u);
  EXPECT_NE(probes["request__output"], 0u);
}

TEST(Probes, GuardedFormsDescribeOnlyWhileEnabled) {
  int described = 0;
  auto describe = [&] {
    ++described;
    return std::string("message");
  };
  requestInput(42, describe);
  requestOutput(42, describe);
  EXPECT_EQ(described, 0) << "no tracer attached, nothing may be built";

  // Raise each semaphore the way an attaching tracer does.
  ++vantreld_request__input_semaphore;
  EXPECT_TRUE(requestInputEnabled());
  EXPECT_FALSE(requestOutputEnabled());
  requestInput(42, describe);
  requestOutput(42, describe);
  EXPECT_EQ(described, 1);
  --vantreld_request__input_semaphore;

  ++vantreld_request__output_semaphore;
  requestInput(42, describe);
  requestOutput(42, describe);
  EXPECT_EQ(described, 2);
  --vantreld_request__output_semaphore;
  EXPECT_FALSE(requestOutputEnabled());
}

}  // namespace
}  // namespace vantrel::probes
