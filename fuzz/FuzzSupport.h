#pragma once
// What the fuzz targets share: splitting one input into the several files or
// messages a target needs, a per-process scratch directory for the targets
// that must go through files, and property checks that stop the run (so that
// libFuzzer, or the replay driver, reports the input) when a property fails.

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "lmo/Value.h"

namespace vantrel::fuzz {

// Parts of a multi-part input are separated by this line. It is in every
// multi-part target's dictionary, so the fuzzer adds and removes parts.
inline constexpr std::string_view kPartSeparator = "\n%%\n";

// The first `count` parts of the input; parts it does not have are empty.
// Anything after the last wanted separator stays in the last part.
std::vector<std::string_view> splitParts(const uint8_t* data, size_t size, size_t count);

// Made once per process, before the first input: log lines are dropped (the
// code under test still formats them), and every directory the system reads
// or writes through the environment (state, runtime, preferences, SDKs, the
// system volume, $HOME) points into scratchDirectory(), so nothing a target
// runs reads or writes anywhere else.
void setUpProcess();

// A directory made under $TMPDIR (else /tmp) on first use and removed when
// the process exits normally. Targets reuse the same file names in it for
// every input, so one input leaves nothing behind for the next.
const std::string& scratchDirectory();

// Replaces the file at path with bytes (0644); the directories above it are
// made. Stops the run when it cannot: a fuzz run on a broken scratch
// directory would test nothing.
void writeFile(const std::string& path, std::string_view bytes);

// Whether two values are the same value, stricter than Value's equality:
// the same type (so true is not 1), integers by value, reals and dates by
// value with a NaN the same as itself, containers element by element.
bool sameValue(const lmo::Value& a, const lmo::Value& b);

// Prints the property that failed and both sides, then aborts.
[[noreturn]] void propertyFailed(const char* property, const std::string& detail);

}  // namespace vantrel::fuzz

// FUZZ_REQUIRE(cond, "property", detail): the property must hold for every
// input; detail (a std::string expression) is only built when it does not.
#define FUZZ_REQUIRE(cond, property, detail)                                  \
  do {                                                                        \
    if (!(cond)) [[unlikely]]                                                 \
      ::vantrel::fuzz::propertyFailed((property), (detail));                  \
  } while (0)
