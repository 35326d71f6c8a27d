#include "platform/Probes.h"

#include <gtest/gtest.h>
#include <stdio.h>
#include <unistd.h>

#include <climits>
#include <cstdint>
#include <map>
#include <sstream>
#include <string>

#include "platform/vantreld_probes.h"

namespace vantrel::probes {
namespace {

// The probes of provider "vantreld" in this test binary's SDT notes: probe
// name (as stored, with "__" for "-") -> semaphore address.
std::map<std::string, uint64_t> probesInThisBinary() {
  char self[PATH_MAX];
  ssize_t n = ::readlink("/proc/self/exe", self, sizeof self - 1);
  if (n <= 0) return {};
  self[n] = '\0';
  // readelf must be given our own path: its /proc/self would be readelf.
  std::string command = std::string("readelf -n '") + self + "'";
  FILE* pipe = ::popen(command.c_str(), "r");
  if (pipe == nullptr) return {};
  std::string output;
  char buffer[4096];
  while (size_t got = fread(buffer, 1, sizeof buffer, pipe)) output.append(buffer, got);
  ::pclose(pipe);

  std::map<std::string, uint64_t> probes;
  std::istringstream lines(output);
  std::string line, provider, name;
  while (std::getline(lines, line)) {
    std::istringstream words(line);
    std::string key;
    words >> key;
    if (key == "Provider:") {
      words >> provider;
    } else if (key == "Name:") {
      words >> name;
    } else if (key == "Location:" && provider == "vantreld") {
      size_t at = line.find("Semaphore: ");
      probes[name] = at == std::string::npos ? 0 : std::stoull(line.substr(at + 11), nullptr, 16);
    }
  }
  return probes;
}

TEST(Probes, EveryProbeIsInTheBinaryAndTheGuardedOnesHaveSemaphores) {
  std::map<std::string, uint64_t> probes = probesInThisBinary();
  for (const char* name :
       {"client__new", "client__done", "request", "request__input", "request__output", "db__load",
        "discover__raw", "plugin__add", "plugin__ready", "plugin__remove"}) {
    EXPECT_TRUE(probes.contains(name)) << name;
  }
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
